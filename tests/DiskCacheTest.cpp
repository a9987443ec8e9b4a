#include "DiskCache.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "PruneStrategy.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::KeyValueStoreFixture;
using test::kInvalid;
using test::kSecond;
using test::LogCapture;
using test::ManifestCall;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Not;
using testing::SizeIs;
using testing::UnorderedElementsAre;

using ItemType = VideoDownloadExtendedMetadata::ItemType;

class DiskCacheTest : public KeyValueStoreFixture {
 protected:
  DiskCacheTest() {
    isDiskCache = true;
    options.normalSize = 100;
    options.survivalSize = 40;
    options.extendedMetadataFactory = std::make_shared<VideoDownloadExtendedMetadataFactory>();
  }

  DiskCache& cache() const { return static_cast<DiskCache&>(*store); }

  void resize(unsigned int normal, unsigned int survival) {
    options.normalSize = normal;
    options.survivalSize = survival;
  }
  void open(unsigned int normal, unsigned int survival) {
    resize(normal, survival);
    open();
  }
  using KeyValueStoreFixture::open;

  // Stores a value, one second after the last.
  void add(const std::string& key, std::size_t size, std::shared_ptr<DiskCacheItem::ExtendedMetadata> data = nullptr) {
    clock.advance(1);
    const Written written = watch(store->store(key, Bytes(size, 'x'), std::move(data)));
    settle();
    ASSERT_EQ(told(written), "<done>") << key;
  }
  // Items "0", "1", ... of ten bytes, each one second younger than the one before.
  void fill(int count) {
    for (int i = 0; i < count; ++i) add(std::to_string(i), 10);
  }

  void beginPruning(bool survival = false) {
    ending.clear();
    store->pruneBackToNormal(onSuccess(), onError(), survival);
  }
  // How a prune ended.
  std::string prune(bool survival = false) {
    beginPruning(survival);
    settle();
    return ending;
  }

  std::vector<std::string> keys() const {
    auto keys = store->getAllKeys();
    std::sort(keys.begin(), keys.end());
    return keys;
  }
  // Records and files name the same items.
  void expectItems(const std::vector<std::string>& expected) const {
    EXPECT_EQ(keys(), expected);
    EXPECT_EQ(valueFiles(), expected);
  }
};

// --- Creation ---

TEST_F(DiskCacheTest, IsPrunable) {
  for (const bool inlineData : {false, true}) {
    options.inlineData = inlineData;
    open();
    EXPECT_TRUE(store->isPrunable());
  }
}

TEST_F(DiskCacheTest, CreatesItsDirectoryAndTakesTwoQueues) {
  openUnloaded();
  EXPECT_TRUE(directory.exists("store"));
  EXPECT_EQ(queues->queueCount(), 1U);
  EXPECT_EQ(queues->workQueueCount(), 1U);
  EXPECT_EQ(store->path, storePath());
  EXPECT_EQ(store->getTemporaryDirectoryPath(), directory.file("temporary"));
}

TEST_F(DiskCacheTest, CreatedWithoutOptionsTakesEachArgumentInItsPlace) {
  options.pruneStrategy = std::make_shared<LRUPruneStrategy>();
  store = DiskCache::createDiskCache(storePath(), directory.file("temporary"), "larder", 5, 1000, 30, 10, false, queues,
                                     options.extendedMetadataFactory, trash, options.pruneStrategy, reporter, nullptr,
                                     files, options.onSizeChanged, 2);
  settle();
  EXPECT_EQ(store->getTemporaryDirectoryPath(), directory.file("temporary"));
  EXPECT_EQ(cache().getPruneStrategy(), options.pruneStrategy);
  fill(6);
  expectItems({"1", "2", "3", "4", "5"});
  EXPECT_EQ(sizes.back(), 50U);
  beginPruning();
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(keys(), SizeIs(3));  // a batch
  settle();
  EXPECT_EQ(prune(true), "<done>");
  expectItems({"5"});
  get("5");
  EXPECT_THAT(accesses(), SizeIs(1));
  clock.advance(1000);
  ASSERT_TRUE(fire(300));
  settle();
  expectItems({"5"});
  clock.advance(1);
  ASSERT_TRUE(fire(3600));
  settle();
  expectItems({});
}

TEST_F(DiskCacheTest, LoadsItsManifestWhenItIsCreatedAndArmsTheFirstExpiry) {
  openUnloaded();
  EXPECT_THROW(store->getAllKeys(), DiskCacheManifestException);
  settle();
  EXPECT_TRUE(store->getManifest()->isLoaded());
  EXPECT_THAT(work().armedDelays(), UnorderedElementsAre(300 * kSecond, 120 * kSecond));
}

TEST_F(DiskCacheTest, GivesOutItsStrategy) {
  options.pruneStrategy = std::make_shared<LRUPruneStrategy>();
  open();
  EXPECT_EQ(cache().getPruneStrategy(), options.pruneStrategy);
  options.pruneStrategy = nullptr;
  reopen();
  EXPECT_EQ(cache().getPruneStrategy(), nullptr);
}

TEST_F(DiskCacheTest, ReportsAccessesUnderItsName) {
  open();
  add("a", 3);
  get("a");
  get("b");
  EXPECT_THAT(events->events(), SizeIs(2));
  EXPECT_THAT(accesses(), SizeIs(2));
}

TEST_F(DiskCacheTest, CapacityStillCounts) {
  options.capacity = 3;
  open();
  fill(4);
  expectItems({"1", "2", "3"});
}

TEST_F(DiskCacheTest, ExpiryStillHappens) {
  open();
  fill(2);
  clock.advance(1000);
  ASSERT_TRUE(fire(300));
  settle();
  expectItems({"1"});  // used exactly its age ago, which is not more
  EXPECT_THAT(work().armedDelays(), UnorderedElementsAre(3600 * kSecond, 120 * kSecond));
}

// --- Pruning ---

TEST_F(DiskCacheTest, ACacheAtItsSizeIsLeftAlone) {
  open(30, 0);
  fill(3);
  sizes.clear();
  EXPECT_EQ(prune(), "<done>");
  expectItems({"0", "1", "2"});
  EXPECT_THAT(sizes, ElementsAre(30U));
}

TEST_F(DiskCacheTest, ACacheOneByteOverItsSizeLosesOneItem) {
  open(29, 0);
  fill(3);
  sizes.clear();
  EXPECT_EQ(prune(), "<done>");
  expectItems({"1", "2"});
  EXPECT_THAT(sizes, ElementsAre(20U));
}

TEST_F(DiskCacheTest, PruningAnEmptyCacheSucceeds) {
  open(0, 0);
  EXPECT_EQ(prune(), "<done>");
  EXPECT_THAT(sizes, ElementsAre(0U));
}

TEST_F(DiskCacheTest, InSurvivalModeTheSmallerSizeCounts) {
  open(60, 20);
  fill(8);
  EXPECT_EQ(prune(false), "<done>");
  expectItems({"2", "3", "4", "5", "6", "7"});
  EXPECT_EQ(prune(true), "<done>");
  expectItems({"6", "7"});
}

TEST_F(DiskCacheTest, TheSurvivalSizeCountsEvenWhenItIsTheLargerOne) {
  open(10, 50);
  fill(8);
  EXPECT_EQ(prune(true), "<done>");
  EXPECT_THAT(keys(), SizeIs(5));
}

TEST_F(DiskCacheTest, ASizeOfZeroTakesEverythingThatHasASize) {
  open(0, 0);
  fill(3);
  EXPECT_EQ(prune(), "<done>");
  expectItems({});
}

TEST_F(DiskCacheTest, PruningFollowsTheStrategyOfTheCache) {
  VideoDownloadPruneStrategy::priorityWeight = 1000;
  resize(10, 0);
  options.pruneStrategy = PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload);
  open();
  add("beginning", 10, std::make_shared<VideoDownloadExtendedMetadata>(0, ItemType::VideoChunk));
  add("later", 10, std::make_shared<VideoDownloadExtendedMetadata>(60, ItemType::VideoChunk));
  EXPECT_EQ(prune(), "<done>");
  VideoDownloadPruneStrategy::priorityWeight = 0;
  expectItems({"beginning"});
}

TEST_F(DiskCacheTest, TheStrategyStillKnowsTheItemsAfterARestart) {
  VideoDownloadPruneStrategy::priorityWeight = 1000;
  resize(10, 0);
  options.pruneStrategy = PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload);
  open();
  add("beginning", 10, std::make_shared<VideoDownloadExtendedMetadata>(0, ItemType::VideoChunk));
  add("later", 10, std::make_shared<VideoDownloadExtendedMetadata>(60, ItemType::VideoChunk));
  reopen();
  EXPECT_EQ(prune(), "<done>");
  VideoDownloadPruneStrategy::priorityWeight = 0;
  expectItems({"beginning"});
}

TEST_F(DiskCacheTest, AUseKeepsAnItemFromBeingPruned) {
  open(10, 0);
  fill(3);
  clock.advance(1);
  get("0");
  EXPECT_EQ(prune(), "<done>");
  expectItems({"0"});
}

// --- Batches ---

TEST_F(DiskCacheTest, PruningGoesBatchByBatchWithTheFilesOfEachGoneBeforeTheNext) {
  resize(0, 0);
  options.batchSize = 2;
  open();
  fill(5);
  beginPruning();
  EXPECT_THAT(keys(), SizeIs(5));  // nothing happens on the caller's thread

  for (const std::size_t left : {3U, 1U, 0U}) {
    ASSERT_TRUE(work().runNext());
    EXPECT_THAT(keys(), SizeIs(left));
    EXPECT_THAT(valueFiles(), Not(SizeIs(left)));
    EXPECT_EQ(work().pending(), 0U);
    ASSERT_TRUE(file().runNext());
    EXPECT_THAT(valueFiles(), SizeIs(left));
    EXPECT_EQ(ending, "");
  }
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(ending, "<done>");
}

TEST_F(DiskCacheTest, EachBatchIsAskedForWithTheTargetAndTheBatchSize) {
  resize(15, 5);
  options.batchSize = 7;
  openWatched();
  fill(3);
  manifest->clearTrace();
  EXPECT_EQ(prune(), "<done>");
  EXPECT_THAT(manifest->trace(), ElementsAre("pruneToSize 15 7", "pruneToSize 15 7"));
}

TEST_F(DiskCacheTest, WhatIsStoredBetweenTwoBatchesCountsInTheNext) {
  resize(10, 0);
  options.batchSize = 1;
  open();
  fill(2);
  beginPruning();
  ASSERT_TRUE(work().runNext());
  clock.advance(1);
  watch(store->store("new", Bytes(10, 'x')));
  settle();
  EXPECT_EQ(ending, "<done>");
  expectItems({"new"});
}

TEST_F(DiskCacheTest, InlineItemsArePrunedWithoutAnyFileBeingTouched) {
  resize(10, 0);
  options.inlineData = true;
  open();
  fill(3);
  files->clearTrace();
  EXPECT_EQ(prune(), "<done>");
  EXPECT_THAT(keys(), ElementsAre("2"));
  EXPECT_EQ(files->calls(Operation::DeleteFile), 0U);
  EXPECT_EQ(get("2"), std::string(10, 'x'));
}

TEST_F(DiskCacheTest, AFileThatCannotBeDeletedIsOneErrorLineAndThePruneGoesOn) {
  open(0, 0);
  fill(3);
  files->failPath(Operation::DeleteFile, directory.file("store/1"), EACCES);
  const LogCapture log;
  EXPECT_EQ(prune(), "<done>");
  EXPECT_THAT(keys(), IsEmpty());
  EXPECT_THAT(valueFiles(), ElementsAre("1"));
  ASSERT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("Failed to delete file at \"" + directory.file("store/1") + "\" domain: "));
}

// --- Overriding the configuration ---

TEST_F(DiskCacheTest, OverridingChangesTheNormalSizeOfTheNextPruneAndNotTheSurvivalSize) {
  open(100, 20);
  fill(8);
  cache().overrideConfiguration(1000, 50);
  EXPECT_EQ(prune(false), "<done>");
  expectItems({"3", "4", "5", "6", "7"});
  EXPECT_EQ(prune(true), "<done>");
  expectItems({"6", "7"});
}

TEST_F(DiskCacheTest, OverridingDoesNotChangeAPruneThatIsQueued) {
  open(50, 0);
  fill(8);
  beginPruning();
  cache().overrideConfiguration(1000, 10);
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(keys(), SizeIs(5));
  EXPECT_EQ(prune(), "<done>");
  EXPECT_THAT(keys(), SizeIs(1));
}

TEST_F(DiskCacheTest, OverridingReplacesTheStaleAgeToo) {
  open();
  fill(2);
  clock.advance(10);
  cache().overrideConfiguration(10, 100);
  ASSERT_TRUE(fire(300));
  settle();
  expectItems({"1"});
}

TEST_F(DiskCacheTest, TheInheritedOverrideLeavesTheSizesAsTheyAre) {
  open(20, 0);
  fill(3);
  cache().overrideConfiguration(5);
  EXPECT_EQ(prune(), "<done>");
  expectItems({"1", "2"});
}

// --- Prunes that fail ---

TEST_F(DiskCacheTest, WhenTheManifestCannotRemoveAnItemTheErrorCallbackIsCalledOnce) {
  resize(0, 0);
  openWatched();
  fill(2);
  manifest->failNext(ManifestCall::PruneToSize, unwritable);
  EXPECT_EQ(prune(), std::string("<error> ") + unwritable.what());
  EXPECT_THAT(keys(), SizeIs(2));
}

TEST_F(DiskCacheTest, ADamagedManifestPurgesTheCacheAndThePruneSucceeds) {
  resize(0, 0);
  openWatched();
  fill(2);
  manifest->failNext(ManifestCall::PruneToSize, corrupted);
  const LogCapture log;
  EXPECT_EQ(prune(), "<done>");
  EXPECT_THAT(errorLines(log), ElementsAre(purgeLine(corrupted)));
  expectItems({});
}

TEST_F(DiskCacheTest, PruningAfterInvalidationCallsTheErrorCallback) {
  open(0, 0);
  fill(1);
  store->invalidateSoon();
  settle();
  EXPECT_EQ(prune(), "<error> " + kInvalid);
}

TEST_F(DiskCacheTest, InvalidationBetweenTwoBatchesEndsThePruneWithItsErrorCallback) {
  resize(0, 0);
  options.batchSize = 1;
  open();
  fill(3);
  beginPruning();
  ASSERT_TRUE(work().runNext());
  store->invalidateSoon();
  settle();
  EXPECT_EQ(ending, "<error> " + kInvalid);
  EXPECT_THAT(valueFiles(), ElementsAre("1", "2"));
}

TEST_F(DiskCacheTest, PruningWithoutCallbacksIsAllowed) {
  open(0, 0);
  fill(2);
  cache().pruneBackToNormal(nullptr, nullptr, false);
  settle();
  expectItems({});
}

TEST_F(DiskCacheTest, CallbacksMayUseTheCacheAgain) {
  open(10, 0);
  fill(3);
  int rounds = 0;
  std::function<void()> again = [&] {
    if (++rounds == 3) return;
    cache().overrideConfiguration(1000, 0);
    store->throwIfInvalid();
    EXPECT_LE(store->getAllKeys().size(), 1U);
    cache().pruneBackToNormal(
        again, [](const std::exception& error) { ADD_FAILURE() << error.what(); }, false);
  };
  cache().pruneBackToNormal(
      again, [](const std::exception& error) { ADD_FAILURE() << error.what(); }, false);
  settle();
  EXPECT_EQ(rounds, 3);
  expectItems({});
}

// --- Lifetimes ---

TEST_F(DiskCacheTest, AQueuedPruneDoesNotKeepTheCacheAliveAndDoesNothingWhenItHasGone) {
  open(0, 0);
  fill(2);
  beginPruning();
  const std::weak_ptr<PersistentKeyValueStore> weak = store;
  store.reset();
  EXPECT_TRUE(weak.expired());
  settle();
  EXPECT_EQ(ending, "");
  EXPECT_THAT(valueFiles(), ElementsAre("0", "1"));
}

TEST_F(DiskCacheTest, ACacheThatGoesBetweenTwoBatchesIsPrunedNoFurther) {
  resize(0, 0);
  options.batchSize = 1;
  open();
  fill(3);
  beginPruning();
  ASSERT_TRUE(work().runNext());
  ASSERT_TRUE(file().runNext());
  store.reset();
  settle();
  EXPECT_EQ(ending, "");
  open();
  expectItems({"1", "2"});
}

TEST_F(DiskCacheTest, ACacheThatGoesWithAWriteOnItsWayLeavesNoRecordWithoutAFile) {
  for (const bool isInvalidatedFirst : {false, true}) {
    open();
    watch(store->store("queued", Bytes(10, 'x')));
    ASSERT_TRUE(work().runNext());
    Future<void> barrier;
    if (isInvalidatedFirst) barrier = store->invalidateWithFuture();
    store.reset();
    settle();
    open();
    EXPECT_EQ(keys(), valueFiles()) << (isInvalidatedFirst ? "invalidated" : "let go");
  }
}

TEST_F(DiskCacheTest, ItsQueuesHoldNoTimerAfterIt) {
  open();
  store.reset();
  EXPECT_THAT(work().armedDelays(), IsEmpty());
  EXPECT_THAT(file().armedDelays(), IsEmpty());
}

// --- Removals that meet a write on its way ---

TEST_F(DiskCacheTest, APruneThatMeetsAQueuedWriteLeavesNeitherRecordNorFile) {
  open(0, 0);
  add("old", 10);
  auto queued = store->store("old", Bytes(50, 'y'));
  ASSERT_TRUE(work().runNext());  // its provisional record is there
  beginPruning();
  settle();
  queued.get();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(keys(), valueFiles());
}

TEST_F(DiskCacheTest, AProvisionalRecordOfNoSizeDoesNotHoldUpThePrune) {
  open(5, 0);
  add("big", 10);
  clock.advance(1);
  auto queued = store->store("small", Bytes(5, 'y'));
  ASSERT_TRUE(work().runNext());
  beginPruning();
  settle();
  queued.get();
  EXPECT_EQ(ending, "<done>");
  expectItems({"small"});
}

TEST_F(DiskCacheTest, AKeyPrunedWhileItsWriteWaitsCanBeStoredAgainAtOnce) {
  open(0, 0);
  add("k", 10);
  clock.advance(-5);  // the provisional record is the oldest
  auto first = store->store("k", Bytes(1, 'a'));
  ASSERT_TRUE(work().runNext());
  clock.advance(10);
  auto other = store->store("z", Bytes(10, 'z'));
  settle();
  first.get();
  other.get();
  beginPruning();
  auto second = store->store("k", Bytes(2, 'b'));
  settle();
  second.get();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(keys(), valueFiles());
}

// --- From a definition ---

class DiskCacheFromDefinition : public DiskCacheTest {
 protected:
  static DiskCacheDefinition definition(PruneStrategyIdentifier strategy, bool inlineData = false,
                                        std::optional<std::int64_t> capacity = std::nullopt,
                                        std::uint32_t staleAge = 1000) {
    return {"larder",
            "media",
            false,
            false,
            1,
            capacity,
            staleAge,
            inlineData,
            55,
            25,
            ExtendedMetadataFactoryIdentifier::VideoDownload,
            strategy};
  }
  void createFrom(const DiskCacheDefinition& from, PruneStrategyIdentifier override_ = PruneStrategyIdentifier::Null) {
    store = std::dynamic_pointer_cast<DiskCache>(from.createStore(storePath(), directory.file("temporary"), queues,
                                                                  trash, nullptr, files, options.onSizeChanged,
                                                                  override_, nullptr));
    ASSERT_NE(store, nullptr);
    settle();
  }
};

TEST_F(DiskCacheFromDefinition, TheOverrideOneTakesTheDefinitionsStrategy) {
  createFrom(definition(PruneStrategyIdentifier::VideoDownload), PruneStrategyIdentifier::Null);
  EXPECT_NE(dynamic_cast<VideoDownloadPruneStrategy*>(cache().getPruneStrategy().get()), nullptr);
  createFrom(definition(PruneStrategyIdentifier::LRU), PruneStrategyIdentifier::Null);
  EXPECT_NE(dynamic_cast<LRUPruneStrategy*>(cache().getPruneStrategy().get()), nullptr);
}

TEST_F(DiskCacheFromDefinition, AnyOtherOverrideReplacesTheDefinitionsStrategy) {
  createFrom(definition(PruneStrategyIdentifier::VideoDownload), PruneStrategyIdentifier::LRU);
  EXPECT_NE(dynamic_cast<LRUPruneStrategy*>(cache().getPruneStrategy().get()), nullptr);
  createFrom(definition(PruneStrategyIdentifier::LRU), PruneStrategyIdentifier::VideoDownload);
  EXPECT_NE(dynamic_cast<VideoDownloadPruneStrategy*>(cache().getPruneStrategy().get()), nullptr);
}

TEST_F(DiskCacheFromDefinition, ADefinitionWithoutAStrategyPrunesByLeastRecentUse) {
  createFrom(definition(PruneStrategyIdentifier::Null), PruneStrategyIdentifier::Null);
  EXPECT_EQ(cache().getPruneStrategy(), nullptr);
  fill(6);
  EXPECT_EQ(prune(), "<done>");
  expectItems({"1", "2", "3", "4", "5"});
}

TEST_F(DiskCacheFromDefinition, ItsLimitsAndServicesArePassedOn) {
  createFrom(definition(PruneStrategyIdentifier::LRU, false, 7));
  EXPECT_EQ(store->getTemporaryDirectoryPath(), directory.file("temporary"));
  fill(9);
  EXPECT_THAT(keys(), SizeIs(7));
  EXPECT_EQ(prune(false), "<done>");
  EXPECT_THAT(keys(), SizeIs(5));
  EXPECT_EQ(prune(true), "<done>");
  EXPECT_THAT(keys(), SizeIs(2));
  EXPECT_EQ(sizes.back(), 20U);
}

TEST_F(DiskCacheFromDefinition, InlineValuesStayInTheManifest) {
  createFrom(definition(PruneStrategyIdentifier::LRU, true));
  fill(2);
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_EQ(get("1"), std::string(10, 'x'));
}

TEST_F(DiskCacheFromDefinition, MetadataIsReadBack) {
  createFrom(definition(PruneStrategyIdentifier::LRU));
  add("a", 1, std::make_shared<VideoDownloadExtendedMetadata>(12, ItemType(3)));
  store.reset();
  createFrom(definition(PruneStrategyIdentifier::LRU));
  const auto item = store->getManifest()->getItem("a");
  const auto* metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(item->extendedMetadata.get());
  ASSERT_NE(metadata, nullptr);
  EXPECT_EQ(metadata->getExtendedMetadata(), 12);
}

TEST_F(DiskCacheFromDefinition, FilesAreDeletedFiftyAtATime) {
  createFrom(definition(PruneStrategyIdentifier::LRU));
  fill(60);
  cache().overrideConfiguration(1000, 0);
  beginPruning();
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(keys(), SizeIs(10));
  settle();
  EXPECT_EQ(ending, "<done>");
  expectItems({});
}

TEST_F(DiskCacheFromDefinition, TheLongestStaleAgeExpiresNothing) {
  createFrom(definition(PruneStrategyIdentifier::LRU, false, std::nullopt, std::numeric_limits<std::uint32_t>::max()));
  fill(1);
  ASSERT_TRUE(fire(300));
  settle();
  expectItems({"0"});
}

// --- Many threads ---

TEST_F(DiskCacheTest, StoringFetchingRemovingAndPruningOnManyThreadsLeavesRecordsAndFilesInAgreement) {
  resize(60, 20);
  options.batchSize = 3;
  options.capacity = 12;
  open();
  std::atomic<int> completed{0};
  std::atomic<bool> ended{false};
  const auto count = [&](auto future) {
    future.then(nullptr, [&](auto& value) {
      ++completed;
      EXPECT_NO_THROW(value.get());
    });
  };
  std::thread fileThread([&] {
    while (!ended) {
      if (!file().runNext()) std::this_thread::yield();
    }
  });
  std::thread workThread([&] {
    while (!ended) {
      if (!work().runNext()) std::this_thread::yield();
    }
  });
  test::runOnThreads(3, [&](std::size_t thread) {
    for (int i = 0; i < 100; ++i) {
      const std::string key = std::to_string((i * 7 + static_cast<int>(thread)) % 10);
      count(store->store(key, Bytes(static_cast<std::size_t>(i % 20), 'x')));
      count(store->fetch(key));
      if (i % 3 == 0) count(store->removeItem(key));
      if (i % 10 == 0) cache().pruneBackToNormal(nullptr, nullptr, i % 20 == 0);
      if (i % 25 == 0) store->clear(nullptr, nullptr);
      if (i % 10 == 5) cache().overrideConfiguration(1000, static_cast<unsigned int>(i));
    }
  });
  ended = true;
  fileThread.join();
  workThread.join();
  settle();
  EXPECT_EQ(completed, 3 * 234);
  EXPECT_EQ(keys(), valueFiles());
  std::uint32_t total = 0;
  for (const std::string& key : keys()) {
    EXPECT_EQ(store->getManifest()->getItem(key)->size, directory.read("store/" + key).size());
    total += store->getManifest()->getItem(key)->size;
  }
  EXPECT_EQ(store->getManifest()->size(), total);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
