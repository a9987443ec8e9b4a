#include "host/testing/CheckedQueues.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Future.h"
#include "host/Await.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::MatchesRegex;

constexpr std::int64_t kHour = 3'600'000'000'000;
constexpr std::chrono::hours kLongPatience(1);

// A queue without any rules: it keeps what it is given, in the order of the calls, and the test runs or drops each as
// it likes.
struct LawlessQueue : AsyncExecutor {
  void dispatch(std::function<void()> task) override {
    given.push_back(std::move(task));
    if (onDispatch) onDispatch();
  }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t /*delayNanoseconds*/, std::function<void()> task,
                                            std::function<void()> /*companion*/) override {
    dispatch(std::move(task));
    return std::make_unique<AsyncTimer>();
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> companion) override {
    return dispatchAfter(delayNanoseconds, std::move(task), std::move(companion));
  }

  void run(std::size_t i) { std::function<void()>(given.at(i))(); }
  void drop(std::size_t i) { given.at(i) = nullptr; }

  std::vector<std::function<void()>> given;
  std::function<void()> onDispatch;
};

struct LawlessFactory : TaskQueueFactory {
  std::shared_ptr<AsyncExecutor> createQueue() override {
    queues.push_back(std::make_shared<LawlessQueue>());
    return queues.back();
  }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return createQueue(); }

  std::vector<std::shared_ptr<LawlessQueue>> queues;
};

class CheckedQueuesTest : public testing::Test {
 protected:
  explicit CheckedQueuesTest(CheckedQueuesOptions options = {}) : checked(factory, std::move(options)) {}

  std::unique_ptr<AsyncTimer> arm(std::int64_t delay) {
    return queue->dispatchAfter(
        delay, [] {}, nullptr);
  }

  // Runs the i-th of what the queue was given on a thread of its own.
  void runBeside(std::size_t i) {
    std::thread([&] { raw->run(i); }).join();
  }

  std::shared_ptr<LawlessFactory> factory = std::make_shared<LawlessFactory>();
  CheckedQueues checked;
  std::shared_ptr<AsyncExecutor> queue = checked.createQueue();
  std::shared_ptr<LawlessQueue> raw = factory->queues.at(0);
};

class CheckedInlineQueuesTest : public CheckedQueuesTest {
 protected:
  CheckedInlineQueuesTest() : CheckedQueuesTest(withInline()) {}

 private:
  static CheckedQueuesOptions withInline() {
    CheckedQueuesOptions options;
    options.allowInline = true;
    return options;
  }
};

// One at a time

TEST_F(CheckedQueuesTest, TasksThatFollowEachOtherAreInOrder) {
  int ran = 0;
  for (int i = 0; i < 3; ++i) queue->dispatch([&] { ++ran; });
  for (std::size_t i = 0; i < 3; ++i) raw->run(i);
  EXPECT_EQ(ran, 3);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, ATaskThatBeginsOnAnotherThreadBeforeTheLastOneHasEndedIsReported) {
  queue->dispatch([&] { runBeside(1); });
  queue->dispatch([] {});
  raw->run(0);
  EXPECT_THAT(checked.violations(),
              ElementsAre("File queue 1: task 2 began before task 1 had ended, on another thread. "
                          "Tasks of a queue run one at a time."));
}

TEST_F(CheckedQueuesTest, ATaskThatBeginsInAnotherOneIsReported) {
  queue->dispatch([&] { raw->run(1); });
  queue->dispatch([] {});
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre("File queue 1: task 2 began before task 1 had ended, on the same "
                                                "thread. Tasks of a queue run one at a time."));
}

TEST_F(CheckedQueuesTest, ATimerThatFiresWhileATaskRunsIsReported) {
  const auto timer = arm(0);
  queue->dispatch([&] { runBeside(0); });
  raw->run(1);
  EXPECT_THAT(checked.violations(), ElementsAre("File queue 1: timer 1 began before task 1 had ended, on another "
                                                "thread. Tasks of a queue run one at a time."));
}

TEST_F(CheckedQueuesTest, QueuesMayRunBesideEachOther) {
  const auto other = checked.createQueue();
  queue->dispatch([&] { std::thread([&] { factory->queues.at(1)->run(0); }).join(); });
  other->dispatch([] {});
  raw->run(0);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, ATaskHasEndedWhenAnExceptionLeavesIt) {
  queue->dispatch([] { throw std::runtime_error("no luck"); });
  queue->dispatch([] {});
  EXPECT_THROW(raw->run(0), std::runtime_error);
  raw->run(1);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

// In order

TEST_F(CheckedQueuesTest, ATaskThatOvertakesAnotherOneIsReportedOnce) {
  for (int i = 0; i < 2; ++i) queue->dispatch([] {});
  raw->run(1);
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre("File queue 1: task 2 began before task 1, dispatched earlier. Tasks "
                                                "of a queue run in the order of dispatch."));
}

TEST_F(CheckedQueuesTest, ATaskThatOvertakesManyIsOneViolation) {
  for (int i = 0; i < 4; ++i) queue->dispatch([] {});
  for (const std::size_t i : {3U, 2U, 1U, 0U}) raw->run(i);
  EXPECT_THAT(checked.violations(), ElementsAre("File queue 1: task 4 began before task 1 and 2 more, dispatched "
                                                "earlier. Tasks of a queue run in the order of dispatch."));
}

TEST_F(CheckedQueuesTest, ATaskMayOvertakeOneThatIsStillBeingDispatched) {
  raw->onDispatch = [&] {
    raw->onDispatch = nullptr;
    queue->dispatch([] {});
    raw->run(1);
  };
  queue->dispatch([] {});
  raw->run(0);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, TasksThatAreDroppedAreInOrder) {
  for (int i = 0; i < 3; ++i) queue->dispatch([] {});
  raw->drop(0);
  raw->run(1);
  raw->drop(2);
  raw->onDispatch = [&] { raw->drop(3); };
  queue->dispatch([] {});
  raw->onDispatch = nullptr;
  queue->dispatch([] {});
  raw->run(4);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, TimersAndTasksHaveNoOrder) {
  queue->dispatch([] {});
  const auto timer = arm(0);
  const auto later = queue->scheduleAfter(
      0, [] {}, nullptr);
  for (const std::size_t i : {2U, 1U, 0U}) raw->run(i);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

// Later, and once

TEST_F(CheckedQueuesTest, ATaskThatRunsInsideDispatchIsReported) {
  raw->onDispatch = [&] { raw->run(raw->given.size() - 1); };
  queue->dispatch([] {});
  EXPECT_THAT(checked.violations(),
              ElementsAre("File queue 1: task 1 ran inside dispatch, on the thread that called it. Tasks run later."));
}

TEST_F(CheckedQueuesTest, ATaskThatRunsInsideItsDispatchInAnotherTaskIsReportedForThatAlone) {
  queue->dispatch([&] {
    raw->onDispatch = [&] { raw->run(1); };
    queue->dispatch([] {});
  });
  raw->run(0);
  EXPECT_THAT(checked.violations(),
              ElementsAre("File queue 1: task 2 ran inside dispatch, on the thread that called it. Tasks run later."));
}

TEST_F(CheckedQueuesTest, ATimerThatRunsInsideTheCallThatArmsItIsReported) {
  raw->onDispatch = [&] { raw->run(raw->given.size() - 1); };
  const auto timer = arm(0);
  const auto other = queue->scheduleAfter(
      0, [] {}, nullptr);
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex(".*: timer 1 ran inside dispatchAfter, .*"),
                                                MatchesRegex(".*: timer 2 ran inside scheduleAfter, .*")));
}

TEST_F(CheckedQueuesTest, ATaskMayRunBeforeItsDispatchReturnsOnAnotherThread) {
  raw->onDispatch = [&] { runBeside(0); };
  queue->dispatch([] {});
  raw->onDispatch = nullptr;
  queue->dispatch([] {});
  raw->run(1);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, AnotherTaskMayRunInsideDispatch) {
  queue->dispatch([] {});
  raw->onDispatch = [&] { raw->run(0); };
  queue->dispatch([] {});
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, ATaskThatRunsAgainIsReported) {
  queue->dispatch([] {});
  raw->run(0);
  raw->run(0);
  EXPECT_THAT(checked.violations(),
              ElementsAre("File queue 1: task 1 ran again. What is given to dispatch runs once."));
}

TEST_F(CheckedQueuesTest, ATimerOfDispatchAfterFiresOnceAndOneOfScheduleAfterMayRepeat) {
  const auto once = arm(0);
  const auto often = queue->scheduleAfter(
      0, [] {}, nullptr);
  for (const std::size_t i : {0U, 0U, 1U, 1U}) raw->run(i);
  EXPECT_THAT(checked.violations(),
              ElementsAre("File queue 1: timer 1 ran again. What is given to dispatchAfter runs once."));
}

TEST_F(CheckedInlineQueuesTest, InlineQueuesMayRunTasksInsideDispatchAndInsideEachOther) {
  raw->onDispatch = [&] { raw->run(raw->given.size() - 1); };
  int ran = 0;
  queue->dispatch([&] {
    queue->dispatch([&] { ++ran; });
    const auto timer = queue->dispatchAfter(
        0, [&] { ++ran; }, nullptr);
  });
  EXPECT_EQ(ran, 2);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedInlineQueuesTest, TasksOfInlineQueuesMayNotOverlapEither) {
  queue->dispatch([&] { runBeside(1); });
  queue->dispatch([] {});
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex(".*: task 2 began before task 1 .* another thread.*")));
}

// Timers

TEST_F(CheckedQueuesTest, ATimerThatFiresEarlyIsReported) {
  const auto hour = arm(kHour);
  const auto forever = queue->scheduleAfter(
      std::numeric_limits<std::int64_t>::max(), [] {}, nullptr);
  raw->run(0);
  raw->run(1);
  EXPECT_THAT(
      checked.violations(),
      ElementsAre(MatchesRegex("File queue 1: timer 1 began 3[0-9]{12} ns before it was due. A timer fires after "
                               "its delay."),
                  MatchesRegex("File queue 1: timer 2 began 9[0-9]+ ns before it was due.*")));
}

TEST_F(CheckedQueuesTest, DelaysOfZeroAndLessAreDueAtOnce) {
  for (const std::int64_t delay : {std::int64_t(0), std::int64_t(-1), std::numeric_limits<std::int64_t>::min()}) {
    const auto timer = arm(delay);
    raw->run(raw->given.size() - 1);
  }
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, TheHandleMayGoDuringTheRunAndAfterIt) {
  std::unique_ptr<AsyncTimer> timer;
  timer = queue->dispatchAfter(
      0, [&] { timer.reset(); }, nullptr);
  auto other = arm(0);
  raw->run(0);
  raw->run(1);
  other.reset();
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST_F(CheckedQueuesTest, ATimerThatFiresAfterItsHandleWasDestroyedInATaskIsReported) {
  auto timer = arm(0);
  queue->dispatch([&] { timer.reset(); });
  raw->run(1);
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre("File queue 1: timer 1 began after its handle was destroyed. That "
                                                "cancels what has not begun."));
}

TEST_F(CheckedQueuesTest, ATimerThatFiresAfterItsHandleWasDestroyedBesideATaskIsReported) {
  auto timer = arm(0);
  queue->dispatch([&] { std::thread([&] { timer.reset(); }).join(); });
  raw->run(1);
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex(".*: timer 1 began after its handle was destroyed.*")));
}

TEST_F(CheckedQueuesTest, ATimerThatFiresWithTasksBetweenItAndTheEndOfItsHandleIsReported) {
  auto timer = arm(0);
  queue->dispatch([] {});
  timer.reset();
  raw->run(1);
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex(".*: timer 1 began after its handle was destroyed.*")));
}

TEST_F(CheckedQueuesTest, ARepetitionAfterTheHandleWasDestroyedInTheRunIsReported) {
  std::unique_ptr<AsyncTimer> timer;
  timer = queue->scheduleAfter(
      0, [&] { timer.reset(); }, nullptr);
  raw->run(0);
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex(".*: timer 1 began after its handle was destroyed.*")));
}

TEST_F(CheckedQueuesTest, ATimerOfAnHourWithoutAHandleThatFiresIsReportedTwice) {
  arm(kHour);
  raw->run(0);
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex(".*: timer 1 began .* ns before it was due.*"),
                                                MatchesRegex(".*: timer 1 began after its handle was destroyed.*")));
}

TEST_F(CheckedQueuesTest, ATimerMayBeginAsItsHandleIsBeingDestroyed) {
  auto timer = arm(0);
  queue->dispatch([] {});
  raw->run(1);
  timer.reset();
  raw->run(0);  // it may have been on its way when the handle was destroyed: nobody can tell
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST(CheckedQueues, TimersUnderATestsControlMayFireEarly) {
  const auto manual = std::make_shared<ManualQueueFactory>();
  CheckedQueuesOptions options;
  options.allowEarlyTimers = true;
  CheckedQueues checked(manual, options);
  const auto queue = checked.createWorkQueue();
  int fired = 0;
  auto timer = queue->scheduleAfter(
      kHour, [&] { ++fired; }, nullptr);
  EXPECT_TRUE(manual->workQueue(0)->fireTimer(kHour));
  auto other = queue->dispatchAfter(
      kHour, [&] { ++fired; }, nullptr);
  other.reset();
  EXPECT_FALSE(manual->workQueue(0)->fireTimer(kHour));
  EXPECT_EQ(fired, 1);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

// Waiting

TEST_F(CheckedQueuesTest, AwaitingInATaskIsReportedAndRefused) {
  Promise<void> promise;
  const Future<void> future = promise.getFuture();
  queue->dispatch([&] { host::await(future); });
  EXPECT_THROW(raw->run(0), std::logic_error);
  EXPECT_THAT(checked.violations(),
              ElementsAre("File queue 1: await was called in task 1. Waiting on a queue's own thread may deadlock."));
  promise.setValue();
  host::await(future);  // refused in tasks only, and unchanged by the refusal
  EXPECT_EQ(checked.violations().size(), 1U);
}

TEST(CheckedQueues, AwaitingOnAThreadOfTheKitIsReportedToo) {
  const auto threads = std::make_shared<host::ThreadQueueFactory>();
  CheckedQueues checked(threads);
  const auto queue = checked.createWorkQueue();
  const auto wait = [&] { host::await(dispatchTask<void>(queue, [] {})); };
  EXPECT_THROW(dispatchTask<void>(queue, wait).get(), std::logic_error);
  EXPECT_TRUE(threads->drain(kLongPatience));
  EXPECT_THAT(checked.violations(),
              ElementsAre("Work queue 1: await was called in task 1. Waiting on a queue's own thread may deadlock."));
}

// Passing through

TEST_F(CheckedQueuesTest, ATaskIsDestroyedWhereTheHostDestroysIt) {
  auto sentinel = std::make_shared<int>(0);
  queue->dispatch([sentinel] {});
  const auto timer = queue->dispatchAfter(
      kHour, [sentinel] {}, nullptr);
  EXPECT_EQ(sentinel.use_count(), 3);
  raw->drop(0);
  EXPECT_EQ(sentinel.use_count(), 2);
  raw->drop(1);
  EXPECT_EQ(sentinel.use_count(), 1);
}

TEST(CheckedQueues, WhatTheHostThrowsPassesThrough) {
  const auto manual = std::make_shared<ManualQueueFactory>();
  CheckedQueues checked(manual);
  const auto queue = checked.createQueue();
  manual->queue(0)->throwOnDispatch(true);
  EXPECT_THROW(queue->dispatch([] {}), std::runtime_error);
  manual->queue(0)->throwOnDispatch(false);
  queue->dispatch([] {});
  manual->runAll();
  EXPECT_THAT(checked.violations(), IsEmpty());
}

TEST(CheckedQueues, AFactoryThatReturnsNullIsReported) {
  struct NoQueues : TaskQueueFactory {
    std::shared_ptr<AsyncExecutor> createQueue() override { return nullptr; }
    std::shared_ptr<AsyncExecutor> createWorkQueue() override { return nullptr; }
  };
  CheckedQueues checked(std::make_shared<NoQueues>());
  EXPECT_EQ(checked.createQueue(), nullptr);
  EXPECT_EQ(checked.createWorkQueue(), nullptr);
  EXPECT_THAT(checked.violations(), ElementsAre("File queue 1: the factory returned null. A factory returns a queue.",
                                                "Work queue 1: the factory returned null. A factory returns a queue."));
}

TEST(CheckedQueues, QueuesAndHandlesOutliveTheFactory) {
  const auto factory = std::make_shared<LawlessFactory>();
  std::vector<std::string> heard;
  CheckedQueuesOptions options;
  options.onViolation = [&](const std::string& violation) { heard.push_back(violation); };
  auto checked = std::make_unique<CheckedQueues>(factory, options);
  auto queue = checked->createQueue();
  checked.reset();
  queue->dispatch([] {});
  auto timer = queue->dispatchAfter(
      0, [] {}, nullptr);
  queue.reset();
  for (const std::size_t i : {0U, 0U, 1U}) factory->queues.at(0)->run(i);
  timer.reset();
  EXPECT_THAT(heard, ElementsAre(MatchesRegex(".*: task 1 ran again.*")));
}

// Reporting

TEST(CheckedQueues, QueuesAreNumberedByRole) {
  const auto factory = std::make_shared<LawlessFactory>();
  CheckedQueues checked(factory);
  const std::vector<std::shared_ptr<AsyncExecutor>> queues = {checked.createWorkQueue(), checked.createQueue(),
                                                              checked.createWorkQueue()};
  for (std::size_t i = 0; i < queues.size(); ++i) {
    queues[i]->dispatch([] {});
    for (int times = 0; times < 2; ++times) factory->queues.at(i)->run(0);
  }
  EXPECT_THAT(checked.violations(), ElementsAre(MatchesRegex("Work queue 1: .*"), MatchesRegex("File queue 1: .*"),
                                                MatchesRegex("Work queue 2: .*")));
}

TEST(CheckedQueues, ACallbackHearsEachViolationAtOnceAndMayThrow) {
  const auto factory = std::make_shared<LawlessFactory>();
  int heard = 0;
  CheckedQueuesOptions options;
  options.onViolation = [&](const std::string&) {
    ++heard;
    throw std::runtime_error("no luck");
  };
  CheckedQueues checked(factory, options);
  const auto queue = checked.createQueue();
  int ran = 0;
  queue->dispatch([&] {
    ++ran;
    EXPECT_EQ(heard, ran - 1);
  });
  for (int i = 0; i < 150; ++i) factory->queues.at(0)->run(0);
  EXPECT_EQ(ran, 150);
  EXPECT_EQ(heard, 149);
  EXPECT_EQ(checked.violations().size(), 100U);
}

TEST(CheckedQueues, ManyThreadsMayUseThreadsOfTheKitWithoutAViolation) {
  const auto threads = std::make_shared<host::ThreadQueueFactory>();
  CheckedQueues checked(threads);
  const auto queue = checked.createQueue();
  int ran = 0;  // unguarded: the queue alone keeps it whole
  runOnThreads(4, [&] {
    for (int i = 0; i < 250; ++i) {
      queue->dispatch([&] { ++ran; });
      const auto timer = queue->dispatchAfter(
          i % 2 == 0 ? 0 : kHour, [&] { ++ran; }, nullptr);
    }
    EXPECT_THAT(checked.violations(), IsEmpty());
  });
  threads->shutDown();
  EXPECT_GE(ran, 1000);
  EXPECT_THAT(checked.violations(), IsEmpty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
