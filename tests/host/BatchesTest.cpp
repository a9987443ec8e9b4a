#include "host/Batches.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstddef>
#include <exception>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "LarderException.h"
#include "host/Await.h"
#include "host/Host.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Contents;
using test::textOf;
using testing::ElementsAre;

using Values = std::vector<std::pair<std::string, Bytes>>;

class Batches : public test::KeyValueStoreFixture {
 protected:
  void SetUp() override {
    openWatched();
    medium->forgetCalls();
  }

  std::size_t transactions() const { return medium->calls("begin").size(); }

  static Values numbered(std::size_t count) {
    Values values;
    for (std::size_t i = 0; i < count; ++i) values.emplace_back("key" + std::to_string(i), bytesOf(std::to_string(i)));
    return values;
  }

  static std::vector<std::string> keysOf(const Values& values) {
    std::vector<std::string> keys;
    for (const auto& value : values) keys.push_back(value.first);
    return keys;
  }

  // The values, or "<miss>"; the work is done.
  std::vector<std::string> fetched(const std::vector<std::string>& keys) {
    auto future = fetchMany(*store, keys);
    settle();
    std::vector<std::string> texts;
    for (const auto& result : await(future)) texts.push_back(result == nullptr ? "<miss>" : textOf(result->value));
    return texts;
  }
};

// What a failed batch says, and then what its nested exception says.
std::string failureOf(const Future<void>& batch) {
  try {
    await(batch);
  } catch (const BatchError& error) {
    try {
      error.rethrow_nested();
    } catch (const std::exception& nested) {
      return error.key() + " | " + error.what() + " | " + nested.what();
    }
  }
  return "<done>";
}

TEST_F(Batches, StoresFetchesAndRemoves) {
  const Future<void> stored = storeAll(*store, {{"one", bytesOf("1")}, {"two", bytesOf("22")}});
  EXPECT_FALSE(stored.isReady());
  settle();
  EXPECT_EQ(failureOf(stored), "<done>");
  EXPECT_THAT(fetched({"two", "nothing", "one", "two"}), ElementsAre("22", "<miss>", "1", "22"));
  const Future<void> removed = removeAll(*store, {"one", "nothing"});
  settle();
  EXPECT_EQ(failureOf(removed), "<done>");
  EXPECT_EQ(contents(), (Contents{{"two", "22"}}));
}

TEST_F(Batches, AnEmptyOneIsDoneAtOnce) {
  EXPECT_EQ(failureOf(storeAll(*store, {})), "<done>");
  EXPECT_EQ(failureOf(removeAll(*store, {})), "<done>");
  EXPECT_TRUE(await(fetchMany(*store, {})).empty());
}

TEST_F(Batches, OfAKeyThatIsThereTwiceTheLastValueStays) {
  const Future<void> stored = storeAll(*store, {{"key", bytesOf("first")}, {"key", bytesOf("last")}});
  settle();
  EXPECT_EQ(failureOf(stored), "<done>");
  EXPECT_THAT(fetched({"key"}), ElementsAre("last"));
}

TEST_F(Batches, ChangesShareATransaction) {
  const Future<void> stored = storeAll(*store, numbered(32));
  settle();
  EXPECT_EQ(failureOf(stored), "<done>");
  EXPECT_EQ(transactions(), 1U);
  const Future<void> removed = removeAll(*store, keysOf(numbered(32)));
  settle();
  EXPECT_EQ(failureOf(removed), "<done>");
  EXPECT_EQ(transactions(), 2U);
  EXPECT_EQ(contents(), Contents());
}

TEST_F(Batches, MoreChangesThanATransactionTakesNeedTwo) {
  const Future<void> stored = storeAll(*store, numbered(34));
  settle();
  EXPECT_EQ(failureOf(stored), "<done>");
  EXPECT_EQ(transactions(), 2U);
}

TEST_F(Batches, AnInlineStoresChangesShareATransactionToo) {
  options.inlineData = true;
  close();
  openWatched();
  medium->forgetCalls();
  const Future<void> stored = storeAll(*store, numbered(5));
  settle();
  EXPECT_EQ(failureOf(stored), "<done>");
  EXPECT_EQ(transactions(), 1U);
  EXPECT_THAT(fetched({"key0", "key4", "key5"}), ElementsAre("0", "4", "<miss>"));
}

TEST_F(Batches, OneThatFailsIsNamedAndTheOthersAreDone) {
  files->failPath(test::Operation::WriteFile, pathOf("two"), ENOSPC);
  const Future<void> stored = storeAll(*store, {{"one", bytesOf("1")}, {"two", bytesOf("2")}, {"three", bytesOf("3")}});
  settle();
  EXPECT_THAT(failureOf(stored), testing::StartsWith("two | Could not store: Store 'store', key 'two', " + store->path +
                                                     ": domain: QZLarderIoErrorErrorDomain; "));
  EXPECT_EQ(contents(), (Contents{{"one", "1"}, {"three", "3"}}));
}

TEST_F(Batches, TheFirstKeyThatHasFailedIsNamed) {
  const std::string zero("a\0b", 3);
  const Future<void> removed = removeAll(*store, {"one", zero, zero + "c"});
  EXPECT_FALSE(removed.isReady());
  settle();
  EXPECT_EQ(failureOf(removed).substr(0, 3), zero);
  try {
    auto results = fetchMany(*store, {"one", zero});
    settle();
    (void)await(results);
    FAIL();
  } catch (const BatchError& error) {
    EXPECT_EQ(error.key(), zero);
    EXPECT_THROW(error.rethrow_nested(), std::invalid_argument);
  }
}

TEST_F(Batches, AStoreThatIsInvalidFailsThem) {
  store->invalidateSoon();
  const Future<void> stored = storeAll(*store, numbered(2));
  settle();
  try {
    await(stored);
    FAIL();
  } catch (const BatchError& error) {
    EXPECT_EQ(error.key(), "key0");
    EXPECT_EQ(error.store(), "store");
    EXPECT_EQ(error.path(), store->path);
    EXPECT_THROW(std::rethrow_if_nested(error), InvalidatedException);
  }
}

TEST_F(Batches, AQueueThatTakesNoTasksFailsThemWithoutThrowing) {
  work().throwOnDispatch(true);
  file().throwOnDispatch(true);
  const Future<void> stored = storeAll(*store, numbered(2));
  const Future<void> removed = removeAll(*store, {"key"});
  const auto found = fetchMany(*store, {"key"});
  settle();
  EXPECT_THAT(failureOf(stored), testing::StartsWith("key0 | Could not store: Store 'store', key 'key0', "));
  EXPECT_THAT(failureOf(removed), testing::StartsWith("key | Could not remove: Store 'store', key 'key', "));
  EXPECT_THROW((void)await(found), BatchError);
}

TEST_F(Batches, WorkThatIsDroppedBreaksThePromise) {
  const Future<void> stored = storeAll(*store, numbered(3));
  work().dropAll();
  file().dropAll();
  settle();
  try {
    await(stored);
    FAIL();
  } catch (const BatchError& error) {
    EXPECT_THROW(error.rethrow_nested(), std::future_error);
  }
}

TEST_F(Batches, NeitherStoreNorArgumentsHaveToOutliveTheCall) {
  Future<void> stored;
  {
    auto values = std::make_unique<Values>(numbered(3));
    stored = storeAll(*store, *values);
  }
  settle();
  EXPECT_EQ(failureOf(stored), "<done>");
  const auto found = fetchMany(*store, {"key1"});
  close();
  settle();
  EXPECT_TRUE(found.isReady());
}

TEST(BatchesOfAHost, ManyThreadsMayUseOneCache) {
  const test::TemporaryDirectory directory;
  const std::string configuration =
      R"({"media": {"area": "caches", "max_size": "9MB", "stores": {"thumbs": {"type": "disk_cache"}}}})";
  Host host(configuration, directory.path());
  const auto cache = host.store<DiskCache>("thumbs");
  test::runOnThreads(3, [&](std::size_t thread) {
    std::vector<std::string> keys;
    Values values;
    for (int i = 0; i < 100; ++i) {
      keys.push_back(std::to_string(thread) + "-" + std::to_string(i));
      values.emplace_back(keys.back(), bytesOf(keys.back()));
    }
    await(storeAll(*cache, values));
    const auto found = await(fetchMany(*cache, keys));
    for (std::size_t i = 0; i < keys.size(); ++i) {
      ASSERT_NE(found[i], nullptr);
      EXPECT_EQ(textOf(found[i]->value), keys[i]);
    }
    await(removeAll(*cache, keys));
  });
  EXPECT_TRUE(cache->getAllKeys().empty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
