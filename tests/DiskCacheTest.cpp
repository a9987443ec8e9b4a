#include "DiskCache.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <functional>
#include <future>
#include <limits>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "DiskCacheManifest.h"
#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "PruneStrategy.h"
#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Barrier.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::EventLog;
using test::FaultyFileUtils;
using test::Latch;
using test::LogCapture;
using test::ManualClock;
using test::ManualExecutor;
using test::ManualQueueFactory;
using test::Operation;
using test::TemporaryDirectory;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Not;
using testing::SizeIs;
using testing::UnorderedElementsAre;

using Bytes = std::vector<unsigned char>;
using ItemType = VideoDownloadExtendedMetadata::ItemType;
using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

constexpr std::int64_t kSecond = 1'000'000'000;

// The callbacks of one prune or clear, counted.
struct Answers {
  int successes = 0;
  std::vector<std::string> errors;

  std::function<void()> onSuccess() {
    return [this] { ++successes; };
  }
  std::function<void(const std::exception&)> onError() {
    return [this](const std::exception& error) { errors.emplace_back(error.what()); };
  }
};

// Forwards to a manifest, and lets a test come in between.
class InterceptedManifest final : public DiskCacheManifestInterface {
 public:
  std::function<void()> afterSetItem;
  std::function<void(std::uint32_t size, std::uint32_t count)> beforePruneToSize;
  std::function<void()> beforeRemoveItem;
  std::function<void()> beforeGetItem;

  explicit InterceptedManifest(std::shared_ptr<DiskCacheManifestInterface> real) : real_(std::move(real)) {}

  void clear() override { real_->clear(); }
  void load() override { real_->load(); }
  void invalidate() override { real_->invalidate(); }
  void setItem(const DiskCacheItem& item) override {
    real_->setItem(item);
    if (afterSetItem) afterSetItem();
  }
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) override {
    if (beforeGetItem) beforeGetItem();
    return real_->getItem(key);
  }
  void updateLastAccessDate(const std::string& key) override { real_->updateLastAccessDate(key); }
  std::optional<std::int32_t> getModificationDate(const std::string& key) override {
    return real_->getModificationDate(key);
  }
  void removeItem(const std::string& key) override {
    if (beforeRemoveItem) beforeRemoveItem();
    real_->removeItem(key);
  }
  Bytes getInlineData(const std::string& key) override { return real_->getInlineData(key); }
  void setInlineData(const std::string& key, const Bytes& data) override { real_->setInlineData(key, data); }
  void removeInlineData(const std::string& key) override { real_->removeInlineData(key); }
  std::vector<DiskCacheItem> pruneToSize(std::uint32_t size, std::uint32_t count) override {
    if (beforePruneToSize) beforePruneToSize(size, count);
    return real_->pruneToSize(size, count);
  }
  std::vector<DiskCacheItem> pruneOldEntries(long date, std::uint32_t count) override {
    return real_->pruneOldEntries(date, count);
  }
  std::unique_ptr<DiskCacheItem> pruneOldestItem() override { return real_->pruneOldestItem(); }
  std::vector<std::string> getAllKeys() override { return real_->getAllKeys(); }
  std::uint32_t size() override { return real_->size(); }
  std::uint32_t count() override { return real_->count(); }
  bool isLoaded() override { return real_->isLoaded(); }

 private:
  const std::shared_ptr<DiskCacheManifestInterface> real_;
};

class DiskCacheTest : public testing::Test {
 protected:
  struct Options {
    std::optional<std::uint64_t> capacity;
    long staleAge = 1000;
    unsigned int normalSize = 100;
    unsigned int survivalSize = 40;
    bool inlineData = false;
    std::shared_ptr<PruneStrategyBase> strategy;
    unsigned int batchSize = 50;
  };

  static Options sizes(unsigned int normal, unsigned int survival) {
    Options options;
    options.normalSize = normal;
    options.survivalSize = survival;
    return options;
  }

  void create(const Options& options) {
    queues_ = std::make_shared<ManualQueueFactory>();
    cache_ = DiskCache::createDiskCache(
        storePath(), directory_.file("temporary"), "thumbs", options.capacity, options.staleAge, options.normalSize,
        options.survivalSize, options.inlineData, queues_, std::make_shared<VideoDownloadExtendedMetadataFactory>(),
        trash_, options.strategy, test::recordingReporter(events_), manifest_, files_,
        [this](unsigned int size) { reportedSizes_.push_back(size); }, options.batchSize);
  }
  void open(const Options& options) {
    create(options);
    run();
  }
  void open() { open(Options()); }
  void restart(const Options& options) {
    cache_.reset();
    run();
    open(options);
  }

  // Supplies the manifest of the next `create`, over a database of its own, so that a test can come in between.
  void intercept() {
    intercepted_ = std::make_shared<InterceptedManifest>(DiskCacheManifest::createDiskCacheManifest(
        directory_.file("manifest"), std::make_shared<ManualExecutor>(), nullptr, nullptr));
    manifest_ = intercepted_;
  }

  void run() { queues_->runAll(); }
  ManualExecutor& fileQueue() { return *queues_->queue(0); }
  ManualExecutor& workQueue() { return *queues_->workQueue(0); }

  void begin(const std::string& key, std::size_t size) { cache_->store(key, Bytes(size, 'x')); }

  // Stores a value, one second after the last.
  void store(const std::string& key, std::size_t size,
             std::shared_ptr<DiskCacheItem::ExtendedMetadata> data = nullptr) {
    clock_.advance(1);
    auto future = cache_->store(key, Bytes(size, 'x'), std::move(data));
    run();
    future.get();
  }
  // Items "0", "1", ... of ten bytes, each one second younger than the one before.
  void fill(int count) {
    for (int i = 0; i < count; ++i) store(std::to_string(i), 10);
  }

  Fetched fetch(const std::string& key) {
    Fetched result;
    std::exception_ptr error;
    cache_->fetch(key).then(nullptr, [&](std::future<Fetched>& value) {
      try {
        result = value.get();
      } catch (...) {
        error = std::current_exception();
      }
    });
    run();
    if (error != nullptr) std::rethrow_exception(error);
    return result;
  }

  Answers prune(bool survival = false) {
    Answers answers;
    cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), survival);
    run();
    return answers;
  }
  void expectPruned(bool survival = false) {
    const Answers answers = prune(survival);
    EXPECT_EQ(answers.successes, 1);
    EXPECT_THAT(answers.errors, IsEmpty());
  }

  std::vector<std::string> keys() {
    auto keys = cache_->getAllKeys();
    std::sort(keys.begin(), keys.end());
    return keys;
  }
  std::vector<std::string> files() const {
    std::vector<std::string> names;
    for (const std::string& name : directory_.names("store")) {
      if (name.rfind("manifest_v1.sqlite", 0) != 0) names.push_back(name);
    }
    return names;
  }
  // Records and files name the same items.
  void expectItems(const std::vector<std::string>& expected) {
    EXPECT_EQ(keys(), expected);
    EXPECT_EQ(files(), expected);
  }

  std::string storePath() const { return directory_.file("store"); }

  TemporaryDirectory directory_;
  ManualClock clock_{1'700'000'000};
  std::shared_ptr<FaultyFileUtils> files_ = std::make_shared<FaultyFileUtils>();
  std::shared_ptr<ManualQueueFactory> trashQueues_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<TrashCollector> trash_ =
      std::make_shared<TrashCollector>(directory_.file("trash"), std::make_shared<FileUtils>(), nullptr, trashQueues_);
  std::shared_ptr<EventLog> events_ = std::make_shared<EventLog>();
  std::shared_ptr<ManualQueueFactory> queues_;
  std::shared_ptr<InterceptedManifest> intercepted_;
  std::shared_ptr<DiskCacheManifestInterface> manifest_;
  std::vector<unsigned int> reportedSizes_;
  std::shared_ptr<DiskCache> cache_;
};

// --- Creation ---

TEST_F(DiskCacheTest, IsPrunable) {
  for (const bool inlineData : {false, true}) {
    Options options;
    options.inlineData = inlineData;
    open(options);
    EXPECT_TRUE(cache_->isPrunable());
  }
}

TEST_F(DiskCacheTest, CreatesItsDirectoryAndTakesTwoQueues) {
  create(Options());
  EXPECT_TRUE(directory_.exists("store"));
  EXPECT_EQ(queues_->queueCount(), 1U);
  EXPECT_EQ(queues_->workQueueCount(), 1U);
  EXPECT_EQ(cache_->path, storePath());
  EXPECT_EQ(cache_->getTemporaryDirectoryPath(), directory_.file("temporary"));
}

TEST_F(DiskCacheTest, LoadsItsManifestWhenItIsCreatedAndArmsTheFirstExpiry) {
  create(Options());
  EXPECT_THROW(cache_->getAllKeys(), DiskCacheManifestException);
  run();
  EXPECT_TRUE(cache_->getManifest()->isLoaded());
  EXPECT_THAT(workQueue().armedDelays(), UnorderedElementsAre(300 * kSecond, 120 * kSecond));
}

TEST_F(DiskCacheTest, GivesOutItsStrategy) {
  Options options;
  options.strategy = std::make_shared<LRUPruneStrategy>();
  open(options);
  EXPECT_EQ(cache_->getPruneStrategy(), options.strategy);
  restart(Options());
  EXPECT_EQ(cache_->getPruneStrategy(), nullptr);
}

TEST_F(DiskCacheTest, ReportsAccessesUnderItsName) {
  open();
  store("a", 3);
  fetch("a");
  fetch("b");
  const auto events = events_->events();
  ASSERT_THAT(events, SizeIs(2));
  for (const auto& event : events) EXPECT_NE(event.payload.find("thumbs"), std::string::npos) << event.payload;
}

TEST_F(DiskCacheTest, CapacityStillCounts) {
  Options options;
  options.capacity = 3;
  open(options);
  fill(4);
  expectItems({"1", "2", "3"});
}

TEST_F(DiskCacheTest, ExpiryStillHappens) {
  open();
  fill(2);
  clock_.advance(1000);
  ASSERT_TRUE(workQueue().fireTimer(300 * kSecond));
  run();
  expectItems({"1"});  // used exactly its age ago, which is not more
  EXPECT_THAT(workQueue().armedDelays(), UnorderedElementsAre(3600 * kSecond, 120 * kSecond));
}

// --- Pruning ---

TEST_F(DiskCacheTest, ACacheAtItsSizeIsLeftAlone) {
  open(sizes(30, 0));
  fill(3);
  reportedSizes_.clear();
  expectPruned();
  expectItems({"0", "1", "2"});
  EXPECT_THAT(reportedSizes_, ElementsAre(30U));
}

TEST_F(DiskCacheTest, ACacheOneByteOverItsSizeLosesOneItem) {
  open(sizes(29, 0));
  fill(3);
  reportedSizes_.clear();
  expectPruned();
  expectItems({"1", "2"});
  EXPECT_THAT(reportedSizes_, ElementsAre(20U));
}

TEST_F(DiskCacheTest, PruningAnEmptyCacheSucceeds) {
  open(sizes(0, 0));
  expectPruned();
  EXPECT_THAT(reportedSizes_, ElementsAre(0U));
}

TEST_F(DiskCacheTest, InSurvivalModeTheSmallerSizeCounts) {
  open(sizes(60, 20));
  fill(8);
  expectPruned(false);
  expectItems({"2", "3", "4", "5", "6", "7"});
  expectPruned(true);
  expectItems({"6", "7"});
}

TEST_F(DiskCacheTest, TheSurvivalSizeCountsEvenWhenItIsTheLargerOne) {
  open(sizes(10, 50));
  fill(8);
  expectPruned(true);
  EXPECT_THAT(keys(), SizeIs(5));
}

TEST_F(DiskCacheTest, ASizeOfZeroTakesEverythingThatHasASize) {
  open(sizes(0, 0));
  fill(3);
  expectPruned();
  expectItems({});
}

TEST_F(DiskCacheTest, PruningFollowsTheStrategyOfTheCache) {
  VideoDownloadPruneStrategy::priorityWeight = 1000;
  Options options = sizes(10, 0);
  options.strategy = PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload);
  open(options);
  store("beginning", 10, std::make_shared<VideoDownloadExtendedMetadata>(0, ItemType::VideoChunk));
  store("later", 10, std::make_shared<VideoDownloadExtendedMetadata>(60, ItemType::VideoChunk));
  expectPruned();
  VideoDownloadPruneStrategy::priorityWeight = 0;
  expectItems({"beginning"});
}

TEST_F(DiskCacheTest, TheStrategyStillKnowsTheItemsAfterARestart) {
  VideoDownloadPruneStrategy::priorityWeight = 1000;
  Options options = sizes(10, 0);
  options.strategy = PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload);
  open(options);
  store("beginning", 10, std::make_shared<VideoDownloadExtendedMetadata>(0, ItemType::VideoChunk));
  store("later", 10, std::make_shared<VideoDownloadExtendedMetadata>(60, ItemType::VideoChunk));
  restart(options);
  expectPruned();
  VideoDownloadPruneStrategy::priorityWeight = 0;
  expectItems({"beginning"});
}

TEST_F(DiskCacheTest, AUseKeepsAnItemFromBeingPruned) {
  open(sizes(10, 0));
  fill(3);
  clock_.advance(1);
  fetch("0");
  expectPruned();
  expectItems({"0"});
}

// --- Batches ---

TEST_F(DiskCacheTest, PruningGoesBatchByBatchWithTheFilesOfEachGoneBeforeTheNext) {
  Options options = sizes(0, 0);
  options.batchSize = 2;
  open(options);
  fill(5);
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  EXPECT_THAT(keys(), SizeIs(5));  // nothing happens on the caller's thread

  for (const std::size_t left : {3U, 1U, 0U}) {
    ASSERT_TRUE(workQueue().runNext());
    EXPECT_THAT(keys(), SizeIs(left));
    EXPECT_THAT(files(), Not(SizeIs(left)));
    EXPECT_EQ(workQueue().pending(), 0U);
    ASSERT_TRUE(fileQueue().runNext());
    EXPECT_THAT(files(), SizeIs(left));
    EXPECT_EQ(answers.successes, 0);
  }
  ASSERT_TRUE(workQueue().runNext());
  EXPECT_EQ(answers.successes, 1);
  EXPECT_THAT(answers.errors, IsEmpty());
}

TEST_F(DiskCacheTest, EachBatchIsAskedForWithTheTargetAndTheBatchSize) {
  intercept();
  Options options = sizes(15, 5);
  options.batchSize = 7;
  open(options);
  fill(3);
  std::vector<std::pair<std::uint32_t, std::uint32_t>> asked;
  intercepted_->beforePruneToSize = [&](std::uint32_t size, std::uint32_t count) { asked.emplace_back(size, count); };
  expectPruned();
  EXPECT_THAT(asked, ElementsAre(std::pair(15U, 7U), std::pair(15U, 7U)));
}

TEST_F(DiskCacheTest, WhatIsStoredBetweenTwoBatchesCountsInTheNext) {
  Options options = sizes(10, 0);
  options.batchSize = 1;
  open(options);
  fill(2);
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  ASSERT_TRUE(workQueue().runNext());
  clock_.advance(1);
  begin("new", 10);
  run();
  EXPECT_EQ(answers.successes, 1);
  expectItems({"new"});
}

TEST_F(DiskCacheTest, InlineItemsArePrunedWithoutAnyFileBeingTouched) {
  Options options = sizes(10, 0);
  options.inlineData = true;
  open(options);
  fill(3);
  files_->clearTrace();
  expectPruned();
  EXPECT_THAT(keys(), ElementsAre("2"));
  EXPECT_EQ(files_->calls(Operation::DeleteFile), 0U);
  EXPECT_EQ(fetch("2")->value, Bytes(10, 'x'));
}

TEST_F(DiskCacheTest, AFileThatCannotBeDeletedIsOneErrorLineAndThePruneGoesOn) {
  open(sizes(0, 0));
  fill(3);
  files_->failPath(Operation::DeleteFile, directory_.file("store/1"), EACCES);
  const LogCapture log;
  expectPruned();
  EXPECT_THAT(keys(), IsEmpty());
  EXPECT_THAT(files(), ElementsAre("1"));
  ASSERT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("Failed to delete file at \"" + directory_.file("store/1") + "\" domain: "));
}

// --- Overriding the configuration ---

TEST_F(DiskCacheTest, OverridingChangesTheNormalSizeOfTheNextPruneAndNotTheSurvivalSize) {
  open(sizes(100, 20));
  fill(8);
  cache_->overrideConfiguration(1000, 50);
  expectPruned(false);
  expectItems({"3", "4", "5", "6", "7"});
  expectPruned(true);
  expectItems({"6", "7"});
}

TEST_F(DiskCacheTest, OverridingDoesNotChangeAPruneThatIsQueued) {
  open(sizes(50, 0));
  fill(8);
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  cache_->overrideConfiguration(1000, 10);
  run();
  EXPECT_EQ(answers.successes, 1);
  EXPECT_THAT(keys(), SizeIs(5));
  expectPruned();
  EXPECT_THAT(keys(), SizeIs(1));
}

TEST_F(DiskCacheTest, OverridingReplacesTheStaleAgeToo) {
  open();
  fill(2);
  clock_.advance(10);
  cache_->overrideConfiguration(10, 100);
  ASSERT_TRUE(workQueue().fireTimer(300 * kSecond));
  run();
  expectItems({"1"});
}

TEST_F(DiskCacheTest, TheInheritedOverrideLeavesTheSizesAsTheyAre) {
  open(sizes(20, 0));
  fill(3);
  cache_->overrideConfiguration(5);
  expectPruned();
  expectItems({"1", "2"});
}

// --- Prunes that fail ---

TEST_F(DiskCacheTest, WhenTheManifestCannotRemoveAnItemTheErrorCallbackIsCalledOnce) {
  intercept();
  open(sizes(0, 0));
  fill(2);
  intercepted_->beforePruneToSize = [](std::uint32_t, std::uint32_t) {
    throw ManifestPersistenceException("The medium is full.", SQLITE_FULL);
  };
  const Answers answers = prune();
  EXPECT_EQ(answers.successes, 0);
  ASSERT_THAT(answers.errors, SizeIs(1));
  EXPECT_NE(answers.errors[0].find("The medium is full."), std::string::npos);
  EXPECT_THAT(keys(), SizeIs(2));
}

TEST_F(DiskCacheTest, ADamagedManifestPurgesTheCacheAndThePruneSucceeds) {
  intercept();
  open(sizes(0, 0));
  fill(2);
  intercepted_->beforePruneToSize = [damaged = true](std::uint32_t, std::uint32_t) mutable {
    if (std::exchange(damaged, false)) throw ManifestCorruptedException("Damaged for the test.", SQLITE_CORRUPT);
  };
  const LogCapture log;
  expectPruned();
  EXPECT_TRUE(log.contains("Store \"thumbs\" purged due to corrupted manifest. "));
  EXPECT_THAT(files(), IsEmpty());
}

TEST_F(DiskCacheTest, PruningAfterInvalidationCallsTheErrorCallback) {
  open(sizes(0, 0));
  fill(1);
  cache_->invalidateSoon();
  run();
  const Answers answers = prune();
  EXPECT_EQ(answers.successes, 0);
  ASSERT_THAT(answers.errors, SizeIs(1));
  EXPECT_NE(answers.errors[0].find("Store has been invalidated."), std::string::npos);
}

TEST_F(DiskCacheTest, InvalidationBetweenTwoBatchesEndsThePruneWithItsErrorCallback) {
  Options options = sizes(0, 0);
  options.batchSize = 1;
  open(options);
  fill(3);
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  ASSERT_TRUE(workQueue().runNext());
  cache_->invalidateSoon();
  run();
  EXPECT_EQ(answers.successes, 0);
  EXPECT_THAT(answers.errors, SizeIs(1));
  EXPECT_THAT(files(), ElementsAre("1", "2"));
}

TEST_F(DiskCacheTest, PruningWithoutCallbacksIsAllowed) {
  open(sizes(0, 0));
  fill(2);
  cache_->pruneBackToNormal(nullptr, nullptr, false);
  run();
  expectItems({});
}

TEST_F(DiskCacheTest, CallbacksMayUseTheCacheAgain) {
  open(sizes(10, 0));
  fill(3);
  int rounds = 0;
  std::function<void()> again = [&] {
    if (++rounds == 3) return;
    cache_->overrideConfiguration(1000, 0);
    cache_->throwIfInvalid();
    EXPECT_LE(cache_->getAllKeys().size(), 1U);
    cache_->pruneBackToNormal(
        again, [](const std::exception& error) { ADD_FAILURE() << error.what(); }, false);
  };
  cache_->pruneBackToNormal(
      again, [](const std::exception& error) { ADD_FAILURE() << error.what(); }, false);
  run();
  EXPECT_EQ(rounds, 3);
  expectItems({});
}

// --- Lifetimes ---

TEST_F(DiskCacheTest, AQueuedPruneDoesNotKeepTheCacheAliveAndDoesNothingWhenItHasGone) {
  open(sizes(0, 0));
  fill(2);
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  const std::weak_ptr<DiskCache> weak = cache_;
  cache_.reset();
  EXPECT_TRUE(weak.expired());
  run();
  EXPECT_EQ(answers.successes, 0);
  EXPECT_THAT(files(), ElementsAre("0", "1"));
}

TEST_F(DiskCacheTest, ACacheThatGoesBetweenTwoBatchesIsPrunedNoFurther) {
  Options options = sizes(0, 0);
  options.batchSize = 1;
  open(options);
  fill(3);
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  ASSERT_TRUE(workQueue().runNext());
  ASSERT_TRUE(fileQueue().runNext());
  cache_.reset();
  run();
  EXPECT_EQ(answers.successes, 0);
  open();
  expectItems({"1", "2"});
}

TEST_F(DiskCacheTest, ACacheThatGoesWithAWriteOnItsWayLeavesNoRecordWithoutAFile) {
  for (const bool isInvalidatedFirst : {false, true}) {
    open();
    begin("queued", 10);
    ASSERT_TRUE(workQueue().runNext());
    Future<void> barrier;
    if (isInvalidatedFirst) barrier = cache_->invalidateWithFuture();
    cache_.reset();
    run();
    open();
    EXPECT_EQ(keys(), files()) << (isInvalidatedFirst ? "invalidated" : "let go");
  }
}

TEST_F(DiskCacheTest, ItsQueuesHoldNoTimerAfterIt) {
  open();
  cache_.reset();
  EXPECT_THAT(workQueue().armedDelays(), IsEmpty());
  EXPECT_THAT(fileQueue().armedDelays(), IsEmpty());
}

// --- Removals that meet a write on its way ---

TEST_F(DiskCacheTest, APruneThatMeetsAQueuedWriteLeavesNeitherRecordNorFile) {
  open(sizes(0, 0));
  store("old", 10);
  auto queued = cache_->store("old", Bytes(50, 'y'));
  ASSERT_TRUE(workQueue().runNext());  // its provisional record is there
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  run();
  queued.get();
  EXPECT_EQ(answers.successes, 1);
  EXPECT_EQ(keys(), files());
}

TEST_F(DiskCacheTest, AProvisionalRecordOfNoSizeDoesNotHoldUpThePrune) {
  open(sizes(5, 0));
  store("big", 10);
  clock_.advance(1);
  auto queued = cache_->store("small", Bytes(5, 'y'));
  ASSERT_TRUE(workQueue().runNext());
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  run();
  queued.get();
  EXPECT_EQ(answers.successes, 1);
  expectItems({"small"});
}

TEST_F(DiskCacheTest, AKeyPrunedWhileItsWriteWaitsCanBeStoredAgainAtOnce) {
  open(sizes(0, 0));
  store("k", 10);
  clock_.advance(-5);  // the provisional record is the oldest
  auto first = cache_->store("k", Bytes(1, 'a'));
  ASSERT_TRUE(workQueue().runNext());
  clock_.advance(10);
  auto other = cache_->store("z", Bytes(10, 'z'));
  run();
  first.get();
  other.get();
  Answers answers;
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  auto second = cache_->store("k", Bytes(2, 'b'));
  run();
  second.get();
  EXPECT_EQ(answers.successes, 1);
  EXPECT_EQ(keys(), files());
}

// A clear takes the records batch by batch, but a write on its way is called off at once: its record must not stand
// there without a file until its batch comes.
class ClearInBatches : public DiskCacheTest {
 protected:
  void SetUp() override {
    Options options;
    options.batchSize = 1;
    open(options);
    fill(2);
    clock_.advance(1);
    queued_ = cache_->store("queued", Bytes(10, 'y'));
    ASSERT_TRUE(workQueue().runNext());
    cache_->clear(answers_.onSuccess(), answers_.onError());
    ASSERT_TRUE(workQueue().runNext());  // the first batch
    fileQueue().runAll();                // the write comes by, and finds that it has been called off
    queued_.get();
    ASSERT_EQ(answers_.successes, 0);
  }

  Answers answers_;
  Future<void> queued_;
};

TEST_F(ClearInBatches, RemovingTheKeyMeanwhileSucceeds) {
  auto removed = cache_->removeItem("queued");
  run();
  EXPECT_NO_THROW(removed.get());
  EXPECT_EQ(answers_.successes, 1);
  expectItems({});
}

TEST_F(ClearInBatches, FetchingTheKeyMeanwhileIsAMiss) {
  EXPECT_EQ(cache_->fetchModificationDate("queued"), std::nullopt);
  EXPECT_EQ(fetch("queued"), nullptr);
  EXPECT_EQ(answers_.successes, 1);
}

TEST_F(ClearInBatches, AProcessThatIsKilledMeanwhileLeavesNoRecordWithoutAFile) {
  for (const std::string& key : keys()) EXPECT_TRUE(directory_.exists("store/" + key)) << key;
}

// --- Damage met in the middle ---

TEST_F(DiskCacheTest, RemovingAnItemFromADamagedManifestPurgesTheCacheAndSucceeds) {
  intercept();
  open();
  fill(2);
  intercepted_->beforeRemoveItem = [damaged = true]() mutable {
    if (std::exchange(damaged, false)) throw ManifestCorruptedException("Damaged for the test.", SQLITE_CORRUPT);
  };
  const LogCapture log;
  auto removed = cache_->removeItem("0");
  run();
  EXPECT_NO_THROW(removed.get());
  EXPECT_TRUE(log.contains("Store \"thumbs\" purged due to corrupted manifest. "));
  EXPECT_THAT(files(), IsEmpty());
}

TEST_F(DiskCacheTest, AStoreThatMeetsADamagedManifestTakesAnEarlierQueuedWriteOfItsKeyAlong) {
  intercept();
  open();
  cache_->store("k", Bytes(1, 'a'));
  ASSERT_TRUE(workQueue().runNext());
  int writes = 0;
  intercepted_->afterSetItem = [&] {
    if (++writes == 1) throw ManifestCorruptedException("Damaged for the test.", SQLITE_CORRUPT);
  };
  const LogCapture log;
  auto later = cache_->store("k", Bytes(2, 'b'));
  ASSERT_TRUE(workQueue().runNext());
  ASSERT_TRUE(log.contains("purged"));
  run();
  later.get();
  // The later value is lost with the purge; the earlier one must not take its place.
  EXPECT_THAT(files(), IsEmpty());
}

TEST_F(DiskCacheTest, AFetchThatLostItsFileToARemovalIsAMissEvenWhenTheManifestIsDamagedByThen) {
  intercept();
  open();
  store("k", 5);
  Fetched fetched = std::make_unique<PersistentKeyValueStore::FetchResult>();
  std::string error;
  cache_->fetch("k").then(nullptr, [&](std::future<Fetched>& value) {
    try {
      fetched = value.get();
    } catch (const std::exception& exception) {
      error = exception.what();
    }
  });
  cache_->removeItem("k");
  workQueue().runAll();
  intercepted_->beforeGetItem = [damaged = true]() mutable {
    if (std::exchange(damaged, false)) throw ManifestCorruptedException("Damaged for the test.", SQLITE_CORRUPT);
  };
  const LogCapture log;
  run();
  EXPECT_EQ(error, "");
  EXPECT_EQ(fetched, nullptr);
  EXPECT_TRUE(log.contains("Store \"thumbs\" purged due to corrupted manifest. "));
}

TEST_F(DiskCacheTest, AClearThatMeetsADamagedManifestCallsQueuedWritesOffAllTheSame) {
  intercept();
  open();
  auto queued = cache_->store("k", Bytes(1, 'a'));
  ASSERT_TRUE(workQueue().runNext());
  intercepted_->beforeRemoveItem = [damaged = true]() mutable {
    if (std::exchange(damaged, false)) throw ManifestCorruptedException("Damaged for the test.", SQLITE_CORRUPT);
  };
  const LogCapture log;
  Answers answers;
  cache_->clear(answers.onSuccess(), answers.onError());
  workQueue().runAll();
  ASSERT_TRUE(log.contains("purged"));
  run();
  queued.get();
  EXPECT_EQ(answers.successes, 1);
  EXPECT_THAT(keys(), IsEmpty());
  EXPECT_THAT(files(), IsEmpty());
}

// --- Inline values on two threads ---

TEST_F(DiskCacheTest, AnInlineValueReadWhileItIsOverwrittenIsTheOldOrTheNewOne) {
  intercept();
  Options options;
  options.inlineData = true;
  open(options);
  store("k", 5);

  Bytes seen;
  bool hit = false;
  Latch reading(1);
  Latch read(1);
  const auto loader = [&](std::shared_ptr<const DiskCacheItem> item, const std::string& path, Bytes& value) {
    reading.countDown();
    hit = cache_->readValue(std::move(item), path, value);
    seen = value;
    read.countDown();
    return hit;
  };
  cache_->fetch("k", PersistentKeyValueStore::Loader(loader));
  ASSERT_TRUE(workQueue().runNext());  // found; its value is to be read on the file queue

  std::thread reader;
  intercepted_->afterSetItem = [&] {
    reader = std::thread([&] { fileQueue().runAll(); });
    reading.wait();
    // The reader may have to wait for the writer; then it reads when this has returned.
    for (int i = 0; i < 10000 && !read.isOpen(); ++i) std::this_thread::yield();
  };
  cache_->store("k", Bytes(7, 'y'));
  workQueue().runAll();
  reader.join();
  run();

  EXPECT_TRUE(hit);
  EXPECT_TRUE(seen == Bytes(5, 'x') || seen == Bytes(7, 'y')) << "a value of " << seen.size() << " bytes";
}

// --- From a definition ---

class DiskCacheFromDefinition : public DiskCacheTest {
 protected:
  static DiskCacheDefinition definition(PruneStrategyIdentifier strategy, bool inlineData = false,
                                        std::optional<std::int64_t> capacity = std::nullopt,
                                        std::uint32_t staleAge = 1000) {
    return {"thumbs",
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
    queues_ = std::make_shared<ManualQueueFactory>();
    const auto store = from.createStore(
        storePath(), directory_.file("temporary"), queues_, trash_, nullptr, files_,
        [this](unsigned int size) { reportedSizes_.push_back(size); }, override_, nullptr);
    cache_ = std::dynamic_pointer_cast<DiskCache>(store);
    ASSERT_NE(cache_, nullptr);
    run();
  }
};

TEST_F(DiskCacheFromDefinition, TheOverrideOneTakesTheDefinitionsStrategy) {
  createFrom(definition(PruneStrategyIdentifier::VideoDownload), PruneStrategyIdentifier::Null);
  EXPECT_NE(dynamic_cast<VideoDownloadPruneStrategy*>(cache_->getPruneStrategy().get()), nullptr);
  createFrom(definition(PruneStrategyIdentifier::LRU), PruneStrategyIdentifier::Null);
  EXPECT_NE(dynamic_cast<LRUPruneStrategy*>(cache_->getPruneStrategy().get()), nullptr);
}

TEST_F(DiskCacheFromDefinition, AnyOtherOverrideReplacesTheDefinitionsStrategy) {
  createFrom(definition(PruneStrategyIdentifier::VideoDownload), PruneStrategyIdentifier::LRU);
  EXPECT_NE(dynamic_cast<LRUPruneStrategy*>(cache_->getPruneStrategy().get()), nullptr);
  createFrom(definition(PruneStrategyIdentifier::LRU), PruneStrategyIdentifier::VideoDownload);
  EXPECT_NE(dynamic_cast<VideoDownloadPruneStrategy*>(cache_->getPruneStrategy().get()), nullptr);
}

TEST_F(DiskCacheFromDefinition, ADefinitionWithoutAStrategyPrunesByLeastRecentUse) {
  createFrom(definition(PruneStrategyIdentifier::Null), PruneStrategyIdentifier::Null);
  EXPECT_EQ(cache_->getPruneStrategy(), nullptr);
  fill(6);
  expectPruned();
  expectItems({"1", "2", "3", "4", "5"});
}

TEST_F(DiskCacheFromDefinition, ItsLimitsAndServicesArePassedOn) {
  createFrom(definition(PruneStrategyIdentifier::LRU, false, 7));
  EXPECT_EQ(cache_->getTemporaryDirectoryPath(), directory_.file("temporary"));
  fill(9);
  EXPECT_THAT(keys(), SizeIs(7));
  expectPruned(false);
  EXPECT_THAT(keys(), SizeIs(5));
  expectPruned(true);
  EXPECT_THAT(keys(), SizeIs(2));
  EXPECT_EQ(reportedSizes_.back(), 20U);
}

TEST_F(DiskCacheFromDefinition, InlineValuesStayInTheManifest) {
  createFrom(definition(PruneStrategyIdentifier::LRU, true));
  fill(2);
  EXPECT_THAT(files(), IsEmpty());
  EXPECT_EQ(fetch("1")->value, Bytes(10, 'x'));
}

TEST_F(DiskCacheFromDefinition, MetadataIsReadBack) {
  createFrom(definition(PruneStrategyIdentifier::LRU));
  store("a", 1, std::make_shared<VideoDownloadExtendedMetadata>(12, ItemType(3)));
  cache_.reset();
  createFrom(definition(PruneStrategyIdentifier::LRU));
  const auto item = cache_->getManifest()->getItem("a");
  const auto* metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(item->extendedMetadata.get());
  ASSERT_NE(metadata, nullptr);
  EXPECT_EQ(metadata->getExtendedMetadata(), 12);
}

TEST_F(DiskCacheFromDefinition, FilesAreDeletedFiftyAtATime) {
  createFrom(definition(PruneStrategyIdentifier::LRU));
  fill(60);
  Answers answers;
  cache_->overrideConfiguration(1000, 0);
  cache_->pruneBackToNormal(answers.onSuccess(), answers.onError(), false);
  ASSERT_TRUE(workQueue().runNext());
  EXPECT_THAT(keys(), SizeIs(10));
  run();
  EXPECT_EQ(answers.successes, 1);
  expectItems({});
}

TEST_F(DiskCacheFromDefinition, TheLongestStaleAgeExpiresNothing) {
  createFrom(definition(PruneStrategyIdentifier::LRU, false, std::nullopt, std::numeric_limits<std::uint32_t>::max()));
  fill(1);
  ASSERT_TRUE(workQueue().fireTimer(300 * kSecond));
  run();
  expectItems({"0"});
}

// --- Many threads ---

TEST_F(DiskCacheTest, StoringFetchingRemovingAndPruningOnManyThreadsLeavesRecordsAndFilesInAgreement) {
  Options options = sizes(60, 20);
  options.batchSize = 3;
  options.capacity = 12;
  open(options);
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
      if (!fileQueue().runNext()) std::this_thread::yield();
    }
  });
  std::thread workThread([&] {
    while (!ended) {
      if (!workQueue().runNext()) std::this_thread::yield();
    }
  });
  test::runOnThreads(3, [&](std::size_t thread) {
    for (int i = 0; i < 100; ++i) {
      const std::string key = std::to_string((i * 7 + static_cast<int>(thread)) % 10);
      count(cache_->store(key, Bytes(static_cast<std::size_t>(i % 20), 'x')));
      count(cache_->fetch(key));
      if (i % 3 == 0) count(cache_->removeItem(key));
      if (i % 10 == 0) cache_->pruneBackToNormal(nullptr, nullptr, i % 20 == 0);
      if (i % 25 == 0) cache_->clear(nullptr, nullptr);
      if (i % 10 == 5) cache_->overrideConfiguration(1000, static_cast<unsigned int>(i));
    }
  });
  ended = true;
  fileThread.join();
  workThread.join();
  run();
  EXPECT_EQ(completed, 3 * 234);
  EXPECT_EQ(keys(), files());
  std::uint32_t total = 0;
  for (const std::string& key : keys()) {
    EXPECT_EQ(cache_->getManifest()->getItem(key)->size, directory_.read("store/" + key).size());
    total += cache_->getManifest()->getItem(key)->size;
  }
  EXPECT_EQ(cache_->getManifest()->size(), total);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
