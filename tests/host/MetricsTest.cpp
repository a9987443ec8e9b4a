// What a host tells of its managers, stores, queues and trash.

#include "host/Metrics.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "DiskCache.h"
#include "DiskSizeCalculator.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "Store.h"
#include "StoreManager.h"
#include "StoreManagerImpl.h"
#include "TrashCollector.h"
#include "host/Host.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::Bytes;
using test::DiskOfChosenSize;
using test::EventLog;
using test::LogCapture;
using test::ManualClock;
using test::ManualQueueFactory;
using test::Operation;
using test::RecordingAnalytics;
using test::TemporaryDirectory;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

constexpr std::int64_t kNow = 1'753'920'000;

const char* const kConfiguration = R"({
  "media": {"session_scoped": false, "max_size": "2KB", "prune_interval": "5 minutes", "stores": {
    "thumbs": {"type": "disk_cache", "name": "pictures", "lru_size_limit": "1KB", "survival_size": "100B",
               "capacity": 7, "stale_age": "2 hours"},
    "web": {"type": "unmanaged", "is_cache": true, "max_size": "1KB"},
    "files": {"type": "unmanaged"}}},
  "inbox": {"stores": {"letters": {"type": "pkvs", "inline_data": true}}}
})";

class Metrics : public testing::Test {
 protected:
  // What waits on a queue may hold the queue.
  void TearDown() override {
    host.reset();
    queues->runAll();
  }

  HostOptions options(const char* configuration = kConfiguration) const {
    HostOptions options;
    options.configuration = configuration;
    options.root = directory.path();
    options.lazyDelaySeconds = 3600;
    options.fileUtils = files;
    options.taskQueueFactory = queues;
    return options;
  }

  void start(HostOptions options) { host = std::make_unique<Host>(std::move(options)); }
  void start() { start(options()); }

  ManagerMetrics managerMetrics(const std::string& name) const {
    for (const ManagerMetrics& manager : host->metrics().managers) {
      if (manager.name == name) return manager;
    }
    throw std::out_of_range(name);
  }

  StoreMetrics storeMetrics(const std::string& identifier) const {
    for (const ManagerMetrics& manager : host->metrics().managers) {
      for (const StoreMetrics& store : manager.stores) {
        if (store.identifier == identifier) return store;
      }
    }
    throw std::out_of_range(identifier);
  }

  void put(PersistentKeyValueStore& store, const std::string& key, std::size_t bytes) const {
    store.store(key, Bytes(bytes));
    queues->runAll();
  }

  void get(PersistentKeyValueStore& store, const std::string& key) const {
    static_cast<void>(store.fetch(key));
    queues->runAll();
  }

  const TemporaryDirectory directory;
  ManualClock clock{kNow};
  const std::shared_ptr<DiskOfChosenSize> files = std::make_shared<DiskOfChosenSize>();
  const std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  std::unique_ptr<Host> host;
};

std::vector<std::string> namesOf(const HostMetrics& metrics) {
  std::vector<std::string> names;
  for (const ManagerMetrics& manager : metrics.managers) {
    names.push_back(manager.name + "/" + manager.session.value_or("-"));
  }
  return names;
}

// Before anything is requested

TEST_F(Metrics, OfAHostThatNobodyHasUsedAreItsLimits) {
  start();
  const HostMetrics metrics = host->metrics();
  EXPECT_EQ(metrics.time, kNow);
  EXPECT_THAT(namesOf(metrics), ElementsAre("inbox/-", "media/-"));
  const ManagerMetrics& media = metrics.managers.at(1);
  EXPECT_FALSE(media.isSessionScoped);
  EXPECT_TRUE(metrics.managers.at(0).isSessionScoped);
  EXPECT_FALSE(media.isBuilt);
  EXPECT_EQ(media.maxBytes, 2048U);
  EXPECT_EQ(media.pruneInterval, 300U);
  EXPECT_EQ(media.bytes, std::nullopt);
  EXPECT_FALSE(metrics.queues);
  EXPECT_FALSE(metrics.trash);
}

TEST_F(Metrics, OfAStoreThatIsNotCreatedAreItsLimits) {
  start();
  const std::vector<StoreMetrics> stores = managerMetrics("media").stores;
  ASSERT_EQ(stores.size(), 3U);
  EXPECT_EQ(stores[0].identifier, "files");
  EXPECT_EQ(stores[0].maxBytes, 0U);
  EXPECT_EQ(stores[2].identifier, "web");
  EXPECT_EQ(stores[2].type, StoreDefinition::Type::Unmanaged);
  EXPECT_EQ(stores[2].maxBytes, 1024U);
  EXPECT_EQ(stores[2].maxItems, std::nullopt);
  EXPECT_EQ(stores[2].staleAge, std::nullopt);
  const StoreMetrics& thumbs = stores[1];
  EXPECT_EQ(thumbs.identifier, "thumbs");
  EXPECT_EQ(thumbs.name, "pictures");
  EXPECT_EQ(thumbs.type, StoreDefinition::Type::DiskCache);
  EXPECT_FALSE(thumbs.isCreated);
  EXPECT_EQ(thumbs.maxBytes, 1024U);
  EXPECT_EQ(thumbs.survivalBytes, 100U);
  EXPECT_EQ(thumbs.maxItems, 7U);
  EXPECT_EQ(thumbs.staleAge, 7200U);
  EXPECT_EQ(thumbs.bytes, std::nullopt);
  EXPECT_EQ(thumbs.items, std::nullopt);
  EXPECT_EQ(thumbs.hits, std::nullopt);
  EXPECT_EQ(thumbs.misses, std::nullopt);
  EXPECT_EQ(thumbs.writes, std::nullopt);
  EXPECT_EQ(thumbs.evictions, std::nullopt);
  EXPECT_FALSE(thumbs.lastPrune);
  const StoreMetrics letters = storeMetrics("letters");
  EXPECT_EQ(letters.type, StoreDefinition::Type::PKVS);
  EXPECT_EQ(letters.maxBytes, std::nullopt);
  EXPECT_EQ(letters.maxItems, std::nullopt);
}

TEST_F(Metrics, CreateNothingAndAccessNoFile) {
  start();
  const auto before = files->trace();
  const std::size_t queueCount = queues->all().size();
  static_cast<void>(host->metrics());
  EXPECT_EQ(files->trace(), before);
  EXPECT_EQ(queues->all().size(), queueCount);
  const auto store = host->store<DiskCache>("thumbs");
  put(*store, "cat", 10);
  files->clearTrace();
  EXPECT_EQ(storeMetrics("thumbs").items, 1U);
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_EQ(queues->runAll(), 0U);
}

// Stores with keys

TEST_F(Metrics, AStoreHasNoSizeBeforeItIsLoaded) {
  start();
  host->store<DiskCache>("thumbs");
  EXPECT_TRUE(storeMetrics("thumbs").isCreated);
  EXPECT_TRUE(managerMetrics("media").isBuilt);
  EXPECT_EQ(storeMetrics("thumbs").bytes, std::nullopt);
  EXPECT_EQ(storeMetrics("thumbs").hits, 0U);
  queues->runAll();
  EXPECT_EQ(storeMetrics("thumbs").bytes, 0U);
  EXPECT_EQ(storeMetrics("thumbs").items, 0U);
  EXPECT_EQ(managerMetrics("media").bytes, 0U);
}

TEST_F(Metrics, TellSizeAndItemsAsAStoreHasReportedThem) {
  start();
  const auto store = host->store<DiskCache>("thumbs");
  put(*store, "cat", 100);
  put(*store, "dog", 50);
  EXPECT_EQ(storeMetrics("thumbs").bytes, 150U);
  EXPECT_EQ(storeMetrics("thumbs").items, 2U);
  EXPECT_EQ(managerMetrics("media").bytes, 150U);
  put(*store, "cat", 1);
  EXPECT_EQ(storeMetrics("thumbs").bytes, 51U);
  EXPECT_EQ(storeMetrics("thumbs").items, 2U);
  store->clear(nullptr, nullptr);
  queues->runAll();
  EXPECT_EQ(storeMetrics("thumbs").bytes, 0U);
  EXPECT_EQ(storeMetrics("thumbs").items, 0U);
}

TEST_F(Metrics, TheRemovalOfAKeyShowsInTheNextReport) {
  start();
  const auto store = host->store<DiskCache>("thumbs");
  put(*store, "cat", 100);
  store->removeItem("cat");
  queues->runAll();
  EXPECT_EQ(storeMetrics("thumbs").items, 1U);
  store->reportSize();
  queues->runAll();
  EXPECT_EQ(storeMetrics("thumbs").items, 0U);
  EXPECT_EQ(storeMetrics("thumbs").bytes, 0U);
}

TEST_F(Metrics, CountAccessesAndWritesAndItemsEvictedForTheCapacity) {
  start();
  const auto store = host->store<DiskCache>("thumbs");
  for (int i = 0; i < 9; ++i) put(*store, std::to_string(i), 1);  // of which 7 stay
  get(*store, "8");
  get(*store, "7");
  get(*store, "no such key");
  const StoreMetrics metrics = storeMetrics("thumbs");
  EXPECT_EQ(metrics.hits, 2U);
  EXPECT_EQ(metrics.misses, 1U);
  EXPECT_EQ(metrics.writes, 9U);
  EXPECT_EQ(metrics.evictions, 2U);
  EXPECT_EQ(metrics.items, 7U);
}

TEST_F(Metrics, OfAStoreThatRunsEverythingAtOnceHaveItsItemsToo) {
  start();
  put(*host->store<DiskCache>("thumbs"), "cat", 100);
  host.reset();
  queues->runAll();
  class AtOnce final : public TaskQueueFactory {
   public:
    std::shared_ptr<AsyncExecutor> createQueue() override { return create(); }
    std::shared_ptr<AsyncExecutor> createWorkQueue() override { return create(); }

   private:
    static std::shared_ptr<AsyncExecutor> create() {
      const auto queue = std::make_shared<test::ManualExecutor>();
      queue->onDispatch = [queue = queue.get()] { queue->runAll(); };
      return queue;
    }
  };
  HostOptions atOnce = options();
  atOnce.taskQueueFactory = std::make_shared<AtOnce>();
  start(std::move(atOnce));
  host->store<DiskCache>("thumbs");
  EXPECT_EQ(storeMetrics("thumbs").bytes, 100U);
  EXPECT_EQ(storeMetrics("thumbs").items, 1U);
}

TEST_F(Metrics, StoresThatWereCreatedInTheBackgroundAreThere) {
  start();
  host->manager("media");
  host->lazyWork()->dispatchNow();
  EXPECT_FALSE(storeMetrics("thumbs").isCreated);
  queues->runAll();
  EXPECT_TRUE(storeMetrics("thumbs").isCreated);
  EXPECT_TRUE(storeMetrics("files").isCreated);
  EXPECT_EQ(storeMetrics("thumbs").bytes, 0U);
}

TEST_F(Metrics, AStoreThatCouldNotBeCreatedIsNot) {
  start();
  host->manager("media");
  files->failAlways(Operation::CreateDirectory, EIO);
  EXPECT_THROW(host->store<DiskCache>("thumbs"), FileUtilsIoException);
  EXPECT_FALSE(storeMetrics("thumbs").isCreated);
  EXPECT_TRUE(managerMetrics("media").isBuilt);
  files->heal();
  put(*host->store<DiskCache>("thumbs"), "cat", 3);
  EXPECT_EQ(storeMetrics("thumbs").bytes, 3U);
}

TEST_F(Metrics, AManagerThatCouldNotBeBuiltIsNot) {
  start();
  files->failAlways(Operation::CreateDirectory, EIO);
  EXPECT_THROW(host->manager("media"), FileUtilsIoException);
  EXPECT_FALSE(managerMetrics("media").isBuilt);
}

TEST_F(Metrics, OfHostileNamesAreReadAgainFromTheJson) {
  start(options(R"({"\"}],\n\u0000": {"session_scoped": false, "stores": {
    "\u0001\"identifier": {"type": "pkvs", "name": "a\"b"},
    "<b>\ud83d\ude00": {"type": "disk_cache", "name": "c\\d", "lru_size_limit": "1KB"}}}})"));
  put(*host->store<DiskCache>("<b>\xf0\x9f\x98\x80"), "cat", 5);
  const HostMetrics metrics = host->metrics();
  const JsonValue json = JsonValue::parse(toJson(metrics));
  ASSERT_EQ(json.at("managers").size(), 1U);
  const JsonValue& manager = json.at("managers")[0];
  EXPECT_EQ(manager.at("name"), std::string("\"}],\n\0", 6));
  ASSERT_EQ(manager.at("stores").size(), 2U);
  for (std::size_t i = 0; i < 2; ++i) {
    EXPECT_EQ(manager.at("stores")[i].at("identifier"), metrics.managers[0].stores[i].identifier);
    EXPECT_EQ(manager.at("stores")[i].at("name"), metrics.managers[0].stores[i].name);
  }
  EXPECT_EQ(manager.at("stores")[0].at("name"), "a\"b");
  EXPECT_EQ(manager.at("stores")[1].at("bytes"), 5);
}

// Prunes

TEST_F(Metrics, ThePruneOfACacheHasItsTimeAndSizes) {
  start();
  const auto store = host->store<DiskCache>("thumbs");
  for (int i = 0; i < 4; ++i) put(*store, std::to_string(i), 512);  // 2 KiB, which is the manager's limit
  EXPECT_FALSE(storeMetrics("thumbs").lastPrune);
  clock.set(kNow + 60);
  put(*store, "last", 1);
  const StoreMetrics metrics = storeMetrics("thumbs");
  ASSERT_TRUE(metrics.lastPrune);
  EXPECT_EQ(metrics.lastPrune->time, kNow + 60);
  EXPECT_EQ(metrics.lastPrune->fromBytes, 2049U);
  EXPECT_EQ(metrics.lastPrune->toBytes, 513U);
  EXPECT_EQ(metrics.bytes, 513U);
  EXPECT_EQ(metrics.items, 2U);
  EXPECT_EQ(metrics.evictions, 3U);
  put(*store, "after", 100);
  EXPECT_EQ(storeMetrics("thumbs").lastPrune->toBytes, 513U);
}

TEST_F(Metrics, APruneThatIsUnderWayHasNoEnd) {
  start();
  const auto store = host->store<DiskCache>("thumbs");
  put(*store, "cat", 3000);
  put(*store, "dog", 3000);  // too early for another prune
  ASSERT_TRUE(storeMetrics("thumbs").lastPrune);
  EXPECT_EQ(storeMetrics("thumbs").lastPrune->toBytes, 0U);
  clock.set(kNow + 301);
  store->store("gnu", Bytes(1));
  while (storeMetrics("thumbs").lastPrune->toBytes) {
    std::size_t ran = 0;
    for (const auto& queue : queues->all()) ran += queue->runNext() ? 1U : 0U;
    ASSERT_GT(ran, 0U);
  }
  EXPECT_EQ(storeMetrics("thumbs").lastPrune->time, kNow + 301);
  EXPECT_EQ(storeMetrics("thumbs").lastPrune->fromBytes, 3001U);
  queues->runAll();
  EXPECT_EQ(storeMetrics("thumbs").lastPrune->toBytes, 1U);
}

TEST_F(Metrics, OnASmallDeviceACacheIsPrunedToItsSurvivalSize) {
  start();
  const auto store = host->store<DiskCache>("thumbs");
  put(*store, "cat", 101);
  files->total = StoreManagerImpl::kMinimumFreeSizeSurvivalMode - 1;
  put(*store, "dog", 100);
  const auto prune = storeMetrics("thumbs").lastPrune;
  ASSERT_TRUE(prune);
  EXPECT_EQ(prune->fromBytes, 201U);
  EXPECT_EQ(prune->toBytes, 100U);
}

TEST_F(Metrics, OfTwoCachesThatEventsDoNotTellApartNoneIsSaidToBePruned) {
  start(options(R"({"media": {"session_scoped": false, "max_size": "1KB", "stores": {
    "old": {"type": "disk_cache", "name": "same", "has_version": true, "version": 1, "lru_size_limit": "1KB"},
    "new": {"type": "disk_cache", "name": "same", "has_version": true, "version": 2, "lru_size_limit": "1KB"},
    "big": {"type": "disk_cache", "name": "same", "has_version": true, "version": 3, "lru_size_limit": "2KB"}}}})"));
  put(*host->store<DiskCache>("new"), "cat", 2000);
  put(*host->store<DiskCache>("big"), "cat", 3000);
  EXPECT_EQ(storeMetrics("new").evictions, 1U);
  EXPECT_FALSE(storeMetrics("new").lastPrune);
  EXPECT_FALSE(storeMetrics("old").lastPrune);
  EXPECT_EQ(storeMetrics("new").bytes, 0U);
  EXPECT_FALSE(storeMetrics("old").isCreated);
  clock.set(kNow + 4000);
  host->store<DiskCache>("big")->reportSize();
  queues->runAll();
  ASSERT_TRUE(storeMetrics("big").lastPrune);
  EXPECT_EQ(storeMetrics("big").lastPrune->fromBytes, 3000U);
}

// Unmanaged stores

TEST_F(Metrics, AnUnmanagedStoreHasASizeOnceItIsMeasured) {
  start();
  host->store<UnmanagedStore>("files");
  queues->runAll();
  EXPECT_TRUE(storeMetrics("files").isCreated);
  EXPECT_EQ(storeMetrics("files").bytes, std::nullopt);
  EXPECT_EQ(storeMetrics("files").hits, std::nullopt);
  const std::string path = host->store<UnmanagedStore>("files")->path;
  host->sizes()->calculateDirectorySize(path);
  EXPECT_EQ(storeMetrics("files").bytes, 0U);
  EXPECT_EQ(storeMetrics("files").items, 0U);
}

TEST_F(Metrics, AnUnmanagedStoreIsMeasuredInTheBackground) {
  directory.write("caches/_sessionlessStore/files__v1/a/b", "12345");
  start();
  host->store<UnmanagedStore>("files");
  host->lazyWork()->dispatchNow();
  queues->runAll();
  EXPECT_EQ(storeMetrics("files").bytes, 5U);
  EXPECT_EQ(storeMetrics("files").items, 1U);
  EXPECT_EQ(managerMetrics("media").bytes, 5U);
  static_cast<void>(host->sizes()->fetchDirectorySize(host->store<UnmanagedStore>("files")->path));
  EXPECT_EQ(storeMetrics("files").items, 1U);
  host.reset();
  start();
  host->store<UnmanagedStore>("files");
  EXPECT_EQ(storeMetrics("files").bytes, 5U);
  EXPECT_EQ(storeMetrics("files").items, std::nullopt);
}

TEST_F(Metrics, AMeasurementThatFailsIsNone) {
  start();
  const auto store = host->store<UnmanagedStore>("files");
  files->failPath(Operation::ListDirectory, store->path, EIO);
  host->sizes()->calculateDirectorySize(store->path);
  EXPECT_EQ(storeMetrics("files").bytes, std::nullopt);
}

TEST_F(Metrics, AnUnmanagedCacheThatWasEmptiedIsEmpty) {
  const std::string path = directory.write("caches/_sessionlessStore/web__v1/page", std::string(2000, 'x'));
  start();
  host->sizes()->calculateDirectorySize(std::filesystem::path(path).parent_path().string());
  host->store<UnmanagedStore>("web");
  EXPECT_FALSE(std::filesystem::exists(path));
  EXPECT_EQ(storeMetrics("web").bytes, 0U);
  EXPECT_EQ(storeMetrics("web").items, 0U);
}

// Events still reach whoever asks for them

TEST_F(Metrics, LeaveTheEventsOfAHostAsTheyAre) {
  const auto log = std::make_shared<EventLog>();
  HostOptions observed = options();
  observed.analytics = std::make_unique<RecordingAnalytics>(log);
  start(std::move(observed));
  const auto store = host->store<DiskCache>("thumbs");
  put(*store, "cat", 3000);
  get(*store, "cat");
  ASSERT_EQ(log->named("qzpkvs_access").size(), 1U);
  EXPECT_EQ(log->named("qzpkvs_access").front().json().at("store_name"), "pictures");
  std::vector<std::string> types;
  for (const auto& event : log->named("qzdiskstore_logging")) types.push_back(event.json().at("event_type"));
  EXPECT_THAT(types, ElementsAre("initialization", "pruning"));
  EXPECT_TRUE(storeMetrics("thumbs").lastPrune);
}

TEST_F(Metrics, LeaveAnUnmanagedStoreTheDefinitionOfTheConfiguration) {
  start();
  EXPECT_EQ(host->store<UnmanagedStore>("files")->definition, host->configuration()->getStore("files"));
}

// Sessions

TEST_F(Metrics, NameTheTagOfASessionAndNeverItsKey) {
  HostOptions secret = options();
  secret.sessionTagMapper = [](const std::string& key) { return "tag-of-" + std::to_string(key.size()); };
  start(std::move(secret));
  put(*host->store<PersistentKeyValueStore>("letters", "s3cret"), "cat", 5);
  EXPECT_THAT(namesOf(host->metrics()), ElementsAre("inbox/tag-of-6", "media/-"));
  EXPECT_EQ(storeMetrics("letters").bytes, 5U);
  EXPECT_EQ(toJson(host->metrics()).find("s3cret"), std::string::npos);
}

TEST_F(Metrics, HaveTheManagersOfEachOpenSession) {
  HostOptions several = options();
  several.accounts = Accounts::Kept;
  start(std::move(several));
  const Session bob = host->openSession("bob");
  const Session alice = host->openSession("alice");
  put(*bob.store<PersistentKeyValueStore>("letters"), "cat", 5);
  const HostMetrics metrics = host->metrics();
  ASSERT_THAT(namesOf(metrics), ElementsAre("inbox/alice", "inbox/bob", "media/-"));
  EXPECT_FALSE(metrics.managers[0].isBuilt);
  EXPECT_TRUE(metrics.managers[1].isBuilt);
  EXPECT_EQ(metrics.managers[0].stores.at(0).bytes, std::nullopt);
  EXPECT_EQ(metrics.managers[1].stores.at(0).bytes, 5U);
}

TEST_F(Metrics, AreThoseOfNoSessionAfterItHasEnded) {
  start();
  for (const auto& queue : queues->all()) queue->onDispatch = [queue = queue.get()] { queue->runAll(); };
  const auto letters = host->store<PersistentKeyValueStore>("letters", "alice");
  put(*letters, "cat", 5);
  EXPECT_THAT(namesOf(host->metrics()), ElementsAre("inbox/alice", "media/-"));
  for (const auto& queue : queues->all()) queue->onDispatch = [queue = queue.get()] { queue->runAll(); };
  host->logOut();
  EXPECT_THAT(namesOf(host->metrics()), ElementsAre("inbox/-", "media/-"));
  EXPECT_FALSE(managerMetrics("inbox").isBuilt);
  EXPECT_EQ(storeMetrics("letters").writes, std::nullopt);
  host->store<PersistentKeyValueStore>("letters", "alice");
  EXPECT_EQ(storeMetrics("letters").writes, 0U);
  EXPECT_EQ(letters->operationCounts().stores, 1U);
}

TEST_F(Metrics, HoldNoStore) {
  start();
  std::weak_ptr<Store> watched = host->store<DiskCache>("thumbs");
  queues->runAll();
  const HostMetrics metrics = host->metrics();
  for (const auto& queue : queues->all()) queue->onDispatch = [queue = queue.get()] { queue->runAll(); };
  host->invalidate();
  queues->runAll();
  EXPECT_TRUE(watched.expired());
  EXPECT_FALSE(managerMetrics("media").isBuilt);
  EXPECT_FALSE(storeMetrics("thumbs").isCreated);
}

// Whoever logs out is in the midst of it when the file layer is asked to move the session's directory away.
TEST_F(Metrics, AreThereInTheMidstOfALogOut) {
  std::optional<HostMetrics> seen;
  class Watching final : public FileUtils {
   public:
    std::function<void()> onRename;
    void rename(const std::string& from, const std::string& to) override {
      if (onRename) std::exchange(onRename, nullptr)();
      FileUtils::rename(from, to);
    }
  };
  const auto watching = std::make_shared<Watching>();
  HostOptions watched = options();
  watched.fileUtils = watching;
  start(std::move(watched));
  put(*host->store<PersistentKeyValueStore>("letters", "alice"), "cat", 5);
  for (const auto& queue : queues->all()) queue->onDispatch = [queue = queue.get()] { queue->runAll(); };
  watching->onRename = [&] { seen = host->metrics(TrashSize::Measured); };
  host->logOut();
  ASSERT_TRUE(seen);
  EXPECT_THAT(namesOf(*seen), ElementsAre("inbox/alice", "media/-"));
  EXPECT_EQ(seen->managers[0].stores.at(0).writes, 1U);
  EXPECT_EQ(seen->managers[0].stores.at(0).bytes, 5U);
}

TEST_F(Metrics, AreThereWhileAManagerIsBuilt) {
  std::vector<bool> built;
  HostOptions watched = options();
  class Watching final : public FileUtils {
   public:
    std::function<void()> onCreateDirectory;
    void createDirectory(const std::string& path, bool recursive) override {
      if (onCreateDirectory) onCreateDirectory();
      FileUtils::createDirectory(path, recursive);
    }
  };
  const auto watching = std::make_shared<Watching>();
  watched.fileUtils = watching;
  start(std::move(watched));
  watching->onCreateDirectory = [&] { built.push_back(managerMetrics("media").isBuilt); };
  host->store<DiskCache>("thumbs");
  watching->onCreateDirectory = nullptr;
  ASSERT_GE(built.size(), 2U);
  EXPECT_FALSE(built.front());  // the manager's directory
  EXPECT_TRUE(built.back());    // the store's
}

// The trash

TEST_F(Metrics, OfTheTrashAreEntriesAndBytesIfTheyAreAskedFor) {
  start();
  EXPECT_FALSE(host->metrics().trash);
  const auto none = host->metrics(TrashSize::Measured).trash;
  ASSERT_TRUE(none);
  EXPECT_EQ(none->entries, 0U);
  EXPECT_EQ(none->bytes, 0U);
  directory.write("old/deeper/file", "12345");
  directory.write("older", "123");
  EXPECT_TRUE(host->trash()->collectPath(directory.file("old")));
  EXPECT_TRUE(host->trash()->collectPath(directory.file("older")));
  const auto trash = host->metrics(TrashSize::Measured).trash;
  ASSERT_TRUE(trash);
  EXPECT_EQ(trash->entries, 2U);
  EXPECT_EQ(trash->bytes, 8U);
  queues->runAll();
  EXPECT_EQ(host->metrics(TrashSize::Measured).trash->entries, 0U);
}

TEST_F(Metrics, CountFifosInTheTrashAndFollowNoLinks) {
  directory.write("elsewhere/file", "12345");
  directory.makeDirectory("trash");
  ASSERT_EQ(::mkfifo(directory.file("trash/fifo").c_str(), 0600), 0);
  std::filesystem::create_symlink(directory.file("elsewhere"), directory.file("trash/link"));
  start();
  const auto trash = host->metrics(TrashSize::Measured).trash;
  ASSERT_TRUE(trash);
  EXPECT_EQ(trash->entries, 2U);
  EXPECT_EQ(trash->bytes, 0U);
}

TEST_F(Metrics, HaveNoTrashIfALinkIsInItsPlace) {
  directory.write("elsewhere/file", "12345");
  std::filesystem::create_symlink(directory.file("elsewhere"), directory.file("trash"));
  start();
  EXPECT_FALSE(host->metrics(TrashSize::Measured).trash);
}

TEST_F(Metrics, OfATrashThatCannotBeReadHaveWhatCanBeKnownAndLog) {
  directory.write("trash/old/file", "12345");
  start();
  const LogCapture log;
  files->failPath(Operation::ListDirectory, directory.file("trash/old"), EACCES);
  const auto trash = host->metrics(TrashSize::Measured).trash;
  ASSERT_TRUE(trash);
  EXPECT_EQ(trash->entries, 1U);
  EXPECT_EQ(trash->bytes, std::nullopt);
  files->failPath(Operation::ListDirectory, directory.file("trash"), EACCES);
  const HostMetrics metrics = host->metrics(TrashSize::Measured);
  EXPECT_FALSE(metrics.trash);
  EXPECT_EQ(metrics.managers.size(), 2U);
  ASSERT_EQ(log.messages().size(), 2U);
  EXPECT_THAT(log.messages()[1], HasSubstr("Cannot measure trash. "));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
