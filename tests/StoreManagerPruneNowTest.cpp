// Rounds of pruning on request, the sizes of stores, and who is told of them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "StoreManager.h"
#include "host/testing/ManualClock.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FakeStore;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr std::time_t kNow = 1'700'000'000;
constexpr unsigned int kInterval = 3600;  // seconds
constexpr unsigned int kLarge = 1'000'000;

class StoreManagerPruneNow : public testing::Test, protected test::ManagerServices {
 protected:
  void TearDown() override {
    if (manager_ != nullptr) manager_->invalidate();
    for (const auto& queue : queues->all()) queue->dropAll();
  }

  // With the stores "a" and "b", of 100 bytes each.
  void build(unsigned int maxSize, unsigned int interval = kInterval, bool maintenance = true) {
    manager_ = std::make_shared<StoreManager>(
        areaPath(), manager({{"a", fake("a", {100})}, {"b", fake("b", {100})}}, maxSize, interval), false,
        names.createStoreDirectoryNameBuilder("1"), trash, queues, sizes, reporter, files, attributes, nullptr,
        maintenance);
    a_ = manager_->getStore<FakeStore>("a");
    b_ = manager_->getStore<FakeStore>("b");
    settle();
  }

  void settle() { queues->queue(0)->runAll(); }

  void report(FakeStore& store, unsigned int size) {
    store.reportSize(size);
    settle();
  }

  void pruneNow() {
    manager_->pruneNow();
    settle();
  }

  test::ManualClock clock_{kNow};
  test::LogCapture log_;
  std::shared_ptr<StoreManager> manager_;
  std::shared_ptr<FakeStore> a_;
  std::shared_ptr<FakeStore> b_;
};

TEST_F(StoreManagerPruneNow, PrunesWhatIsOverItsOwnLimitInAManagerThatIsNotOverIts) {
  build(kLarge);
  report(*a_, 101);
  report(*b_, 100);
  EXPECT_EQ(a_->pruneCount(), 0U);
  pruneNow();
  EXPECT_EQ(a_->pruneCount(), 1U);
  EXPECT_EQ(b_->pruneCount(), 0U);
  EXPECT_FALSE(a_->lastPruneWasForSurvival());
}

TEST_F(StoreManagerPruneNow, HappensOnTheManagersQueue) {
  build(kLarge);
  report(*a_, 101);
  manager_->pruneNow();
  EXPECT_EQ(a_->pruneCount(), 0U);
  EXPECT_EQ(queues->queue(0)->runAll(), 1U);
  EXPECT_EQ(a_->pruneCount(), 1U);
}

TEST_F(StoreManagerPruneNow, DoesNotWaitForTheInterval) {
  build(0);
  report(*a_, 101);
  a_->finishPrune();
  report(*a_, 102);
  EXPECT_EQ(a_->pruneCount(), 1U);
  pruneNow();
  EXPECT_EQ(a_->pruneCount(), 2U);
}

TEST_F(StoreManagerPruneNow, BeginsTheIntervalAnew) {
  build(0);
  report(*a_, 101);
  a_->finishPrune();
  clock_.advance(kInterval - 1);
  pruneNow();
  a_->finishPrune();
  clock_.advance(1);  // over, if it had begun with the first round
  report(*a_, 102);
  EXPECT_EQ(a_->pruneCount(), 2U);
  clock_.advance(kInterval - 1);
  report(*a_, 103);
  EXPECT_EQ(a_->pruneCount(), 3U);
}

TEST_F(StoreManagerPruneNow, OfNothingLeavesTheIntervalAlone) {
  build(kLarge);
  pruneNow();
  report(*b_, kLarge + 1);
  EXPECT_EQ(b_->pruneCount(), 1U);
}

TEST_F(StoreManagerPruneNow, FollowsTheRoundThatIsUnderWay) {
  build(0);
  report(*a_, 101);
  report(*b_, 101);  // too late for this round
  pruneNow();
  EXPECT_EQ(b_->pruneCount(), 0U);
  a_->finishPrune();
  report(*a_, 100);  // as a store does behind its prune
  EXPECT_EQ(a_->pruneCount(), 1U);
  EXPECT_EQ(b_->pruneCount(), 1U);
  b_->finishPrune();
  report(*b_, 101);
  EXPECT_EQ(b_->pruneCount(), 1U);  // the request is done
}

TEST_F(StoreManagerPruneNow, PrunesForSurvivalOnASmallDisk) {
  build(kLarge);
  report(*b_, 1);
  files->total = 104857599;
  pruneNow();
  EXPECT_EQ(b_->pruneCount(), 1U);
  EXPECT_TRUE(b_->lastPruneWasForSurvival());
}

TEST_F(StoreManagerPruneNow, DoesNothingWithoutAnInterval) {
  build(0, 0);
  report(*a_, 101);
  pruneNow();
  EXPECT_EQ(a_->pruneCount(), 0U);
}

TEST_F(StoreManagerPruneNow, DoesNothingWithoutMaintenance) {
  build(0, kInterval, false);
  report(*a_, 101);
  manager_->pruneNow();
  EXPECT_EQ(queues->queue(0)->pending(), 0U);
  EXPECT_EQ(a_->pruneCount(), 0U);
}

TEST_F(StoreManagerPruneNow, DoesNothingOnceTheManagerIsInvalid) {
  build(kLarge);
  report(*a_, 101);
  manager_->pruneNow();
  manager_->invalidate();
  settle();
  pruneNow();
  EXPECT_EQ(a_->pruneCount(), 0U);
}

TEST_F(StoreManagerPruneNow, ThrowsWhatTheQueueThrows) {
  build(kLarge);
  report(*a_, 101);
  queues->queue(0)->throwOnDispatch(true);
  EXPECT_THROW(manager_->pruneNow(), std::runtime_error);
  queues->queue(0)->throwOnDispatch(false);
  report(*b_, 1);  // the request stands
  EXPECT_EQ(a_->pruneCount(), 1U);
}

// Sizes

TEST_F(StoreManagerPruneNow, ASizeIsWhatTheStoreReportedLast) {
  build(kLarge);
  EXPECT_EQ(manager_->sizeOf("a"), 0U);
  report(*a_, 7);
  report(*a_, 4294967295U);
  EXPECT_EQ(manager_->sizeOf("a"), 4294967295U);
  EXPECT_EQ(manager_->sizeOf("b"), 0U);
  EXPECT_EQ(manager_->sizeOf("c"), 0U);
  manager_->invalidate();
  EXPECT_EQ(manager_->sizeOf("a"), 0U);
}

class SizeListener : public StoreManagerPruneNow {
 protected:
  void listen() {
    setListener([this](const string& identifier, std::uint32_t size) {
      told_.push_back(identifier + " " + std::to_string(size));
    });
  }

  void setListener(StoreManager::SizeListener listener) {
    manager_->setSizeListener(std::make_shared<const StoreManager::SizeListener>(std::move(listener)));
  }

  std::vector<string> told_;
};

TEST_F(SizeListener, IsToldOfEachReport) {
  build(kLarge);
  listen();
  report(*a_, 7);
  report(*a_, 7);
  report(*b_, 4294967295U);
  EXPECT_THAT(told_, ElementsAre("a 7", "a 7", "b 4294967295"));
}

TEST_F(SizeListener, IsToldWithoutMaintenanceAndWithoutAnInterval) {
  build(0, 0, false);
  listen();
  report(*a_, 7);
  EXPECT_THAT(told_, ElementsAre("a 7"));
}

TEST_F(SizeListener, ComesBeforeTheLimitsAreChecked) {
  build(0);
  std::size_t pruned = 1;
  setListener([&](const string&, std::uint32_t) { pruned = a_->pruneCount(); });
  queues->queue(0)->onDispatch = [this] { settle(); };
  a_->reportSize(101);
  EXPECT_EQ(pruned, 0U);
  EXPECT_EQ(a_->pruneCount(), 1U);
}

TEST_F(SizeListener, MayUseTheManager) {
  build(kLarge);
  queues->queue(0)->onDispatch = [this] { settle(); };
  setListener([this](const string& identifier, std::uint32_t) {
    told_.push_back(std::to_string(manager_->sizeOf(identifier)));
    manager_->setSizeListener(nullptr);
    manager_->pruneNow();
  });
  a_->reportSize(101);
  EXPECT_THAT(told_, ElementsAre("101"));
  EXPECT_EQ(a_->pruneCount(), 1U);
}

TEST_F(SizeListener, IsReplaced) {
  build(kLarge);
  const auto token = std::make_shared<int>(0);
  setListener([token](const string&, std::uint32_t) {});
  EXPECT_EQ(token.use_count(), 2);
  listen();
  EXPECT_EQ(token.use_count(), 1);
  report(*a_, 7);
  manager_->setSizeListener(nullptr);
  report(*a_, 8);
  EXPECT_THAT(told_, ElementsAre("a 7"));
}

TEST_F(SizeListener, IsNotToldByAnInvalidManager) {
  build(kLarge);
  listen();
  manager_->invalidate();
  a_->reportSize(7);
  EXPECT_THAT(told_, IsEmpty());
}

TEST_F(SizeListener, StaysWhenTheHandleIsGone) {
  build(kLarge);
  listen();
  manager_ = nullptr;
  a_->reportSize(7);
  EXPECT_THAT(told_, ElementsAre("a 7"));
}

TEST_F(SizeListener, IsReplacedWhileStoresReport) {
  build(kLarge);
  std::atomic<int> calls{0};
  std::vector<std::thread> threads;
  for (const auto& store : {a_, b_}) {
    threads.emplace_back([store] {
      for (unsigned int size = 0; size < 1000; ++size) store->reportSize(size);
    });
  }
  for (int i = 0; i < 100; ++i) {
    setListener([&](const string&, std::uint32_t) { ++calls; });
    manager_->setSizeListener(nullptr);
  }
  for (std::thread& thread : threads) thread.join();
  const int before = calls;
  a_->reportSize(1);
  EXPECT_EQ(calls, before);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
