#include "LazyDispatcher.h"

#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::kSecond;
using test::ManualExecutor;
using test::ManualQueueFactory;

// A host whose timers run although their handle is gone, as one that lost the race against the cancellation.
class LateTimerExecutor : public AsyncExecutor {
 public:
  std::function<void()> timerTask;

  void dispatch(std::function<void()> /*task*/) override { throw std::logic_error("not expected"); }
  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t /*delayNanoseconds*/, std::function<void()> task,
                                            std::function<void()> /*companion*/) override {
    timerTask = std::move(task);
    return std::make_unique<AsyncTimer>();
  }
  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t /*delayNanoseconds*/, std::function<void()> /*task*/,
                                            std::function<void()> /*companion*/) override {
    throw std::logic_error("not expected");
  }
};

class OneQueueFactory : public TaskQueueFactory {
 public:
  explicit OneQueueFactory(std::shared_ptr<AsyncExecutor> queue) : queue_(std::move(queue)) {}
  std::shared_ptr<AsyncExecutor> createQueue() override { return queue_; }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return queue_; }

 private:
  std::shared_ptr<AsyncExecutor> queue_;
};

class LazyDispatcherTest : public testing::Test {
 protected:
  // A released task holds its own queue: what a test leaves unrun would keep both.
  void TearDown() override {
    if (queue_ != nullptr) queue_->dropAll();
    otherQueue_->dropAll();
  }

  void createDispatcher(long delaySeconds = 10) {
    dispatcher_ = LazyDispatcher::createLazyDispatcher(factory_, delaySeconds);
  }

  std::shared_ptr<ManualExecutor> timerQueue() const { return factory_->workQueue(0); }

  // A task that notes that it ran.
  std::function<void()> task(const string& name) {
    return [this, name] { ran_.push_back(name); };
  }

  std::shared_ptr<ManualQueueFactory> factory_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<ManualExecutor> queue_ = std::make_shared<ManualExecutor>();
  std::shared_ptr<ManualExecutor> otherQueue_ = std::make_shared<ManualExecutor>();
  std::shared_ptr<LazyDispatcher> dispatcher_;
  std::vector<string> ran_;
};

TEST_F(LazyDispatcherTest, CreatingArmsOneTimerOnAWorkQueueOfItsOwn) {
  createDispatcher(5);
  EXPECT_EQ(factory_->queueCount(), 0U);
  ASSERT_EQ(factory_->workQueueCount(), 1U);
  ASSERT_EQ(timerQueue()->timers().size(), 1U);
  const test::TimerInfo timer = timerQueue()->timers()[0];
  EXPECT_EQ(timer.delayNanoseconds, 5 * kSecond);
  EXPECT_FALSE(timer.viaSchedule);
  EXPECT_FALSE(timer.cancelled);
  EXPECT_EQ(timerQueue()->companions(), 0U);
  EXPECT_EQ(timerQueue()->pending(), 0U);
}

TEST_F(LazyDispatcherTest, TheConstructorAloneTakesAQueueAndArmsNothing) {
  const LazyDispatcher dispatcher(factory_);
  ASSERT_EQ(factory_->workQueueCount(), 1U);
  EXPECT_TRUE(timerQueue()->timers().empty());
}

TEST_F(LazyDispatcherTest, DelaysAreCountedInSixtyFourBits) {
  createDispatcher(604800);
  EXPECT_EQ(timerQueue()->armedDelays(), std::vector<std::int64_t>{604800 * kSecond});
}

TEST_F(LazyDispatcherTest, ANegativeOrHugeDelayIsDefined) {
  createDispatcher(-1);
  dispatcher_->scheduleDispatch(std::numeric_limits<long>::max());
  ASSERT_EQ(timerQueue()->timers().size(), 2U);
  EXPECT_EQ(timerQueue()->timers()[0].delayNanoseconds, -kSecond);
}

TEST_F(LazyDispatcherTest, WithADelayOfZeroTheTasksWaitForTheTimerAllTheSame) {
  createDispatcher(0);
  dispatcher_->addTask(task("a"), queue_);
  EXPECT_EQ(timerQueue()->armedDelays(), std::vector<std::int64_t>{0});
  EXPECT_EQ(queue_->pending(), 0U);
  ASSERT_TRUE(timerQueue()->fireTimer(0));
  EXPECT_EQ(queue_->pending(), 1U);
}

TEST_F(LazyDispatcherTest, NothingReachesAnExecutorBeforeTheMomentAndEverythingAtOnceAfterIt) {
  createDispatcher();
  dispatcher_->addTask(task("early"), queue_);
  EXPECT_EQ(queue_->pending(), 0U);
  dispatcher_->dispatchNow();
  EXPECT_EQ(queue_->pending(), 1U);
  dispatcher_->addTask(task("late"), queue_);
  EXPECT_EQ(queue_->pending(), 2U);
  EXPECT_TRUE(ran_.empty());
  queue_->runAll();
  EXPECT_EQ(ran_, (std::vector<string>{"early", "late"}));
}

TEST_F(LazyDispatcherTest, TheTimerReleasesTheTasksAndLetsLaterOnesThrough) {
  createDispatcher(3);
  dispatcher_->addTask(task("a"), queue_);
  ASSERT_TRUE(timerQueue()->fireTimer(3 * kSecond));
  dispatcher_->addTask(task("b"), queue_);
  queue_->runAll();
  EXPECT_EQ(ran_, (std::vector<string>{"a", "b"}));
}

TEST_F(LazyDispatcherTest, EachTaskGoesSinglyToItsExecutorInTheOrderOfAdding) {
  createDispatcher();
  dispatcher_->addTask(task("a1"), queue_);
  dispatcher_->addTask(task("b1"), otherQueue_);
  dispatcher_->addTask(task("a2"), queue_);
  dispatcher_->addTask(task("b2"), otherQueue_);
  std::vector<string> dispatches;
  queue_->onDispatch = [&] { dispatches.emplace_back("a"); };
  otherQueue_->onDispatch = [&] { dispatches.emplace_back("b"); };
  dispatcher_->dispatchNow();
  EXPECT_EQ(dispatches, (std::vector<string>{"a", "b", "a", "b"}));
  EXPECT_EQ(queue_->pending(), 2U);
  EXPECT_EQ(otherQueue_->pending(), 2U);
  otherQueue_->runAll();
  queue_->runAll();
  EXPECT_EQ(ran_, (std::vector<string>{"b1", "b2", "a1", "a2"}));
}

TEST_F(LazyDispatcherTest, DispatchingTwiceRunsEachTaskOnce) {
  createDispatcher();
  dispatcher_->addTask(task("a"), queue_);
  dispatcher_->dispatchNow();
  dispatcher_->dispatchNow();
  EXPECT_EQ(queue_->runAll(), 1U);
}

TEST_F(LazyDispatcherTest, TheTimerStaysArmedAfterADispatchAndFindsNothing) {
  createDispatcher(7);
  dispatcher_->addTask(task("a"), queue_);
  dispatcher_->dispatchNow();
  ASSERT_TRUE(timerQueue()->fireTimer(7 * kSecond));
  EXPECT_EQ(queue_->runAll(), 1U);
}

TEST_F(LazyDispatcherTest, TheSameTaskAddedTwiceRunsTwice) {
  createDispatcher();
  const auto twice = task("a");
  dispatcher_->addTask(twice, queue_);
  dispatcher_->addTask(twice, queue_);
  dispatcher_->dispatchNow();
  queue_->runAll();
  EXPECT_EQ(ran_, (std::vector<string>{"a", "a"}));
}

TEST_F(LazyDispatcherTest, ANullExecutorIsRefusedInBothStatesAndChangesNothing) {
  createDispatcher();
  const auto addWithoutExecutor = [this] {
    try {
      dispatcher_->addTask(task("never"), nullptr);
    } catch (const std::invalid_argument& error) {
      return string(error.what());
    }
    return string();
  };
  EXPECT_EQ(addWithoutExecutor(), "Dispatch queue can not be null.");
  dispatcher_->addTask(task("a"), queue_);
  dispatcher_->dispatchNow();
  EXPECT_EQ(addWithoutExecutor(), "Dispatch queue can not be null.");
  queue_->runAll();
  EXPECT_EQ(ran_, std::vector<string>{"a"});
}

TEST_F(LazyDispatcherTest, WillBeTriggeredExternallyCancelsTheTimerAndKeepsCollecting) {
  createDispatcher(4);
  dispatcher_->addTask(task("a"), queue_);
  dispatcher_->willBeTriggeredExternally();
  EXPECT_TRUE(timerQueue()->timers()[0].cancelled);
  EXPECT_FALSE(timerQueue()->fireTimer(4 * kSecond));
  dispatcher_->addTask(task("b"), queue_);
  EXPECT_EQ(queue_->pending(), 0U);
  dispatcher_->dispatchNow();
  queue_->runAll();
  EXPECT_EQ(ran_, (std::vector<string>{"a", "b"}));
}

TEST_F(LazyDispatcherTest, SchedulingAgainReplacesAndCancelsTheEarlierTimer) {
  createDispatcher(4);
  dispatcher_->scheduleDispatch(8);
  EXPECT_TRUE(timerQueue()->timers()[0].cancelled);
  EXPECT_EQ(timerQueue()->armedDelays(), std::vector<std::int64_t>{8 * kSecond});
  dispatcher_->addTask(task("a"), queue_);
  EXPECT_FALSE(timerQueue()->fireTimer(4 * kSecond));
  EXPECT_TRUE(timerQueue()->fireTimer(8 * kSecond));
  EXPECT_EQ(queue_->pending(), 1U);
  EXPECT_EQ(factory_->workQueueCount(), 1U);
}

TEST_F(LazyDispatcherTest, SchedulingAfterWillBeTriggeredExternallyArmsAgain) {
  createDispatcher(4);
  dispatcher_->willBeTriggeredExternally();
  dispatcher_->scheduleDispatch(2);
  dispatcher_->addTask(task("a"), queue_);
  EXPECT_TRUE(timerQueue()->fireTimer(2 * kSecond));
  EXPECT_EQ(queue_->pending(), 1U);
}

TEST_F(LazyDispatcherTest, TheTimersTaskMayScheduleAnew) {
  createDispatcher(1);
  queue_->onDispatch = [this] { dispatcher_->scheduleDispatch(2); };  // as a task would on an executor that hurries
  dispatcher_->addTask(task("a"), queue_);
  EXPECT_TRUE(timerQueue()->fireTimer(kSecond));
  EXPECT_EQ(timerQueue()->armedDelays(), std::vector<std::int64_t>{2 * kSecond});
}

// Lifetimes

TEST_F(LazyDispatcherTest, APendingTimerDoesNotKeepTheDispatcherAlive) {
  createDispatcher();
  const std::weak_ptr<LazyDispatcher> kept = dispatcher_;
  dispatcher_.reset();
  EXPECT_TRUE(kept.expired());
  EXPECT_TRUE(timerQueue()->timers()[0].cancelled);
}

TEST_F(LazyDispatcherTest, DestroyingTheDispatcherDropsItsTasksUnrun) {
  createDispatcher();
  auto token = std::make_shared<int>(0);
  const std::weak_ptr<int> kept = token;
  dispatcher_->addTask([token = std::move(token)] { FAIL(); }, queue_);
  EXPECT_FALSE(kept.expired());
  dispatcher_.reset();
  EXPECT_TRUE(kept.expired());
  EXPECT_EQ(queue_->pending(), 0U);
}

TEST_F(LazyDispatcherTest, ATimerThatFiresAfterTheDispatcherIsGoneDoesNothing) {
  const auto lateQueue = std::make_shared<LateTimerExecutor>();
  auto dispatcher = LazyDispatcher::createLazyDispatcher(std::make_shared<OneQueueFactory>(lateQueue), 1);
  dispatcher->addTask(task("never"), queue_);
  dispatcher.reset();
  ASSERT_TRUE(lateQueue->timerTask);
  lateQueue->timerTask();
  EXPECT_EQ(queue_->pending(), 0U);
}

TEST_F(LazyDispatcherTest, AReleasedTaskKeepsItsExecutorAliveUntilItHasRun) {
  createDispatcher();
  const std::weak_ptr<ManualExecutor> kept = queue_;
  dispatcher_->addTask(task("a"), std::exchange(queue_, nullptr));
  dispatcher_->dispatchNow();
  dispatcher_.reset();
  ASSERT_FALSE(kept.expired());
  EXPECT_TRUE(kept.lock()->runNext());
  EXPECT_EQ(ran_, std::vector<string>{"a"});
  EXPECT_TRUE(kept.expired());
}

TEST_F(LazyDispatcherTest, ATaskThatWasForwardedAtOnceLeavesItsExecutorToItsOwners) {
  createDispatcher();
  dispatcher_->dispatchNow();
  const std::weak_ptr<ManualExecutor> kept = queue_;
  dispatcher_->addTask(task("a"), queue_);
  queue_.reset();
  EXPECT_TRUE(kept.expired());
}

TEST_F(LazyDispatcherTest, AReleasedTaskOutlivesTheDispatcher) {
  createDispatcher();
  dispatcher_->addTask(task("a"), queue_);
  dispatcher_->dispatchNow();
  dispatcher_.reset();
  queue_->runAll();
  EXPECT_EQ(ran_, std::vector<string>{"a"});
}

// Failures of the host's queues

TEST_F(LazyDispatcherTest, WhatDispatchThrowsReachesTheCallerOfAddTaskAndReleasesTheLock) {
  createDispatcher();
  dispatcher_->dispatchNow();
  queue_->throwOnDispatch(true);
  EXPECT_THROW(dispatcher_->addTask(task("a"), queue_), std::runtime_error);
  dispatcher_->addTask(task("b"), otherQueue_);
  EXPECT_EQ(otherQueue_->pending(), 1U);
}

TEST_F(LazyDispatcherTest, WhatDispatchThrowsReachesTheCallerOfDispatchNowAndTheTasksAfterItAreLost) {
  createDispatcher();
  auto token = std::make_shared<int>(0);
  const std::weak_ptr<int> lost = token;
  dispatcher_->addTask(task("a"), otherQueue_);
  dispatcher_->addTask(task("refused"), queue_);
  dispatcher_->addTask([token = std::move(token)] {}, otherQueue_);
  queue_->throwOnDispatch(true);
  EXPECT_THROW(dispatcher_->dispatchNow(), std::runtime_error);
  EXPECT_TRUE(lost.expired());
  EXPECT_EQ(otherQueue_->pending(), 1U);

  queue_->throwOnDispatch(false);
  dispatcher_->dispatchNow();
  EXPECT_EQ(queue_->pending(), 0U);
  dispatcher_->addTask(task("b"), queue_);  // the moment has passed nevertheless
  EXPECT_EQ(queue_->pending(), 1U);
}

// Locks and threads

TEST_F(LazyDispatcherTest, DispatchNowHandsTasksOverWithoutTheLock) {
  createDispatcher();
  dispatcher_->addTask(task("a"), queue_);
  queue_->onDispatch = [this] {
    queue_->onDispatch = nullptr;
    dispatcher_->addTask(task("b"), otherQueue_);
    dispatcher_->willBeTriggeredExternally();
    dispatcher_->dispatchNow();
  };
  dispatcher_->dispatchNow();
  EXPECT_EQ(queue_->pending(), 1U);
  EXPECT_EQ(otherQueue_->pending(), 1U);
}

TEST_F(LazyDispatcherTest, AddTaskForwardsUnderTheLock) {
  createDispatcher();
  dispatcher_->dispatchNow();
  std::atomic<bool> forwarded{false};
  std::atomic<bool> overtaken{false};
  test::Latch otherStarted(1);
  std::thread other;
  otherQueue_->onDispatch = [&] { overtaken = !forwarded; };
  queue_->onDispatch = [&] {
    other = std::thread([&] {
      otherStarted.countDown();
      dispatcher_->addTask(task("b"), otherQueue_);
    });
    otherStarted.wait();
    for (int i = 0; i < 2000; ++i) std::this_thread::yield();
    forwarded = true;
  };
  dispatcher_->addTask(task("a"), queue_);
  other.join();
  EXPECT_EQ(otherQueue_->pending(), 1U);
  EXPECT_FALSE(overtaken);
}

TEST_F(LazyDispatcherTest, ATaskAddedWhileTheMomentComesIsNeverLostAndNeverRunTwice) {
  constexpr std::size_t kAdders = 3;
  constexpr std::size_t kTasks = 40;
  for (int round = 0; round < 60; ++round) {
    const auto dispatcher = LazyDispatcher::createLazyDispatcher(factory_, 1);
    std::vector<std::shared_ptr<ManualExecutor>> queues;
    for (std::size_t i = 0; i < kAdders; ++i) queues.push_back(std::make_shared<ManualExecutor>());
    std::vector<std::atomic<int>> runs(kAdders * kTasks);
    test::runOnThreads(kAdders + 2, [&](std::size_t thread) {
      if (thread >= kAdders) return dispatcher->dispatchNow();
      for (std::size_t i = 0; i < kTasks; ++i) {
        dispatcher->addTask([&runs, index = thread * kTasks + i] { ++runs[index]; }, queues[thread]);
      }
    });
    for (const auto& queue : queues) EXPECT_EQ(queue->runAll(), kTasks);
    for (const auto& count : runs) ASSERT_EQ(count, 1);
  }
}

TEST_F(LazyDispatcherTest, TheTimerMayFireWhileTheHostTakesOver) {
  for (int round = 0; round < 100; ++round) {
    const auto factory = std::make_shared<ManualQueueFactory>();
    const auto dispatcher = LazyDispatcher::createLazyDispatcher(factory, 1);
    const auto queue = std::make_shared<ManualExecutor>();
    test::runOnThreads(3, [&](std::size_t thread) {
      if (thread == 0) factory->workQueue(0)->fireTimer(kSecond);
      if (thread == 1) {
        dispatcher->willBeTriggeredExternally();
        dispatcher->dispatchNow();
      }
      if (thread == 2) dispatcher->addTask([] {}, queue);
    });
    ASSERT_EQ(queue->runAll(), 1U);
  }
}

TEST_F(LazyDispatcherTest, TheDispatcherMayGoWhileItsTimerFires) {
  for (int round = 0; round < 100; ++round) {
    const auto factory = std::make_shared<ManualQueueFactory>();
    auto dispatcher = LazyDispatcher::createLazyDispatcher(factory, 1);
    const auto queue = std::make_shared<ManualExecutor>();
    dispatcher->addTask([] {}, queue);
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) {
        factory->workQueue(0)->fireTimer(kSecond);
      } else {
        dispatcher.reset();
      }
    });
    ASSERT_LE(queue->runAll(), 1U);
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
