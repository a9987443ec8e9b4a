#include "host/testing/QueueConformance.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "host/ThreadQueueFactory.h"
#include "support/BrokenQueues.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using testing::AllOf;
using testing::Contains;
using testing::ContainsRegex;
using testing::Each;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;

using Sentences = std::vector<std::string>;

// For queues that use the patience up. It also ends the situations in which a queue is held, so what needs those, and
// what conforms, has to get the default, or else a slow machine decides.
QueueConformanceOptions impatient() {
  QueueConformanceOptions options;
  options.patience = std::chrono::milliseconds(300);
  return options;
}

template <class Factory> Sentences check(const QueueConformanceOptions& options = {}) {
  return checkConformance([] { return std::make_shared<Factory>(); }, options);
}

template <class Queue> Sentences checkQueue(const QueueConformanceOptions& options = {}) {
  return check<FactoryOf<Queue>>(options);
}

// Waits, after the check, until all that was left behind in a deadlock has come to its end.
template <class Queue> Sentences checkDeadlocked() {
  using Factory = FactoryOf<Queue>;
  struct Alive {
    std::mutex mutex;
    std::condition_variable changed;
    int factories = 0;
  };
  Alive alive;
  const auto make = [&alive] {
    const std::lock_guard<std::mutex> lock(alive.mutex);
    ++alive.factories;
    return std::shared_ptr<TaskQueueFactory>(new Factory, [&alive](TaskQueueFactory* factory) {
      delete factory;
      const std::lock_guard<std::mutex> unlocking(alive.mutex);
      --alive.factories;
      alive.changed.notify_all();
    });
  };
  Deadlock::letAll(false);
  Sentences sentences = checkConformance(make, impatient());
  Deadlock::letAll(true);
  std::unique_lock<std::mutex> lock(alive.mutex);
  alive.changed.wait(lock, [&] { return alive.factories == 0; });
  return sentences;
}

// Queues that conform

TEST(QueueConformance, ThreadsOfTheKitKeepTheContractAndAllFurtherPromises) {
  const LogCapture log;  // of tasks that throw
  QueueConformanceOptions options;
  options.continueAfterExceptions = true;
  options.finishReleasedQueues = true;
  options.fireScheduledTimersOnce = true;
  options.destroyCancelledTasks = true;
  options.closeWithFactory = true;
  EXPECT_THAT(check<host::ThreadQueueFactory>(options), IsEmpty());
}

TEST(QueueConformance, QueuesThatShareOneThreadKeepTheContract) {
  class OneQueue : public TaskQueueFactory {
   public:
    std::shared_ptr<AsyncExecutor> createQueue() override { return queue_; }
    std::shared_ptr<AsyncExecutor> createWorkQueue() override { return queue_; }

   private:
    host::ThreadQueueFactory kit_;
    const std::shared_ptr<AsyncExecutor> queue_ = kit_.createQueue();
  };
  EXPECT_THAT(check<OneQueue>(), IsEmpty());
}

TEST(QueueConformance, QueuesThatPassEverythingOnKeepTheContract) {
  EXPECT_THAT(checkQueue<PassingQueue>(), IsEmpty());
}

TEST(QueueConformance, TimersOfScheduleAfterMayRepeat) {
  class Queue : public PassingQueue {
   public:
    using PassingQueue::PassingQueue;

    std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delay, Task task, Task /*companion*/) override {
      auto timer = std::make_unique<Repetition>();
      Repetition::arm(timer->state, *queue, queue, delay, task);
      return timer;
    }

   private:
    struct State {
      std::mutex mutex;
      std::unique_ptr<AsyncTimer> next;
      bool isOver = false;
    };
    struct Repetition : AsyncTimer {
      ~Repetition() override {
        std::unique_ptr<AsyncTimer> last;
        const std::lock_guard<std::mutex> lock(state->mutex);
        state->isOver = true;
        last = std::move(state->next);
      }

      static void arm(const std::shared_ptr<State>& state, AsyncExecutor& queue, std::weak_ptr<AsyncExecutor> weakQueue,
                      std::int64_t delay, const Task& task) {
        auto runAndRepeat = [state, weakQueue, delay, task] {
          task();
          if (const auto own = weakQueue.lock()) arm(state, *own, weakQueue, delay, task);
        };
        std::unique_ptr<AsyncTimer> timer = queue.dispatchAfter(delay, std::move(runAndRepeat), nullptr);
        const std::lock_guard<std::mutex> lock(state->mutex);
        if (!state->isOver) state->next.swap(timer);
      }

      const std::shared_ptr<State> state = std::make_shared<State>();
    };
  };
  EXPECT_THAT(checkQueue<Queue>(), IsEmpty());
  QueueConformanceOptions options;
  options.fireScheduledTimersOnce = true;
  EXPECT_THAT(checkQueue<Queue>(options), Contains(ContainsRegex("A timer of scheduleAfter: A timer of "
                                                                 "scheduleAfter fired [0-9]+ times instead of once")));
}

// Tasks

TEST(QueueConformance, FindsAPoolThatIsNotSerial) {
  EXPECT_THAT(checkQueue<PooledQueue>(), Contains("A long task: File queue 1: task 2 began before task 1 had ended, on "
                                                  "another thread. Tasks of a queue run one at a time."));
}

TEST(QueueConformance, FindsAQueueThatReorders) {
  EXPECT_THAT(
      checkQueue<ReversingQueue>(),
      Contains("A backlog of tasks: File queue 1: task 101 began before task 2 and 98 more, dispatched earlier. "
               "Tasks of a queue run in the order of dispatch."));
}

TEST(QueueConformance, FindsAQueueThatRunsTasksInsideDispatchAndTriesItNoFurther) {
  EXPECT_THAT(checkQueue<InlineQueue>(),
              AllOf(Not(IsEmpty()), Each(HasSubstr("A task and a timer: ")),
                    Contains(HasSubstr("task 1 ran inside dispatch, on the thread that called it."))));
}

TEST(QueueConformance, FindsAQueueThatRunsTasksTwice) {
  EXPECT_THAT(checkQueue<RepeatingQueue>(),
              Contains(ContainsRegex("task 1 ran again. What is given to dispatch runs once.")));
}

TEST(QueueConformance, FindsAQueueThatLosesTasks) {
  EXPECT_THAT(checkQueue<ForgettingQueue>(impatient()),
              Contains(ContainsRegex("Tasks of several threads: [0-9]+ of 800 tasks ran within 300 ms.")));
}

TEST(QueueConformance, FindsAQueueThatKeepsTasksThatHaveRun) {
  EXPECT_THAT(checkQueue<KeepingQueue>(impatient()),
              Contains("The destruction of a task: 0 of 1 tasks were destroyed after they "
                       "had run within 300 ms."));
  KeepingQueue::letGo();
}

TEST(QueueConformance, FindsAQueueThatDestroysTasksUnderItsLock) {
  const Sentences sentences = checkDeadlocked<LockingQueue>();
  EXPECT_THAT(sentences, Contains("Tasks from the destruction of a task: 0 of 3 tasks ran that the destruction of a "
                                  "task dispatched within 300 ms."));
  EXPECT_THAT(sentences, Contains("Tasks from the destruction of a task: A call of the factory, of a queue or of a "
                                  "handle did not return."));
}

// Timers

TEST(QueueConformance, FindsTimersThatFireEarly) {
  EXPECT_THAT(
      checkQueue<ImpatientTimersQueue>(),
      Contains(ContainsRegex("timer [0-9]+ began [0-9]+ ns before it was due. A timer fires after its delay.")));
}

TEST(QueueConformance, FindsTimersThatFireEarlyBecauseTheDelayDoesNotFitTheirCounter) {
  EXPECT_THAT(checkQueue<NarrowTimersQueue>(),
              Contains(ContainsRegex("Timers of very long delays: Work queue 1: timer [0-9]+ began "
                                     "[0-9]+ ns before it was due.")));
}

TEST(QueueConformance, FindsHandlesThatCancelNothing) {
  const Sentences sentences = checkQueue<StubbornTimersQueue>();
  for (const std::string situation : {"in a task", "by another thread"}) {
    EXPECT_THAT(sentences, Contains(ContainsRegex("Timers that are cancelled " + situation +
                                                  ": .* queue 1: timer 1 "
                                                  "began after its handle was destroyed.")));
  }
}

TEST(QueueConformance, FindsHandlesThatDoNotCancelATimerThatWaitsForItsQueue) {
  EXPECT_THAT(checkQueue<HastyTimersQueue>(),
              Contains(ContainsRegex("Timers that are cancelled in a task: .* timer 1 began after its handle")));
}

TEST(QueueConformance, FindsTimersThatRunBesideTheTasksOfTheirQueue) {
  EXPECT_THAT(checkQueue<BesideTimersQueue>(),
              Contains(ContainsRegex("Timers that are due while a task runs: File queue 1: timer 1 began before "
                                     "task 1 had ended, on another thread.")));
}

TEST(QueueConformance, FindsTimersThatNeverFire) {
  EXPECT_THAT(checkQueue<UnpunctualTimersQueue>(impatient()),
              Contains("Timers of different delays: 0 of 1 timers with a delay of -9223372036854775808 ns fired within "
                       "300 ms."));
}

TEST(QueueConformance, FindsAHandleThatWaitsForItsOwnTask) {
  EXPECT_THAT(checkDeadlocked<WaitingTimersQueue>(),
              Contains("Timers that cancel themselves: 0 of 1 timers fired that destroy their own handle within 300 "
                       "ms."));
}

// Further promises

TEST(QueueConformance, FindsAQueueThatStopsAtAnException) {
  class Queue : public PassingQueue {
   public:
    using PassingQueue::PassingQueue;
    void dispatch(Task task) override {
      queue->dispatch([hasFailed = hasFailed_, task = std::move(task)] {
        if (*hasFailed) return;
        *hasFailed = true;
        task();
        *hasFailed = false;
      });
    }

   private:
    const std::shared_ptr<bool> hasFailed_ = std::make_shared<bool>(false);  // used on the queue's thread alone
  };
  const LogCapture log;
  EXPECT_THAT(checkQueue<Queue>(), IsEmpty());
  QueueConformanceOptions options = impatient();
  options.continueAfterExceptions = true;
  EXPECT_THAT(checkQueue<Queue>(options), Contains("Tasks that throw: 0 of 1 tasks ran within 300 ms."));
}

TEST(QueueConformance, FindsAQueueThatDropsItsTasksWhenItIsReleased) {
  class Queue : public PassingQueue {
   public:
    using PassingQueue::PassingQueue;
    void dispatch(Task task) override {
      queue->dispatch([alive = std::weak_ptr<int>(alive_), task = std::move(task)] {
        if (!alive.expired()) task();
      });
    }

   private:
    const std::shared_ptr<int> alive_ = std::make_shared<int>(0);
  };
  EXPECT_THAT(checkQueue<Queue>(), IsEmpty());
  QueueConformanceOptions options = impatient();
  options.finishReleasedQueues = true;
  options.patience = std::chrono::seconds(1);  // the queue has to be held until it is released
  EXPECT_THAT(checkQueue<Queue>(options),
              Contains("A queue that is released: 10 of 20 tasks of a released queue ran within 1000 ms."));
}

TEST(QueueConformance, FindsAQueueThatKeepsTheTasksOfCancelledTimers) {
  class Queue : public PassingQueue {
   public:
    using PassingQueue::PassingQueue;

   protected:
    std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
      const std::lock_guard<std::mutex> lock(mutex_);
      kept_.push_back(task);
      return PassingQueue::arm(delay, std::move(task));
    }

   private:
    std::mutex mutex_;
    std::vector<Task> kept_;
  };
  QueueConformanceOptions options = impatient();
  options.destroyCancelledTasks = true;
  EXPECT_THAT(checkQueue<Queue>(options), AllOf(Contains(ContainsRegex("Timers that are cancelled: .* due after 0 ns, "
                                                                       "remained")),
                                                Contains(HasSubstr("due after 3600000000000 ns, remained"))));
}

TEST(QueueConformance, FindsQueuesThatRunOnAfterTheirFactory) {
  class Factory : public TaskQueueFactory {
   public:
    explicit Factory(host::ThreadQueueFactory& longerLived) : longerLived_(longerLived) {}
    std::shared_ptr<AsyncExecutor> createQueue() override { return longerLived_.createQueue(); }
    std::shared_ptr<AsyncExecutor> createWorkQueue() override { return longerLived_.createWorkQueue(); }

   private:
    host::ThreadQueueFactory& longerLived_;
  };
  host::ThreadQueueFactory kit;
  const auto make = [&kit] { return std::make_shared<Factory>(kit); };
  EXPECT_THAT(checkConformance(make), IsEmpty());
  QueueConformanceOptions options;
  options.closeWithFactory = true;
  EXPECT_THAT(checkConformance(make, options),
              Contains("Queues whose factory is destroyed: The task of a timer that had "
                       "not fired remained after closing."));
}

// Factories

TEST(QueueConformance, FindsAFactoryWithoutQueues) {
  struct Factory : TaskQueueFactory {
    std::shared_ptr<AsyncExecutor> createQueue() override { return nullptr; }
    std::shared_ptr<AsyncExecutor> createWorkQueue() override { return nullptr; }
  };
  EXPECT_THAT(check<Factory>(), ElementsAre("A task and a timer: File queue 1: the factory returned null. A factory "
                                            "returns a queue."));
}

TEST(QueueConformance, FindsAFactoryThatThrows) {
  struct Factory : TaskQueueFactory {
    std::shared_ptr<AsyncExecutor> createQueue() override { throw std::runtime_error("no luck"); }
    std::shared_ptr<AsyncExecutor> createWorkQueue() override { return createQueue(); }
  };
  EXPECT_THAT(check<Factory>(), ElementsAre("A task and a timer: The factory, a queue or a handle threw: no luck"));
}

TEST(QueueConformance, ReportsThatThereIsNoFactory) {
  EXPECT_THAT(checkConformance([] { return nullptr; }),
              ElementsAre("A task and a timer: The factory, a queue or a handle threw: there is no factory"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
