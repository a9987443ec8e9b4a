#include "host/ThreadQueueFactory.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <limits>
#include <memory>
#include <mutex>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Future.h"
#include "support/Barrier.h"
#include "support/LogCapture.h"

#if defined(__linux__)
#include <pthread.h>
#include <sched.h>
#endif

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::Latch;
using test::LogCapture;
using test::runOnThreads;

constexpr std::int64_t kMillisecond = 1'000'000;
constexpr std::int64_t kHour = 3'600'000 * kMillisecond;
constexpr std::chrono::hours kLongPatience(1);

// Opens latches when the thread that has them has ended: several, as one thread may serve all queues.
struct ThreadEnd {
  std::vector<std::shared_ptr<Latch>> latches;
  ~ThreadEnd() {
    for (const auto& latch : latches) latch->countDown();
  }
};
thread_local ThreadEnd threadEnd;

// Opens a latch when its last copy is destroyed: put into a task, it tells when the task is gone.
std::shared_ptr<void> countDownWhenGone(Latch& latch) {
  return {static_cast<void*>(&latch), [](void* gone) { static_cast<Latch*>(gone)->countDown(); }};
}

class ThreadQueueFactoryTest : public testing::Test {
 protected:
  // Returns when everything that was dispatched before has run.
  static void finish(AsyncExecutor& queue) {
    Latch done(1);
    queue.dispatch([&] { done.countDown(); });
    done.wait();
  }

  static void finish(const std::shared_ptr<AsyncExecutor>& queue) { finish(*queue); }

  // Keeps the queue busy until the latch opens; returns when the queue has begun to wait.
  static void block(const std::shared_ptr<AsyncExecutor>& queue, std::shared_ptr<Latch> gate) {
    Latch begun(1);
    queue->dispatch([&begun, gate = std::move(gate)] {
      begun.countDown();
      gate->wait();
    });
    begun.wait();
  }

  // Returns when all timers that are due by now have been handed to their queues.
  void handOutDueTimers() {
    Latch handedOut(1);
    const auto queue = factory->createQueue();
    const auto timer = queue->dispatchAfter(
        0, [&] { handedOut.countDown(); }, nullptr);
    handedOut.wait();
  }

  static std::shared_ptr<Latch> watchThreadEnd(AsyncExecutor& queue) {
    auto ended = std::make_shared<Latch>(1);
    queue.dispatch([ended] { threadEnd.latches.push_back(ended); });
    return ended;
  }

  std::unique_ptr<ThreadQueueFactory> factory = std::make_unique<ThreadQueueFactory>();
};

// Queues

TEST_F(ThreadQueueFactoryTest, TasksRunInTheOrderOfDispatch) {
  const auto queue = factory->createQueue();
  std::vector<int> order;
  std::vector<int> expected;
  for (int i = 0; i < 1000; ++i) {
    queue->dispatch([&order, i] { order.push_back(i); });
    expected.push_back(i);
  }
  finish(queue);
  EXPECT_EQ(order, expected);
}

TEST_F(ThreadQueueFactoryTest, TasksOfManyThreadsNeverOverlapAndKeepEachThreadsOrder) {
  const auto queue = factory->createWorkQueue();
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  std::vector<std::vector<int>> order(4);  // unguarded: the queue alone keeps it whole
  runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 250; ++i) {
      queue->dispatch([&, thread, i] {
        if (++running > 1) overlapped = true;
        order[thread].push_back(i);
        --running;
      });
    }
  });
  finish(queue);
  EXPECT_FALSE(overlapped);
  for (const std::vector<int>& ofThread : order) {
    ASSERT_EQ(ofThread.size(), 250U);
    for (std::size_t i = 0; i < ofThread.size(); ++i) EXPECT_EQ(ofThread[i], static_cast<int>(i));
  }
}

TEST_F(ThreadQueueFactoryTest, QueuesRunSideBySide) {
  Latch bothRunning(2);
  const auto first = factory->createQueue();
  const auto second = factory->createWorkQueue();
  first->dispatch([&] { bothRunning.arriveAndWait(); });
  second->dispatch([&] { bothRunning.arriveAndWait(); });
  finish(first);
  finish(second);
  EXPECT_TRUE(bothRunning.isOpen());
}

#if defined(__linux__)
// The names of the threads of this process that are the factory's, less those of other factories of this test.
std::multiset<std::string> threadNames() {
  std::multiset<std::string> names;
  for (const auto& thread : std::filesystem::directory_iterator("/proc/self/task")) {
    std::ifstream file(thread.path() / "comm");
    std::string name;
    if (std::getline(file, name) && name.rfind("cellar-", 0) == 0) names.insert(name);
  }
  return names;
}

std::multiset<std::string> expectedThreadNames() {
  cpu_set_t processors;
  EXPECT_EQ(sched_getaffinity(0, sizeof(processors), &processors), 0);
  std::multiset<std::string> names = {"cellar-timer"};
  for (int number = 1; number <= CPU_COUNT(&processors) + 1; ++number) names.insert("cellar-" + std::to_string(number));
  return names;
}

// Every thread has set its name once each of them runs something at the same time.
void occupyAllThreads(ThreadQueueFactory& factory, const std::function<void()>& meanwhile) {
  const std::size_t count = expectedThreadNames().size() - 1;
  Latch running(count);
  Latch gate(1);
  Latch done(count);
  std::vector<std::shared_ptr<AsyncExecutor>> queues;
  for (std::size_t i = 0; i < count; ++i) {
    queues.push_back(factory.createQueue());
    queues.back()->dispatch([&] {
      running.countDown();
      gate.wait();
      done.countDown();
    });
  }
  running.wait();
  meanwhile();
  gate.countDown();
  done.wait();
}

TEST_F(ThreadQueueFactoryTest, AThousandQueuesShareAFewThreadsWhichAreNumbered) {
  std::vector<std::shared_ptr<AsyncExecutor>> queues;
  std::atomic<int> ran{0};
  for (int i = 0; i < 500; ++i) {
    for (const auto& queue : {factory->createQueue(), factory->createWorkQueue()}) {
      queue->dispatch([&] { ++ran; });
      queues.push_back(queue);
    }
  }
  handOutDueTimers();  // the thread of the timers has its name
  std::multiset<std::string> names;
  occupyAllThreads(*factory, [&] { names = threadNames(); });
  EXPECT_TRUE(factory->drain(kLongPatience));
  EXPECT_EQ(ran, 1000);
  EXPECT_EQ(names, expectedThreadNames());
}

TEST_F(ThreadQueueFactoryTest, OneQueueProceedsThoughAllOthersDispatchToThemselvesForEver) {
  std::atomic<bool> isOver{false};
  std::vector<std::shared_ptr<AsyncExecutor>> busy;
  std::vector<std::function<void()>> again(4 * expectedThreadNames().size());
  Latch allBusy(again.size());
  for (std::function<void()>& task : again) {
    busy.push_back(factory->createQueue());
    task = [&, queue = busy.back().get()] {
      allBusy.countDown();
      if (!isOver) queue->dispatch(task);
    };
    busy.back()->dispatch(task);
  }
  allBusy.wait();
  const auto queue = factory->createWorkQueue();
  for (int i = 0; i < 100; ++i) finish(queue);
  isOver = true;
  EXPECT_TRUE(factory->drain(kLongPatience));
}

TEST_F(ThreadQueueFactoryTest, OneQueueProceedsThoughPairsOfOthersDispatchToEachOtherForEver) {
  std::atomic<bool> isOver{false};
  std::vector<std::shared_ptr<AsyncExecutor>> busy;
  std::vector<std::function<void()>> again(4 * expectedThreadNames().size());
  Latch allBusy(again.size());
  for (std::size_t i = 0; i < again.size(); ++i) busy.push_back(factory->createQueue());
  for (std::size_t i = 0; i < again.size(); ++i) {
    const std::size_t partner = i ^ 1U;
    again[i] = [&, partner] {
      allBusy.countDown();
      if (!isOver) busy[partner]->dispatch(again[partner]);
    };
  }
  for (std::size_t i = 0; i < again.size(); ++i) busy[i]->dispatch(again[i]);
  allBusy.wait();
  const auto queue = factory->createWorkQueue();
  for (int i = 0; i < 100; ++i) finish(queue);
  isOver = true;
  EXPECT_TRUE(factory->drain(kLongPatience));
}

TEST_F(ThreadQueueFactoryTest, ThreadsDoNotTakeTheProcessorFromThoseThatWakeThem) {
  int refusal = 0;
  std::thread([&] {
    const sched_param noPriority{};
    refusal = pthread_setschedparam(pthread_self(), SCHED_BATCH, &noPriority);
  }).join();
  if (refusal != 0) GTEST_SKIP() << "the system lets no thread be a batch thread: error " << refusal;
  int policy = -1;
  const auto queue = factory->createWorkQueue();
  queue->dispatch([&] { policy = sched_getscheduler(0); });
  finish(*queue);
  EXPECT_EQ(policy, SCHED_BATCH);
}
#endif

TEST_F(ThreadQueueFactoryTest, ATaskIsDestroyedBeforeTheNextOneBegins) {
  const auto queue = factory->createQueue();
  Latch gone(1);
  bool goneInTime = false;
  queue->dispatch([sentinel = countDownWhenGone(gone)] {});
  queue->dispatch([&] { goneInTime = gone.isOpen(); });
  finish(queue);
  EXPECT_TRUE(goneInTime);
}

TEST_F(ThreadQueueFactoryTest, ATaskMayDispatchOnItsOwnQueueAndRunsLater) {
  const auto queue = factory->createQueue();
  std::vector<std::string> order;
  Latch done(1);
  queue->dispatch([&] {
    queue->dispatch([&] {
      order.emplace_back("inner");
      done.countDown();
    });
    order.emplace_back("outer");
  });
  done.wait();
  EXPECT_EQ(order, (std::vector<std::string>{"outer", "inner"}));
}

TEST_F(ThreadQueueFactoryTest, ATaskMayCreateQueues) {
  const auto queue = factory->createQueue();
  std::shared_ptr<AsyncExecutor> created;
  queue->dispatch([&] { created = factory->createWorkQueue(); });
  finish(queue);
  ASSERT_NE(created, nullptr);
  finish(created);
}

TEST_F(ThreadQueueFactoryTest, AnExceptionOutOfATaskIsOneLogLineAndTheQueueGoesOn) {
  const LogCapture log;
  const auto queue = factory->createQueue();
  bool ran = false;
  queue->dispatch([] { throw std::runtime_error("no luck"); });
  queue->dispatch([] { throw 7; });
  queue->dispatch([&] { ran = true; });
  finish(queue);
  EXPECT_TRUE(ran);
  EXPECT_EQ(log.messages(), (std::vector<std::string>{"Task failed on queue cellar-file-1: no luck",
                                                      "Task failed on queue cellar-file-1: unknown exception"}));
  EXPECT_EQ(log.errorCount(), 2U);
}

TEST_F(ThreadQueueFactoryTest, AnEmptyTaskIsOneLogLine) {
  const LogCapture log;
  const auto queue = factory->createQueue();
  queue->dispatch(nullptr);
  finish(queue);
  EXPECT_EQ(log.errorCount(), 1U);
}

// Letting go of a queue

TEST_F(ThreadQueueFactoryTest, AQueueThatIsLetGoFinishesItsTasks) {
  auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  std::atomic<int> ran{0};
  Latch done(100);
  for (int i = 0; i < 100; ++i) {
    queue->dispatch([&] {
      ++ran;
      done.countDown();
    });
  }
  queue.reset();
  EXPECT_EQ(ran, 0);
  gate->countDown();
  done.wait();
  EXPECT_EQ(ran, 100);
}

TEST_F(ThreadQueueFactoryTest, AQueueMayBeLetGoByItsOwnTask) {
  auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  AsyncExecutor& executor = *queue;
  Latch lastTask(1);
  std::weak_ptr<AsyncExecutor> released = queue;
  executor.dispatch([owned = std::move(queue)]() mutable { owned.reset(); });
  executor.dispatch([&] { lastTask.countDown(); });
  gate->countDown();
  lastTask.wait();
  EXPECT_TRUE(released.expired());
}

TEST_F(ThreadQueueFactoryTest, AQueueMayBeLetGoWithTheTaskThatOwnsIt) {
  auto queue = factory->createQueue();
  AsyncExecutor& executor = *queue;
  const std::weak_ptr<AsyncExecutor> released = queue;
  executor.dispatch([owned = std::move(queue)] {});
  EXPECT_TRUE(factory->drain(kLongPatience));
  EXPECT_TRUE(released.expired());
}

TEST_F(ThreadQueueFactoryTest, ManyShortLivedQueuesRunEverything) {
  std::atomic<int> ran{0};
  for (int i = 0; i < 200; ++i) {
    factory->createQueue()->dispatch([&] { ++ran; });
  }
  factory.reset();
  EXPECT_EQ(ran, 200);
}

// Timers

TEST_F(ThreadQueueFactoryTest, ATimerFiresAmongTheTasksOfItsQueue) {
  const auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  std::vector<std::string> order;  // unguarded: the queue alone keeps it whole
  bool isRefused = false;
  queue->dispatch([&] { order.emplace_back("before"); });
  const auto timer = queue->dispatchAfter(
      0,
      [&] {
        order.emplace_back("timer");
        try {
          ThreadQueueFactory::refuseOnQueueThread("waiting", "");
        } catch (const std::logic_error&) {
          isRefused = true;
        }
      },
      nullptr);
  handOutDueTimers();
  queue->dispatch([&] { order.emplace_back("behind"); });
  gate->countDown();
  finish(queue);
  EXPECT_EQ(order, (std::vector<std::string>{"before", "timer", "behind"}));
  EXPECT_TRUE(isRefused);
}

TEST_F(ThreadQueueFactoryTest, ATimerNeverFiresEarly) {
  const auto queue = factory->createQueue();
  const auto begin = std::chrono::steady_clock::now();
  std::chrono::steady_clock::time_point firedAt;
  Latch fired(1);
  const auto timer = queue->dispatchAfter(
      5 * kMillisecond,
      [&] {
        firedAt = std::chrono::steady_clock::now();
        fired.countDown();
      },
      nullptr);
  fired.wait();
  EXPECT_GE(firedAt - begin, std::chrono::milliseconds(5));
}

TEST_F(ThreadQueueFactoryTest, TimersFireOnceHoweverTheyWereArmed) {
  const auto queue = factory->createQueue();
  std::atomic<int> dispatched{0};
  std::atomic<int> scheduled{0};
  Latch later(1);
  const auto first = queue->dispatchAfter(
      0, [&] { ++dispatched; }, nullptr);
  const auto second = queue->scheduleAfter(
      kMillisecond, [&] { ++scheduled; }, nullptr);
  const auto third = queue->scheduleAfter(
      5 * kMillisecond, [&] { later.countDown(); }, nullptr);
  later.wait();
  EXPECT_EQ(dispatched, 1);
  EXPECT_EQ(scheduled, 1);
}

TEST_F(ThreadQueueFactoryTest, CompanionsAreIgnored) {
  const auto queue = factory->createQueue();
  std::atomic<bool> companionRan{false};
  Latch fired(1);
  const auto timer = queue->dispatchAfter(
      0, [&] { fired.countDown(); }, [&] { companionRan = true; });
  fired.wait();
  finish(queue);
  EXPECT_FALSE(companionRan);
}

TEST_F(ThreadQueueFactoryTest, ATimerWithoutATaskDoesNothing) {
  const LogCapture log;
  const auto queue = factory->createQueue();
  const auto timer = queue->dispatchAfter(0, nullptr, nullptr);
  handOutDueTimers();
  finish(queue);
  EXPECT_EQ(log.errorCount(), 0U);
}

TEST_F(ThreadQueueFactoryTest, DelaysOfZeroOrLessAreDueAtOnceInTheOrderOfArming) {
  const auto queue = factory->createQueue();
  std::vector<std::int64_t> order;
  std::vector<std::unique_ptr<AsyncTimer>> timers;
  const std::vector<std::int64_t> delays = {0, -1, std::numeric_limits<std::int64_t>::min(), 0};
  for (const std::int64_t delay : delays) {
    timers.push_back(queue->dispatchAfter(
        delay, [&order, delay] { order.push_back(delay); }, nullptr));
  }
  handOutDueTimers();
  finish(queue);
  EXPECT_EQ(order, delays);
}

TEST_F(ThreadQueueFactoryTest, ATimerThatIsDueEarlierOvertakesOneThatWasArmedEarlier) {
  const auto queue = factory->createQueue();
  std::vector<std::string> order;
  Latch done(2);
  const auto note = [&](const std::string& name) {
    return [&, name] {
      order.push_back(name);
      done.countDown();
    };
  };
  const auto later = queue->dispatchAfter(20 * kMillisecond, note("later"), nullptr);
  const auto sooner = queue->dispatchAfter(0, note("sooner"), nullptr);
  done.wait();
  EXPECT_EQ(order, (std::vector<std::string>{"sooner", "later"}));
}

TEST_F(ThreadQueueFactoryTest, HugeDelaysNeverComeAndHoldNobodyUp) {
  const auto queue = factory->createQueue();
  std::atomic<bool> fired{false};
  auto longest = queue->dispatchAfter(
      std::numeric_limits<std::int64_t>::max(), [&] { fired = true; }, nullptr);
  auto hundredYears = queue->dispatchAfter(
      100 * 365 * 24 * kHour, [&] { fired = true; }, nullptr);
  Latch sooner(1);
  const auto timer = queue->dispatchAfter(
      kMillisecond, [&] { sooner.countDown(); }, nullptr);
  sooner.wait();
  EXPECT_FALSE(fired);
}

TEST_F(ThreadQueueFactoryTest, ATimerOfABusyQueueHoldsUpNoOtherQueue) {
  const auto busy = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(busy, gate);
  std::atomic<bool> fired{false};
  const auto timer = busy->dispatchAfter(
      0, [&] { fired = true; }, nullptr);
  handOutDueTimers();
  EXPECT_FALSE(fired);
  gate->countDown();
  finish(busy);
  EXPECT_TRUE(fired);
}

// Cancelling

TEST_F(ThreadQueueFactoryTest, ACancelledTimerNeverRunsAndItsTaskIsGone) {
  const auto queue = factory->createQueue();
  Latch gone(1);
  std::atomic<bool> ran{false};
  auto timer = queue->dispatchAfter(
      kHour, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  EXPECT_FALSE(gone.isOpen());
  timer.reset();
  EXPECT_TRUE(gone.isOpen());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, ACancelledTimerThatIsQueuedAlreadyDoesNotRunAndItsTaskIsGone) {
  const auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  Latch gone(1);
  std::atomic<bool> ran{false};
  auto timer = queue->dispatchAfter(
      0, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  handOutDueTimers();
  timer.reset();
  EXPECT_TRUE(gone.isOpen());
  gate->countDown();
  finish(queue);
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, ATimerMayBeCancelledByItsOwnTask) {
  const auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  std::unique_ptr<AsyncTimer> timer;
  Latch cancelled(1);
  timer = queue->dispatchAfter(
      0,
      [&] {
        timer.reset();
        cancelled.countDown();
      },
      nullptr);
  gate->countDown();
  cancelled.wait();
  finish(queue);
  EXPECT_EQ(timer, nullptr);
}

TEST_F(ThreadQueueFactoryTest, ATimersTaskMayArmTheNextOneInItsPlace) {
  const auto queue = factory->createQueue();
  std::unique_ptr<AsyncTimer> timer;
  Latch rounds(5);
  std::function<void()> arm = [&] {
    timer = queue->scheduleAfter(
        kMillisecond / 10,
        [&] {
          rounds.countDown();
          if (!rounds.isOpen()) arm();
        },
        nullptr);
  };
  queue->dispatch(arm);
  rounds.wait();
  finish(queue);
  EXPECT_TRUE(rounds.isOpen());
}

TEST_F(ThreadQueueFactoryTest, CancellingDoesNotWaitForATaskThatRuns) {
  const auto queue = factory->createQueue();
  Latch begun(1);
  Latch cancelled(1);
  std::atomic<bool> finished{false};
  auto timer = queue->dispatchAfter(
      0,
      [&] {
        begun.countDown();
        cancelled.wait();
        finished = true;
      },
      nullptr);
  begun.wait();
  timer.reset();
  EXPECT_FALSE(finished);
  cancelled.countDown();
  finish(queue);
  EXPECT_TRUE(finished);
}

TEST_F(ThreadQueueFactoryTest, ATimerMayBeCancelledUnderALockThatItsTaskWants) {
  const auto queue = factory->createQueue();
  std::mutex mutex;
  Latch begun(1);
  bool ran = false;
  {
    const std::lock_guard<std::mutex> lock(mutex);
    auto timer = queue->dispatchAfter(
        0,
        [&] {
          begun.countDown();
          const std::lock_guard<std::mutex> taskLock(mutex);
          ran = true;
        },
        nullptr);
    begun.wait();
    timer.reset();
    EXPECT_FALSE(ran);
  }
  finish(queue);
  EXPECT_TRUE(ran);
}

TEST_F(ThreadQueueFactoryTest, OnceTheHandleIsGoneATaskHasBegunOrNeverBegins) {
  const auto queue = factory->createQueue();
  for (int round = 0; round < 300; ++round) {
    std::atomic<int> begun{0};
    auto timer = queue->dispatchAfter(
        round % 3, [&] { ++begun; }, nullptr);
    if (round % 2 == 0) std::this_thread::yield();
    timer.reset();
    // On one queue a task that had begun is over now, and one that had not must not touch `begun` any more.
    finish(queue);
    const int afterCancelling = begun;
    finish(queue);
    EXPECT_EQ(begun, afterCancelling);
    EXPECT_LE(afterCancelling, 1);
  }
}

TEST_F(ThreadQueueFactoryTest, ManyThreadsMayArmAndCancelAtOnce) {
  const auto queue = factory->createQueue();
  std::atomic<int> fired{0};
  runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 200; ++i) {
      auto cancelled = queue->dispatchAfter(
          kHour, [&] { fired += 1000; }, nullptr);
      Latch done(1);
      const auto kept = queue->dispatchAfter(
          static_cast<std::int64_t>(thread),
          [&] {
            ++fired;
            done.countDown();
          },
          nullptr);
      cancelled.reset();
      done.wait();
    }
  });
  finish(queue);
  EXPECT_EQ(fired, 800);
}

TEST_F(ThreadQueueFactoryTest, ATimerDoesNotKeepItsQueueOpen) {
  auto queue = factory->createQueue();
  const std::weak_ptr<AsyncExecutor> released = queue;
  std::atomic<bool> ran{false};
  const auto timer = queue->dispatchAfter(
      kHour, [&] { ran = true; }, nullptr);
  queue.reset();
  EXPECT_TRUE(released.expired());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, ATimerThatComesDueAfterItsQueueIsDroppedUnrun) {
  auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  Latch gone(1);
  std::atomic<bool> ran{false};
  const auto timer = queue->dispatchAfter(
      500 * kMillisecond, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  queue.reset();
  gate->countDown();
  gone.wait();
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, ATimerHandleMayOutliveQueueAndFactory) {
  auto queue = factory->createQueue();
  auto timer = queue->dispatchAfter(
      kHour, [] {}, nullptr);
  queue.reset();
  factory.reset();
  timer.reset();
  EXPECT_EQ(timer, nullptr);
}

// The end of the factory

TEST_F(ThreadQueueFactoryTest, DestroyingTheFactoryRunsWhatWasDispatched) {
  const auto file = factory->createQueue();
  const auto work = factory->createWorkQueue();
  std::atomic<int> ran{0};
  const auto gate = std::make_shared<Latch>(1);
  block(file, gate);
  for (int i = 0; i < 100; ++i) {
    file->dispatch([&] { ++ran; });
    work->dispatch([&] { ++ran; });
  }
  work->dispatch([gate] { gate->countDown(); });
  factory.reset();
  EXPECT_EQ(ran, 200);
}

TEST_F(ThreadQueueFactoryTest, DestroyingTheFactoryEndsItsThreadsThoughQueuesAreKept) {
  const auto queue = factory->createQueue();
  const auto ended = watchThreadEnd(*queue);
  factory.reset();
  EXPECT_TRUE(ended->isOpen());
}

TEST_F(ThreadQueueFactoryTest, DestroyingTheFactoryDropsPendingTimers) {
  const auto queue = factory->createQueue();
  Latch gone(1);
  std::atomic<bool> ran{false};
  const auto timer = queue->dispatchAfter(
      kHour, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  factory.reset();
  EXPECT_TRUE(gone.isOpen());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, TasksDispatchedAfterTheFactoryAreDestroyedUnrun) {
  const auto queue = factory->createQueue();
  factory.reset();
  Latch gone(1);
  std::atomic<bool> ran{false};
  queue->dispatch([&ran, sentinel = countDownWhenGone(gone)] { ran = true; });
  EXPECT_TRUE(gone.isOpen());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, FuturesOfTasksDispatchedAfterTheFactoryAreBrokenPromises) {
  const auto queue = factory->createQueue();
  factory.reset();
  Future<void> future = dispatchTask<void>(queue, [] {});
  try {
    future.get();
    FAIL() << "A dropped task has no result.";
  } catch (const std::future_error& error) {
    EXPECT_EQ(error.code(), std::future_errc::broken_promise);
  }
}

TEST_F(ThreadQueueFactoryTest, TimersArmedAfterTheFactoryAreDroppedAndStillHaveAHandle) {
  const auto queue = factory->createQueue();
  factory.reset();
  Latch gone(1);
  std::atomic<bool> ran{false};
  const auto timer = queue->scheduleAfter(
      0, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  EXPECT_NE(timer, nullptr);
  EXPECT_TRUE(gone.isOpen());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, AQueueCreatedAfterShutDownIsClosed) {
  factory->shutDown();
  for (const auto& queue : {factory->createQueue(), factory->createWorkQueue()}) {
    ASSERT_NE(queue, nullptr);
    Latch gone(1);
    queue->dispatch([sentinel = countDownWhenGone(gone)] { ADD_FAILURE() << "A closed queue runs nothing."; });
    EXPECT_TRUE(gone.isOpen());
  }
}

TEST_F(ThreadQueueFactoryTest, TheFactoryMayBeDestroyedByATaskOfItsOwnQueue) {
  const auto queue = factory->createQueue();
  const auto other = factory->createWorkQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  block(other, gate);
  const auto ended = watchThreadEnd(*queue);
  const auto otherEnded = watchThreadEnd(*other);
  std::atomic<int> ran{0};
  queue->dispatch([&ran, owned = std::shared_ptr<ThreadQueueFactory>(std::move(factory))]() mutable {
    owned.reset();
    ++ran;
  });
  queue->dispatch([&] { ++ran; });
  other->dispatch([&] { ++ran; });
  gate->countDown();
  ended->wait();
  otherEnded->wait();
  EXPECT_EQ(ran, 3);
  Latch gone(1);
  queue->dispatch([sentinel = countDownWhenGone(gone)] { ADD_FAILURE() << "A closed queue runs nothing."; });
  EXPECT_TRUE(gone.isOpen());
}

TEST_F(ThreadQueueFactoryTest, TheFactoryMayBeDestroyedOnItsQueueWhileAnotherTaskWaitsForThatQueue) {
  const auto queue = factory->createQueue();
  const auto other = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  Latch behind(1);
  queue->dispatch([owned = std::shared_ptr<ThreadQueueFactory>(std::move(factory))] {});
  queue->dispatch([&] { behind.countDown(); });
  const auto otherEnded = watchThreadEnd(*other);
  const auto ended = watchThreadEnd(*queue);
  other->dispatch([&] { behind.wait(); });
  gate->countDown();
  otherEnded->wait();
  ended->wait();
  EXPECT_TRUE(behind.isOpen());
}

TEST_F(ThreadQueueFactoryTest, TheFactoryMayBeDestroyedWithATimersTask) {
  auto queue = factory->createQueue();
  const auto kept = factory->createQueue();
  const auto keptEnded = watchThreadEnd(*kept);
  AsyncExecutor& executor = *queue;
  Latch gone(1);
  {
    // The queue is gone before the timer is due, so its task is destroyed by the thread that serves the timers.
    auto owned = std::shared_ptr<ThreadQueueFactory>(std::move(factory));
    auto task = [owned = std::move(owned), sentinel = countDownWhenGone(gone)] {};
    const auto timer = executor.dispatchAfter(2 * kMillisecond, std::move(task), nullptr);
    queue.reset();
    gone.wait();
  }
  keptEnded->wait();
  EXPECT_TRUE(keptEnded->isOpen());
}

TEST_F(ThreadQueueFactoryTest, ShutDownMayBeCalledOftenAndByManyThreads) {
  const auto queue = factory->createQueue();
  const auto ended = watchThreadEnd(*queue);
  std::atomic<int> endedWhenReturned{0};
  runOnThreads(4, [&] {
    factory->shutDown();
    if (ended->isOpen()) ++endedWhenReturned;
  });
  factory->shutDown();
  EXPECT_EQ(endedWhenReturned, 4);
}

TEST_F(ThreadQueueFactoryTest, TasksOfSeveralQueuesMayShutDownAtOnce) {
  const auto first = factory->createQueue();
  const auto second = factory->createQueue();
  Latch bothRunning(2);
  Latch bothReturned(2);
  for (const auto& queue : {first, second}) {
    queue->dispatch([&] {
      bothRunning.arriveAndWait();
      factory->shutDown();
      bothReturned.arriveAndWait();
    });
  }
  bothReturned.wait();
  factory.reset();
  EXPECT_TRUE(bothReturned.isOpen());
}

TEST_F(ThreadQueueFactoryTest, ATaskMayShutDownWhileAnotherThreadDoes) {
  const auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  std::atomic<bool> returned{false};
  queue->dispatch([&] {
    factory->shutDown();
    returned = true;
  });
  std::thread opener([&] { gate->countDown(); });
  factory->shutDown();
  opener.join();
  EXPECT_TRUE(returned);
}

TEST_F(ThreadQueueFactoryTest, AbandonDoesNotWaitForATaskThatIsStuck) {
  const auto stuck = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(stuck, gate);
  const auto ended = watchThreadEnd(*stuck);
  factory->abandon();
  factory.reset();
  EXPECT_FALSE(ended->isOpen());
  gate->countDown();
  ended->wait();
}

// Draining

TEST_F(ThreadQueueFactoryTest, DrainWaitsForWorkThatIsHandedFromQueueToQueue) {
  const auto first = factory->createQueue();
  const auto second = factory->createWorkQueue();
  std::atomic<int> hops{0};
  std::function<void()> hop = [&] {
    const int done = ++hops;
    if (done < 100) (done % 2 == 0 ? first : second)->dispatch(hop);
  };
  first->dispatch(hop);
  EXPECT_TRUE(factory->drain(kLongPatience));
  EXPECT_EQ(hops, 100);
}

TEST_F(ThreadQueueFactoryTest, DrainOfIdleQueuesIsTrueEvenWithoutPatience) {
  const auto queue = factory->createQueue();
  EXPECT_TRUE(factory->drain(std::chrono::milliseconds(0)));
  EXPECT_TRUE(factory->drain(std::chrono::milliseconds::min()));
}

TEST_F(ThreadQueueFactoryTest, DrainGivesUpWhenItsPatienceIsOver) {
  const auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  EXPECT_FALSE(factory->drain(std::chrono::milliseconds(0)));
  EXPECT_FALSE(factory->drain(std::chrono::milliseconds(2)));
  gate->countDown();
  EXPECT_TRUE(factory->drain(std::chrono::milliseconds::max()));
  EXPECT_TRUE(factory->drain(std::chrono::seconds::max()));
}

TEST_F(ThreadQueueFactoryTest, DrainWaitsUntilTheLastTaskIsGoneNotOnlyRun) {
  const auto queue = factory->createQueue();
  Latch going(1);
  Latch gate(1);
  const auto goSlowly = [&](void*) {
    going.countDown();
    gate.wait();
  };
  queue->dispatch([sentinel = std::shared_ptr<void>(&gate, goSlowly)] {});
  going.wait();
  EXPECT_FALSE(factory->drain(std::chrono::milliseconds(0)));
  gate.countDown();
  EXPECT_TRUE(factory->drain(kLongPatience));
}

TEST_F(ThreadQueueFactoryTest, DrainDoesNotWaitForArmedTimers) {
  const auto queue = factory->createQueue();
  const auto timer = queue->dispatchAfter(
      kHour, [] {}, nullptr);
  EXPECT_TRUE(factory->drain(kLongPatience));
}

TEST_F(ThreadQueueFactoryTest, DrainFromATaskIsFalseAtOnce) {
  const auto queue = factory->createQueue();
  bool drained = true;
  queue->dispatch([&] { drained = factory->drain(kLongPatience); });
  finish(queue);
  EXPECT_FALSE(drained);
}

// Refusing new work

TEST_F(ThreadQueueFactoryTest, WorkOfOtherThreadsThatIsRefusedIsDestroyedUnrun) {
  const auto queue = factory->createQueue();
  factory->refuseNewWork();
  Latch gone(1);
  std::atomic<bool> ran{false};
  queue->dispatch([&ran, sentinel = countDownWhenGone(gone)] { ran = true; });
  EXPECT_TRUE(gone.isOpen());
  EXPECT_THROW(dispatchTask<void>(queue, [] {}).get(), std::future_error);
  EXPECT_TRUE(factory->drain(kLongPatience));
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, WhatWasDispatchedBeforeTheRefusalRunsAndMayDispatchFurtherTasks) {
  const auto first = factory->createQueue();
  const auto second = factory->createWorkQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(first, gate);
  std::atomic<int> hops{0};
  std::function<void()> hop = [&] {
    const int done = ++hops;
    if (done < 100) (done % 2 == 0 ? first : second)->dispatch(hop);
  };
  first->dispatch(hop);
  factory->refuseNewWork();
  gate->countDown();
  EXPECT_TRUE(factory->drain(kLongPatience));
  EXPECT_EQ(hops, 100);
}

TEST_F(ThreadQueueFactoryTest, TasksOfAnotherFactoryAreRefusedLikeThoseOfAnyThread) {
  ThreadQueueFactory other;
  const auto queue = factory->createQueue();
  factory->refuseNewWork();
  const auto work = [&] { dispatchTask<void>(queue, [] {}).get(); };
  EXPECT_THROW(dispatchTask<void>(other.createQueue(), work).get(), std::future_error);
}

TEST_F(ThreadQueueFactoryTest, AQueueThatIsCreatedAfterTheRefusalWorksForTasksOnly) {
  const auto queue = factory->createQueue();
  const auto gate = std::make_shared<Latch>(1);
  block(queue, gate);
  std::atomic<bool> ran{false};
  queue->dispatch([&] { factory->createWorkQueue()->dispatch([&] { ran = true; }); });
  factory->refuseNewWork();
  const auto late = factory->createQueue();
  EXPECT_THROW(dispatchTask<void>(late, [] {}).get(), std::future_error);
  gate->countDown();
  EXPECT_TRUE(factory->drain(kLongPatience));
  EXPECT_TRUE(ran);
}

// Also one that is being handed over just then.
TEST_F(ThreadQueueFactoryTest, NoTimerFiresOnceTheFactoryIsDrainedAfterTheRefusal) {
  constexpr std::chrono::microseconds delay(50);
  for (int i = 0; i < 300; ++i) {
    std::atomic<bool> isDrained{false};
    std::atomic<bool> firedLate{false};
    ThreadQueueFactory closing;
    const auto queue = closing.createQueue();
    const auto due = std::chrono::steady_clock::now() + delay;
    const auto timer = queue->dispatchAfter(
        std::chrono::nanoseconds(delay).count(), [&] { firedLate = isDrained.load(); }, nullptr);
    while (std::chrono::steady_clock::now() < due + std::chrono::microseconds(i)) std::this_thread::yield();
    closing.refuseNewWork();
    EXPECT_TRUE(closing.drain(kLongPatience));
    isDrained = true;
    closing.shutDown();
    ASSERT_FALSE(firedLate);
  }
}

TEST_F(ThreadQueueFactoryTest, TheRefusalDropsTimersArmedBeforeAndAfterIt) {
  const auto queue = factory->createQueue();
  Latch gone(2);
  std::atomic<bool> ran{false};
  const auto before = queue->dispatchAfter(
      kHour, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  factory->refuseNewWork();
  const auto after = queue->dispatchAfter(
      0, [&ran, sentinel = countDownWhenGone(gone)] { ran = true; }, nullptr);
  EXPECT_TRUE(gone.isOpen());
  factory->shutDown();
  EXPECT_FALSE(ran);
}

TEST_F(ThreadQueueFactoryTest, DrainEndsThoughOtherThreadsKeepDispatchingOnceTheyAreRefused) {
  const auto queue = factory->createQueue();
  std::atomic<bool> isOver{false};
  Latch busy(2);
  std::vector<std::thread> threads;
  for (int i = 0; i < 2; ++i) {
    threads.emplace_back([&] {
      while (!isOver) {
        queue->dispatch([] {});
        busy.countDown();
      }
    });
  }
  busy.wait();
  factory->refuseNewWork();
  EXPECT_TRUE(factory->drain(kLongPatience));
  isOver = true;
  for (std::thread& thread : threads) thread.join();
}

TEST_F(ThreadQueueFactoryTest, TasksThatKeepDispatchingAreNotRefusedAndEndWhenTheQueuesAreClosed) {
  const auto queue = factory->createQueue();
  std::function<void()> hop = [&] { queue->dispatch(hop); };
  queue->dispatch(hop);
  factory->refuseNewWork();
  EXPECT_FALSE(factory->drain(std::chrono::milliseconds(2)));
  factory->shutDown();
  EXPECT_TRUE(factory->drain(std::chrono::milliseconds(0)));
}

TEST_F(ThreadQueueFactoryTest, ATaskOfAnotherFactoryMayDrainThisOne) {
  ThreadQueueFactory other;
  const auto queue = other.createQueue();
  bool drained = false;
  queue->dispatch([&] { drained = factory->drain(kLongPatience); });
  finish(queue);
  EXPECT_TRUE(drained);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
