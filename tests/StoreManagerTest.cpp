#include "StoreManager.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <future>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "PersistentKeyValueStore.h"
#include "support/Barrier.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FakeStore;
using test::Operation;
using Texts = std::vector<string>;

class StoreManagerTest : public testing::Test, protected test::ManagerServices {
 protected:
  void TearDown() override {
    invalidate();
    for (const auto& queue : queues->all()) queue->dropAll();
    StoreManager::setForceCleanseOnInit(false);
  }

  StoreManager& build(Stores definitions, bool runMaintenance = true, bool forceCleanse = false) {
    manager_ = std::make_unique<StoreManager>(areaPath(), manager(std::move(definitions)), forceCleanse,
                                              names.createStoreDirectoryNameBuilder("1"), trash, queues, sizes,
                                              reporter, files, attributes, dispatcher_, runMaintenance);
    return *manager_;
  }

  // With queues that run at once: a store that keeps values waits for them.
  void invalidate() {
    if (manager_ == nullptr) return;
    for (const auto& queue : queues->all()) queue->onDispatch = [&queue = *queue] { queue.runAll(); };
    manager_->invalidate();
    for (const auto& queue : queues->all()) queue->onDispatch = nullptr;
  }

  string managerPath() const { return areaPath() + "/_store_1"; }

  std::shared_ptr<test::ManualQueueFactory> lazyQueues_ = std::make_shared<test::ManualQueueFactory>();
  std::shared_ptr<LazyDispatcher> dispatcher_ = LazyDispatcher::createLazyDispatcher(lazyQueues_, 1);
  std::unique_ptr<StoreManager> manager_;
  test::LogCapture log_;
};

// Construction

TEST_F(StoreManagerTest, WithMaintenanceItCleansUpMeasuresAndInitializesLazily) {
  directory.makeDirectory("area/_store_1/u_250_v1");
  directory.makeDirectory("area/_store_1/old_1_v1");
  directory.makeDirectory("area/_store_2");
  build({{"u", unmanaged("u")}, {"a", fake("a")}});
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(sizes->registered(), (std::vector<std::pair<string, long>>{{managerPath() + "/u_250_v1", 604800}}));
  ASSERT_EQ(queues->queueCount(), 1U);
  EXPECT_EQ(queues->queue(0)->runAll(), 1U);
  EXPECT_EQ(trash->collected(), (Texts{managerPath() + "/old_1_v1", areaPath() + "/_store_2"}));
  ASSERT_EQ(queues->workQueueCount(), 1U);
  EXPECT_TRUE(stores->creations().empty());
  dispatcher_->dispatchNow();
  queues->workQueue(0)->runAll();
  EXPECT_EQ(stores->createdNames(), Texts{"a"});
}

TEST_F(StoreManagerTest, WithoutMaintenanceItOnlyMeasuresAndInitializesLazily) {
  directory.makeDirectory("area/_store_1/u_250_v1");
  directory.makeDirectory("area/_store_1/old_1_v1");
  directory.makeDirectory("area/_store_2");
  files->total = 1;
  build({{"u", unmanaged("u")}, {"a", fake("a")}}, false, true);
  EXPECT_EQ(files->calls(Operation::GetDiskSpace), 0U);
  EXPECT_EQ(queues->queue(0)->runAll(), 0U);
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(sizes->registered().size(), 1U);
  dispatcher_->dispatchNow();
  queues->workQueue(0)->runAll();
  EXPECT_EQ(stores->createdNames(), Texts{"a"});
}

TEST_F(StoreManagerTest, WithoutMaintenanceItsStoresAreNotPruned) {
  build({{"a", fake("a")}}, false);
  const auto store = manager_->getStore<FakeStore>("a");
  store->reportSize(1000);
  queues->queue(0)->runAll();
  EXPECT_EQ(store->pruneCount(), 0U);
}

TEST_F(StoreManagerTest, WithMaintenanceItsStoresArePruned) {
  build({{"a", fake("a")}});
  const auto store = manager_->getStore<FakeStore>("a");
  store->reportSize(1000);
  queues->queue(0)->runAll();
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerTest, ItCleansesBeforeItLooksForUnmanagedStores) {
  directory.write("area/_store_1/u_250_v1/file", "bytes");
  directory.makeDirectory("area/_store_2");
  build({{"u", unmanaged("u")}}, true, true);
  EXPECT_EQ(trash->collected(), Texts{managerPath()});
  EXPECT_TRUE(sizes->registered().empty());
  EXPECT_EQ(directory.names("area"), Texts{"_store_2"});  // its temporary directory went along
}

TEST_F(StoreManagerTest, AStoreOfACleansedManagerBeginsEmpty) {
  directory.write("area/_store_1/u_250_v1/file", "bytes");
  build({{"u", unmanaged("u")}}, true, true);
  manager_->getStore<UnmanagedStore>("u");
  EXPECT_TRUE(directory.names("area/_store_1/u_250_v1").empty());
}

TEST_F(StoreManagerTest, AVerySmallDiskIsCleansedUnasked) {
  files->total = 78643199;
  build({});
  EXPECT_EQ(trash->collected(), Texts{managerPath()});
}

TEST_F(StoreManagerTest, ItWorksWithoutReporterAndLazyDispatcher) {
  reporter = nullptr;
  dispatcher_ = nullptr;
  build({{"u", unmanaged("u")}, {"a", fake("a")}});
  EXPECT_NE(manager_->getStoreImpl("u", PruneStrategyIdentifier::Null), nullptr);
  EXPECT_EQ(queues->workQueueCount(), 0U);
}

TEST_F(StoreManagerTest, ADirectoryThatCannotBeCreatedFailsTheConstruction) {
  files->failAlways(Operation::CreateDirectory, EROFS);
  EXPECT_THROW(build({}), FileUtilsIoException);
}

// Forwarding

TEST_F(StoreManagerTest, ForwardsToTheFullManager) {
  build({{"a", fake("a")}});
  EXPECT_EQ(manager_->getTemporaryDirectory(), managerPath() + "/tmp");
  EXPECT_TRUE(manager_->isValid());
  const auto store = manager_->getStoreImpl("a", PruneStrategyIdentifier::VideoDownload);
  EXPECT_EQ(store, (*stores)["a"]);
  EXPECT_EQ(stores->creations()[0].pruneStrategy, PruneStrategyIdentifier::VideoDownload);
  manager_->trashStoreOnStartup("a");
  EXPECT_EQ(directory.read("area/_store_1/a_250_v1/_cellar_extended_attributes"), R"({"trash_on_start_up":true})");
  EXPECT_THROW(manager_->trashStoreOnStartup("x"), std::logic_error);
}

TEST_F(StoreManagerTest, AnUnknownIdentifierGivesNothingAndOneErrorLine) {
  build({});
  EXPECT_EQ(manager_->getStoreImpl("x", PruneStrategyIdentifier::Null), nullptr);
  EXPECT_EQ(log_.messages(),
            Texts{"Definition not defined for store with identifier x in StoreManager with name 'media'"});
}

TEST_F(StoreManagerTest, InvalidatingInvalidatesTheStoresAndDiscardsTheData) {
  build({{"a", fake("a")}});
  const auto store = manager_->getStore<FakeStore>("a");
  manager_->invalidate();
  manager_->invalidate();
  EXPECT_FALSE(manager_->isValid());
  EXPECT_EQ(store->invalidations(), 1U);
  EXPECT_EQ(trash->collected(), Texts{managerPath()});
  EXPECT_EQ(manager_->getStoreImpl("a", PruneStrategyIdentifier::Null), nullptr);
}

TEST_F(StoreManagerTest, InvalidatingAndLettingGoFreesManagerAndStores) {
  build({{"a", fake("a")}});
  const std::weak_ptr<FakeStore> kept = manager_->getStore<FakeStore>("a");
  EXPECT_FALSE(kept.expired());
  manager_->invalidate();
  EXPECT_TRUE(kept.expired());
  manager_.reset();
  queues->queue(0)->runAll();
}

TEST_F(StoreManagerTest, LettingTheLastHandleGoFreesTheStoresWithoutInvalidatingThem) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  const std::weak_ptr<FakeStore> released = manager_->getStore<FakeStore>("a");
  const auto held = manager_->getStore<FakeStore>("b");
  manager_.reset();
  EXPECT_TRUE(released.expired());
  EXPECT_EQ(held->invalidations(), 0U);
  held->reportSize(1000);
  queues->queue(0)->runAll();
  EXPECT_EQ(held->pruneCount(), 1U);
  EXPECT_TRUE(directory.exists("area/_store_1/a_250_v1"));
}

TEST_F(StoreManagerTest, AnUnmanagedStoreIsCountedThoughTheHandleHasGone) {
  build({{"u", unmanaged("u")}});
  const auto store = manager_->getStoreImpl("u", PruneStrategyIdentifier::Null);
  const std::size_t before = events->events().size();
  manager_.reset();
  queues->queue(0)->runAll();
  EXPECT_GT(events->events().size(), before);
}

TEST_F(StoreManagerTest, ADefinitionThatIsNoneIsNoStore) {
  directory.makeDirectory("area/_store_1/old_1_v1");
  build({{"none", nullptr}, {"a", fake("a")}});
  queues->queue(0)->runAll();
  EXPECT_EQ(trash->collected(), Texts{managerPath() + "/old_1_v1"});
  EXPECT_EQ(manager_->getStoreImpl("none", PruneStrategyIdentifier::Null), nullptr);
  EXPECT_NE(manager_->getStore<FakeStore>("a"), nullptr);
}

TEST_F(StoreManagerTest, LettingTheHandleGoStopsNothingThatIsUnderWayAndLosesNoData) {
  directory.makeDirectory("area/_store_1/old_1_v1");
  build({{"u", unmanaged("u")}});
  manager_->getStoreImpl("u", PruneStrategyIdentifier::Null);
  manager_.reset();
  EXPECT_TRUE(trash->collected().empty());
  queues->queue(0)->runAll();
  EXPECT_EQ(trash->collected(), Texts{managerPath() + "/old_1_v1"});
  EXPECT_TRUE(directory.exists("area/_store_1/u_250_v1"));
}

// With stores that keep values

TEST_F(StoreManagerTest, ADiskCacheOverItsLimitIsPrunedWhenItsManagerIsOverTheLimit) {
  build({{"kv", std::make_shared<PKVSDefinition>("kv", "media", false, false, 1U, std::nullopt, false, 1000U)},
         {"dc", std::make_shared<DiskCacheDefinition>("dc", "media", false, false, 1U, std::nullopt, 1000U, false,
                                                      1000U, 0U, ExtendedMetadataFactoryIdentifier::Null,
                                                      PruneStrategyIdentifier::LRU)}});
  const auto cache = manager_->getStore<DiskCache>("dc");
  const auto store = manager_->getStore<PersistentKeyValueStore>("kv");
  queues->runAll();
  events->clear();
  store->store("kept", std::vector<unsigned char>(5000));
  cache->store("first", std::vector<unsigned char>(600));
  cache->store("second", std::vector<unsigned char>(600));
  queues->runAll();
  EXPECT_EQ(cache->getAllKeys().size(), 1U);
  EXPECT_EQ(store->getAllKeys(), Texts{"kept"});
  std::vector<JsonValue> prunings;
  for (const test::LoggedEvent& event : events->named("qzdiskstore_logging")) {
    if (event.json().at("event_type") == "pruning") prunings.push_back(event.json());
  }
  const JsonValue expected{{"event_type", "pruning"}, {"store_name", "dc"}, {"current_size", 1200}, {"max_size", 1000}};
  EXPECT_EQ(prunings, std::vector<JsonValue>{expected});
}

TEST_F(StoreManagerTest, StoresThatKeepValuesAreFreedWithTheManager) {
  build({{"kv", std::make_shared<PKVSDefinition>("kv", "media", false, false, 1U, std::nullopt, false, 1000U)}});
  const std::weak_ptr<Store> kept = manager_->getStoreImpl("kv", PruneStrategyIdentifier::Null);
  queues->runAll();
  kept.lock()->weak_from_this<PersistentKeyValueStore>().lock()->store("key", {1, 2, 3});
  queues->runAll();
  EXPECT_TRUE(directory.exists("area/_store_1/kv_250_v1"));
  invalidate();
  EXPECT_TRUE(kept.expired());
  EXPECT_FALSE(directory.exists("area/_store_1"));
}

class StoreManagerRelease : public StoreManagerTest {
 protected:
  using Value = std::vector<unsigned char>;

  std::shared_ptr<PersistentKeyValueStore> openStore() {
    build({{"kv", std::make_shared<PKVSDefinition>("kv", "media", false, false, 1U, std::nullopt, false, 1000U)}});
    auto store = manager_->getStore<PersistentKeyValueStore>("kv");
    queues->runAll();
    return store;
  }

  // What a fresh manager finds.
  std::string storedAfterRestart(const std::string& key) {
    const auto store = openStore();
    std::string found = "<pending>";
    store->fetch(key).then(nullptr, [&](std::future<std::unique_ptr<PersistentKeyValueStore::FetchResult>>& result) {
      const auto value = result.get();
      found = value == nullptr ? "<miss>" : std::string(value->value.begin(), value->value.end());
    });
    queues->runAll();
    return found;
  }

  bool hasFile(const std::string& key) const { return directory.exists("area/_store_1/kv_250_v1/" + key); }
};

TEST_F(StoreManagerRelease, FinishesWhatItsStoresHaveAcceptedBeforeTheyAreDestroyed) {
  auto store = openStore();
  const std::weak_ptr<Store> released = store;
  int written = 0;
  for (int i = 0; i < 100; ++i) {
    store->store("key" + std::to_string(i), Value{'v'}).then(nullptr, [&](std::future<void>& result) {
      result.get();
      ++written;
    });
  }
  store.reset();
  manager_.reset();
  EXPECT_FALSE(released.expired());
  queues->runAll();
  EXPECT_TRUE(released.expired());
  EXPECT_EQ(written, 100);
  for (int i = 0; i < 100; ++i) EXPECT_TRUE(hasFile("key" + std::to_string(i))) << i;
  EXPECT_EQ(storedAfterRestart("key99"), "v");
}

TEST_F(StoreManagerRelease, FinishesAClearOfManyBatches) {
  auto store = openStore();
  for (int i = 0; i < 120; ++i) store->store("key" + std::to_string(i), Value{'v'});
  queues->runAll();
  bool isCleared = false;
  store->clear([&] { isCleared = true; }, nullptr);
  const std::weak_ptr<Store> released = store;
  store.reset();
  manager_.reset();
  queues->runAll();
  EXPECT_TRUE(isCleared);
  EXPECT_TRUE(released.expired());
  EXPECT_FALSE(hasFile("key0"));
  EXPECT_FALSE(hasFile("key119"));
}

TEST_F(StoreManagerRelease, DeletesNothingWhenTheQueuesNeverRunAgain) {
  auto store = openStore();
  store->store("key", Value{'o', 'l', 'd'});
  queues->runAll();
  store->store("key", Value{'n', 'e', 'w'});
  queues->workQueue(queues->workQueueCount() - 1)->runNext();
  store.reset();
  manager_.reset();
  for (const auto& queue : queues->all()) queue->dropAll();
  EXPECT_EQ(storedAfterRestart("key"), "old");
}

TEST_F(StoreManagerRelease, LeavesAStoreToWhoHoldsItAndFinishesToo) {
  const auto store = openStore();
  store->store("key", Value{'v'});
  manager_.reset();
  queues->runAll();
  EXPECT_EQ(store->getAllKeys(), Texts{"key"});
  EXPECT_EQ(store.use_count(), 1);
}

TEST_F(StoreManagerRelease, OfAnIdleStoreDestroysItAtOnce) {
  auto store = openStore();
  store->store("key", Value{'v'});
  queues->runAll();
  const std::weak_ptr<Store> released = store;
  store.reset();
  manager_.reset();
  EXPECT_TRUE(released.expired());
}

TEST_F(StoreManagerRelease, OfAQueueThatTakesNoTasksReleasesTheStoreAndSaysSo) {
  auto store = openStore();
  store->store("key", Value{'v'});
  const std::weak_ptr<Store> released = store;
  store.reset();
  for (const auto& queue : queues->all()) queue->throwOnDispatch(true);
  manager_.reset();
  EXPECT_TRUE(released.expired());
  EXPECT_NE(log_.lines().size(), 0U);
  EXPECT_EQ(log_.lines().back().message, "Store \"kv\" cannot finish what it has accepted: The queue takes no tasks.");
  for (const auto& queue : queues->all()) queue->throwOnDispatch(false);
}

// Typed access

TEST_F(StoreManagerTest, TypedAccessGivesTheStoreAsItsTypeOrAnyBase) {
  build({{"u", unmanaged("u", 12)}});
  const std::shared_ptr<UnmanagedStore> store = manager_->getStore<UnmanagedStore>("u");
  ASSERT_NE(store, nullptr);
  EXPECT_EQ(store->getMaxSize(), 12U);
  EXPECT_EQ(manager_->getStore<Store>("u"), store);
}

TEST_F(StoreManagerTest, TypedAccessAsAnotherTypeNamesTheStoreAndBothTypes) {
  build({{"id", unmanaged("name")}});
  try {
    manager_->getStore<FakeStore>("id");
    FAIL();
  } catch (const std::logic_error& error) {
    EXPECT_STREQ(
        error.what(),
        "Store 'id' is a velmora::mobile::xplat::cellar::UnmanagedStore, "
        "not a velmora::mobile::xplat::cellar::test::FakeStore. Ask for the class that belongs to its \"type\".");
  }
  EXPECT_NE(manager_->getStore<UnmanagedStore>("id"), nullptr);
}

TEST_F(StoreManagerTest, AStoreWhoseCreationFailedIsCreatedAgainWhereThatIsWanted) {
  build({{"a", fake("a")}});
  manager_->retryFailedCreations();
  files->failPath(Operation::CreateDirectory, managerPath() + "/a_250_v1", ENOSPC);
  for (int i = 0; i < 2; ++i) {
    EXPECT_THROW(manager_->getStoreImpl("a", PruneStrategyIdentifier::Null), FileUtilsIoException);
  }
  files->heal();
  EXPECT_NE(manager_->getStoreImpl("a", PruneStrategyIdentifier::Null), nullptr);
}

TEST_F(StoreManagerTest, TypedAccessIsEmptyWhereTheUntypedOneIs) {
  build({{"u", unmanaged("u")}});
  EXPECT_EQ(manager_->getStore<UnmanagedStore>("x"), nullptr);
  manager_->invalidate();
  EXPECT_EQ(manager_->getStore<FakeStore>("u"), nullptr);
}

TEST_F(StoreManagerTest, TypedAccessTakesTheDefinitionsStrategyUnlessToldOtherwise) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  manager_->getStore<FakeStore>("a");
  manager_->getStore<FakeStore>("b", PruneStrategyIdentifier::LRU);
  ASSERT_EQ(stores->creations().size(), 2U);
  EXPECT_EQ(stores->creations()[0].pruneStrategy, PruneStrategyIdentifier::Null);
  EXPECT_EQ(stores->creations()[1].pruneStrategy, PruneStrategyIdentifier::LRU);
}

// The force-cleanse flag

TEST_F(StoreManagerTest, TheForceCleanseFlagIsOffAtFirstAndKeepsWhatItIsSetTo) {
  EXPECT_FALSE(StoreManager::forceCleanseOnInit());
  StoreManager::setForceCleanseOnInit(true);
  EXPECT_TRUE(StoreManager::forceCleanseOnInit());
  bool seen = false;
  std::thread([&] { seen = StoreManager::forceCleanseOnInit(); }).join();
  EXPECT_TRUE(seen);
  StoreManager::setForceCleanseOnInit(false);
  EXPECT_FALSE(StoreManager::forceCleanseOnInit());
}

TEST_F(StoreManagerTest, TheFlagDoesNotConcernAManagerThatIsToldOtherwise) {
  StoreManager::setForceCleanseOnInit(true);
  directory.write("area/_store_1/a_250_v1/value", "bytes");
  build({{"a", fake("a")}}, true, false);
  EXPECT_TRUE(directory.exists("area/_store_1/a_250_v1/value"));
}

TEST_F(StoreManagerTest, TheFlagMayBeUsedFromManyThreads) {
  test::runOnThreads(4, [](std::size_t thread) {
    for (int i = 0; i < 200; ++i) {
      StoreManager::setForceCleanseOnInit(thread % 2 == 0);
      StoreManager::forceCleanseOnInit();
    }
  });
  StoreManager::setForceCleanseOnInit(true);
  EXPECT_TRUE(StoreManager::forceCleanseOnInit());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
