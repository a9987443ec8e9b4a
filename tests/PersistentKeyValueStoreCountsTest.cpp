#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <tuple>

#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::KeyValueStoreFixture;
using test::told;
using test::watch;

class PersistentKeyValueStoreOperationCounts : public KeyValueStoreFixture {
 protected:
  // "hits misses stores evictions"
  std::string counts() const {
    const auto counts = store->operationCounts();
    return std::to_string(counts.hits) + " " + std::to_string(counts.misses) + " " + std::to_string(counts.stores) +
           " " + std::to_string(counts.evictions);
  }
};

TEST_F(PersistentKeyValueStoreOperationCounts, BeginAtNothingWithEveryStart) {
  open();
  EXPECT_EQ(counts(), "0 0 0 0");
  put("key", "value");
  reopen();
  EXPECT_EQ(counts(), "0 0 0 0");
}

TEST_F(PersistentKeyValueStoreOperationCounts, TellHitsFromMisses) {
  open();
  put("key", "value");
  get("key");
  get("key");
  get("nothing");
  EXPECT_EQ(counts(), "2 1 1 0");
}

TEST_F(PersistentKeyValueStoreOperationCounts, CountASearchForSeveralKeysOnceAndOneForNoneNotAtAll) {
  open();
  put("b", "value");
  const auto found = watch(store->fetchFirst({"a", "b"}, answering("value")));
  const auto missed = watch(store->fetchFirst({"c", "d"}, answering("value")));
  const auto none = watch(store->fetchFirst({}, answering("value")));
  settle();
  EXPECT_EQ(told(none), "<miss>");
  EXPECT_EQ(counts(), "1 1 1 0");
}

TEST_F(PersistentKeyValueStoreOperationCounts, CountAHitWhoseFileHasGone) {
  open();
  put("key", "value");
  files->deleteFile(pathOf("key"));
  get("key");
  EXPECT_EQ(counts(), "1 0 1 0");
}

TEST_F(PersistentKeyValueStoreOperationCounts, CountWhatWasWrittenAndNotWhatFailed) {
  for (const bool inlineData : {false, true}) {
    options.inlineData = inlineData;
    open();
    put("key", "value");
    put("key", "another");
    EXPECT_EQ(counts(), "0 0 2 0") << inlineData;
    close();
  }
  options.inlineData = false;
  open();
  const auto failed =
      watch(store->store("other", nullptr, [](const std::string&) -> unsigned int { throw std::runtime_error("no"); }));
  settle();
  EXPECT_EQ(told(failed), "<error> no");
  EXPECT_EQ(counts(), "0 0 0 0");
}

TEST_F(PersistentKeyValueStoreOperationCounts, CountWhatGoesForTheCapacity) {
  for (const bool inlineData : {false, true}) {
    options.inlineData = inlineData;
    options.capacity = 3;
    open();
    putMany(5);
    EXPECT_EQ(counts(), "0 0 5 2") << inlineData;
    clear();
    close();
  }
}

TEST_F(PersistentKeyValueStoreOperationCounts, CountWhatExpires) {
  open();
  putMany(3);
  clock.advance(1001);
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_EQ(counts(), "0 0 3 3");
}

TEST_F(PersistentKeyValueStoreOperationCounts, DoNotTakeARemovalOrAClearForAnEviction) {
  open();
  putMany(3);
  drop("key0");
  EXPECT_EQ(clear(), "<done>");
  EXPECT_EQ(counts(), "0 0 3 0");
}

TEST_F(PersistentKeyValueStoreOperationCounts, CountWhatAPruneOfADiskCacheTakes) {
  isDiskCache = true;
  options.normalSize = 20;
  options.batchSize = 2;
  open();
  for (const char* const key : {"a", "b", "c", "d", "e"}) put(key, std::string(10, 'x'));
  store->pruneBackToNormal(onSuccess(), onError(), false);
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(store->operationCounts().evictions, 3U);
}

TEST_F(PersistentKeyValueStoreOperationCounts, AreThereAfterInvalidation) {
  open();
  put("key", "value");
  auto future = store->invalidateWithFuture();
  settle();
  EXPECT_EQ(counts(), "0 0 1 0");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
