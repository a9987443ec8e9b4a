#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;
using testing::ElementsAre;

TEST(ManualExecutor, RunsNothingUntilItIsTold) {
  ManualExecutor queue;
  int ran = 0;
  queue.dispatch([&] { ++ran; });
  EXPECT_EQ(ran, 0);
  EXPECT_EQ(queue.pending(), 1U);
  EXPECT_TRUE(queue.runNext());
  EXPECT_EQ(ran, 1);
  EXPECT_FALSE(queue.runNext());
}

TEST(ManualExecutor, RunsTasksInOrderAndThoseAddedMeanwhileToo) {
  ManualExecutor queue;
  std::vector<int> order;
  queue.dispatch([&] {
    order.push_back(1);
    queue.dispatch([&] { order.push_back(3); });
  });
  queue.dispatch([&] { order.push_back(2); });
  EXPECT_EQ(queue.runAll(), 3U);
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
}

TEST(ManualExecutor, DestroysATaskOnceItHasRun) {
  ManualExecutor queue;
  auto held = std::make_shared<int>(0);
  queue.dispatch([held] { ++*held; });
  queue.runNext();
  EXPECT_EQ(*held, 1);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(ManualExecutor, DropsTasksUnrun) {
  ManualExecutor queue;
  auto held = std::make_shared<int>(0);
  queue.dispatch([held] { ++*held; });
  queue.dropAll();
  EXPECT_EQ(queue.pending(), 0U);
  EXPECT_EQ(*held, 0);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(ManualExecutor, ATaskMayDispatchWhileItIsDropped) {
  ManualExecutor queue;
  std::shared_ptr<int> dispatching(new int(0), [&](const int* value) {
    queue.dispatch([] {});
    delete value;
  });
  queue.dispatch([held = std::move(dispatching)] {});
  queue.dropAll();
  EXPECT_EQ(queue.pending(), 1U);
}

TEST(ManualExecutor, AnExceptionReachesTheRunnerAndTheTaskIsGone) {
  ManualExecutor queue;
  queue.dispatch([] { throw std::domain_error("task"); });
  EXPECT_THROW(queue.runNext(), std::domain_error);
  EXPECT_EQ(queue.pending(), 0U);
  queue.dispatch([] {});
  EXPECT_TRUE(queue.runNext());
}

TEST(ManualExecutor, TheHookSeesEveryDispatchAndMayRunTheTaskAtOnce) {
  ManualExecutor queue;
  queue.onDispatch = [&] { queue.runAll(); };
  int ran = 0;
  queue.dispatch([&] { queue.dispatch([&] { ++ran; }); });
  EXPECT_EQ(ran, 1);
}

TEST(ManualExecutor, CanRefuseTasks) {
  ManualExecutor queue;
  queue.throwOnDispatch(true);
  EXPECT_THROW(queue.dispatch([] {}), std::runtime_error);
  EXPECT_EQ(queue.pending(), 0U);
  queue.throwOnDispatch(false);
  queue.dispatch([] {});
  EXPECT_EQ(queue.pending(), 1U);
}

TEST(ManualExecutor, RunsOneTaskAtATimeWhoeverRunsIt) {
  ManualExecutor queue;
  int running = 0;
  int most = 0;
  for (int i = 0; i < 200; ++i) {
    queue.dispatch([&] {  // plain integers: the queue itself keeps the tasks apart
      most = std::max(most, ++running);
      --running;
    });
  }
  std::atomic<std::size_t> ran{0};
  runOnThreads(4, [&] { ran += queue.runAll(); });
  EXPECT_EQ(ran, 200U);
  EXPECT_EQ(most, 1);
}

TEST(ManualExecutor, ATaskMayLetGoOfTheLastReferenceToItsQueue) {
  auto queue = std::make_shared<ManualExecutor>();
  ManualExecutor* const raw = queue.get();
  raw->dispatch([held = std::move(queue)] {});
  EXPECT_TRUE(raw->runNext());
}

TEST(ManualExecutor, ATimerFiresWhenItsDelayIsNamed) {
  ManualExecutor queue;
  int fired = 0;
  const auto timer = queue.dispatchAfter(
      5 * kSecond, [&] { ++fired; }, nullptr);
  EXPECT_EQ(queue.runAll(), 0U);
  EXPECT_FALSE(queue.fireTimer(4 * kSecond));
  EXPECT_THAT(queue.armedDelays(), ElementsAre(5 * kSecond));
  EXPECT_TRUE(queue.fireTimer(5 * kSecond));
  EXPECT_EQ(fired, 1);
  EXPECT_FALSE(queue.fireTimer(5 * kSecond));
  EXPECT_TRUE(queue.armedDelays().empty());
}

TEST(ManualExecutor, DestroyingTheHandleCancelsTheTimerAndFreesItsTask) {
  ManualExecutor queue;
  auto held = std::make_shared<int>(0);
  auto timer = queue.scheduleAfter(
      kSecond, [held] { ++*held; }, nullptr);
  timer.reset();
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_FALSE(queue.fireTimer(kSecond));
  ASSERT_EQ(queue.timers().size(), 1U);
  EXPECT_TRUE(queue.timers()[0].cancelled);
  EXPECT_FALSE(queue.timers()[0].fired);
}

TEST(ManualExecutor, AFiredTimerDoesNotCountAsCancelled) {
  ManualExecutor queue;
  std::unique_ptr<AsyncTimer> timer;
  timer = queue.dispatchAfter(
      kSecond, [&] { timer.reset(); }, nullptr);
  EXPECT_TRUE(queue.fireTimer(kSecond));
  EXPECT_EQ(timer, nullptr);
  EXPECT_TRUE(queue.timers()[0].fired);
  EXPECT_FALSE(queue.timers()[0].cancelled);
}

TEST(ManualExecutor, RemembersHowEachTimerWasArmed) {
  ManualExecutor queue;
  const auto first = queue.dispatchAfter(
      kSecond, [] {}, nullptr);
  const auto second = queue.scheduleAfter(
      2 * kSecond, [] {}, [] {});
  ASSERT_EQ(queue.timers().size(), 2U);
  EXPECT_FALSE(queue.timers()[0].viaSchedule);
  EXPECT_TRUE(queue.timers()[1].viaSchedule);
  EXPECT_EQ(queue.timers()[1].delayNanoseconds, 2 * kSecond);
  EXPECT_EQ(queue.companions(), 1U);
}

TEST(ManualExecutor, OfTwoTimersOfOneDelayTheOlderFiresFirst) {
  ManualExecutor queue;
  std::vector<int> order;
  const auto first = queue.dispatchAfter(
      kSecond, [&] { order.push_back(1); }, nullptr);
  const auto second = queue.dispatchAfter(
      kSecond, [&] { order.push_back(2); }, nullptr);
  EXPECT_TRUE(queue.fireTimer(kSecond));
  EXPECT_TRUE(queue.fireTimer(kSecond));
  EXPECT_THAT(order, ElementsAre(1, 2));
}

TEST(ManualExecutor, AHandleMayOutliveTheQueue) {
  auto held = std::make_shared<int>(0);
  std::unique_ptr<AsyncTimer> timer;
  {
    ManualExecutor queue;
    timer = queue.dispatchAfter(
        kSecond, [held] {}, nullptr);
  }
  EXPECT_EQ(held.use_count(), 1);
  timer.reset();
}

// ManualQueueFactory

TEST(ManualQueueFactory, KeepsItsQueuesInTheOrderOfTheirCreation) {
  ManualQueueFactory factory;
  const auto queue = factory.createQueue();
  const auto firstWork = factory.createWorkQueue();
  const auto secondWork = factory.createWorkQueue();
  EXPECT_EQ(factory.queueCount(), 1U);
  EXPECT_EQ(factory.workQueueCount(), 2U);
  EXPECT_EQ(factory.queue(0), queue);
  EXPECT_EQ(factory.workQueue(0), firstWork);
  EXPECT_EQ(factory.workQueue(1), secondWork);
  EXPECT_THROW(factory.queue(1), std::out_of_range);
}

TEST(ManualQueueFactory, RunsAllItsQueuesInTurnUntilTheyAreEmpty) {
  ManualQueueFactory factory;
  const auto queue = factory.createQueue();
  const auto work = factory.createWorkQueue();
  std::vector<string> order;
  queue->dispatch([&] {
    order.emplace_back("queue 1");
    factory.createWorkQueue()->dispatch([&] { order.emplace_back("new"); });
  });
  queue->dispatch([&] { order.emplace_back("queue 2"); });
  work->dispatch([&] { order.emplace_back("work 1"); });
  EXPECT_EQ(factory.runAll(), 4U);
  EXPECT_THAT(order, ElementsAre("queue 1", "work 1", "queue 2", "new"));
  EXPECT_EQ(factory.runAll(), 0U);
}

TEST(ManualQueueFactory, ATaskThatHoldsItsOwnQueueIsFreedWithTheFactory) {
  auto held = std::make_shared<int>(0);
  {
    ManualQueueFactory factory;
    const auto queue = factory.createQueue();
    queue->dispatch([queue, held] {});
  }
  EXPECT_EQ(held.use_count(), 1);
}

// Latch, runOnThreads

TEST(Latch, OpensWhenItIsCountedDown) {
  Latch latch(2);
  latch.countDown();
  EXPECT_FALSE(latch.isOpen());
  latch.countDown();
  EXPECT_TRUE(latch.isOpen());
  latch.countDown();
  latch.wait();
  EXPECT_TRUE(latch.isOpen());
}

TEST(Latch, HoldsThreadsBackUntilItOpens) {
  Latch latch(1);
  std::atomic<bool> passed{false};
  std::thread thread([&] {
    latch.wait();
    passed = true;
  });
  EXPECT_FALSE(passed);
  latch.countDown();
  thread.join();
  EXPECT_TRUE(passed);
}

TEST(RunOnThreads, GivesEachThreadItsNumberAndHasThemAllAtOnce) {
  Latch together(3);  // opens only when all three are running
  std::vector<int> seen(3);
  runOnThreads(3, [&](std::size_t i) {
    together.arriveAndWait();
    seen[i] = static_cast<int>(i) + 1;
  });
  EXPECT_THAT(seen, ElementsAre(1, 2, 3));
}

TEST(RunOnThreads, ThrowsWhatAThreadThrew) {
  std::atomic<int> ran{0};
  EXPECT_THROW(runOnThreads(2,
                            [&] {
                              ++ran;
                              throw std::domain_error("thread");
                            }),
               std::domain_error);
  EXPECT_EQ(ran, 2);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
