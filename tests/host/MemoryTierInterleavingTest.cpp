#include <gtest/gtest.h>

#include <cerrno>
#include <memory>
#include <stdexcept>
#include <string>

#include "host/MemoryTierFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Got;
using test::hasNested;
using test::isA;
using test::kBroken;
using test::told;
using test::Value;
using test::watch;
using test::Written;

class MemoryTierInterleaving : public test::MemoryTierFixture {};

TEST_F(MemoryTierInterleaving, AFetchThatIsOvertakenByAStoreDoesNotPutTheOldValueIntoMemory) {
  openTier();
  put("a", "old");
  const Got got = watch(tier->fetch("a"));
  const Written written = watch(tier->store("a", bytesOf("new")));
  settle();
  EXPECT_EQ(told(got), "old");
  EXPECT_EQ(inMemory("a"), "new");
  EXPECT_EQ(onDisk("a"), "new");
}

TEST_F(MemoryTierInterleaving, AFetchThatIsOvertakenByAStoreThatFailsDoesNotPutTheOldValueIntoMemory) {
  openTier();
  put("a", "old");
  const Got got = watch(tier->fetch("a"));
  work().runNext();
  files->failNext(test::Operation::WriteFile, ENOSPC);
  const Written written = watch(tier->store("a", bytesOf("new")));
  settle();
  EXPECT_NE(told(written), "<done>");
  EXPECT_EQ(told(got), "old");
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), onDisk("a"));
}

TEST_F(MemoryTierInterleaving, AFetchThatIsOvertakenByARemovalIsNotKept) {
  openTier();
  put("a", "old");
  const Got got = watch(tier->fetch("a"));
  work().runNext();
  const Written removed = watch(tier->remove("a"));
  settle();
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), "<miss>");
}

TEST_F(MemoryTierInterleaving, AFetchThatIsOvertakenByAClearIsNotKept) {
  openTier();
  put("a", "old");
  const Got got = watch(tier->fetch("a"));
  work().runNext();
  const Written cleared = watch(tier->clear());
  settle();
  EXPECT_EQ(told(cleared), "<done>");
  EXPECT_EQ(told(got), "old");
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), "<miss>");
}

TEST_F(MemoryTierInterleaving, AFetchDoesNotJoinOneFromBeforeAClear) {
  openTier();
  put("a", "old");
  const Got before = watch(tier->fetch("a"));
  work().runNext();
  const Written cleared = watch(tier->clear());
  const Got behind = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(before), "old");
  EXPECT_EQ(told(behind), "<miss>");
}

TEST_F(MemoryTierInterleaving, AFetchThatBeginsDuringAClearIsNotKept) {
  openTier();
  put("a", "old");
  const Written cleared = watch(tier->clear());
  const Got got = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), onDisk("a"));
}

TEST_F(MemoryTierInterleaving, WhatIsStoredDuringAClearIsNotInMemoryUnlessItIsInTheStore) {
  openTier();
  put("a", "old");
  const Written cleared = watch(tier->clear());
  const Written written = watch(tier->store("a", bytesOf("new")));
  EXPECT_EQ(inMemory("a"), "<miss>");
  settle();
  EXPECT_EQ(told(cleared), "<done>");
  EXPECT_EQ(fetched("a"), onDisk("a"));
  keep("b", "later");
  EXPECT_EQ(inMemory("b"), "later");
}

TEST_F(MemoryTierInterleaving, AClearEmptiesMemoryAtOnce) {
  openTier();
  keep("a", "old");
  const Written cleared = watch(tier->clear());
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(told(cleared), "<pending>");
  settle();
  EXPECT_EQ(told(cleared), "<done>");
  EXPECT_EQ(onDisk("a"), "<miss>");
}

TEST_F(MemoryTierInterleaving, AClearThatFailsSaysWhyAndMemoryIsUsedAgain) {
  openTier();
  keep("a", "old");
  store->invalidateSoon();
  const Written cleared = watch(tier->clear());
  settle();
  EXPECT_TRUE(isA<InvalidatedException>(cleared->failure));
}

TEST_F(MemoryTierInterleaving, AClearThatTheQueueRefusesFails) {
  openTier();
  work().throwOnDispatch(true);
  const Written cleared = watch(tier->clear());
  EXPECT_EQ(told(cleared), "<error> Store 'store', " + store->path + ": The queue takes no tasks.");
  work().throwOnDispatch(false);
  keep("a", "value");
  EXPECT_EQ(inMemory("a"), "value");
}

TEST_F(MemoryTierInterleaving, WhatACallbackOfADroppedClearThrowsIsOneErrorLine) {
  openTier();
  tier->clear().then(nullptr, [](std::future<void>& cleared) { cleared.get(); });
  const test::LogCapture log;
  work().dropAll();
  ASSERT_EQ(log.messages().size(), 1U);
  EXPECT_EQ(log.messages().front().rfind("A callback of a clear has thrown: ", 0), 0U) << log.messages().front();
  keep("a", "value");
  EXPECT_EQ(inMemory("a"), "value");
}

TEST_F(MemoryTierInterleaving, AClearThatTheQueueDropsIsABrokenPromiseAndMemoryIsUsedAgain) {
  openTier();
  const Written cleared = watch(tier->clear());
  work().dropAll();
  EXPECT_EQ(told(cleared), kBroken);
  keep("a", "value");
  EXPECT_EQ(inMemory("a"), "value");
}

TEST_F(MemoryTierInterleaving, AStoreIsReadBeforeItIsWritten) {
  openTier();
  keep("a", "old");
  const Written written = watch(tier->store("a", bytesOf("new")));
  EXPECT_EQ(told(watch(tier->fetch("a"))), "new");
  tier->trim(0);
  const Got behind = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(behind), "new");
}

TEST_F(MemoryTierInterleaving, ARemovalIsSeenBeforeItIsDone) {
  openTier();
  keep("a", "old");
  const Written removed = watch(tier->remove("a"));
  EXPECT_EQ(inMemory("a"), "<miss>");
  const Got got = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(got), "<miss>");
}

TEST_F(MemoryTierInterleaving, AValueThatCouldNotBeStoredIsNotInMemory) {
  openTier();
  keep("a", "old");
  files->failNext(test::Operation::WriteFile, ENOSPC);
  const Written written = watch(tier->store("a", bytesOf("new")));
  EXPECT_EQ(inMemory("a"), "new");
  settle();
  EXPECT_TRUE(hasNested<FileUtilsIoException>(written->failure));
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), onDisk("a"));
}

TEST_F(MemoryTierInterleaving, AValueThatTheQueueRefusesOrDropsIsNotInMemory) {
  openTier();
  work().throwOnDispatch(true);
  file().throwOnDispatch(true);
  const Written refused = watch(tier->store("a", bytesOf("new")));
  EXPECT_EQ(told(refused), "<error> Store 'store', key 'a', " + store->path + ": The queue takes no tasks.");
  EXPECT_EQ(inMemory("a"), "<miss>");
  work().throwOnDispatch(false);
  file().throwOnDispatch(false);
  const Written dropped = watch(tier->store("a", bytesOf("new")));
  work().dropAll();
  file().dropAll();
  EXPECT_EQ(told(dropped), kBroken);
  EXPECT_EQ(inMemory("a"), "<miss>");
}

TEST_F(MemoryTierInterleaving, OfTwoStoresTheLaterIsInMemoryAlsoWhenTheEarlierFails) {
  openTier();
  files->failNext(test::Operation::WriteFile, ENOSPC);
  const Written first = watch(tier->store("a", bytesOf("1")));
  const Written second = watch(tier->store("a", bytesOf("2")));
  EXPECT_EQ(inMemory("a"), "2");
  settle();
  EXPECT_NE(told(first), "<done>");
  EXPECT_EQ(fetched("a"), onDisk("a"));
}

TEST_F(MemoryTierInterleaving, AChangeMadeWhileTheStoreIsAskedIsHandedToItBehind) {
  openTier();
  Written inner;
  file().beforeDispatch = work().beforeDispatch = [&] {
    if (inner == nullptr) inner = watch(tier->store("a", bytesOf("2")));
  };
  const Written outer = watch(tier->store("a", bytesOf("1")));
  EXPECT_EQ(inMemory("a"), "2");
  settle();
  EXPECT_EQ(told(outer), "<done>");
  EXPECT_EQ(told(inner), "<done>");
  EXPECT_EQ(onDisk("a"), "2");
}

TEST_F(MemoryTierInterleaving, WorksWithQueuesThatRunEverythingAtOnce) {
  openTier();
  work().onDispatch = [this] { work().runAll(); };
  file().onDispatch = [this] { file().runAll(); };
  EXPECT_EQ(told(watch(tier->store("a", bytesOf("1")))), "<done>");
  tier->trim(0);
  EXPECT_EQ(told(watch(tier->fetch("a"))), "1");
  EXPECT_EQ(told(watch(tier->clear())), "<done>");
  EXPECT_EQ(told(watch(tier->fetch("a"))), "<miss>");
}

// --- Fetching together ---

TEST_F(MemoryTierInterleaving, FetchesOfOneKeyShareOneFromTheStore) {
  openTier();
  put("a", "value");
  const Got first = watch(tier->fetch("a"));
  const Got second = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(first), "value");
  EXPECT_EQ((*first->value).get(), (*second->value).get());
  EXPECT_EQ(store->operationCounts().hits, 1u);
}

TEST_F(MemoryTierInterleaving, AFetchDoesNotJoinOneThatAChangeHasOvertaken) {
  openTier(0);
  put("a", "old");
  const Got before = watch(tier->fetch("a"));
  const Written written = watch(tier->store("a", bytesOf("new")));
  const Got behind = watch(tier->fetch("a"));
  settle();
  EXPECT_EQ(told(before), "old");
  EXPECT_EQ(told(behind), "new");
}

TEST_F(MemoryTierInterleaving, AFailureReachesAllWhoFetchTogetherAndIsNotKept) {
  openTier();
  put("a", "value");
  files->failNext(test::Operation::ReadFile, EIO);
  const Got first = watch(tier->fetch("a"));
  const Got second = watch(tier->fetch("a"));
  settle();
  EXPECT_TRUE(hasNested<FileUtilsIoException>(first->failure));
  EXPECT_TRUE(hasNested<FileUtilsIoException>(second->failure));
  EXPECT_EQ(fetched("a"), "value");
}

TEST_F(MemoryTierInterleaving, ACallbackThatThrowsKeepsNobodyElseFromTheValue) {
  openTier();
  put("a", "value");
  tier->fetch("a").then(nullptr, [](std::future<Value>&) { throw std::runtime_error("no"); });
  const Got second = watch(tier->fetch("a"));
  EXPECT_THROW(settle(), std::runtime_error);
  settle();
  EXPECT_EQ(told(second), "value");
  EXPECT_EQ(inMemory("a"), "value");
}

TEST_F(MemoryTierInterleaving, ADroppedFetchIsABrokenPromiseAndTheNextOneWorks) {
  openTier();
  put("a", "value");
  const Got got = watch(tier->fetch("a"));
  work().dropAll();
  EXPECT_EQ(told(got), kBroken);
  EXPECT_EQ(fetched("a"), "value");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
