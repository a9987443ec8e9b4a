#include <array>
#include <limits>
#include <thread>

#include "host/testing/conformance/Trial.h"

namespace velmora::mobile::xplat::cellar::test::conformance {

namespace {

using Queue = Trial::Queue;
using Timer = std::unique_ptr<AsyncTimer>;
using Limits = std::numeric_limits<std::int64_t>;

Timer arm(const Queue& queue, bool schedule, std::int64_t delay, std::function<void()> task) {
  return schedule ? queue->scheduleAfter(delay, std::move(task), nullptr)
                  : queue->dispatchAfter(delay, std::move(task), nullptr);
}

// A handle that tasks and threads share, and that is destroyed without a lock.
class SharedHandle {
 public:
  void set(Timer timer) {
    const std::lock_guard<std::mutex> lock(mutex_);
    timer_.swap(timer);
  }

  void reset() { set(nullptr); }

 private:
  std::mutex mutex_;
  Timer timer_;
};

void differentDelays(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  for (const bool schedule : {false, true}) {
    for (const std::int64_t delay :
         {Limits::min(), std::int64_t(-1), std::int64_t(0), std::int64_t(1), kMillisecond, 3 * kMillisecond}) {
      const SharedSignal fired = newSignal();
      const Timer timer = arm(queue, schedule, delay, [fired] { fired->raise(); });
      trial.expect(fired, 1, "timers with a delay of " + std::to_string(delay) + " ns fired");
    }
  }
  trial.finish(queue);
}

// What a number of nanoseconds, microseconds or milliseconds becomes that is too large for its type.
void longDelays(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  std::vector<Timer> timers;
  for (const bool schedule : {false, true}) {
    for (const std::int64_t unit : {std::int64_t(1), std::int64_t(1'000), kMillisecond, 1'000 * kMillisecond}) {
      for (const std::int64_t count : {std::int64_t(1) << 31, std::int64_t(1) << 32}) {
        timers.push_back(arm(queue, schedule, unit * count, [] {}));
      }
    }
    for (const std::int64_t delay : {Limits::max(), Limits::max() - 1, Limits::max() / 2}) {
      timers.push_back(arm(queue, schedule, delay, [] {}));
    }
  }
  for (int i = 0; i < 3; ++i) trial.waitForTimer(queue, kMillisecond);
  timers.clear();
  trial.finish(queue);
}

void besideTasks(Trial& trial) {
  const Queue queue = trial.newFileQueue();
  const SharedSignal fired = newSignal();
  std::vector<Timer> timers;
  {
    const auto hold = trial.hold(queue);
    for (const bool schedule : {false, true}) {
      timers.push_back(arm(queue, schedule, 0, [fired] { fired->raise(); }));
    }
    fired->waitFor(1, kOpportunity);
  }
  trial.expect(fired, 2, "timers fired");
}

// Both timers stay armed until a task has destroyed their handles: tasks of the queue run one at a time.
void cancelledInTask(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  const SharedSignal cancelled = newSignal();
  queue->dispatch([cancelled, weakQueue = std::weak_ptr<AsyncExecutor>(queue)] {
    if (const Queue own = weakQueue.lock()) {
      std::vector<Timer> timers;
      for (const bool schedule : {false, true}) timers.push_back(arm(own, schedule, 0, [] {}));
      std::this_thread::sleep_for(kOpportunity / 2);
      timers.clear();
    }
    cancelled->raise();
  });
  trial.expect(cancelled, 1, "tasks ran that destroy handles");
  trial.waitForTimer(queue, kMillisecond);
  trial.finish(queue);
}

void cancelledByAnotherThread(Trial& trial) {
  const Queue queue = trial.newFileQueue();
  std::vector<Timer> timers;
  auto hold = trial.hold(queue);
  for (const bool schedule : {false, true}) timers.push_back(arm(queue, schedule, 0, [] {}));
  std::this_thread::sleep_for(kOpportunity / 2);
  timers.clear();
  hold.reset();
  trial.waitForTimer(queue, kMillisecond);
  trial.finish(queue);
}

void cancelledBeforeDue(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  for (const bool schedule : {false, true}) arm(queue, schedule, 3 * kMillisecond, [] {});
  trial.waitForTimer(queue, 4 * kMillisecond);
  trial.finish(queue);
}

void cancelledByItself(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  for (const bool schedule : {false, true}) {
    const auto handle = std::make_shared<SharedHandle>();
    const SharedSignal returned = newSignal();
    {
      const auto hold = trial.hold(queue);  // so that the task finds its handle
      handle->set(arm(queue, schedule, 0, [handle, returned] {
        handle->reset();
        returned->raise();
      }));
    }
    trial.expect(returned, 1, "timers fired that destroy their own handle");
  }
  trial.waitForTimer(queue, kMillisecond);
  trial.finish(queue);
}

void severalThreads(Trial& trial) {
  constexpr std::size_t threads = 4;
  constexpr std::size_t timers = 50;  // of each thread that remain armed, and as many that do not
  const Queue queue = trial.newFileQueue();
  const SharedSignal fired = newSignal();
  std::array<std::vector<Timer>, threads> armed;
  onThreads(threads, [&](std::size_t thread) {
    for (std::size_t i = 0; i < timers; ++i) {
      const auto delay = static_cast<std::int64_t>(i % 5) * (kMillisecond / 2);
      armed[thread].push_back(arm(queue, i % 2 == 0, delay, [fired, once = newSignal()] {
        once->raise();
        if (once->count() == 1) fired->raise();  // timers of `scheduleAfter` may repeat
      }));
      arm(queue, i % 2 == 1, delay, [] {});
    }
  });
  trial.expect(fired, threads * timers, "timers fired");
  for (std::vector<Timer>& ofThread : armed) ofThread.clear();
  trial.finish(queue);
}

// The task's destructor uses the queue, as that of a promise does whose callback dispatches.
void dispatchingDestruction(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  const SharedSignal ran = newSignal();
  const auto dispatchAnother = [ran, weakQueue = std::weak_ptr<AsyncExecutor>(queue)] {
    if (const Queue own = weakQueue.lock()) {
      own->dispatch([ran] { ran->raise(); });
      arm(own, false, kHour, [] {});
    }
  };
  for (const bool schedule : {false, true}) {
    for (const std::int64_t delay : {std::int64_t(0), kHour}) {
      const SharedSignal fired = newSignal();
      Timer timer = arm(queue, schedule, delay, [fired, sentinel = whenGone(dispatchAnother)] { fired->raise(); });
      if (delay == 0) trial.expect(fired, 1, "timers fired");
      timer.reset();
    }
  }
  trial.expect(ran, 2, "tasks ran that the destruction of a timer's task dispatched");  // the cancelled ones may stay
  trial.finish(queue);
}

}  // namespace

std::vector<Situation> situationsOfTimers() {
  return {{"Timers of different delays", differentDelays},
          {"Timers of very long delays", longDelays},
          {"Timers that are due while a task runs", besideTasks},
          {"Timers that are cancelled in a task", cancelledInTask},
          {"Timers that are cancelled by another thread", cancelledByAnotherThread},
          {"Timers that are cancelled before they are due", cancelledBeforeDue},
          {"Timers that cancel themselves", cancelledByItself},
          {"Timers of several threads", severalThreads},
          {"Tasks from the destruction of a timer's task", dispatchingDestruction}};
}

}  // namespace velmora::mobile::xplat::cellar::test::conformance
