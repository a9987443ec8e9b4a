#include "host/MemoryTier.h"

#include <gtest/gtest.h>

#include <cstddef>
#include <memory>
#include <stdexcept>
#include <string>

#include "host/MemoryTierFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Got;
using test::isA;
using test::kBroken;
using test::told;
using test::Value;
using test::watch;
using test::Written;

constexpr std::size_t kOverhead = host::MemoryTier::kEntryOverhead;

class MemoryTier : public test::MemoryTierFixture {};

// --- What is kept ---

TEST_F(MemoryTier, FetchesFromTheStoreOnceAndThenFromMemoryWithoutACopy) {
  openTier();
  put("a", "value");
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), "value");
  const Value first = tier->find("a");
  const Got second = watch(tier->fetch("a"));
  EXPECT_EQ(told(second), "value");
  EXPECT_EQ((*second->value).get(), first.get());
  EXPECT_EQ(store->operationCounts().hits, 1u);
}

TEST_F(MemoryTier, AMissIsNullAndIsNotKept) {
  openTier();
  EXPECT_EQ(fetched("a"), "<miss>");
  put("a", "value");
  EXPECT_EQ(fetched("a"), "value");
}

TEST_F(MemoryTier, KeepsAnEmptyValue) {
  openTier();
  keep("a", "");
  ASSERT_NE(tier->find("a"), nullptr);
  EXPECT_TRUE(tier->find("a")->empty());
}

TEST_F(MemoryTier, WhatIsStoredIsSharedWithTheCallerAndReachesTheStore) {
  openTier();
  const auto value = std::make_shared<const Bytes>(bytesOf("shared"));
  const Written written = watch(tier->store("a", value));
  EXPECT_EQ(told(written), "<pending>");
  EXPECT_EQ(tier->find("a"), value);
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(onDisk("a"), "shared");
}

TEST_F(MemoryTier, PassesMetadataOnToTheStore) {
  options.extendedMetadataFactory = std::make_shared<VideoDownloadExtendedMetadataFactory>();
  openTier();
  const auto metadata = std::make_shared<VideoDownloadExtendedMetadata>();
  const Written written = watch(tier->store("a", bytesOf("value"), metadata));
  settle();
  EXPECT_EQ(store->getManifest()->getItem("a")->extendedMetadata, metadata);
}

TEST_F(MemoryTier, ANullValueAndANullStoreAreRefused) {
  openTier();
  EXPECT_THROW(tier->store("a", Value()), std::invalid_argument);
  EXPECT_THROW(host::MemoryTier(nullptr, 1), std::invalid_argument);
}

TEST_F(MemoryTier, CountsHitsMissesEntriesAndBytes) {
  openTier();
  put("key", "value");
  EXPECT_EQ(fetched("key"), "value");    // a miss
  EXPECT_EQ(fetched("none"), "<miss>");  // a miss
  EXPECT_EQ(fetched("key"), "value");    // a hit
  EXPECT_EQ(inMemory("key"), "value");   // a hit
  EXPECT_EQ(inMemory("none"), "<miss>");
  const host::MemoryTier::Counts counts = tier->counts();
  EXPECT_EQ(counts.hits, 2u);
  EXPECT_EQ(counts.misses, 2u);
  EXPECT_EQ(counts.entries, 1u);
  EXPECT_EQ(counts.bytes, kOverhead + 3 + 5);
}

TEST_F(MemoryTier, CountsTheBytesOfAValueThatIsReplacedOrRemoved) {
  openTier();
  keep("a", "12345");
  keep("a", "123");
  EXPECT_EQ(tier->counts().bytes, kOverhead + 1 + 3);
  keep("a", "1234567");
  EXPECT_EQ(tier->counts().bytes, kOverhead + 1 + 7);
  const Written removed = watch(tier->remove("a"));
  EXPECT_EQ(tier->counts().bytes, 0u);
  EXPECT_EQ(tier->counts().entries, 0u);
}

TEST_F(MemoryTier, ABoundThatIsReachedExactlyIsNotPassed) {
  const std::size_t each = kOverhead + 1 + 10;
  openTier(4 * each);
  for (const char* key : {"a", "b", "c", "d"}) keep(key, "0123456789");
  EXPECT_EQ(tier->counts().entries, 4u);
  EXPECT_EQ(tier->counts().bytes, 4 * each);
  keep("e", "");
  EXPECT_EQ(tier->counts().entries, 4u);
  EXPECT_EQ(inMemory("a"), "<miss>");
}

TEST_F(MemoryTier, AValueOfExactlyTheLargestPartIsKeptAndALargerOneIsNot) {
  const std::size_t bound = 4 * (kOverhead + 1 + 10);
  openTier(bound);
  keep("a", "0123456789");
  EXPECT_EQ(inMemory("a"), "0123456789");
  keep("a", "0123456789+");
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(tier->counts().bytes, 0u);
  EXPECT_EQ(fetched("a"), "0123456789+");
  EXPECT_EQ(inMemory("a"), "<miss>");
}

TEST_F(MemoryTier, KeepsNothingWithABoundOfZero) {
  openTier(0);
  keep("a", "");
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), "");
  EXPECT_EQ(tier->counts().entries, 0u);
}

TEST_F(MemoryTier, EvictsTheOldestThatWasNotFoundSinceTheHandCameBy) {
  openTier(4 * (kOverhead + 1 + 1));
  for (const char* key : {"a", "b", "c", "d"}) keep(key, "1");
  EXPECT_EQ(inMemory("a"), "1");
  EXPECT_EQ(inMemory("c"), "1");
  keep("e", "1");  // the hand passes a, which was found, and removes b
  keep("f", "1");  // it passes c and removes d
  EXPECT_EQ(tier->counts().entries, 4u);
  keep("g", "1");  // it removes e, which stands behind
  std::string left;
  for (const char* key : {"a", "b", "c", "d", "e", "f", "g"}) left += inMemory(key) == "1" ? key : "";
  EXPECT_EQ(left, "acfg");
}

TEST_F(MemoryTier, AHandWhoseEntryIsRemovedGoesOnBehindIt) {
  openTier(4 * (kOverhead + 1 + 1));
  for (const char* key : {"a", "b", "c", "d"}) keep(key, "1");
  EXPECT_EQ(inMemory("a"), "1");
  keep("e", "1");  // removes b; the hand stands at c
  watch(tier->remove("c"));
  keep("f", "1");
  keep("g", "1");  // removes d
  std::string left;
  for (const char* key : {"a", "b", "c", "d", "e", "f", "g"}) left += inMemory(key) == "1" ? key : "";
  EXPECT_EQ(left, "aefg");
}

TEST_F(MemoryTier, ANewValueIsKeptAlsoWhenAllOthersWereFound) {
  openTier(4 * (kOverhead + 1 + 1));
  for (const char* key : {"a", "b", "c", "d"}) keep(key, "1");
  for (const char* key : {"a", "b", "c", "d"}) EXPECT_EQ(inMemory(key), "1");
  keep("e", "1");
  EXPECT_EQ(inMemory("e"), "1");
  EXPECT_EQ(inMemory("a"), "<miss>");
}

TEST_F(MemoryTier, AValueThatGrowsIsKeptAndOthersGo) {
  openTier(8 * (kOverhead + 2));
  for (const char* key : {"a", "b", "c", "d", "e", "f", "g", "h"}) keep(key, "1");
  keep("a", std::string(1 + kOverhead, 'x'));
  EXPECT_EQ(inMemory("a"), std::string(1 + kOverhead, 'x'));
  EXPECT_LE(tier->counts().bytes, 8 * (kOverhead + 2));
  EXPECT_EQ(tier->counts().entries, 7u);
}

TEST_F(MemoryTier, AValueThatGrowsWhereTheHandStandsIsKeptAlsoWhenAllOthersWereFound) {
  openTier(8 * (kOverhead + 2));
  const std::string keys = "abcdefgh";
  for (const char key : keys) keep({key}, "1");
  for (const char key : keys) EXPECT_EQ(inMemory({key}), "1");
  keep("a", std::string(1 + kOverhead, 'x'));
  EXPECT_EQ(inMemory("a"), std::string(1 + kOverhead, 'x'));
  EXPECT_EQ(inMemory("b"), "<miss>");
  EXPECT_EQ(tier->counts().entries, 7u);
}

// --- Trimming ---

TEST_F(MemoryTier, TrimsToAtMostSoManyBytesAndKeepsThemInTheStore) {
  openTier();
  for (const char* key : {"a", "b", "c"}) keep(key, "1");
  const std::size_t each = kOverhead + 2;
  tier->trim(3 * each);
  EXPECT_EQ(tier->counts().entries, 3u);
  tier->trim(3 * each - 1);
  EXPECT_EQ(tier->counts().bytes, 2 * each);
  tier->trim(0);
  EXPECT_EQ(tier->counts().bytes, 0u);
  EXPECT_EQ(fetched("a"), "1");
  EXPECT_EQ(inMemory("a"), "1");
}

TEST_F(MemoryTier, AValueThatACallerHoldsSurvivesTrimming) {
  openTier();
  keep("a", "value");
  const Value held = tier->find("a");
  tier->trim(0);
  EXPECT_EQ(told(held), "value");
}

// --- The end ---

TEST_F(MemoryTier, AnInvalidatedStoreIsNoticedByTheNextAccess) {
  openTier();
  keep("a", "secret");
  keep("b", "secret");
  store->invalidateSoon();
  settle();
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(tier->counts().entries, 0u);
  const Got got = watch(tier->fetch("b"));
  settle();
  EXPECT_TRUE(isA<InvalidatedException>(got->failure));
}

TEST_F(MemoryTier, WhatIsStoredAfterTheInvalidationIsNotFound) {
  openTier();
  store->invalidateSoon();
  const Written written = watch(tier->store("a", bytesOf("value")));
  EXPECT_EQ(inMemory("a"), "<miss>");
  settle();
  EXPECT_TRUE(isA<InvalidatedException>(written->failure));
}

TEST_F(MemoryTier, ATierThatIsGoneLetsTheStoreFinish) {
  openTier();
  put("a", "value");
  const Got got = watch(tier->fetch("a"));
  const Written written = watch(tier->store("b", bytesOf("b")));
  const Written cleared = watch(tier->clear());
  tier.reset();
  settle();
  EXPECT_EQ(told(got), "value");
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(cleared), "<done>");
}

TEST_F(MemoryTier, ReleasesItsStoreAlthoughAFetchIsUnderWay) {
  openTier();
  const Got got = watch(tier->fetch("a"));
  const std::weak_ptr<Store> weak = store->weak_from_this();
  store.reset();
  EXPECT_FALSE(weak.expired());
  tier.reset();
  EXPECT_TRUE(weak.expired());
  settle();
  EXPECT_EQ(told(got), "<miss>");
}

TEST_F(MemoryTier, ACallbackMayDestroyTheTier) {
  openTier();
  keep("a", "value");
  tier->trim(0);
  tier->fetch("a").then(nullptr, [this](std::future<Value>&) { tier.reset(); });
  const Got other = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(other), "value");
  EXPECT_EQ(tier, nullptr);
}

TEST_F(MemoryTier, AQueueThatRunsAtOnceMayDestroyTheTierWithinACall) {
  openTier();
  Got other;
  Written written;
  work().onDispatch = [&] {
    if (tier == nullptr) return;
    other = watch(tier->fetch("b"));  // wait for their turn
    written = watch(tier->store("c", bytesOf("value")));
    tier.reset();
  };
  const Got got = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(got), "<miss>");
  EXPECT_EQ(told(other), "<miss>");
  EXPECT_EQ(told(written), "<done>");
  openTier();
  const Got kept = watch(tier->fetch("c"));
  settle();
  EXPECT_EQ(told(kept), "value") << "what was accepted is stored";
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
