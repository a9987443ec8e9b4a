#include "StoreManagerImpl.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <ctime>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "LazyDispatcher.h"
#include "host/testing/ManualClock.h"
#include "support/Barrier.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FakeStore;
using test::Operation;
using test::PruneRequest;

constexpr std::uint32_t kLargest = std::numeric_limits<std::uint32_t>::max();
constexpr std::time_t kNow = 1'700'000'000;

class StoreManagerImplTest : public testing::Test, protected test::ManagerServices {
 protected:
  // What a test leaves valid or queued would keep the manager and its stores alive.
  void TearDown() override {
    if (manager_ != nullptr) manager_->invalidate();
    for (const auto& queue : queues->all()) queue->dropAll();
  }

  StoreManagerImpl& build(const StoreManagerDefinition& definition, bool maintenance = true) {
    manager_ =
        std::make_shared<StoreManagerImpl>(areaPath(), definition, names.createStoreDirectoryNameBuilder("1"), trash,
                                           queues, sizes, reporter, files, attributes, dispatcher_, maintenance);
    return *manager_;
  }

  void createDispatcher() { dispatcher_ = LazyDispatcher::createLazyDispatcher(lazyQueues_, 1); }

  // The manager's queue.
  std::shared_ptr<test::ManualExecutor> queue() const { return queues->queue(0); }

  std::shared_ptr<FakeStore> get(const string& identifier) {
    return std::dynamic_pointer_cast<FakeStore>(getAny(identifier));
  }
  std::shared_ptr<Store> getAny(const string& identifier) {
    return manager_->getStoreImpl(identifier, PruneStrategyIdentifier::Null);
  }

  // A size report with everything that follows from it.
  void report(const string& identifier, unsigned int size) {
    manager_->onStoreSizeChanged(identifier, size);
    settle();
  }
  void settle() { queue()->runAll(); }

  // The manager's events so far, as in "pruning a 10/5".
  std::vector<string> reported() const {
    std::vector<string> texts;
    for (const test::LoggedEvent& event : events->named("qzdiskstore_logging")) {
      const JsonValue payload = event.json();
      texts.push_back(payload.at("event_type").get<string>() + " " + payload.at("store_name").get<string>() + " " +
                      payload.at("current_size").dump() + "/" + payload.at("max_size").dump());
    }
    return texts;
  }

  string managerPath() const { return areaPath() + "/_store_1"; }

  static string ioFailure(int code) { return FileUtilsIoException(code, std::generic_category().message(code)).what(); }

  test::ManualClock clock_{kNow};
  test::LogCapture log_;
  std::shared_ptr<test::ManualQueueFactory> lazyQueues_ = std::make_shared<test::ManualQueueFactory>();
  std::shared_ptr<LazyDispatcher> dispatcher_;
  std::shared_ptr<StoreManagerImpl> manager_;
};

using Texts = std::vector<string>;

// Construction and forwarding

TEST_F(StoreManagerImplTest, TheThresholdsAreInBytes) {
  EXPECT_EQ(std::int64_t{StoreManagerImpl::kMinimumFreeSizeSurvivalMode}, 104857600);
  EXPECT_EQ(std::int64_t{StoreManagerImpl::kCleanseMinimumFreeSizeTrash}, 78643200);
  EXPECT_EQ(std::int64_t{StoreManagerImpl::kCleanseMinimumFreeSizePurge}, 52428800);
}

TEST_F(StoreManagerImplTest, ConstructionTakesOneQueueAndStartsNothing) {
  createDispatcher();
  build(manager({{"a", fake("a")}, {"u", unmanaged("u")}}));
  EXPECT_EQ(queues->queueCount(), 1U);
  EXPECT_EQ(queues->workQueueCount(), 0U);
  EXPECT_EQ(queue()->pending(), 0U);
  EXPECT_TRUE(stores->creations().empty());
  EXPECT_TRUE(sizes->registered().empty());
  EXPECT_TRUE(directory.exists("area/_store_1/tmp"));
}

TEST_F(StoreManagerImplTest, ConstructionThrowsWhatCreatingTheDirectoriesThrows) {
  files->failAlways(Operation::CreateDirectory, ENOSPC);
  EXPECT_THROW(build(manager({})), FileUtilsIoException);
}

TEST_F(StoreManagerImplTest, AQueueThatRunsEverythingAtOnceFindsNoLockHeld) {
  StoreManagerDefinition definition = manager({{"a", fake("a", {5})}, {"u", unmanaged("u")}});
  definition.maxSize = 5;
  build(definition, true);
  queue()->onDispatch = [this] { queue()->runAll(); };
  EXPECT_NE(getAny("u"), nullptr);
  const auto store = get("a");
  manager_->onStoreSizeChanged("a", 10);
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, ForwardsToTheCommonCore) {
  const auto definition = unmanaged("u");
  build(manager({{"u", definition}}));
  EXPECT_EQ(manager_->getTemporaryDirectory(), managerPath() + "/tmp");
  EXPECT_EQ(manager_->getStorePath(definition), managerPath() + "/u_250_v1");
  EXPECT_TRUE(manager_->isValid());
  getAny("u");
  manager_->trashStoreOnStartup("u");
  EXPECT_EQ(directory.read("area/_store_1/u_250_v1/_cellar_extended_attributes"), R"({"trash_on_start_up":true})");
  EXPECT_THROW(manager_->trashStoreOnStartup("x"), std::logic_error);
  directory.makeDirectory("area/_store_1/old_1_v1");
  directory.makeDirectory("area/_store_9");
  manager_->cleanupOldStores();
  manager_->cleanupParentDirectory();
  EXPECT_EQ(trash->collected(), (Texts{managerPath() + "/old_1_v1", areaPath() + "/_store_9"}));
  manager_->invalidate();
  EXPECT_FALSE(manager_->isValid());
}

// Getting a store

TEST_F(StoreManagerImplTest, AnUnknownIdentifierGivesNothingAndOneErrorLineEachTime) {
  build(manager({}));
  EXPECT_EQ(getAny("x"), nullptr);
  const string line = "Definition not defined for store with identifier x in StoreManager with name 'media'";
  EXPECT_EQ(log_.messages(), Texts{line});
  EXPECT_EQ(getAny("x"), nullptr);
  EXPECT_EQ(log_.messages(), (Texts{line, line}));
  EXPECT_EQ(log_.errorCount(), 2U);
}

TEST_F(StoreManagerImplTest, AManagedStoreGetsAllServicesAndIsNotMeasured) {
  build(manager({{"id", fake("a")}}));
  const auto store = manager_->getStoreImpl("id", PruneStrategyIdentifier::VideoDownload);
  ASSERT_EQ(stores->creations().size(), 1U);
  const test::Creation creation = stores->creations()[0];
  EXPECT_EQ(creation.taskQueueFactory, queues.get());
  EXPECT_EQ(creation.trashCollector, trash.get());
  EXPECT_EQ(creation.analyticsReporter, reporter.get());
  EXPECT_EQ(creation.fileUtils, files.get());
  EXPECT_TRUE(creation.hasSizeCallback);
  EXPECT_EQ(creation.pruneStrategy, PruneStrategyIdentifier::VideoDownload);
  EXPECT_TRUE(sizes->fetched().empty());
  EXPECT_TRUE(reported().empty());
  EXPECT_EQ(queue()->pending(), 0U);
  EXPECT_EQ(manager_->getStoreImpl("id", PruneStrategyIdentifier::LRU), store);
}

TEST_F(StoreManagerImplTest, TheSizeCallbackReportsUnderTheStoresIdentifier) {
  build(manager({{"id", fake("name", {50})}}));
  get("id")->reportSize(7);
  EXPECT_EQ(reported(), Texts{"initialization name 7/50"});
  EXPECT_EQ(queue()->pending(), 1U);
}

TEST_F(StoreManagerImplTest, AfterInvalidatingThereAreNoStoresAndNoLines) {
  build(manager({{"a", fake("a")}, {"u", unmanaged("u")}}));
  manager_->invalidate();
  EXPECT_EQ(getAny("a"), nullptr);
  EXPECT_EQ(getAny("u"), nullptr);
  EXPECT_TRUE(log_.messages().empty());
  EXPECT_TRUE(reported().empty());
  EXPECT_EQ(queue()->pending(), 0U);
}

TEST_F(StoreManagerImplTest, WhatCreatingAStoreThrowsReachesTheCaller) {
  stores->onCreate = [](const string&, const auto&) { throw FileUtilsIoException(EIO, "no luck"); };
  build(manager({{"a", fake("a")}}));
  EXPECT_THROW(getAny("a"), FileUtilsIoException);
}

// Unmanaged stores

TEST_F(StoreManagerImplTest, AnUnmanagedStoreIsReportedAtCreationAndAgainOnItsFirstSizeReport) {
  build(manager({{"id", unmanaged("u", 100)}}));
  sizes->setSize(managerPath() + "/u_250_v1", 40);
  getAny("id");
  EXPECT_EQ(sizes->fetched(), Texts{managerPath() + "/u_250_v1"});
  EXPECT_EQ(reported(), Texts{"initialization u 40/100"});
  ASSERT_EQ(queue()->pending(), 1U);
  queue()->runNext();
  EXPECT_EQ(reported(), (Texts{"initialization u 40/100", "initialization u 40/100"}));
  settle();
  EXPECT_EQ(reported().size(), 2U);
}

TEST_F(StoreManagerImplTest, OnlyTheCallThatCreatesAnUnmanagedStoreMeasuresIt) {
  build(manager({{"u", unmanaged("u", 100)}}));
  getAny("u");
  getAny("u");
  EXPECT_EQ(sizes->fetched().size(), 1U);
  EXPECT_EQ(reported().size(), 1U);
  EXPECT_EQ(queue()->pending(), 1U);
}

TEST_F(StoreManagerImplTest, OfManyThreadsOneMeasuresTheUnmanagedStore) {
  build(manager({{"u", unmanaged("u", 100)}}));
  std::vector<std::shared_ptr<Store>> got(6);
  test::runOnThreads(got.size(), [&](std::size_t thread) { got[thread] = getAny("u"); });
  for (const auto& store : got) EXPECT_EQ(store, got[0]);
  EXPECT_EQ(sizes->fetched().size(), 1U);
  EXPECT_EQ(reported().size(), 1U);
  EXPECT_EQ(queue()->pending(), 1U);
}

TEST_F(StoreManagerImplTest, AnOversizedUnmanagedCacheIsTrashedRecreatedAndCountedAsEmpty) {
  directory.write("area/_store_1/u_250_v1/file", "bytes");
  build(manager({{"u", unmanaged("u", 100, true)}}));
  sizes->setSize(managerPath() + "/u_250_v1", 101);
  EXPECT_NE(getAny("u"), nullptr);
  EXPECT_EQ(trash->collected(), Texts{managerPath() + "/u_250_v1"});
  EXPECT_TRUE(directory.names("area/_store_1/u_250_v1").empty());
  EXPECT_EQ(reported(), (Texts{"initialization u 101/100", "eviction u 101/100"}));
  settle();
  EXPECT_EQ(reported(), (Texts{"initialization u 101/100", "eviction u 101/100", "initialization u 0/100"}));
}

TEST_F(StoreManagerImplTest, AnUnmanagedCacheOfExactlyItsLimitIsKept) {
  directory.write("area/_store_1/u_250_v1/file", "bytes");
  build(manager({{"u", unmanaged("u", 100, true)}}));
  sizes->setSize(managerPath() + "/u_250_v1", 100);
  getAny("u");
  settle();
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_TRUE(directory.exists("area/_store_1/u_250_v1/file"));
  EXPECT_EQ(reported(), (Texts{"initialization u 100/100", "initialization u 100/100"}));
}

TEST_F(StoreManagerImplTest, AnUnmanagedCacheWithoutALimitIsEvictedAsSoonAsItHoldsAByte) {
  build(manager({{"u", unmanaged("u", 0, true)}, {"v", unmanaged("v", 0, true)}}));
  sizes->setSize(managerPath() + "/u_250_v1", 1);
  getAny("u");
  getAny("v");
  EXPECT_EQ(trash->collected(), Texts{managerPath() + "/u_250_v1"});
}

TEST_F(StoreManagerImplTest, AnOversizedUnmanagedStoreThatIsNoCacheIsKept) {
  build(manager({{"u", unmanaged("u", 100, false)}}));
  sizes->setSize(managerPath() + "/u_250_v1", 1000);
  getAny("u");
  settle();
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(reported(), (Texts{"initialization u 1000/100", "initialization u 1000/100"}));
}

TEST_F(StoreManagerImplTest, AnOversizedUnmanagedCacheThatCannotBeTrashedIsKeptWithItsSize) {
  directory.write("area/_store_1/u_250_v1/file", "bytes");
  build(manager({{"u", unmanaged("u", 100, true)}}));
  sizes->setSize(managerPath() + "/u_250_v1", 500);
  trash->refuses = true;
  EXPECT_NE(getAny("u"), nullptr);
  settle();
  EXPECT_TRUE(directory.exists("area/_store_1/u_250_v1/file"));
  EXPECT_EQ(reported(), (Texts{"initialization u 500/100", "initialization u 500/100"}));
}

TEST_F(StoreManagerImplTest, SizesBeyondThirtyTwoBitsEvictAndAreReportedModuloTheirRange) {
  build(manager({{"u", unmanaged("u", kLargest, true)}, {"v", unmanaged("v", 100, false)}}));
  sizes->setSize(managerPath() + "/u_250_v1", (1LL << 32) + 5);
  sizes->setSize(managerPath() + "/v_250_v1", (1LL << 32) + 6);
  getAny("u");
  getAny("v");
  settle();
  EXPECT_EQ(reported(), (Texts{"initialization u 5/4294967295", "eviction u 5/4294967295", "initialization v 6/100",
                               "initialization u 0/4294967295", "initialization v 6/100"}));
}

TEST_F(StoreManagerImplTest, AnEvictedDirectoryThatCannotBeRecreatedReachesTheCaller) {
  build(manager({{"u", unmanaged("u", 100, true)}}));
  const string path = managerPath() + "/u_250_v1";
  sizes->setSize(path, 101);
  trash->onCollect = [&](const string&) { files->failPath(Operation::CreateDirectory, path, ENOSPC); };
  EXPECT_THROW(getAny("u"), FileUtilsIoException);
  trash->onCollect = nullptr;
}

TEST_F(StoreManagerImplTest, AnUnmanagedStoreCountsInTheManagersTotal) {
  build(manager({{"u", unmanaged("u", 100)}, {"a", fake("a", {0})}}, 50));
  sizes->setSize(managerPath() + "/u_250_v1", 50);
  const auto store = get("a");
  getAny("u");
  settle();
  EXPECT_EQ(store->pruneCount(), 0U);
  report("a", 1);
  EXPECT_EQ(store->pruneCount(), 1U);
}

// Size reports

TEST_F(StoreManagerImplTest, TheFirstSizeReportIsTheInitializationAndLaterOnesAreNot) {
  build(manager({{"id", fake("name", {9})}}, kLargest));
  get("id");
  for (const unsigned int size : {3U, 4U, 0U, 3U}) report("id", size);
  EXPECT_EQ(reported(), Texts{"initialization name 3/9"});
}

TEST_F(StoreManagerImplTest, AFirstReportOfNothingIsAnInitializationToo) {
  build(manager({{"a", fake("a", {9})}}));
  get("a");
  report("a", 0);
  report("a", 0);
  EXPECT_EQ(reported(), Texts{"initialization a 0/9"});
}

TEST_F(StoreManagerImplTest, EachReportHasTheLimitsCheckedOnTheManagersQueue) {
  build(manager({{"a", fake("a")}}));
  get("a");
  manager_->onStoreSizeChanged("a", 1);
  manager_->onStoreSizeChanged("a", 2);
  EXPECT_EQ(queue()->pending(), 2U);
}

TEST_F(StoreManagerImplTest, ASizeOfAStoreThatNobodyAskedForIsIgnored) {
  build(manager({{"a", fake("a")}}));
  manager_->onStoreSizeChanged("a", 1);
  manager_->onStoreSizeChanged("unknown", 1);
  EXPECT_EQ(queue()->pending(), 0U);
  EXPECT_TRUE(reported().empty());
}

TEST_F(StoreManagerImplTest, ASizeAfterInvalidatingIsIgnored) {
  build(manager({{"a", fake("a")}}));
  const auto store = get("a");
  manager_->invalidate();
  store->reportSize(5);
  EXPECT_EQ(queue()->pending(), 0U);
  EXPECT_TRUE(reported().empty());
}

TEST_F(StoreManagerImplTest, ASizeReportedWhileTheStoreIsCreatedCountsOnce) {
  stores->onCreate = [](const string&, const auto& sizeChanged) { sizeChanged(100); };
  build(manager({{"a", fake("a", {10})}}, 99));
  const auto store = get("a");
  settle();
  EXPECT_EQ(store->pruneCount(), 1U);
  report("a", 100);
  EXPECT_EQ(events->named("qzdiskstore_logging").at(0).json().at("event_type"), "initialization");
  EXPECT_EQ(reported().size(), 2U);  // that one and the pruning
}

TEST_F(StoreManagerImplTest, ACheckThatMeetsAStoreStillBeingCreatedPassesItBy) {
  stores->onCreate = [&](const string&, const auto& sizeChanged) {
    sizeChanged(100);
    settle();
  };
  build(manager({{"a", fake("a", {10})}}, 99));
  const auto store = get("a");
  EXPECT_EQ(store->pruneCount(), 0U);
  manager_->pruneStoresIfNecessary();
  EXPECT_EQ(store->pruneCount(), 1U);  // nothing had been started before, so no interval has to pass
}

TEST_F(StoreManagerImplTest, TheTotalFollowsReplacementsNotSums) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 20));
  const auto a = get("a");
  const auto b = get("b");
  report("b", 10);
  report("a", 10);
  report("a", 4);
  report("b", 16);  // 20: at the limit
  EXPECT_EQ(a->pruneCount() + b->pruneCount(), 0U);
  report("a", 5);  // 21
  EXPECT_EQ(a->pruneCount(), 1U);
  EXPECT_EQ(b->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, TheTotalWrapsAndComesBack) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 6));
  const auto a = get("a");
  const auto b = get("b");
  report("b", 1);
  report("a", kLargest);  // 2^32 in all, that is 0
  report("b", 7);         // 6 more: at the limit
  report("a", 0);         // 7 in all, as if it had never wrapped
  EXPECT_EQ(a->pruneCount(), 0U);
  EXPECT_EQ(b->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, ATotalThatHasComeBackIsComparedAsItIs) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 7));
  const auto b = get("b");
  get("a");
  report("b", 1);
  report("a", kLargest);
  report("b", 7);
  report("a", 0);  // 7 in all: at the limit
  EXPECT_EQ(b->pruneCount(), 0U);
}

TEST_F(StoreManagerImplTest, AWrappedTotalAboveTheLimitPrunes) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 6));
  const auto a = get("a");
  get("b");
  manager_->onStoreSizeChanged("a", kLargest);
  manager_->onStoreSizeChanged("b", 8);  // 7 in all
  settle();
  EXPECT_EQ(a->pruneCount(), 1U);
}

// When stores are pruned

TEST_F(StoreManagerImplTest, AManagerWithoutAnIntervalNeverPrunesAndNeverLooks) {
  files->total = 1;
  build(manager({{"a", fake("a")}}, 0, 0));
  const auto store = get("a");
  files->clearTrace();
  report("a", kLargest);
  EXPECT_EQ(store->pruneCount(), 0U);
  EXPECT_TRUE(files->trace().empty());
}

TEST_F(StoreManagerImplTest, WithoutMaintenanceNothingIsCheckedButTheTotalIsKept) {
  build(manager({{"a", fake("a")}}, 10), false);
  const auto store = get("a");
  store->reportSize(11);
  EXPECT_EQ(queue()->pending(), 0U);
  EXPECT_EQ(reported(), Texts{"initialization a 11/0"});
  manager_->pruneStoresIfNecessary();
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, AStoreOverItsOwnLimitIsNotPrunedInAManagerAtItsLimit) {
  build(manager({{"a", fake("a", {5})}}, 10));
  const auto store = get("a");
  report("a", 10);
  EXPECT_EQ(store->pruneCount(), 0U);
  report("a", 11);
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, AStoreAtItsOwnLimitIsNotPrunedInAManagerOverItsLimit) {
  build(manager({{"a", fake("a", {5})}, {"b", fake("b", {5})}}, 0));
  const auto a = get("a");
  const auto b = get("b");
  manager_->onStoreSizeChanged("a", 5);
  manager_->onStoreSizeChanged("b", 6);
  settle();
  EXPECT_EQ(a->pruneCount(), 0U);
  EXPECT_EQ(b->pruneCount(), 1U);
  EXPECT_FALSE(b->lastPruneWasForSurvival());
}

TEST_F(StoreManagerImplTest, AStoreThatIsNotPrunableIsPassedBy) {
  build(manager({{"a", fake("a", {0, true, false})}}, 0));
  const auto store = get("a");
  report("a", 100);
  EXPECT_EQ(store->pruneCount(), 0U);
  EXPECT_EQ(reported(), Texts{"initialization a 100/0"});
}

TEST_F(StoreManagerImplTest, AnUnmanagedStoreIsNeverAskedToPrune) {
  files->total = 1;
  build(manager({{"u", unmanaged("u", 1, true)}}, 0));
  getAny("u");
  report("u", 100);
  EXPECT_EQ(reported().size(), 2U);
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplTest, APruneIsReportedBeforeTheStoreIsAsked) {
  build(manager({{"id", fake("name", {5})}}, 0));
  const auto store = get("id");
  Texts reportedWhenAsked;
  store->onPrune = [&](const PruneRequest& request) {
    reportedWhenAsked = reported();
    request.onSuccess();
  };
  report("id", 6);
  EXPECT_EQ(reportedWhenAsked, (Texts{"initialization name 6/5", "pruning name 6/5"}));
  EXPECT_EQ(reported(), reportedWhenAsked);
}

TEST_F(StoreManagerImplTest, TwoReportsInQuickSuccessionStartOneRound) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0));
  const auto a = get("a");
  const auto b = get("b");
  manager_->onStoreSizeChanged("a", 10);
  manager_->onStoreSizeChanged("b", 10);
  manager_->onStoreSizeChanged("a", 11);
  settle();
  EXPECT_EQ(a->pruneCount(), 1U);
  EXPECT_EQ(b->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, TheDiskIsLookedAtEvenWhenTheTotalIsWithinItsLimit) {
  build(manager({{"a", fake("a")}}, 10));
  get("a");
  files->clearTrace();
  report("a", 1);
  EXPECT_EQ(files->trace(), Texts{"getDiskSpace " + managerPath()});
}

TEST_F(StoreManagerImplTest, OnADiskBelowAHundredMebibytesEveryPrunableStoreIsPrunedForSurvival) {
  files->total = 104857599;
  build(manager({{"a", fake("a", {50})}, {"b", fake("b", {50})}, {"c", fake("c", {50, true, false})}}, 1000));
  const auto a = get("a");
  const auto b = get("b");
  const auto c = get("c");
  report("a", 0);
  EXPECT_EQ(a->pruneCount(), 1U);
  EXPECT_EQ(b->pruneCount(), 1U);
  EXPECT_EQ(c->pruneCount(), 0U);
  EXPECT_TRUE(a->lastPruneWasForSurvival());
  EXPECT_TRUE(b->lastPruneWasForSurvival());
  const Texts all = reported();
  EXPECT_EQ(std::count(all.begin(), all.end(), "pruning a 0/50"), 1);
  EXPECT_EQ(std::count(all.begin(), all.end(), "pruning b 0/50"), 1);
}

TEST_F(StoreManagerImplTest, ADiskOfAHundredMebibytesIsLargeEnoughHoweverFull) {
  files->total = 104857600;
  files->available = 0;
  build(manager({{"a", fake("a", {50})}}, 1000));
  const auto store = get("a");
  report("a", 1000);
  EXPECT_EQ(store->pruneCount(), 0U);
  report("a", 1001);
  EXPECT_EQ(store->pruneCount(), 1U);
  EXPECT_FALSE(store->lastPruneWasForSurvival());
}

TEST_F(StoreManagerImplTest, ADiskThatCannotBeLookedAtIsOneErrorLineAndNoSurvivalMode) {
  build(manager({{"a", fake("a", {5})}, {"b", fake("b", {50})}}, 10));
  const auto a = get("a");
  const auto b = get("b");
  files->failAlways(Operation::GetDiskSpace, EIO);
  report("b", 1);
  EXPECT_EQ(a->pruneCount() + b->pruneCount(), 0U);
  EXPECT_EQ(log_.errorCount(), 1U);
  EXPECT_TRUE(log_.contains(ioFailure(EIO)));
  report("a", 11);
  EXPECT_EQ(a->pruneCount(), 1U);
  EXPECT_EQ(b->pruneCount(), 0U);
  EXPECT_FALSE(a->lastPruneWasForSurvival());
}

// Rounds and intervals

TEST_F(StoreManagerImplTest, TheNextRoundMayStartOneIntervalAfterTheLastOneEnded) {
  build(manager({{"a", fake("a")}}, 0, 100));
  const auto store = get("a");
  report("a", 1);
  EXPECT_EQ(store->pruneCount(), 1U);
  clock_.advance(50);
  store->finishPrune();
  clock_.advance(99);
  report("a", 2);
  EXPECT_EQ(store->pruneCount(), 1U);
  clock_.advance(1);
  report("a", 3);
  EXPECT_EQ(store->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, TheFirstRoundWaitsForNoIntervalHoweverLong) {
  build(manager({{"a", fake("a")}}, 0, kLargest));
  const auto store = get("a");
  report("a", 1);
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, ALongIntervalIsKeptToTheSecond) {
  clock_.set(500'000'000);  // so that its end can be reached with a clock of 32 bits
  build(manager({{"a", fake("a")}}, 0, 1'600'000'000));
  const auto store = get("a");
  report("a", 1);
  store->finishPrune();
  clock_.advance(1'599'999'999);
  report("a", 2);
  EXPECT_EQ(store->pruneCount(), 1U);
  clock_.advance(1);
  report("a", 3);
  EXPECT_EQ(store->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, AnIntervalIsNotShortenedByTheWidthOfTheClock) {
  clock_.set(1'700'000'000);
  build(manager({{"a", fake("a")}}, 0, 4'000'000'000));
  const auto store = get("a");
  report("a", 1);
  store->finishPrune();
  for (const std::time_t now : {1'700'000'001, 2'000'000'000, std::numeric_limits<std::int32_t>::max()}) {
    clock_.set(now);
    report("a", 2);
    EXPECT_EQ(store->pruneCount(), 1U) << now;
  }
}

TEST_F(StoreManagerImplTest, WhileARoundIsInProgressNoOtherStartsHoweverLongItTakes) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0, 10));
  const auto a = get("a");
  const auto b = get("b");
  manager_->onStoreSizeChanged("a", 5);
  manager_->onStoreSizeChanged("b", 5);
  settle();
  a->finishPrune();
  clock_.advance(1000);
  report("a", 6);
  EXPECT_EQ(a->pruneCount(), 1U);
  b->finishPrune();
  clock_.advance(9);
  report("a", 7);
  EXPECT_EQ(a->pruneCount(), 1U);
  clock_.advance(1);
  report("a", 8);
  EXPECT_EQ(a->pruneCount(), 2U);
  EXPECT_EQ(b->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, AStoreCreatedDuringARoundWaitsForTheNext) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0, 10));
  const auto a = get("a");
  report("a", 5);
  const auto b = get("b");
  report("b", 5);
  EXPECT_EQ(b->pruneCount(), 0U);
  a->finishPrune();
  clock_.advance(10);
  report("b", 5);
  EXPECT_EQ(b->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, ACheckThatPrunesNothingIsNoRound) {
  build(manager({{"a", fake("a", {5})}, {"b", fake("b", {0, true, false})}}, 0, 1000));
  const auto a = get("a");
  get("b");
  report("b", 9);  // over the total, but nothing can be done
  report("a", 6);
  EXPECT_EQ(a->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, ACompletionOfAnUnknownStoreDoesNotEndTheRound) {
  build(manager({{"a", fake("a")}}, 0, 1));
  const auto store = get("a");
  report("a", 5);
  manager_->onStorePruneBackToNormalComplete("unknown");
  manager_->checkPruneCompletion();
  clock_.advance(10);
  report("a", 6);
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, ACompletionCheckWithNothingUnderWayStartsTheIntervalAnew) {
  build(manager({{"a", fake("a")}}, 0, 10));
  const auto store = get("a");
  manager_->checkPruneCompletion();
  clock_.advance(9);
  report("a", 5);
  EXPECT_EQ(store->pruneCount(), 0U);
  clock_.advance(1);
  report("a", 5);
  EXPECT_EQ(store->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, AStoreThatReportsItsCompletionTwiceDoesNoHarm) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0, 10));
  const auto a = get("a");
  const auto b = get("b");
  manager_->onStoreSizeChanged("a", 5);
  manager_->onStoreSizeChanged("b", 5);
  settle();
  const PruneRequest request = a->takePrune();
  request.onSuccess();
  request.onSuccess();
  clock_.advance(10);
  report("a", 6);
  EXPECT_EQ(a->pruneCount(), 1U);  // b is still at it
  b->finishPrune();
  clock_.advance(10);
  report("a", 6);
  EXPECT_EQ(a->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, AStoreWhoseNameIsNotItsIdentifierIsPrunedAgain) {
  build(manager({{"id", fake("name")}}, 0, 10));
  const auto store = get("id");
  for (std::size_t round = 1; round <= 3; ++round) {
    report("id", 5);
    ASSERT_EQ(store->pruneCount(), round);
    store->finishPrune();
    clock_.advance(10);
  }
}

TEST_F(StoreManagerImplTest, StoresThatBearEachOthersNamesAreNotMistaken) {
  build(manager({{"x", fake("y")}, {"y", fake("x")}}, 0, 10));
  const auto x = get("x");
  const auto y = get("y");
  manager_->onStoreSizeChanged("x", 5);
  manager_->onStoreSizeChanged("y", 5);
  settle();
  x->finishPrune();
  clock_.advance(10);
  report("x", 5);
  EXPECT_EQ(x->pruneCount(), 1U);
  y->finishPrune();
  clock_.advance(10);
  report("x", 5);
  EXPECT_EQ(x->pruneCount(), 2U);
  EXPECT_EQ(y->pruneCount(), 2U);
}

// Failing and hasty stores

TEST_F(StoreManagerImplTest, AFailedPruneIsLoggedAndCompletesItsRound) {
  build(manager({{"a", fake("a")}}, 0, 10));
  const auto store = get("a");
  report("a", 5);
  store->failPrune(FileUtilsIoException(EIO, "no luck"));
  EXPECT_EQ(log_.messages(), Texts{string("Failed to prune store ") + FileUtilsIoException(EIO, "no luck").what()});
  EXPECT_EQ(log_.errorCount(), 1U);
  clock_.advance(10);
  report("a", 5);
  EXPECT_EQ(store->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, APruneThatThrowsCountsAsFailedAndTheOthersGoOn) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}, {"c", fake("c")}}, 0, 10));
  std::vector<std::shared_ptr<FakeStore>> all{get("a"), get("b"), get("c")};
  for (const auto& store : all) {
    store->onPrune = [](const PruneRequest&) { throw std::runtime_error("stuck"); };
  }
  for (const string identifier : {"a", "b", "c"}) manager_->onStoreSizeChanged(identifier, 5);
  EXPECT_NO_THROW(settle());
  for (const auto& store : all) EXPECT_EQ(store->pruneCount(), 1U);
  EXPECT_EQ(log_.messages(), Texts(3, "Failed to prune store stuck"));
  clock_.advance(10);
  report("a", 5);
  for (const auto& store : all) EXPECT_EQ(store->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, APruneThatCompletesAtOnceDoesNotDeadlock) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0, 10));
  const auto a = get("a");
  const auto b = get("b");
  a->onPrune = [&](const PruneRequest& request) {
    a->reportSize(0);
    request.onSuccess();
  };
  b->onPrune = [](const PruneRequest& request) { request.onError(std::runtime_error("at once")); };
  manager_->onStoreSizeChanged("a", 5);
  manager_->onStoreSizeChanged("b", 5);
  settle();
  EXPECT_EQ(log_.messages(), Texts{"Failed to prune store at once"});
  clock_.advance(9);
  report("b", 5);
  EXPECT_EQ(b->pruneCount(), 1U);
  clock_.advance(1);
  report("b", 5);
  EXPECT_EQ(b->pruneCount(), 2U);
}

TEST_F(StoreManagerImplTest, AStoreThatCompletesAtOnceDoesNotEndTheRoundOfTheOthers) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0, 10));
  const auto a = get("a");
  const auto b = get("b");
  const auto completeAtOnce = [](const PruneRequest& request) { request.onSuccess(); };
  a->onPrune = completeAtOnce;
  manager_->onStoreSizeChanged("a", 5);
  manager_->onStoreSizeChanged("b", 5);
  settle();
  clock_.advance(100);
  report("a", 5);
  EXPECT_EQ(a->pruneCount(), 1U);
  EXPECT_EQ(b->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, AStoreMayUseTheManagerWhileItIsAskedToPrune) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0, 10));
  const auto a = get("a");
  a->onPrune = [&](const PruneRequest& request) {
    EXPECT_NE(get("b"), nullptr);
    manager_->pruneStoresIfNecessary();
    manager_->invalidate();
    request.onSuccess();
  };
  report("a", 5);
  EXPECT_EQ(a->pruneCount(), 1U);
  EXPECT_FALSE(manager_->isValid());
}

TEST_F(StoreManagerImplTest, AfterInvalidatingQueuedChecksAndLateCompletionsDoNothing) {
  build(manager({{"a", fake("a")}}, 0));
  const auto store = get("a");
  report("a", 5);
  const PruneRequest late = store->takePrune();
  manager_->onStoreSizeChanged("a", 6);
  manager_->invalidate();
  files->clearTrace();
  settle();
  late.onSuccess();
  late.onError(std::runtime_error("late"));
  EXPECT_EQ(store->pruneCount(), 1U);
  EXPECT_TRUE(files->trace().empty());
}

// Lifetimes

TEST_F(StoreManagerImplTest, AManagerWithoutStoresGoesWithItsHandle) {
  createDispatcher();
  build(manager({{"a", fake("a")}}));
  manager_->startCalculatingUnmanagedStoresSize();
  manager_->initAllStoresLazy();
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_.reset();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplTest, AStoreKeepsItsManagerAliveThroughTheSizeCallback) {
  build(manager({{"a", fake("a")}}));
  auto store = get("a");
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_->invalidate();
  manager_.reset();
  EXPECT_FALSE(kept.expired());
  store->reportSize(5);
  store.reset();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplTest, InvalidatingBreaksTheCircleOfManagerAndStore) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}));
  const std::weak_ptr<Store> keptStore = get("a");
  get("b");
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  auto handle = std::exchange(manager_, nullptr);
  handle->invalidate();
  EXPECT_TRUE(keptStore.expired());
  handle.reset();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplTest, ClosingBreaksTheCircleTooAndMaintainsWhatIsHeld) {
  build(manager({{"a", fake("a")}}));
  auto store = get("a");
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_->close();
  EXPECT_EQ(getAny("a"), nullptr);
  const auto managersQueue = queue();
  manager_.reset();
  store->reportSize(1000);
  EXPECT_EQ(managersQueue->pending(), 1U);
  settle();
  EXPECT_EQ(store->pruneCount(), 1U);
  EXPECT_FALSE(kept.expired());
  store.reset();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplTest, AStoreThatGoesInTheMiddleOfItsPruneDoesNotHoldUpTheOthers) {
  build(manager({{"a", fake("a")}, {"b", fake("b")}}));
  auto a = get("a");
  const auto b = get("b");
  const auto managersQueue = queue();
  manager_->close();
  manager_.reset();
  a->reportSize(1000);
  managersQueue->runAll();
  ASSERT_EQ(a->pruneCount(), 1U);
  b->reportSize(1000);
  managersQueue->runAll();
  EXPECT_EQ(b->pruneCount(), 0U);  // one round at a time
  a.reset();
  b->reportSize(1001);
  managersQueue->runAll();  // the round is over
  clock_.advance(1'000'000);
  b->reportSize(1002);
  managersQueue->runAll();
  EXPECT_EQ(b->pruneCount(), 1U);
}

TEST_F(StoreManagerImplTest, InvalidatingFromWithinTheCleanUpDoesNotWaitForItself) {
  build(manager({}));
  directory.makeDirectory("area/_store_1/old_1_v1");
  trash->onCollect = [&](const string&) { manager_->invalidate(); };
  manager_->startCleanup();
  settle();
  trash->onCollect = nullptr;
  EXPECT_FALSE(manager_->isValid());
}

TEST_F(StoreManagerImplTest, InvalidatingFromWithinAnInvalidationDoesNotWaitForACleanUp) {
  const test::Watchdog watchdog(60);
  build(manager({{"a", fake("a")}}));
  get("a");
  test::Latch cleaning(1);
  test::Latch release(1);
  files->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::ListDirectories || path != areaPath()) return;
    cleaning.countDown();
    release.wait();
  };
  (*stores)["a"]->onInvalidate = [&] {
    manager_->invalidate();
    release.countDown();
  };
  manager_->startCleanup();
  std::thread cleaner([&] { settle(); });
  cleaning.wait();
  manager_->invalidate();
  cleaner.join();
  EXPECT_TRUE(release.isOpen());
}

TEST_F(StoreManagerImplTest, AMeasuredSizeKeepsTheManagerAliveUntilItIsCounted) {
  build(manager({{"u", unmanaged("u", 100)}}));
  getAny("u");
  const auto managersQueue = queue();
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_.reset();
  EXPECT_FALSE(kept.expired());
  managersQueue->runAll();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplTest, AQueuedCheckKeepsTheManagerAliveUntilItHasRun) {
  build(manager({{"u", unmanaged("u", 100)}}));
  getAny("u");
  settle();
  manager_->onStoreSizeChanged("u", 5);
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_.reset();
  EXPECT_FALSE(kept.expired());
  settle();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplTest, APruneUnderWayKeepsTheManagerAliveByEitherCallback) {
  for (const bool success : {true, false}) {
    build(manager({{"a", fake("a")}}, 0));
    auto store = get("a");
    manager_->onStoreSizeChanged("a", 5);
    for (const auto& each : queues->all()) each->runAll();
    PruneRequest request = store->takePrune();
    if (success) {
      request.onError = nullptr;
    } else {
      request.onSuccess = nullptr;
    }
    const std::weak_ptr<StoreManagerImpl> kept = manager_;
    manager_->invalidate();
    manager_.reset();
    store.reset();
    EXPECT_FALSE(kept.expired());
    if (success) {
      request.onSuccess();
    } else {
      request.onError(std::runtime_error("late"));
    }
    request = {};
    EXPECT_TRUE(kept.expired());
  }
}

TEST_F(StoreManagerImplTest, ACleanUpKeepsTheManagerAliveUntilItHasRun) {
  build(manager({}));
  directory.makeDirectory("area/_store_1/old_1_v1");
  manager_->startCleanup();
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_.reset();
  EXPECT_FALSE(kept.expired());
  settle();
  EXPECT_TRUE(kept.expired());
  EXPECT_EQ(trash->collected(), Texts{managerPath() + "/old_1_v1"});
}

TEST_F(StoreManagerImplTest, LazyCreationDoesNotKeepTheManagerAliveAndDoesNothingOnceItIsGone) {
  createDispatcher();
  build(manager({{"a", fake("a")}}));
  manager_->initAllStoresLazy();
  dispatcher_->dispatchNow();
  const std::weak_ptr<StoreManagerImpl> kept = manager_;
  manager_.reset();
  EXPECT_TRUE(kept.expired());
  EXPECT_EQ(queues->workQueue(0)->runAll(), 1U);
  EXPECT_TRUE(stores->creations().empty());
}

// Cleansing

TEST_F(StoreManagerImplTest, AForcedCleanseTrashesTheManagersDirectory) {
  build(manager({}));
  directory.write("area/_store_1/a_250_v1/value", "bytes");
  directory.makeDirectory("area/_store_2");
  manager_->cleanseIfNecessary(true);
  EXPECT_EQ(trash->collected(), Texts{managerPath()});
  EXPECT_EQ(directory.names("area"), Texts{"_store_2"});
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplTest, ADiskBelowSeventyFiveMebibytesIsCleansed) {
  build(manager({}));
  files->total = 78643199;
  manager_->cleanseIfNecessary(false);
  EXPECT_EQ(trash->collected(), Texts{managerPath()});
  EXPECT_EQ(log_.messages(),
            Texts{"Discarding manager directory \"" + managerPath() +
                  "\": its file system of 78643199 bytes is smaller than the limit of 78643200 bytes."});
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(StoreManagerImplTest, ADiskOfSeventyFiveMebibytesIsNotCleansedHoweverFull) {
  build(manager({}));
  files->total = 78643200;
  files->available = 0;
  manager_->cleanseIfNecessary(false);
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplTest, AVeryLargeDiskIsNotCleansed) {
  build(manager({}));
  files->total = (1LL << 32) + 1;  // 1 in 32 bits
  manager_->cleanseIfNecessary(false);
  EXPECT_TRUE(trash->collected().empty());
}

TEST_F(StoreManagerImplTest, CleansingWithoutAManagerDirectoryDoesNothing) {
  build(manager({}));
  std::filesystem::remove_all(managerPath());
  files->total = 1;
  files->clearTrace();
  manager_->cleanseIfNecessary(true);
  EXPECT_EQ(files->trace(), Texts{"pathExists " + managerPath()});
  EXPECT_TRUE(trash->collected().empty());
}

TEST_F(StoreManagerImplTest, ADiskThatCannotBeLookedAtIsCleansedOnlyWhenForced) {
  build(manager({}));
  files->failAlways(Operation::GetDiskSpace, EIO);
  EXPECT_NO_THROW(manager_->cleanseIfNecessary(false));
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(log_.errorCount(), 1U);
  EXPECT_TRUE(log_.contains(ioFailure(EIO)));
  EXPECT_NO_THROW(manager_->cleanseIfNecessary(true));
  EXPECT_EQ(trash->collected(), Texts{managerPath()});
}

class StoreManagerImplIncidents : public StoreManagerImplTest {
 protected:
  void buildReporting(Stores definitions = {}) {
    build(manager(std::move(definitions)));
    manager_->setIncidents(incidents_.reporter);
  }

  string discarded() const {
    return "ManagerDiscarded " + managerPath() + ": Discarding manager directory \"" + managerPath() +
           "\": its file system of 78643199 bytes is smaller than the limit of 78643200 bytes.";
  }

  test::IncidentLog incidents_;
};

TEST_F(StoreManagerImplIncidents, TellOfAManagerThatIsDiscardedForTheSizeOfItsFileSystem) {
  buildReporting();
  files->total = 78643199;
  manager_->cleanseIfNecessary(false);
  EXPECT_EQ(incidents_.queue->pending(), 1U);
  EXPECT_EQ(incidents_.take(), Texts{discarded()});
}

TEST_F(StoreManagerImplIncidents, TellOfNoManagerThatStays) {
  buildReporting();
  manager_->cleanseIfNecessary(false);
  files->failNext(Operation::GetDiskSpace, EIO);
  manager_->cleanseIfNecessary(false);
  files->total = 78643199;
  trash->refuses = true;
  manager_->cleanseIfNecessary(false);
  EXPECT_TRUE(directory.exists("area/_store_1"));
  EXPECT_TRUE(incidents_.take().empty());
}

TEST_F(StoreManagerImplIncidents, TellOfNoManagerWhoseDiscardingIsForced) {
  for (const long long total : {78643200LL, 78643199LL}) {
    buildReporting();
    files->total = total;
    manager_->cleanseIfNecessary(true);
    EXPECT_FALSE(directory.exists("area/_store_1"));
  }
  EXPECT_TRUE(incidents_.take().empty());
}

TEST_F(StoreManagerImplIncidents, AreToldWithoutALockSoThatTheHandlerMayUseTheManager) {
  incidents_.runAtOnce();
  incidents_.onIncident = [&](const Incident&) { EXPECT_NE(get("a"), nullptr); };
  buildReporting({{"a", fake("a")}});
  files->total = 78643199;
  manager_->cleanseIfNecessary(false);
  EXPECT_EQ(incidents_.take(), Texts{discarded()});
  EXPECT_EQ(stores->createdNames(), Texts{"a"});
}

TEST_F(StoreManagerImplIncidents, TellOfAStoreThatCannotBeCreatedOnRequestOrInTheBackground) {
  createDispatcher();
  stores->onCreate = [](const string&, const auto&) { throw FileUtilsIoException(EIO, "no luck"); };
  buildReporting({{"a", fake("a")}});
  manager_->retryFailedCreations();
  EXPECT_THROW(get("a"), FileUtilsIoException);
  manager_->initAllStoresLazy();
  dispatcher_->dispatchNow();
  queues->workQueue(0)->runAll();
  const string line = "CreationFailed a: Could not create store \"a\": domain: QZLarderIoErrorErrorDomain; code: " +
                      std::to_string(EIO) + "; description: no luck .";
  EXPECT_EQ(incidents_.take(), (Texts{line, line}));
}

TEST_F(StoreManagerImplIncidents, OfTheTrashAreToldWhenTheCleaningUpIsOver) {
  const test::Watchdog watchdog(60);
  incidents_.runAtOnce();
  incidents_.onIncident = [&](const Incident&) {
    files->heal();
    // Invalidating waits for a clean-up of another thread.
    std::thread([&] { manager_->invalidate(); }).join();
  };
  buildReporting();
  trash->setIncidents(incidents_.reporter);
  trashQueues->queue(0)->onDispatch = [&] { trashQueues->queue(0)->runAll(); };
  directory.write("area/_store_1/old_1_v1/value", "bytes");
  files->failAlways(Operation::DeleteFile, EBUSY);
  manager_->startCleanup();
  settle();
  EXPECT_EQ(incidents_.take().size(), 1U);
  EXPECT_FALSE(manager_->isValid());
}

// Cleaning up, measuring

TEST_F(StoreManagerImplTest, CleaningUpIsOneTaskForOldStoresAndThenOtherSessions) {
  build(manager({}));
  directory.makeDirectory("area/_store_1/old_1_v1");
  directory.makeDirectory("area/_store_9");
  manager_->startCleanup();
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(queue()->pending(), 1U);
  settle();
  EXPECT_EQ(trash->collected(), (Texts{managerPath() + "/old_1_v1", areaPath() + "/_store_9"}));
}

TEST_F(StoreManagerImplTest, ACleanUpThatComesAfterTheInvalidationLeavesTheNextSessionAlone) {
  build(manager({}));
  manager_->startCleanup();
  manager_->invalidate();
  directory.makeDirectory("area/_store_2");
  directory.makeDirectory("area/_store_1/fresh_1_v1");
  settle();
  EXPECT_EQ(directory.names("area"), (Texts{"_store_1", "_store_2"}));
  EXPECT_TRUE(directory.exists("area/_store_1/fresh_1_v1"));
}

TEST_F(StoreManagerImplTest, InvalidatingWaitsForACleanUpThatIsUnderWay) {
  build(manager({}));
  directory.makeDirectory("area/_store_9");
  test::Latch cleaning(1);
  test::Latch release(1);
  files->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::ListDirectories || path != areaPath()) return;
    cleaning.countDown();
    release.wait();
  };
  manager_->startCleanup();
  std::thread cleaner([&] { settle(); });
  cleaning.wait();
  Texts afterInvalidate;
  std::thread invalidator([&] {
    manager_->invalidate();
    afterInvalidate = directory.names("area");
  });
  while (manager_->isValid()) std::this_thread::yield();
  for (int i = 0; i < 1000; ++i) std::this_thread::yield();
  release.countDown();
  cleaner.join();
  invalidator.join();
  EXPECT_TRUE(afterInvalidate.empty());  // the other session's directory had gone before it returned
}

TEST_F(StoreManagerImplTest, AFailedCleanUpOfOldStoresDoesNotKeepOtherSessionsFromBeingCleanedUp) {
  build(manager({}));
  directory.makeDirectory("area/_store_9");
  files->failPath(Operation::ListDirectories, managerPath(), EIO);
  manager_->startCleanup();
  EXPECT_NO_THROW(settle());
  EXPECT_EQ(log_.messages(), Texts{"Cleanup of old stores failed " + ioFailure(EIO)});
  EXPECT_EQ(trash->collected(), Texts{areaPath() + "/_store_9"});
}

TEST_F(StoreManagerImplTest, OnlyUnmanagedStoresThatExistAreRegisteredForMeasuring) {
  directory.makeDirectory("area/_store_1/u_250_v1");
  directory.makeDirectory("area/_store_1/a_250_v1");
  build(manager({{"id", unmanaged("u")}, {"absent", unmanaged("absent")}, {"a", fake("a")}}));
  manager_->startCalculatingUnmanagedStoresSize();
  EXPECT_EQ(sizes->registered(), (std::vector<std::pair<string, long>>{{managerPath() + "/u_250_v1", 604800}}));
  EXPECT_TRUE(sizes->fetched().empty());
}

// Lazy creation

TEST_F(StoreManagerImplTest, WithoutALazyDispatcherNothingIsCreatedLazily) {
  build(manager({{"a", fake("a")}}));
  manager_->initAllStoresLazy();
  EXPECT_EQ(queues->workQueueCount(), 0U);
}

TEST_F(StoreManagerImplTest, StoresAreCreatedInTheOrderOfTheDefinitionWhenTheDispatcherReleasesThem) {
  createDispatcher();
  const auto definition =
      manager({{"a", fake("a")}, {"b", fake("b")}, {"c", fake("c")}, {"d", fake("d")}, {"e", fake("e")}});
  build(definition);
  manager_->initAllStoresLazy();
  EXPECT_EQ(queues->workQueueCount(), 1U);
  EXPECT_EQ(queues->workQueue(0)->pending(), 0U);
  dispatcher_->dispatchNow();
  EXPECT_EQ(queues->workQueue(0)->pending(), 1U);
  EXPECT_TRUE(stores->creations().empty());
  queues->workQueue(0)->runAll();
  Texts expected;
  for (const auto& [identifier, store] : definition.stores) expected.push_back(identifier);
  EXPECT_EQ(stores->createdNames(), expected);
  for (const test::Creation& creation : stores->creations()) {
    EXPECT_EQ(creation.pruneStrategy, PruneStrategyIdentifier::LRU);
  }
}

TEST_F(StoreManagerImplTest, AStoreObtainedEarlierKeepsItsStrategy) {
  createDispatcher();
  build(manager({{"a", fake("a")}}));
  manager_->initAllStoresLazy();
  const auto store = manager_->getStoreImpl("a", PruneStrategyIdentifier::VideoDownload);
  dispatcher_->dispatchNow();
  queues->workQueue(0)->runAll();
  ASSERT_EQ(stores->creations().size(), 1U);
  EXPECT_EQ(stores->creations()[0].pruneStrategy, PruneStrategyIdentifier::VideoDownload);
  EXPECT_EQ(getAny("a"), store);
}

TEST_F(StoreManagerImplTest, AStoreThatCannotBeCreatedLazilyIsLoggedAndTheWalkGoesOn) {
  createDispatcher();
  stores->onCreate = [](const string& name, const auto&) {
    if (name == "bad") throw FileUtilsIoException(EIO, "no luck");
  };
  build(manager({{"a", fake("a")}, {"id", fake("bad")}, {"b", fake("b")}}));
  manager_->initAllStoresLazy();
  dispatcher_->dispatchNow();
  EXPECT_NO_THROW(queues->workQueue(0)->runAll());
  EXPECT_EQ(stores->creations().size(), 2U);
  EXPECT_EQ(log_.messages(),
            Texts{string("Could not initialize store id: ") + FileUtilsIoException(EIO, "no luck").what()});
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(StoreManagerImplTest, OtherExceptionsLeaveTheLazyTask) {
  createDispatcher();
  stores->onCreate = [](const string&, const auto&) { throw std::runtime_error("odd"); };
  build(manager({{"a", fake("a")}, {"b", fake("b")}}));
  manager_->initAllStoresLazy();
  dispatcher_->dispatchNow();
  EXPECT_THROW(queues->workQueue(0)->runAll(), std::runtime_error);
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplTest, LazyCreationOfAnInvalidManagerCreatesNothing) {
  createDispatcher();
  build(manager({{"a", fake("a")}, {"u", unmanaged("u")}}));
  manager_->initAllStoresLazy();
  manager_->invalidate();
  dispatcher_->dispatchNow();
  queues->workQueue(0)->runAll();
  EXPECT_TRUE(stores->creations().empty());
  EXPECT_TRUE(log_.messages().empty());
  EXPECT_FALSE(directory.exists("area/_store_1"));
}

// Reporting

TEST_F(StoreManagerImplTest, EventsCarryTheirFourValues) {
  build(manager({}));
  manager_->reportEventToAnalytics("s", StoreManagerEvent::Type::Eviction, kLargest, 3);
  EXPECT_EQ(reported(), Texts{"eviction s 4294967295/3"});
}

TEST_F(StoreManagerImplTest, WithoutAReporterEverythingWorksSilently) {
  reporter = nullptr;
  build(manager({{"a", fake("a")}, {"u", unmanaged("u", 1, true)}}, 0));
  sizes->setSize(managerPath() + "/u_250_v1", 2);
  const auto store = get("a");
  getAny("u");
  report("a", 5);
  manager_->reportEventToAnalytics("s", StoreManagerEvent::Type::Pruning, 1, 1);
  EXPECT_EQ(store->pruneCount(), 1U);
  EXPECT_EQ(trash->collected().size(), 1U);
  EXPECT_TRUE(events->events().empty());
}

// Threads

TEST_F(StoreManagerImplTest, ReportsPrunesAndLookupsFromManyThreadsLeaveTheRightTotal) {
  constexpr int kReports = 100;
  build(manager({{"a", fake("a")}, {"b", fake("b")}, {"c", fake("c")}, {"d", fake("d")}}, 40, 1));
  for (const string identifier : {"a", "b", "c", "d"}) {
    const auto store = get(identifier);
    store->onPrune = [](const PruneRequest& request) { request.onSuccess(); };
  }
  test::runOnThreads(6, [&](std::size_t thread) {
    if (thread == 4) {
      for (int i = 0; i < kReports; ++i) {
        settle();
        clock_.advance(1);
      }
      return;
    }
    if (thread == 5) {
      for (int i = 0; i < kReports; ++i) get("b");
      return;
    }
    const string identifier(1, static_cast<char>('a' + thread));
    for (unsigned int i = 0; i < kReports; ++i) manager_->onStoreSizeChanged(identifier, i * 7919U);
    manager_->onStoreSizeChanged(identifier, 10);
  });
  settle();
  clock_.advance(10);
  const std::size_t before = get("a")->pruneCount();
  report("a", 10);  // 40: at the limit
  EXPECT_EQ(get("a")->pruneCount(), before);
  report("a", 11);
  EXPECT_EQ(get("a")->pruneCount(), before + 1);
  std::size_t initializations = 0;
  for (const string& text : reported()) initializations += text.rfind("initialization", 0) == 0 ? 1U : 0U;
  EXPECT_EQ(initializations, 4U);
}

TEST_F(StoreManagerImplTest, ARoundWhoseLastStoresFinishAtTheSameTimeEnds) {
  constexpr std::size_t kStores = 16;
  constexpr std::size_t kThreads = 4;  // more than there may be processors: one that is interrupted comes late
  reporter = nullptr;
  Stores definitions;
  for (std::size_t i = 0; i < kStores; ++i) definitions["s" + std::to_string(i)] = fake("s" + std::to_string(i));
  build(manager(definitions, 0, 1));
  std::vector<std::shared_ptr<FakeStore>> all;
  for (std::size_t i = 0; i < kStores; ++i) {
    all.push_back(get("s" + std::to_string(i)));
    all.back()->reportSize(1);
  }
  for (std::size_t round = 1; round <= 1500; ++round) {
    all[0]->reportSize(static_cast<unsigned int>(round));
    settle();
    for (const auto& store : all) ASSERT_EQ(store->pruneCount(), round) << "the round before has not ended";
    test::runOnThreads(kThreads, [&](std::size_t thread) {
      for (std::size_t i = thread; i < kStores; i += kThreads) all[i]->finishPrune();
    });
    clock_.advance(1);
  }
}

TEST_F(StoreManagerImplTest, InvalidatingWhileStoresReportAndFinishIsSafe) {
  for (int round = 0; round < 30; ++round) {
    build(manager({{"a", fake("a")}, {"b", fake("b")}}, 0));
    const auto a = get("a");
    const auto b = get("b");
    const auto managersQueue = queues->queue(queues->queueCount() - 1);
    test::runOnThreads(4, [&](std::size_t thread) {
      if (thread == 0) {
        for (unsigned int i = 0; i < 20; ++i) a->reportSize(i);
      } else if (thread == 1) {
        for (unsigned int i = 0; i < 20; ++i) b->reportSize(i);
      } else if (thread == 2) {
        managersQueue->runAll();
        while (a->prunesUnderWay() > 0) a->finishPrune();
      } else {
        manager_->invalidate();
      }
    });
    managersQueue->runAll();
    while (a->prunesUnderWay() > 0) a->finishPrune();
    while (b->prunesUnderWay() > 0) b->finishPrune();
    EXPECT_GE(a->invalidations(), 1U);
    manager_.reset();
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
