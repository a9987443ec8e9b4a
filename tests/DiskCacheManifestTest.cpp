#include "DiskCacheManifest.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>
#include <new>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "PruneStrategy.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/MemoryPersistence.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::LogCapture;
using test::ManualClock;
using test::ManualExecutor;
using test::MemoryMedium;
using test::MemoryPersistence;
using test::TemporaryDirectory;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;
using testing::UnorderedElementsAre;

using ItemType = VideoDownloadExtendedMetadata::ItemType;

constexpr std::int64_t kFlushInterval = 120'000'000'000;
constexpr std::uint32_t kMany = std::numeric_limits<std::uint32_t>::max();

// A strategy made of any ordering, sensible or not.
class AnyOrder final : public PruneStrategyBase {
 public:
  using Order = std::function<bool(const DiskCacheItem& a, const DiskCacheItem& b)>;
  explicit AnyOrder(Order order) : order_(std::move(order)) {}
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override { return order_(*a, *b); }

 private:
  const Order order_;
};

std::shared_ptr<PruneStrategyBase> orderedBy(AnyOrder::Order order) {
  return std::make_shared<AnyOrder>(std::move(order));
}

DiskCacheItem item(const std::string& key, std::uint32_t size, std::int32_t date,
                   std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata = nullptr) {
  return {key, key, size, false, date, date, std::move(metadata)};
}

std::vector<std::string> keysOf(const std::vector<DiskCacheItem>& items) {
  std::vector<std::string> keys;
  for (const DiskCacheItem& each : items) keys.push_back(each.key);
  return keys;
}

class DiskCacheManifestTest : public testing::Test {
 protected:
  void create(std::shared_ptr<PruneStrategyBase> strategy = nullptr) {
    manifest_ = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(medium_), executor_,
                                                    std::move(strategy));
  }
  void createLoaded(std::shared_ptr<PruneStrategyBase> strategy = nullptr) {
    create(std::move(strategy));
    manifest_->load();
  }
  void restart() {
    manifest_.reset();
    createLoaded();
  }

  // Items "0", "1", ... of `size` bytes, last used at 1000, 1001, ...
  void fill(int count, std::uint32_t size = 10) {
    for (int i = 0; i < count; ++i) manifest_->setItem(item(std::to_string(i), size, 1000 + i));
  }
  void use(int count) {
    for (int i = 0; i < count; ++i) manifest_->updateLastAccessDate(std::to_string(i));
  }
  bool fireTimer() { return executor_->fireTimer(kFlushInterval); }

  std::vector<std::string> keysInMemory() {
    auto keys = manifest_->getAllKeys();
    std::sort(keys.begin(), keys.end());
    return keys;
  }
  std::uint32_t sumInMemory() {
    std::uint32_t sum = 0;
    for (const std::string& key : manifest_->getAllKeys()) sum += manifest_->getItem(key)->size;
    return sum;
  }

  // Memory and medium hold the same records, and the total is their sum.
  void expectConsistent() {
    EXPECT_EQ(keysInMemory(), medium_->keys());
    EXPECT_EQ(manifest_->count(), medium_->rows().size());
    EXPECT_EQ(manifest_->size(), sumInMemory());
    for (const auto& [key, row] : medium_->rows()) {
      const auto inMemory = manifest_->getItem(key);
      ASSERT_NE(inMemory, nullptr) << key;
      EXPECT_EQ(inMemory->size, row.item.size) << key;
      EXPECT_EQ(inMemory->filename, row.item.filename) << key;
      EXPECT_EQ(inMemory->hasInlineData, row.item.hasInlineData) << key;
      EXPECT_EQ(inMemory->modificationDate, row.item.modificationDate) << key;
    }
  }

  std::shared_ptr<MemoryMedium> medium_ = std::make_shared<MemoryMedium>();
  std::shared_ptr<ManualExecutor> executor_ = std::make_shared<ManualExecutor>();
  std::shared_ptr<DiskCacheManifest> manifest_;
};

// --- Before loading ---

TEST_F(DiskCacheManifestTest, ANewManifestIsNotLoadedAndKnowsNoTotals) {
  medium_->put(item("a", 7, 1));
  create();

  EXPECT_FALSE(manifest_->isLoaded());
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_EQ(manifest_->size(), 0U);
  EXPECT_THAT(executor_->timers(), IsEmpty());
  EXPECT_THAT(medium_->calls("getAllItems"), IsEmpty());
}

TEST_F(DiskCacheManifestTest, AskingForAllKeysBeforeLoadingThrows) {
  create();
  try {
    manifest_->getAllKeys();
    FAIL() << "Nothing was thrown.";
  } catch (const DiskCacheManifestException& error) {
    EXPECT_STREQ(error.description(), "Manifest hasn't been loaded from disk yet");
    EXPECT_STREQ(error.domain(), "QZDiskCacheManifestErrorDomain");
    EXPECT_EQ(error.code(), 0);
  }
}

TEST_F(DiskCacheManifestTest, ARecordAskedForBeforeLoadingIsReadOnceAndKept) {
  medium_->put(item("a", 7, 1));
  create();

  EXPECT_EQ(manifest_->getItem("a")->size, 7U);
  EXPECT_EQ(manifest_->getItem("a")->size, 7U);
  EXPECT_THAT(medium_->calls("getItem"), ElementsAre("a"));
  EXPECT_EQ(manifest_->count(), 1U);
  EXPECT_EQ(manifest_->size(), 7U);
  EXPECT_FALSE(manifest_->isLoaded());
}

TEST_F(DiskCacheManifestTest, AnUnknownKeyIsNullBeforeAndAfterLoading) {
  create();
  EXPECT_EQ(manifest_->getItem("a"), nullptr);
  EXPECT_EQ(manifest_->getModificationDate("a"), std::nullopt);
  EXPECT_EQ(manifest_->count(), 0U);

  manifest_->load();
  medium_->forgetCalls();
  EXPECT_EQ(manifest_->getItem("a"), nullptr);
  EXPECT_EQ(manifest_->getModificationDate("a"), std::nullopt);
  EXPECT_THAT(medium_->calls("getItem"), IsEmpty());
}

TEST_F(DiskCacheManifestTest, TheModificationDateIsThatOfTheRecordBeforeAndAfterLoading) {
  DiskCacheItem changed = item("a", 7, 5);
  changed.modificationDate = -3;
  medium_->put(changed);
  create();
  EXPECT_EQ(manifest_->getModificationDate("a"), -3);

  manifest_->load();
  EXPECT_EQ(manifest_->getModificationDate("a"), -3);
}

TEST_F(DiskCacheManifestTest, PrunesBeforeLoadingTakeNothing) {
  medium_->put(item("a", 7, 1));
  create();
  manifest_->getItem("a");

  EXPECT_THAT(manifest_->pruneToSize(0, kMany), IsEmpty());
  EXPECT_THAT(manifest_->pruneOldEntries(1000, kMany), IsEmpty());
  EXPECT_EQ(manifest_->pruneOldestItem(), nullptr);
  EXPECT_THAT(medium_->keys(), ElementsAre("a"));
}

TEST_F(DiskCacheManifestTest, AKeyRemovedBeforeLoadingIsGoneFromTheMediumWhetherItWasReadOrNot) {
  medium_->put(item("read", 7, 1));
  medium_->put(item("unread", 9, 1));
  create();
  manifest_->getItem("read");

  manifest_->removeItem("read");
  manifest_->removeItem("unread");
  EXPECT_EQ(manifest_->size(), 0U);
  EXPECT_THAT(medium_->keys(), IsEmpty());

  manifest_->load();
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_EQ(manifest_->getItem("read"), nullptr);
}

TEST_F(DiskCacheManifestTest, AnItemUsedBeforeLoadingIsReadAndDatedNow) {
  const ManualClock clock(5000);
  medium_->put(item("a", 7, 1));
  create();

  manifest_->updateLastAccessDate("a");
  manifest_->updateLastAccessDate("unknown");
  EXPECT_EQ(manifest_->count(), 1U);

  manifest_->load();
  EXPECT_EQ(manifest_->getItem("a")->lastAccessDate, 5000);
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), ElementsAre("a"));
  EXPECT_EQ(medium_->accessDate("a"), 5000);
}

// --- Loading ---

TEST_F(DiskCacheManifestTest, LoadingTakesEveryRecordIn) {
  medium_->put(item("a", 7, 1));
  medium_->put(item("b", 9, 2));
  createLoaded();

  EXPECT_TRUE(manifest_->isLoaded());
  EXPECT_THAT(keysInMemory(), ElementsAre("a", "b"));
  EXPECT_EQ(manifest_->count(), 2U);
  EXPECT_EQ(manifest_->size(), 16U);
}

TEST_F(DiskCacheManifestTest, RecordsReadOrSetBeforeLoadingTakePrecedence) {
  medium_->put(item("read", 7, 1));
  medium_->put(item("set", 9, 1));
  create();
  manifest_->getItem("read");
  manifest_->setItem(item("set", 20, 2));
  medium_->put(item("read", 1000, 1));
  medium_->put(item("set", 1000, 1));

  manifest_->load();
  EXPECT_EQ(manifest_->getItem("read")->size, 7U);
  EXPECT_EQ(manifest_->getItem("set")->size, 20U);
  EXPECT_EQ(manifest_->size(), 27U);
  EXPECT_EQ(manifest_->count(), 2U);
}

TEST_F(DiskCacheManifestTest, LoadingTwiceChangesNothingAndKeepsOneTimer) {
  medium_->put(item("a", 7, 1));
  createLoaded();
  medium_->put(item("behind", 100, 1));
  manifest_->load();

  EXPECT_EQ(manifest_->count(), 1U);
  EXPECT_EQ(manifest_->size(), 7U);
  EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
}

TEST_F(DiskCacheManifestTest, ALoadThatFailsLeavesItUnloadedAndASecondOneWorks) {
  medium_->put(item("a", 7, 1));
  create();
  medium_->fail("getAllItems");
  EXPECT_THROW(manifest_->load(), ManifestPersistenceException);
  EXPECT_FALSE(manifest_->isLoaded());
  EXPECT_EQ(manifest_->count(), 0U);

  medium_->heal();
  manifest_->load();
  EXPECT_TRUE(manifest_->isLoaded());
  EXPECT_EQ(manifest_->count(), 1U);
  EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
}

TEST_F(DiskCacheManifestTest, RecordsAreReadAndSetWhileALoadIsUnderWayAndTakePrecedence) {
  medium_->put(item("a", 7, 1));
  medium_->put(item("b", 9, 1));
  create();
  medium_->onCall = [&](const std::string& operation, const std::string&) {
    if (operation != "getAllItems") return;
    EXPECT_EQ(manifest_->getItem("a")->size, 7U);  // would wait for ever under the lock of the items
    manifest_->setItem(item("b", 30, 2));
  };
  manifest_->load();
  medium_->onCall = nullptr;

  EXPECT_EQ(manifest_->getItem("b")->size, 30U);
  EXPECT_EQ(manifest_->size(), 37U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, AnInlineValueSetWhileALoadIsUnderWayIsFoundAfterwards) {
  medium_->put(item("a", 2, 1));
  create();
  medium_->onCall = [&](const std::string& operation, const std::string&) {
    if (operation == "getAllItems") manifest_->setInlineData("a", {1, 2});
  };
  manifest_->load();
  medium_->onCall = nullptr;

  EXPECT_EQ(manifest_->getInlineData("a"), (Bytes{1, 2}));
  expectConsistent();
}

// Another thread's call begins while a load is reading, and gets no further before that is done.
class DiskCacheManifestHeldOffByALoad : public DiskCacheManifestTest {
 protected:
  void expectHeldOff(const std::string& operation, const std::function<void()>& call) {
    medium_->put(item("a", 7, 1));
    medium_->put(item("b", 9, 1));
    create();
    std::thread other;
    medium_->onCall = [&](const std::string& happened, const std::string&) {
      if (happened != "getAllItems") return;
      test::Latch begun(1);
      other = std::thread([&] {
        begun.countDown();
        call();
      });
      begun.wait();
      for (int i = 0; i < 200; ++i) {
        std::this_thread::yield();
        ASSERT_THAT(medium_->calls(operation), IsEmpty());
      }
    };
    manifest_->load();
    other.join();
    medium_->onCall = nullptr;
    EXPECT_THAT(medium_->calls(operation), SizeIs(1));
  }
};

TEST_F(DiskCacheManifestHeldOffByALoad, AClearWaits) {
  expectHeldOff("clearItems", [&] { manifest_->clear(); });
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_EQ(manifest_->size(), 0U);
}

TEST_F(DiskCacheManifestHeldOffByALoad, ARemovalWaitsSoThatTheKeyDoesNotComeBack) {
  expectHeldOff("removeItem", [&] { manifest_->removeItem("a"); });
  EXPECT_EQ(manifest_->getItem("a"), nullptr);
  EXPECT_EQ(manifest_->size(), 9U);
  expectConsistent();
}

// --- Setting and removing ---

TEST_F(DiskCacheManifestTest, AnItemThatIsSetIsOnTheMediumAtOnce) {
  createLoaded();
  manifest_->setItem(item("a", 7, 1));
  EXPECT_EQ(medium_->row("a").item.size, 7U);
  EXPECT_EQ(manifest_->getItem("a")->size, 7U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, ReplacingAnItemChangesTheTotalByTheDifference) {
  createLoaded();
  manifest_->setItem(item("a", 100, 1));
  manifest_->setItem(item("b", 5, 1));
  manifest_->setItem(item("a", 40, 1));
  EXPECT_EQ(manifest_->size(), 45U);
  EXPECT_EQ(manifest_->count(), 2U);
  manifest_->setItem(item("a", 140, 1));
  EXPECT_EQ(manifest_->size(), 145U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, ReplacingAnItemBeforeLoadingCountsItOnce) {
  medium_->put(item("a", 100, 1));
  create();
  manifest_->getItem("a");
  manifest_->setItem(item("a", 1, 2));
  EXPECT_EQ(manifest_->size(), 1U);
  manifest_->load();
  EXPECT_EQ(manifest_->size(), 1U);
}

TEST_F(DiskCacheManifestTest, WhenSettingFailsMemoryIsAsBefore) {
  createLoaded();
  manifest_->setItem(item("a", 7, 1));
  medium_->fail("setItem");
  EXPECT_THROW(manifest_->setItem(item("a", 100, 2)), ManifestPersistenceException);
  EXPECT_THROW(manifest_->setItem(item("b", 100, 2)), ManifestPersistenceException);

  EXPECT_EQ(manifest_->getItem("a")->size, 7U);
  EXPECT_EQ(manifest_->getItem("b"), nullptr);
  EXPECT_EQ(manifest_->size(), 7U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, WhatIsReturnedIsACopy) {
  createLoaded();
  const auto metadata = std::make_shared<VideoDownloadExtendedMetadata>(3, ItemType::VideoChunk);
  manifest_->setItem(item("a", 7, 1, metadata));
  const auto copy = manifest_->getItem("a");
  copy->size = 1000;
  copy->filename = "elsewhere";

  EXPECT_EQ(manifest_->getItem("a")->size, 7U);
  EXPECT_EQ(manifest_->getItem("a")->filename, "a");
  EXPECT_EQ(manifest_->getItem("a")->extendedMetadata, metadata);
}

TEST_F(DiskCacheManifestTest, RemovingTakesRecordAndSize) {
  createLoaded();
  fill(3);
  manifest_->removeItem("1");
  EXPECT_EQ(manifest_->size(), 20U);
  EXPECT_EQ(manifest_->getItem("1"), nullptr);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, RemovingWhatIsNotThereTouchesNothing) {
  createLoaded();
  fill(1);
  medium_->forgetCalls();
  manifest_->removeItem("unknown");
  EXPECT_THAT(medium_->calls("removeItem"), IsEmpty());
  EXPECT_EQ(manifest_->size(), 10U);
}

TEST_F(DiskCacheManifestTest, WhenRemovingFailsMemoryIsAsBefore) {
  createLoaded();
  fill(1);
  medium_->fail("removeItem");
  EXPECT_THROW(manifest_->removeItem("0"), ManifestPersistenceException);
  EXPECT_NE(manifest_->getItem("0"), nullptr);
  EXPECT_EQ(manifest_->size(), 10U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, TheTotalWrapsAtThirtyTwoBitsAndComesBack) {
  createLoaded();
  manifest_->setItem(item("huge", kMany, 1));
  manifest_->setItem(item("small", 3, 2));
  EXPECT_EQ(manifest_->size(), 2U);
  manifest_->removeItem("huge");
  EXPECT_EQ(manifest_->size(), 3U);
  manifest_->removeItem("small");
  EXPECT_EQ(manifest_->size(), 0U);

  medium_->put(item("one", 1U << 31U, 1));
  medium_->put(item("two", 1U << 31U, 1));
  restart();
  EXPECT_EQ(manifest_->size(), 0U);
  EXPECT_EQ(manifest_->pruneOldestItem()->size, 1U << 31U);
  EXPECT_EQ(manifest_->size(), 1U << 31U);
}

// --- Clearing ---

TEST_F(DiskCacheManifestTest, ClearingLeavesAnEmptyLoadedManifest) {
  create();
  fill(3);
  manifest_->clear();
  EXPECT_TRUE(manifest_->isLoaded());
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_EQ(manifest_->size(), 0U);
  EXPECT_THAT(keysInMemory(), IsEmpty());
  EXPECT_THAT(medium_->calls("clearItems"), SizeIs(1));
}

TEST_F(DiskCacheManifestTest, LoadingAfterClearingBringsNothingBackAndStartsTheTimer) {
  create();
  manifest_->clear();
  medium_->put(item("left", 7, 1));
  EXPECT_THAT(executor_->armedDelays(), IsEmpty());
  manifest_->load();
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
}

TEST_F(DiskCacheManifestTest, AClearThatFailsBeforeLoadingDoesNotCountAsLoaded) {
  medium_->put(item("a", 7, 1));
  create();
  manifest_->getItem("a");
  medium_->fail("clearItems");
  EXPECT_THROW(manifest_->clear(), ManifestPersistenceException);
  EXPECT_FALSE(manifest_->isLoaded());

  medium_->heal();
  manifest_->clear();
  EXPECT_TRUE(manifest_->isLoaded());
  EXPECT_EQ(manifest_->size(), 0U);
  EXPECT_EQ(manifest_->count(), 0U);
}

// --- Inline values ---

TEST_F(DiskCacheManifestTest, AnInlineValueIsFoundAtOnceAndMarksTheRecord) {
  createLoaded();
  manifest_->setItem(item("a", 2, 1));
  manifest_->setInlineData("a", {1, 2});
  EXPECT_TRUE(manifest_->getItem("a")->hasInlineData);
  EXPECT_EQ(manifest_->getInlineData("a"), (Bytes{1, 2}));
  EXPECT_EQ(manifest_->getItem("a")->lastAccessDate, 1);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, RemovingAnInlineValueLeavesTheRecord) {
  createLoaded();
  manifest_->setItem(item("a", 2, 1));
  manifest_->setInlineData("a", {1, 2});
  manifest_->removeInlineData("a");
  EXPECT_FALSE(manifest_->getItem("a")->hasInlineData);
  EXPECT_THAT(manifest_->getInlineData("a"), IsEmpty());
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, SettingTheItemAgainDropsItsInlineValue) {
  createLoaded();
  manifest_->setItem(item("a", 2, 1));
  manifest_->setInlineData("a", {1, 2});
  manifest_->setItem(item("a", 2, 1));
  EXPECT_THAT(manifest_->getInlineData("a"), IsEmpty());
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, AnInlineValueIsNotLookedForWhereTheRecordHasNone) {
  createLoaded();
  manifest_->setItem(item("a", 2, 1));
  EXPECT_THAT(manifest_->getInlineData("a"), IsEmpty());
  EXPECT_THAT(manifest_->getInlineData("unknown"), IsEmpty());
  EXPECT_THAT(medium_->calls("getInlineData"), IsEmpty());
}

TEST_F(DiskCacheManifestTest, AnInlineValueIsReadFromTheMediumBeforeLoading) {
  DiskCacheItem stored = item("a", 2, 1);
  stored.hasInlineData = true;
  medium_->put(stored, {1, 2});
  create();
  EXPECT_EQ(manifest_->getInlineData("a"), (Bytes{1, 2}));
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_THAT(manifest_->getInlineData("unknown"), IsEmpty());

  EXPECT_TRUE(manifest_->getItem("a")->hasInlineData);
  EXPECT_EQ(manifest_->getInlineData("a"), (Bytes{1, 2}));
}

TEST_F(DiskCacheManifestTest, WhenAnInlineValueCannotBeWrittenOrRemovedTheMarkIsAsBefore) {
  createLoaded();
  manifest_->setItem(item("a", 2, 1));
  medium_->fail("setInlineData");
  EXPECT_THROW(manifest_->setInlineData("a", {1, 2}), ManifestPersistenceException);
  EXPECT_FALSE(manifest_->getItem("a")->hasInlineData);

  medium_->heal();
  manifest_->setInlineData("a", {1, 2});
  medium_->fail("removeInlineData");
  EXPECT_THROW(manifest_->removeInlineData("a"), ManifestPersistenceException);
  EXPECT_EQ(manifest_->getInlineData("a"), (Bytes{1, 2}));
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, AnInlineValueForAKeyWithoutARecordMakesNone) {
  createLoaded();
  manifest_->setInlineData("a", {1, 2});
  manifest_->removeInlineData("b");
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_THAT(manifest_->getInlineData("a"), IsEmpty());
  EXPECT_THAT(medium_->keys(), IsEmpty());
}

// --- Access dates ---

TEST_F(DiskCacheManifestTest, UsingAnItemDatesItInMemoryAndWritesNothingYet) {
  ManualClock clock(5000);
  createLoaded();
  fill(1);
  medium_->forgetCalls();
  manifest_->updateLastAccessDate("0");

  EXPECT_EQ(manifest_->getItem("0")->lastAccessDate, 5000);
  EXPECT_EQ(manifest_->getItem("0")->modificationDate, 1000);
  EXPECT_EQ(medium_->writes(), 0U);
  EXPECT_EQ(executor_->pending(), 0U);

  clock.set(5003);
  manifest_->updateLastAccessDate("0");
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), ElementsAre("0"));
  EXPECT_EQ(medium_->accessDate("0"), 5003);
}

TEST_F(DiskCacheManifestTest, FiveHundredAndTwelveUsedItemsWaitForTheTimer) {
  const ManualClock clock(5000);
  createLoaded();
  fill(512);
  medium_->forgetCalls();
  use(512);
  use(512);
  EXPECT_EQ(executor_->pending(), 0U);
  EXPECT_EQ(medium_->writes(), 0U);

  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), SizeIs(512));
}

TEST_F(DiskCacheManifestTest, TheFiveHundredAndThirteenthSendsAllOfThemInOneTask) {
  const ManualClock clock(5000);
  createLoaded();
  fill(513);
  medium_->forgetCalls();
  use(512);
  EXPECT_EQ(executor_->pending(), 0U);
  manifest_->updateLastAccessDate("512");
  EXPECT_EQ(executor_->pending(), 1U);
  EXPECT_EQ(medium_->writes(), 0U);

  EXPECT_EQ(executor_->runAll(), 1U);
  const auto written = medium_->calls("updateLastAccessDate");
  EXPECT_THAT(written, SizeIs(513));
  EXPECT_THAT(std::set<std::string>(written.begin(), written.end()), SizeIs(513));
  EXPECT_EQ(medium_->accessDate("512"), 5000);

  // The count begins anew, and the timer finds nothing left.
  use(512);
  EXPECT_EQ(executor_->pending(), 0U);
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), SizeIs(512));
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), IsEmpty());
}

TEST_F(DiskCacheManifestTest, AnExecutorThatTakesNoTaskLosesNoDate) {
  const ManualClock clock(5000);
  createLoaded();
  fill(513);
  medium_->forgetCalls();
  use(512);
  executor_->throwOnDispatch(true);
  EXPECT_THROW(manifest_->updateLastAccessDate("512"), std::runtime_error);
  executor_->throwOnDispatch(false);
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), SizeIs(513));
}

TEST_F(DiskCacheManifestTest, OneItemUsedOverAndOverIsOneDate) {
  createLoaded();
  fill(1);
  for (int i = 0; i < 2000; ++i) manifest_->updateLastAccessDate("0");
  EXPECT_EQ(executor_->pending(), 0U);
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), ElementsAre("0"));
}

TEST_F(DiskCacheManifestTest, KeysThatAreNotThereLeaveNoDates) {
  createLoaded();
  use(2000);
  EXPECT_EQ(executor_->pending(), 0U);
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(medium_->writes(), 0U);
}

TEST_F(DiskCacheManifestTest, DatesFromBeforeLoadingAreSentByTheFirstUseAfterIt) {
  for (int i = 0; i < 601; ++i) medium_->put(item(std::to_string(i), 1, 1));
  create();
  use(600);
  EXPECT_EQ(executor_->pending(), 0U);

  manifest_->load();
  EXPECT_EQ(executor_->pending(), 0U);
  manifest_->updateLastAccessDate("600");
  EXPECT_EQ(executor_->runAll(), 1U);
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), SizeIs(601));
}

TEST_F(DiskCacheManifestTest, AnExecutorThatRunsTasksAtOnceDoesNotDeadlock) {
  executor_->onDispatch = [this] { executor_->runAll(); };
  createLoaded();
  fill(513);
  use(513);
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), SizeIs(513));
}

TEST_F(DiskCacheManifestTest, DatesAreWrittenWithoutTheLockOfTheItems) {
  createLoaded();
  fill(3);
  use(3);
  int reentered = 0;
  medium_->onCall = [&](const std::string& operation, const std::string& key) {
    if (operation != "updateLastAccessDate") return;
    ++reentered;
    EXPECT_NE(manifest_->getItem(key), nullptr);
    manifest_->updateLastAccessDate(key);
    manifest_->removeItem(std::to_string(100 + reentered));
  };
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(reentered, 3);

  medium_->onCall = nullptr;
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());  // what was used meanwhile has waited for this one
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), UnorderedElementsAre("0", "1", "2"));
}

// --- The timer ---

TEST_F(DiskCacheManifestTest, TheTimerIsArmedForTwoMinutesAndAgainAfterEachFiring) {
  createLoaded();
  ASSERT_THAT(executor_->timers(), SizeIs(1));
  EXPECT_EQ(executor_->timers()[0].delayNanoseconds, kFlushInterval);
  EXPECT_TRUE(executor_->timers()[0].viaSchedule);
  for (int i = 0; i < 3; ++i) {
    EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
    ASSERT_TRUE(fireTimer());
  }
  EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
  EXPECT_THAT(executor_->timers(), SizeIs(4));
}

// A host whose timers fire again and again until their handle goes.
class RepeatingExecutor final : public AsyncExecutor {
 public:
  void dispatch(std::function<void()> task) override { task(); }
  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t, std::function<void()>, std::function<void()>) override {
    throw std::logic_error("Not asked for here.");
  }
  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t, std::function<void()> task, std::function<void()>) override {
    tasks_.push_back(std::make_shared<std::function<void()>>(std::move(task)));
    return std::make_unique<Handle>(tasks_.back());
  }
  // Fires every timer whose handle is there.
  void tick() {
    const auto tasks = tasks_;
    for (const auto& task : tasks) {
      const std::function<void()> running = *task;  // it may replace its own handle
      if (running) running();
    }
  }
  std::size_t armed() const {
    return static_cast<std::size_t>(
        std::count_if(tasks_.begin(), tasks_.end(), [](const auto& task) { return *task != nullptr; }));
  }

 private:
  struct Handle final : AsyncTimer {
    explicit Handle(std::shared_ptr<std::function<void()>> task_) : task(std::move(task_)) {}
    ~Handle() override { *task = nullptr; }
    std::shared_ptr<std::function<void()>> task;
  };
  std::vector<std::shared_ptr<std::function<void()>>> tasks_;
};

TEST_F(DiskCacheManifestTest, OnAHostWhoseTimersRepeatThereIsOneTimerAndEachFiringFlushesOnce) {
  const auto repeating = std::make_shared<RepeatingExecutor>();
  auto manifest = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(medium_), repeating, nullptr);
  manifest->setItem(item("a", 1, 1));
  manifest->load();
  for (int i = 0; i < 3; ++i) {
    manifest->updateLastAccessDate("a");
    medium_->forgetCalls();
    EXPECT_EQ(repeating->armed(), 1U);
    repeating->tick();
    EXPECT_THAT(medium_->calls("updateLastAccessDate"), ElementsAre("a"));
  }
  manifest.reset();
  EXPECT_EQ(repeating->armed(), 0U);
}

TEST_F(DiskCacheManifestTest, TheTimerIsArmedAgainWhenDatesCannotBeWritten) {
  createLoaded();
  fill(1);
  use(1);
  medium_->fail("updateLastAccessDate");
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
}

// --- Dates that cannot be written ---

TEST_F(DiskCacheManifestTest, DatesThatCannotBeWrittenAreOneErrorLineAndWaitForTheNextTime) {
  const ManualClock clock(5000);
  createLoaded();
  fill(5);
  use(5);
  medium_->forgetCalls();
  medium_->fail("updateLastAccessDate", 2);
  const LogCapture log;
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("The medium is full."));
  const auto tried = medium_->calls("updateLastAccessDate");
  ASSERT_THAT(tried, SizeIs(3));

  medium_->heal();
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  const auto written = medium_->calls("updateLastAccessDate");
  EXPECT_THAT(written, SizeIs(3));  // the one that failed and the two after it
  EXPECT_EQ(std::count(written.begin(), written.end(), tried[2]), 1);
  for (int i = 0; i < 5; ++i) EXPECT_EQ(medium_->accessDate(std::to_string(i)), 5000);
}

TEST_F(DiskCacheManifestTest, AnItemUsedAgainBeforeTheNextTimeKeepsItsNewerDate) {
  ManualClock clock(5000);
  createLoaded();
  fill(1);
  use(1);
  medium_->fail("updateLastAccessDate");
  medium_->onCall = nullptr;
  ASSERT_TRUE(fireTimer());

  clock.set(6000);
  use(1);
  medium_->heal();
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(medium_->accessDate("0"), 6000);
}

TEST_F(DiskCacheManifestTest, AFailedTaskOfFiveHundredAndThirteenIsKeptToo) {
  const ManualClock clock(5000);
  createLoaded();
  fill(513);
  use(513);
  medium_->fail("updateLastAccessDate", 500);
  executor_->runAll();
  medium_->heal();
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), SizeIs(13));
  for (const auto& row : medium_->rows()) EXPECT_EQ(row.second.item.lastAccessDate, 5000) << row.first;
}

TEST_F(DiskCacheManifestTest, FailedDatesOfAnItemThatHasGoneAreForgotten) {
  createLoaded();
  fill(2);
  use(2);
  medium_->fail("updateLastAccessDate");
  ASSERT_TRUE(fireTimer());
  manifest_->removeItem("0");
  medium_->heal();
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), ElementsAre("1"));
}

// --- A flush that fails, or has not run yet, is not multiplied ---

class DiskCacheManifestFlush : public DiskCacheManifestTest {
 protected:
  void SetUp() override {
    createLoaded();
    fill(kItems);
    medium_->forgetCalls();
  }
  void useAll() { use(kItems); }
  std::size_t written() const { return medium_->calls("updateLastAccessDate").size(); }

  // As many as the next use of another item sends off.
  static constexpr int kItems = 2 * 513;

  ManualClock clock_{5000};
};

TEST_F(DiskCacheManifestFlush, ThatFailedIsNotTriedAgainByFetches) {
  medium_->fail("updateLastAccessDate");
  const LogCapture log;
  use(513);
  executor_->runAll();
  EXPECT_EQ(written(), 1U);  // tried, in vain
  EXPECT_EQ(log.errorCount(), 1U);

  for (int i = 0; i < 10; ++i) {
    useAll();
    EXPECT_EQ(executor_->pending(), 0U);
  }
  EXPECT_EQ(written(), 1U);
  EXPECT_EQ(log.errorCount(), 1U);
}

TEST_F(DiskCacheManifestFlush, ThatFailedIsTriedAgainByTheTimerWithOneLineEachTime) {
  medium_->fail("updateLastAccessDate");
  const LogCapture log;
  use(513);
  executor_->runAll();
  for (std::size_t failures = 2; failures < 5; ++failures) {
    ASSERT_TRUE(fireTimer());
    useAll();
    EXPECT_EQ(executor_->pending(), 0U);
    EXPECT_EQ(written(), failures);
    EXPECT_EQ(log.errorCount(), failures);
  }
}

TEST_F(DiskCacheManifestFlush, ThatFailedOnTheTimerIsNotTriedAgainByFetchesEither) {
  medium_->fail("updateLastAccessDate");
  use(512);
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(written(), 1U);
  useAll();
  EXPECT_EQ(executor_->pending(), 0U);
}

TEST_F(DiskCacheManifestFlush, ThatFailedKeepsTheNewestDateOfEachItem) {
  medium_->fail("updateLastAccessDate", 100);
  use(513);
  executor_->runAll();
  clock_.set(6000);
  for (int i = 0; i < 3; ++i) use(600);
  medium_->heal();
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(written(), 600U);
  for (int i = 0; i < 600; ++i) EXPECT_EQ(medium_->accessDate(std::to_string(i)), 6000);
}

TEST_F(DiskCacheManifestFlush, ThatSucceedsOnTheTimerEndsTheWaiting) {
  medium_->fail("updateLastAccessDate");
  use(513);
  executor_->runAll();
  medium_->heal();
  ASSERT_TRUE(fireTimer());

  use(512);
  EXPECT_EQ(executor_->pending(), 0U);
  manifest_->updateLastAccessDate("512");
  EXPECT_EQ(executor_->pending(), 1U);
}

TEST_F(DiskCacheManifestFlush, ThatFailedWaitsNoLongerOnceTheManifestBeginsAnew) {
  medium_->fail("updateLastAccessDate");
  use(513);
  executor_->runAll();
  medium_->heal();
  manifest_->clear();
  fill(513);
  use(513);
  EXPECT_EQ(executor_->pending(), 1U);
}

TEST_F(DiskCacheManifestFlush, WithADateThatAnyExceptionKeepsFromBeingWrittenWaitsForTheTimerToo) {
  medium_->onCall = [](const std::string&, const std::string&) { throw std::bad_alloc(); };
  const LogCapture log;
  use(513);
  EXPECT_NO_THROW(executor_->runAll());
  useAll();
  EXPECT_EQ(executor_->pending(), 0U);
  EXPECT_NO_THROW(fireTimer());
  EXPECT_THAT(executor_->armedDelays(), ElementsAre(kFlushInterval));
  EXPECT_EQ(log.errorCount(), 2U);

  medium_->onCall = nullptr;
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(written(), static_cast<std::size_t>(kItems));
}

TEST_F(DiskCacheManifestFlush, ThatHasNotRunYetIsTheOnlyOne) {
  for (int i = 0; i < 3; ++i) {
    useAll();
    EXPECT_EQ(executor_->pending(), 1U);
  }
  EXPECT_EQ(written(), 0U);

  EXPECT_EQ(executor_->runAll(), 1U);  // the first 513, and then all others
  for (int i = 0; i < kItems; ++i) EXPECT_EQ(medium_->accessDate(std::to_string(i)), 5000) << i;
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(written(), 0U);
}

TEST_F(DiskCacheManifestFlush, LeavesFiveHundredAndTwelveThatCameWhileItWasQueuedToTheTimer) {
  use(513);
  for (int i = 513; i < 513 + 512; ++i) manifest_->updateLastAccessDate(std::to_string(i));
  EXPECT_EQ(executor_->runAll(), 1U);
  EXPECT_EQ(written(), 513U);
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(written(), 513U + 512U);
}

TEST_F(DiskCacheManifestFlush, ThatFailsLeavesWhatCameWhileItWasQueuedToTheTimer) {
  useAll();
  medium_->fail("updateLastAccessDate");
  const LogCapture log;
  EXPECT_EQ(executor_->runAll(), 1U);
  EXPECT_EQ(log.errorCount(), 1U);

  medium_->heal();
  medium_->forgetCalls();
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(written(), static_cast<std::size_t>(kItems));
}

TEST_F(DiskCacheManifestFlush, ThatTheExecutorDropsDoesNotHoldUpTheNext) {
  use(513);
  executor_->dropAll();
  use(512);
  EXPECT_EQ(executor_->pending(), 0U);
  manifest_->updateLastAccessDate("512");
  EXPECT_EQ(executor_->pending(), 1U);
  EXPECT_EQ(executor_->runAll(), 1U);
  EXPECT_EQ(written(), 513U);
}

TEST_F(DiskCacheManifestFlush, ThatWasQueuedBeforeTheTimersFailedMayStillSucceedAndEndTheWaiting) {
  useAll();
  ASSERT_EQ(executor_->pending(), 1U);
  medium_->fail("updateLastAccessDate");
  ASSERT_TRUE(fireTimer());
  medium_->heal();
  EXPECT_EQ(executor_->runAll(), 1U);
  for (int i = 0; i < kItems; ++i) EXPECT_EQ(medium_->accessDate(std::to_string(i)), 5000) << i;
}

// --- What becomes of waiting dates ---

class DiskCacheManifestWaitingDates : public DiskCacheManifestTest {
 protected:
  // Items "0" and "1" of 1000 and 1001, used at 5000 and not written yet.
  void SetUp() override {
    createLoaded();
    fill(2);
    use(2);
    medium_->forgetCalls();
  }
  std::vector<std::string> flushed() {
    EXPECT_TRUE(fireTimer());
    return medium_->calls("updateLastAccessDate");
  }

  ManualClock clock_{5000};
};

TEST_F(DiskCacheManifestWaitingDates, SettingTheItemDropsIts) {
  manifest_->setItem(item("0", 1, 4000));
  EXPECT_THAT(flushed(), ElementsAre("1"));
  EXPECT_EQ(medium_->accessDate("0"), 4000);
  EXPECT_EQ(manifest_->getItem("0")->lastAccessDate, 4000);
}

TEST_F(DiskCacheManifestWaitingDates, RemovingTheItemDropsItsSoThatALaterItemOfThatKeyKeepsItsOwn) {
  manifest_->removeItem("0");
  medium_->put(item("0", 1, 77));
  EXPECT_THAT(flushed(), ElementsAre("1"));
  EXPECT_EQ(medium_->accessDate("0"), 77);
}

TEST_F(DiskCacheManifestWaitingDates, ClearingDropsAll) {
  manifest_->clear();
  EXPECT_THAT(flushed(), IsEmpty());
}

TEST_F(DiskCacheManifestWaitingDates, PruningDropsThoseOfWhatGoes) {
  manifest_->setItem(item("2", 1, 1));
  manifest_->pruneToSize(0, kMany);
  EXPECT_THAT(flushed(), IsEmpty());
}

TEST_F(DiskCacheManifestWaitingDates, WhenSettingTheItemFailsItsWaitsOn) {
  medium_->fail("setItem");
  EXPECT_THROW(manifest_->setItem(item("0", 1, 4000)), ManifestPersistenceException);
  EXPECT_THAT(flushed(), UnorderedElementsAre("0", "1"));
}

TEST_F(DiskCacheManifestWaitingDates, DestroyingTheManifestWritesThem) {
  manifest_.reset();
  EXPECT_THAT(medium_->calls("updateLastAccessDate"), UnorderedElementsAre("0", "1"));
  EXPECT_EQ(medium_->accessDate("0"), 5000);
  EXPECT_EQ(medium_->accessDate("1"), 5000);
}

TEST_F(DiskCacheManifestWaitingDates, DestroyingTheManifestOnAFullMediumIsOneErrorLine) {
  medium_->fail("updateLastAccessDate");
  const LogCapture log;
  manifest_.reset();
  EXPECT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("The medium is full."));
}

TEST_F(DiskCacheManifestWaitingDates, OfATaskThatHasNotRunDoNotTurnBackTheDateOfAnItemThatIsSetMeanwhile) {
  for (int i = 2; i < 513; ++i) manifest_->setItem(item(std::to_string(i), 1, 1000));
  use(513);
  ASSERT_EQ(executor_->pending(), 1U);

  manifest_->setItem(item("0", 1, 6000));
  executor_->runAll();
  EXPECT_EQ(medium_->accessDate("0"), 6000);
  EXPECT_EQ(medium_->accessDate("1"), 5000);
}

TEST_F(DiskCacheManifestWaitingDates, ThatCouldNotBeWrittenDoNotTurnBackTheDateOfAnItemThatWasSetMeanwhile) {
  medium_->onCall = [&](const std::string& operation, const std::string& key) {
    if (operation != "updateLastAccessDate") return;
    medium_->fail("updateLastAccessDate");
    manifest_->setItem(item(key == "0" ? "1" : "0", 1, 6000));  // the one that is about to fail
  };
  ASSERT_TRUE(fireTimer());
  medium_->onCall = nullptr;
  medium_->heal();
  ASSERT_TRUE(fireTimer());
  EXPECT_EQ(std::max(medium_->accessDate("0"), medium_->accessDate("1")), 6000);
}

// --- Lifetimes ---

TEST_F(DiskCacheManifestTest, ATaskThatOutlivesTheManifestDoesNothing) {
  createLoaded();
  fill(513);
  use(513);
  ASSERT_EQ(executor_->pending(), 1U);
  manifest_.reset();
  medium_->forgetCalls();
  EXPECT_EQ(executor_->runAll(), 1U);
  EXPECT_EQ(medium_->writes(), 0U);
}

TEST_F(DiskCacheManifestTest, TheTimerGoesWithTheManifest) {
  createLoaded();
  manifest_.reset();
  EXPECT_THAT(executor_->armedDelays(), IsEmpty());
  EXPECT_TRUE(executor_->timers()[0].cancelled);
}

// Timers whose handle cancels nothing, as on a host where the task is already on its way when the handle goes.
class LateExecutor final : public AsyncExecutor {
 public:
  void dispatch(std::function<void()> task) override { tasks.push_back(std::move(task)); }
  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t, std::function<void()> task, std::function<void()>) override {
    tasks.push_back(std::move(task));
    return std::make_unique<AsyncTimer>();
  }
  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t, std::function<void()> task, std::function<void()>) override {
    tasks.push_back(std::move(task));
    return std::make_unique<AsyncTimer>();
  }
  std::vector<std::function<void()>> tasks;
};

TEST_F(DiskCacheManifestFlush, ThatHasRunIsOverAlsoWhereTheExecutorKeepsItsTask) {
  const auto late = std::make_shared<LateExecutor>();
  auto manifest = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(medium_), late, nullptr);
  manifest->load();
  ASSERT_THAT(late->tasks, SizeIs(1));  // the timer's
  for (std::size_t flushes = 1; flushes < 4; ++flushes) {
    for (int i = 0; i < 513; ++i) manifest->updateLastAccessDate(std::to_string(i));
    ASSERT_THAT(late->tasks, SizeIs(1 + flushes));
    late->tasks.back()();
    EXPECT_EQ(written(), 513U * flushes);
  }
}

TEST_F(DiskCacheManifestTest, ATimerTaskThatOutlivesTheManifestDoesNothing) {
  const auto late = std::make_shared<LateExecutor>();
  auto manifest = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(medium_), late, nullptr);
  manifest->load();
  manifest.reset();
  medium_->forgetCalls();
  ASSERT_THAT(late->tasks, SizeIs(1));
  late->tasks[0]();
  EXPECT_THAT(late->tasks, SizeIs(1));
  EXPECT_EQ(medium_->writes(), 0U);
}

TEST_F(DiskCacheManifestTest, ATimerTaskDoesNotKeepTheManifestAlive) {
  createLoaded();
  fill(513);
  use(513);
  const std::weak_ptr<DiskCacheManifest> weak = manifest_;
  manifest_.reset();
  EXPECT_TRUE(weak.expired());
}

TEST_F(DiskCacheManifestTest, TheLastReferenceMayGoWhileTheTimerTaskRuns) {
  const ManualClock clock(5000);
  createLoaded();
  fill(2);
  use(2);
  medium_->onCall = [&](const std::string&, const std::string&) { manifest_.reset(); };
  ASSERT_TRUE(fireTimer());
  medium_->onCall = nullptr;
  EXPECT_EQ(medium_->accessDate("0"), 5000);
  EXPECT_EQ(medium_->accessDate("1"), 5000);
  EXPECT_THAT(executor_->armedDelays(), IsEmpty());
}

TEST_F(DiskCacheManifestTest, KnowsItselfAsItsOwnTypeAndAsItsInterface) {
  create();
  EXPECT_EQ(manifest_->weak_from_this<DiskCacheManifest>().lock(), manifest_);
  EXPECT_EQ(manifest_->weak_from_this<DiskCacheManifestInterface>().lock(), manifest_);
}

// --- Invalidation ---

TEST_F(DiskCacheManifestTest, AfterInvalidationMemoryWorksAndTheMediumIsLeftAlone) {
  createLoaded();
  fill(2);
  manifest_->invalidate();
  EXPECT_THAT(medium_->calls("invalidate"), SizeIs(1));
  manifest_->setItem(item("new", 5, 1));
  manifest_->removeItem("0");
  manifest_->setInlineData("1", {1});

  EXPECT_EQ(manifest_->count(), 2U);
  EXPECT_EQ(manifest_->size(), 15U);
  EXPECT_EQ(manifest_->getItem("0"), nullptr);
  EXPECT_THAT(manifest_->pruneToSize(0, kMany), SizeIs(2));
  EXPECT_THAT(medium_->keys(), ElementsAre("0", "1"));
}

TEST_F(DiskCacheManifestTest, InvalidationStopsTheTimerAndNothingArmsItAgain) {
  createLoaded();
  manifest_->invalidate();
  EXPECT_THAT(executor_->armedDelays(), IsEmpty());
  manifest_->load();
  EXPECT_THAT(executor_->armedDelays(), IsEmpty());
}

TEST_F(DiskCacheManifestTest, InvalidationDuringAFlushIsTheEndOfTheTimer) {
  createLoaded();
  fill(3);
  use(3);
  medium_->onCall = [&](const std::string& operation, const std::string&) {
    if (operation == "updateLastAccessDate") manifest_->invalidate();
  };
  ASSERT_TRUE(fireTimer());
  EXPECT_THAT(executor_->armedDelays(), IsEmpty());
}

TEST_F(DiskCacheManifestTest, DestroyingAnInvalidatedManifestWritesNothing) {
  const ManualClock clock(5000);
  createLoaded();
  fill(1);
  use(1);
  manifest_->invalidate();
  const LogCapture log;
  manifest_.reset();
  EXPECT_EQ(medium_->accessDate("0"), 1000);
  EXPECT_EQ(log.errorCount(), 0U);
}

// --- Pruning to a size ---

TEST_F(DiskCacheManifestTest, PruningToASizeAtOrAboveTheTotalTakesNothing) {
  createLoaded();
  fill(3);
  EXPECT_THAT(manifest_->pruneToSize(30, kMany), IsEmpty());
  EXPECT_THAT(manifest_->pruneToSize(31, kMany), IsEmpty());
  EXPECT_THAT(manifest_->pruneToSize(kMany, kMany), IsEmpty());
  EXPECT_EQ(manifest_->count(), 3U);
}

TEST_F(DiskCacheManifestTest, PruningToOneByteLessThanTheTotalTakesOne) {
  createLoaded();
  fill(3);
  EXPECT_THAT(keysOf(manifest_->pruneToSize(29, kMany)), ElementsAre("0"));
  EXPECT_EQ(manifest_->size(), 20U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, PruningStopsAsSoonAsTheTotalIsAtTheSize) {
  createLoaded();
  fill(10);
  EXPECT_THAT(keysOf(manifest_->pruneToSize(70, kMany)), ElementsAre("0", "1", "2"));
  EXPECT_EQ(manifest_->size(), 70U);
  EXPECT_THAT(keysOf(manifest_->pruneToSize(65, kMany)), ElementsAre("3"));
  EXPECT_EQ(manifest_->size(), 60U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, PruningTakesNoMoreThanItsCount) {
  createLoaded();
  fill(10);
  EXPECT_THAT(manifest_->pruneToSize(0, 0), IsEmpty());
  EXPECT_EQ(manifest_->count(), 10U);
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, 1)), ElementsAre("0"));
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, 3)), ElementsAre("1", "2", "3"));
  EXPECT_THAT(manifest_->pruneToSize(0, kMany), SizeIs(6));
  EXPECT_THAT(manifest_->pruneToSize(0, kMany), IsEmpty());
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, PruningToNothingLeavesWhatIsOfNoSizeAndYoungerThanTheRest) {
  createLoaded();
  manifest_->setItem(item("old and empty", 0, 1));
  manifest_->setItem(item("full", 10, 2));
  manifest_->setItem(item("young and empty", 0, 3));
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("old and empty", "full"));
  EXPECT_THAT(keysInMemory(), ElementsAre("young and empty"));
}

TEST_F(DiskCacheManifestTest, PrunedRecordsComeWhole) {
  createLoaded();
  const auto metadata = std::make_shared<VideoDownloadExtendedMetadata>();
  manifest_->setItem({"key", "file", 9, false, 3, 4, metadata});
  manifest_->setInlineData("key", {1});
  const auto pruned = manifest_->pruneToSize(0, kMany);
  ASSERT_THAT(pruned, SizeIs(1));
  EXPECT_EQ(pruned[0].key, "key");
  EXPECT_EQ(pruned[0].filename, "file");
  EXPECT_EQ(pruned[0].size, 9U);
  EXPECT_TRUE(pruned[0].hasInlineData);
  EXPECT_EQ(pruned[0].modificationDate, 3);
  EXPECT_EQ(pruned[0].lastAccessDate, 4);
  EXPECT_EQ(pruned[0].extendedMetadata, metadata);
}

TEST_F(DiskCacheManifestTest, UsingAnItemMovesItToTheEndOfTheOrder) {
  const ManualClock clock(5000);
  createLoaded();
  fill(3);
  manifest_->updateLastAccessDate("0");
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("1", "2", "0"));
}

TEST_F(DiskCacheManifestTest, PruningFollowsAnyStrategy) {
  createLoaded(orderedBy([](const DiskCacheItem& a, const DiskCacheItem& b) { return a.size > b.size; }));
  for (const std::uint32_t size : {5U, 80U, 20U, 40U, 10U}) {
    manifest_->setItem(item(std::to_string(size), size, static_cast<std::int32_t>(size)));
  }
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("80", "40", "20", "10", "5"));
}

TEST_F(DiskCacheManifestTest, BothConfiguredStrategiesAndNoneOrderByDateWithTheDefaultWeights) {
  for (const auto identifier :
       {PruneStrategyIdentifier::LRU, PruneStrategyIdentifier::Null, PruneStrategyIdentifier::VideoDownload}) {
    createLoaded(PruneStrategyFactory(identifier));
    for (const int date : {30, -10, 20, 0, 10}) {
      manifest_->setItem(
          item(std::to_string(date), 1, date, std::make_shared<VideoDownloadExtendedMetadata>(0, ItemType(date % 3))));
    }
    EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("-10", "0", "10", "20", "30"));
  }
}

class DiskCacheManifestWeightedVideo : public DiskCacheManifestTest {
 protected:
  void SetUp() override {
    VideoDownloadPruneStrategy::priorityWeight = 100;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 10;
  }
  void TearDown() override {
    VideoDownloadPruneStrategy::priorityWeight = 0;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 0;
  }
  static std::shared_ptr<DiskCacheItem::ExtendedMetadata> chunk(int second) {
    return std::make_shared<VideoDownloadExtendedMetadata>(second, ItemType::VideoChunk);
  }
};

TEST_F(DiskCacheManifestWeightedVideo, EarlyChunksAreKeptLonger) {
  createLoaded(PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload));
  manifest_->setItem(item("early", 1, 1000, chunk(10)));
  manifest_->setItem(item("late", 1, 1050, chunk(11)));
  manifest_->setItem(item("latest", 1, 1101, chunk(500)));
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("late", "early", "latest"));
}

TEST_F(DiskCacheManifestWeightedVideo, ExpiryAndTheOldestItemGoByDateAloneWhateverTheStrategy) {
  createLoaded(PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload));
  manifest_->setItem(item("early", 1, 1000, chunk(10)));
  manifest_->setItem(item("late", 1, 1050, chunk(11)));
  manifest_->setItem(item("latest", 1, 1101, chunk(500)));
  EXPECT_EQ(manifest_->pruneOldestItem()->key, "early");
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(2000, kMany)), ElementsAre("late", "latest"));
}

// With a weight, video items go by their weighted dates among themselves and by plain dates beside others: circles.
TEST_F(DiskCacheManifestWeightedVideo, ItemsWithoutMetadataAmongTheOthersAreStillPrunedOnceEach) {
  createLoaded(PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload));
  std::mt19937 random(7);
  for (int i = 0; i < 300; ++i) {
    const int kind = static_cast<int>(random() % 3);
    manifest_->setItem(item(std::to_string(i), 1, static_cast<std::int32_t>(random() % 300),
                            kind == 0 ? nullptr : chunk(kind == 1 ? 0 : 100)));
  }
  std::set<std::string> seen;
  for (int round = 0; round < 6; ++round) {
    for (const std::string& key : keysOf(manifest_->pruneToSize(0, 50))) {
      EXPECT_TRUE(seen.insert(key).second) << key;
    }
    expectConsistent();
  }
  EXPECT_EQ(seen.size(), 300U);
  EXPECT_EQ(manifest_->size(), 0U);
}

class DiskCacheManifestSenselessOrder : public DiskCacheManifestTest, public testing::WithParamInterface<int> {
 protected:
  std::shared_ptr<PruneStrategyBase> order() {
    switch (GetParam()) {
      case 0:
        return orderedBy([](const DiskCacheItem&, const DiskCacheItem&) { return true; });
      case 1:
        return orderedBy([](const DiskCacheItem&, const DiskCacheItem&) { return false; });
      case 2:  // rock, paper, scissors
        return orderedBy([](const DiskCacheItem& a, const DiskCacheItem& b) {
          return (a.lastAccessDate % 3 + 1) % 3 == b.lastAccessDate % 3;
        });
      default:
        return orderedBy([this](const DiskCacheItem&, const DiskCacheItem&) { return (random_() & 1U) == 0U; });
    }
  }
  std::mt19937 random_{11};
};

TEST_P(DiskCacheManifestSenselessOrder, EveryItemIsPrunedOnceAndTheTotalIsRight) {
  for (const int count : {1, 2, 3, 16, 17, 100, 500}) {
    createLoaded(order());
    fill(count, 3);
    std::set<std::string> seen;
    while (manifest_->count() > 0) {
      const auto batch = keysOf(manifest_->pruneToSize(0, 7));
      ASSERT_FALSE(batch.empty());
      ASSERT_LE(batch.size(), 7U);
      for (const std::string& key : batch) EXPECT_TRUE(seen.insert(key).second) << key;
      EXPECT_EQ(manifest_->size(), 3U * manifest_->count());
    }
    EXPECT_EQ(seen.size(), static_cast<std::size_t>(count));
    EXPECT_THAT(medium_->keys(), IsEmpty());
  }
}

TEST_P(DiskCacheManifestSenselessOrder, PruningStopsAtTheSizeAllTheSame) {
  createLoaded(order());
  fill(100, 3);
  EXPECT_THAT(manifest_->pruneToSize(120, kMany), SizeIs(60));
  EXPECT_EQ(manifest_->size(), 120U);
  expectConsistent();
}

INSTANTIATE_TEST_SUITE_P(DiskCacheManifest, DiskCacheManifestSenselessOrder, testing::Range(0, 4));

// --- Pruning old entries ---

TEST_F(DiskCacheManifestTest, AnItemUsedAtTheDateItselfStays) {
  createLoaded();
  fill(3);
  EXPECT_THAT(manifest_->pruneOldEntries(1000, kMany), IsEmpty());
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(1001, kMany)), ElementsAre("0"));
  EXPECT_THAT(keysInMemory(), ElementsAre("1", "2"));
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, OldEntriesGoOldestFirstAndNoMoreThanTheCount) {
  createLoaded();
  for (const int date : {5, 3, 9, 1, 7}) manifest_->setItem(item(std::to_string(date), 10, date));
  EXPECT_THAT(manifest_->pruneOldEntries(100, 0), IsEmpty());
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(100, 1)), ElementsAre("1"));
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(9, 2)), ElementsAre("3", "5"));
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(9, 2)), ElementsAre("7"));
  EXPECT_THAT(manifest_->pruneOldEntries(9, 2), IsEmpty());
  EXPECT_EQ(manifest_->size(), 10U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, OldEntriesGoWhateverTheirSize) {
  createLoaded();
  manifest_->setItem(item("empty", 0, 1));
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(2, kMany)), ElementsAre("empty"));
}

TEST_F(DiskCacheManifestTest, DatesBeforeTheEpochAndAtTheEndsOfTheirRangeAreOrdered) {
  createLoaded();
  constexpr std::int32_t earliest = std::numeric_limits<std::int32_t>::min();
  constexpr std::int32_t latest = std::numeric_limits<std::int32_t>::max();
  for (const std::int32_t date : {0, latest, -1, earliest}) manifest_->setItem(item(std::to_string(date), 1, date));
  EXPECT_THAT(manifest_->pruneOldEntries(earliest, kMany), IsEmpty());
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(0, kMany)), ElementsAre(std::to_string(earliest), "-1"));
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(latest, kMany)), ElementsAre("0"));
  EXPECT_EQ(manifest_->pruneOldestItem()->lastAccessDate, latest);
}

// --- The oldest item ---

TEST_F(DiskCacheManifestTest, TheOldestItemIsTheOneUsedLeastRecently) {
  createLoaded();
  for (const int date : {5, 3, 9}) manifest_->setItem(item(std::to_string(date), 10, date));
  EXPECT_EQ(manifest_->pruneOldestItem()->key, "3");
  EXPECT_EQ(manifest_->pruneOldestItem()->key, "5");
  EXPECT_EQ(manifest_->size(), 10U);
  EXPECT_EQ(manifest_->pruneOldestItem()->key, "9");
  EXPECT_EQ(manifest_->pruneOldestItem(), nullptr);
  EXPECT_EQ(manifest_->size(), 0U);
}

TEST_F(DiskCacheManifestTest, AmongItemsOfOneDateOneGoesAtATime) {
  createLoaded();
  for (const char* key : {"a", "b", "c"}) manifest_->setItem(item(key, 1, 7));
  std::set<std::string> seen;
  for (int i = 0; i < 3; ++i) seen.insert(manifest_->pruneOldestItem()->key);
  EXPECT_THAT(seen, ElementsAre("a", "b", "c"));
  expectConsistent();
}

// --- Prunes that fail ---

TEST_F(DiskCacheManifestTest, APruneThatFailsAtItsFirstItemThrowsAndChangesNothing) {
  createLoaded();
  fill(3);
  medium_->fail("removeItem");
  EXPECT_THROW(manifest_->pruneToSize(0, kMany), ManifestPersistenceException);
  EXPECT_THROW(manifest_->pruneOldEntries(5000, kMany), ManifestPersistenceException);
  EXPECT_THROW(manifest_->pruneOldestItem(), ManifestPersistenceException);
  EXPECT_EQ(manifest_->size(), 30U);
  expectConsistent();
}

TEST_F(DiskCacheManifestTest, APruneThatFailsMidwayReturnsWhatHasGone) {
  medium_->canPerformTogether = false;
  createLoaded();
  fill(5);
  medium_->fail("removeItem", 2);
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("0", "1"));
  EXPECT_EQ(manifest_->size(), 30U);
  expectConsistent();
  EXPECT_THROW(manifest_->pruneToSize(0, kMany), ManifestPersistenceException);

  medium_->heal();
  medium_->fail("removeItem", 1);
  EXPECT_THAT(keysOf(manifest_->pruneOldEntries(5000, kMany)), ElementsAre("2"));
  expectConsistent();
  EXPECT_THROW(manifest_->pruneOldEntries(5000, kMany), ManifestPersistenceException);

  medium_->heal();
  EXPECT_THAT(keysOf(manifest_->pruneToSize(0, kMany)), ElementsAre("3", "4"));
}

// --- Many threads ---

TEST_F(DiskCacheManifestTest, ManyThreadsLeaveMemoryMediumAndTotalInAgreement) {
  for (int i = 0; i < 20; ++i) medium_->put(item(std::to_string(i), 5, 1000 + i));
  create(std::make_shared<LRUPruneStrategy>());
  test::runOnThreads(4, [&](std::size_t thread) {
    std::mt19937 random(static_cast<unsigned>(thread) + 1);
    for (int i = 0; i < 400; ++i) {
      const std::string key = std::to_string(random() % 40);
      switch (random() % 12) {
        case 0:
        case 1:
        case 2:
          manifest_->setItem(item(key, static_cast<std::uint32_t>(random() % 50), static_cast<std::int32_t>(i)));
          break;
        case 3:
          manifest_->removeItem(key);
          break;
        case 4:
          manifest_->pruneToSize(300, 3);
          break;
        case 5:
          manifest_->pruneOldEntries(50, 2);
          break;
        case 6:
          manifest_->pruneOldestItem();
          break;
        case 7:
          manifest_->load();
          break;
        case 8:
          executor_->fireTimer(kFlushInterval);
          break;
        case 9:
          manifest_->getModificationDate(key);
          manifest_->getInlineData(key);
          break;
        case 10:
          if (random() % 40 == 0) manifest_->clear();
          manifest_->size();
          break;
        default:
          manifest_->updateLastAccessDate(key);
          executor_->runAll();
      }
    }
  });
  manifest_->load();
  EXPECT_TRUE(manifest_->isLoaded());
  expectConsistent();
  EXPECT_THAT(executor_->armedDelays(), SizeIs(1));
}

// --- On a real database ---

class DiskCacheManifestOnDisk : public testing::Test {
 protected:
  void open(std::shared_ptr<ExtendedMetadataFactory> factory = nullptr) {
    manifest_.reset();
    manifest_ = DiskCacheManifest::createDiskCacheManifest(path(), executor_, std::move(factory), nullptr);
    manifest_->load();
  }
  std::string path() const { return directory_.file("manifest_v1.sqlite"); }

  // The first column of each row, seen by a connection of the test's own.
  std::vector<std::string> select(const std::string& sql) const {
    sqlite3* database = nullptr;
    EXPECT_EQ(sqlite3_open(path().c_str(), &database), SQLITE_OK);
    std::vector<std::string> rows;
    const auto collect = [](void* out, int, char** values, char**) {
      static_cast<std::vector<std::string>*>(out)->push_back(values[0] == nullptr ? "NULL" : values[0]);
      return 0;
    };
    EXPECT_EQ(sqlite3_exec(database, sql.c_str(), collect, &rows, nullptr), SQLITE_OK) << sqlite3_errmsg(database);
    sqlite3_close(database);
    return rows;
  }

  TemporaryDirectory directory_;
  std::shared_ptr<ManualExecutor> executor_ = std::make_shared<ManualExecutor>();
  std::shared_ptr<DiskCacheManifest> manifest_;
};

TEST_F(DiskCacheManifestOnDisk, RecordsAndInlineValuesAreFoundAgainAfterARestart) {
  open();
  manifest_->setItem({"a", "file", 7, false, -3, 4, nullptr});
  manifest_->setItem(item("inline", 2, 5));
  manifest_->setInlineData("inline", {0, 255});
  manifest_->setItem(item("removed", 2, 5));
  manifest_->removeItem("removed");

  open();
  EXPECT_EQ(manifest_->count(), 2U);
  EXPECT_EQ(manifest_->size(), 9U);
  const auto found = manifest_->getItem("a");
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->filename, "file");
  EXPECT_EQ(found->modificationDate, -3);
  EXPECT_EQ(found->lastAccessDate, 4);
  EXPECT_TRUE(manifest_->getItem("inline")->hasInlineData);
  EXPECT_EQ(manifest_->getInlineData("inline"), (Bytes{0, 255}));
}

TEST_F(DiskCacheManifestOnDisk, AccessDatesReachTheDatabaseWithTheTimerAndAtTheEnd) {
  ManualClock clock(5000);
  open();
  manifest_->setItem(item("a", 1, 1));
  manifest_->updateLastAccessDate("a");
  EXPECT_THAT(select("SELECT last_access_date FROM LarderManifest"), ElementsAre("1"));
  ASSERT_TRUE(executor_->fireTimer(kFlushInterval));
  EXPECT_THAT(select("SELECT last_access_date FROM LarderManifest"), ElementsAre("5000"));

  clock.set(6000);
  manifest_->updateLastAccessDate("a");
  manifest_.reset();
  EXPECT_THAT(select("SELECT last_access_date FROM LarderManifest"), ElementsAre("6000"));
}

TEST_F(DiskCacheManifestOnDisk, MetadataComesBackOnlyWithAFactory) {
  open();
  manifest_->setItem(item("a", 1, 1, std::make_shared<VideoDownloadExtendedMetadata>(12, ItemType(2))));
  open();
  EXPECT_EQ(manifest_->getItem("a")->extendedMetadata, nullptr);

  open(std::make_shared<VideoDownloadExtendedMetadataFactory>());
  const auto found = manifest_->getItem("a");
  const auto* metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(found->extendedMetadata.get());
  ASSERT_NE(metadata, nullptr);
  EXPECT_EQ(metadata->getExtendedMetadata(), 12);
  EXPECT_EQ(metadata->getItemType(), ItemType(2));
}

TEST_F(DiskCacheManifestOnDisk, ADamagedDatabaseCannotBeOpened) {
  directory_.write("manifest_v1.sqlite", std::string(4096, 'x'));
  EXPECT_THROW(DiskCacheManifest::createDiskCacheManifest(path(), executor_, nullptr, nullptr),
               ManifestCorruptedException);
}

TEST_F(DiskCacheManifestOnDisk, ADirectoryThatIsNotThereCannotBeOpened) {
  try {
    DiskCacheManifest::createDiskCacheManifest(directory_.file("missing/manifest_v1.sqlite"), executor_, nullptr,
                                               nullptr);
    FAIL() << "Nothing was thrown.";
  } catch (const ManifestCorruptedException&) {
    FAIL() << "Taken for a damaged one.";
  } catch (const ManifestPersistenceException& error) {
    EXPECT_EQ(error.code(), SQLITE_CANTOPEN);
  }
}

TEST_F(DiskCacheManifestOnDisk, ClearingAfterTheFileWentStartsANewDatabase) {
  open();
  manifest_->setItem(item("a", 1, 1));
  for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path() + suffix);
  manifest_->clear();
  manifest_->load();
  EXPECT_EQ(manifest_->count(), 0U);
  EXPECT_THAT(select("SELECT key FROM LarderManifest"), IsEmpty());

  manifest_->setItem(item("b", 2, 1));
  EXPECT_THAT(select("SELECT key FROM LarderManifest"), ElementsAre("b"));
  open();
  EXPECT_EQ(manifest_->size(), 2U);
}

TEST_F(DiskCacheManifestOnDisk, InvalidationClosesTheDatabaseSoThatItsCompanionsGo) {
  open();
  manifest_->setItem(item("a", 1, 1));
  manifest_->invalidate();
  EXPECT_THAT(directory_.names(), ElementsAre("manifest_v1.sqlite"));
  manifest_->setItem(item("b", 1, 1));
  manifest_.reset();
  EXPECT_THAT(select("SELECT key FROM LarderManifest"), ElementsAre("a"));
}

TEST_F(DiskCacheManifestOnDisk, KeysOfAnyBytesAreKeptApart) {
  open();
  const std::vector<std::string> keys = {"", std::string("a\0b", 3), "a", "A", "\xff\xfe", "'; DROP TABLE", "a "};
  for (const std::string& key : keys) manifest_->setItem({key, key, 1, false, 1, 1, nullptr});
  open();
  EXPECT_THAT(manifest_->getAllKeys(), testing::UnorderedElementsAreArray(keys));
  EXPECT_EQ(manifest_->size(), keys.size());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
