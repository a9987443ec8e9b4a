#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <thread>
#include <utility>
#include <vector>

#include "executor/AsyncExecutor.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar::test {

// What a test sees of a timer that was armed on a ManualExecutor.
struct TimerInfo {
  std::int64_t delayNanoseconds;
  bool viaSchedule;  // armed with scheduleAfter, not with dispatchAfter
  bool cancelled;    // its handle was destroyed before it fired
  bool fired;
};

// A serial queue under the test's control: nothing runs until the test says so, then it runs on the calling thread, one
// task at a time even when several threads run the queue. A task that runs its own queue (as `onDispatch` may) nests.
// Thread-safe. An exception that leaves a task reaches whoever ran it; the task is gone by then.
class ManualExecutor : public AsyncExecutor {
 public:
  // Called after each dispatch on the dispatching thread, with no lock held: `queue.onDispatch = [&] { queue.runAll();
  // }` makes a queue that runs everything at once. To be set before other threads use the queue.
  std::function<void()> onDispatch;

  ManualExecutor() : state_(std::make_shared<State>()) {}
  ManualExecutor(const ManualExecutor&) = delete;
  ManualExecutor& operator=(const ManualExecutor&) = delete;
  ~ManualExecutor() override {
    dropAll();
    dropTimers();
  }

  void dispatch(std::function<void()> task) override {
    {
      const std::lock_guard<std::mutex> lock(state_->mutex);
      if (state_->throwsOnDispatch) throw std::runtime_error("The queue takes no tasks.");
      state_->tasks.push_back(std::move(task));
    }
    if (onDispatch) onDispatch();
  }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> companion) override {
    return arm({delayNanoseconds, false, false, false}, std::move(task), companion);
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> companion) override {
    return arm({delayNanoseconds, true, false, false}, std::move(task), companion);
  }

  std::size_t pending() const {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->tasks.size();
  }

  // Runs the oldest task; false when there is none. Waits while another thread runs one.
  bool runNext() {
    const Turn turn(state_);
    std::function<void()> task;
    {
      const std::lock_guard<std::mutex> lock(state_->mutex);
      if (state_->tasks.empty()) return false;
      task = std::move(state_->tasks.front());
      state_->tasks.pop_front();
    }
    task();
    return true;
  }

  // Runs until nothing is left, tasks added meanwhile too; the number of tasks run.
  std::size_t runAll() {
    std::size_t count = 0;
    while (runNext()) ++count;
    return count;
  }

  // Destroys the waiting tasks without running them, as a queue does that is shut down. Timers stay armed.
  void dropAll() {
    std::deque<std::function<void()>> dropped;  // destroyed after the lock: a task's destructor may use the queue
    const std::lock_guard<std::mutex> lock(state_->mutex);
    dropped.swap(state_->tasks);
  }

  // Every timer ever armed, oldest first.
  std::vector<TimerInfo> timers() const {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    std::vector<TimerInfo> infos;
    for (const std::shared_ptr<Entry>& entry : state_->timers) infos.push_back(entry->info);
    return infos;
  }

  // The delays of the timers that are neither cancelled nor fired, oldest first.
  std::vector<std::int64_t> armedDelays() const {
    std::vector<std::int64_t> delays;
    for (const TimerInfo& timer : timers()) {
      if (!timer.cancelled && !timer.fired) delays.push_back(timer.delayNanoseconds);
    }
    return delays;
  }

  // Runs the oldest armed timer of that delay on the calling thread; false when there is none.
  bool fireTimer(std::int64_t delayNanoseconds) {
    const Turn turn(state_);
    std::function<void()> task;
    {
      const std::lock_guard<std::mutex> lock(state_->mutex);
      const std::shared_ptr<Entry> entry = state_->armed(delayNanoseconds);
      if (!entry) return false;
      entry->info.fired = true;
      task = std::move(entry->task);
      entry->task = nullptr;
    }
    task();
    return true;
  }

  // While set, `dispatch` throws std::runtime_error and takes no task.
  void throwOnDispatch(bool throws) {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    state_->throwsOnDispatch = throws;
  }

  // How many timers came with a companion function.
  std::size_t companions() const {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->companions;
  }

  // Cancels every armed timer, as a queue does that is shut down. Their handles may live on.
  void dropTimers() {
    std::vector<std::function<void()>> dropped;
    const std::lock_guard<std::mutex> lock(state_->mutex);
    for (const std::shared_ptr<Entry>& entry : state_->timers) {
      if (entry->info.fired || entry->info.cancelled) continue;
      entry->info.cancelled = true;
      dropped.push_back(std::move(entry->task));
      entry->task = nullptr;
    }
  }

 private:
  struct Entry {
    TimerInfo info;
    std::function<void()> task;
  };

  struct State {
    std::mutex mutex;
    std::condition_variable idle;
    std::thread::id runner;  // who runs a task now
    int depth = 0;           // how many it runs, one inside the other
    std::deque<std::function<void()>> tasks;
    std::vector<std::shared_ptr<Entry>> timers;
    std::size_t companions = 0;
    bool throwsOnDispatch = false;

    std::shared_ptr<Entry> armed(std::int64_t delayNanoseconds) const {
      for (const std::shared_ptr<Entry>& entry : timers) {
        const TimerInfo& info = entry->info;
        if (info.delayNanoseconds == delayNanoseconds && !info.cancelled && !info.fired) return entry;
      }
      return nullptr;
    }
  };

  // The right to run a task: one thread at a time. No lock is held meanwhile, so a task may use the queue freely.
  class Turn {
   public:
    explicit Turn(std::shared_ptr<State> state) : state_(std::move(state)) {
      std::unique_lock<std::mutex> lock(state_->mutex);
      const std::thread::id self = std::this_thread::get_id();
      state_->idle.wait(lock, [&] { return state_->depth == 0 || state_->runner == self; });
      state_->runner = self;
      ++state_->depth;
    }
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;
    ~Turn() {
      const std::lock_guard<std::mutex> lock(state_->mutex);
      if (--state_->depth == 0) state_->idle.notify_all();
    }

   private:
    std::shared_ptr<State> state_;  // the task may let go of the queue itself
  };

  // The handle. It outlives the queue without harm.
  class Timer : public AsyncTimer {
   public:
    Timer(std::shared_ptr<State> state, std::shared_ptr<Entry> entry)
        : state_(std::move(state)), entry_(std::move(entry)) {}
    Timer(const Timer&) = delete;
    Timer& operator=(const Timer&) = delete;
    ~Timer() override {
      std::function<void()> dropped;
      const std::lock_guard<std::mutex> lock(state_->mutex);
      if (entry_->info.fired || entry_->info.cancelled) return;
      entry_->info.cancelled = true;
      dropped = std::move(entry_->task);
      entry_->task = nullptr;
    }

   private:
    std::shared_ptr<State> state_;
    std::shared_ptr<Entry> entry_;
  };

  std::unique_ptr<AsyncTimer> arm(const TimerInfo& info, std::function<void()> task,
                                  const std::function<void()>& companion) {
    const std::shared_ptr<Entry> entry = std::make_shared<Entry>(Entry{info, std::move(task)});
    const std::lock_guard<std::mutex> lock(state_->mutex);
    if (companion) ++state_->companions;
    state_->timers.push_back(entry);
    return std::make_unique<Timer>(state_, entry);
  }

  std::shared_ptr<State> state_;
};

// Hands out manual queues and keeps them in the order of their creation. Its destructor drops what still waits on them,
// so that a task which holds its own queue cannot keep it alive for ever. Thread-safe.
class ManualQueueFactory : public TaskQueueFactory {
 public:
  ManualQueueFactory() = default;
  ManualQueueFactory(const ManualQueueFactory&) = delete;
  ManualQueueFactory& operator=(const ManualQueueFactory&) = delete;
  ~ManualQueueFactory() override {
    for (const std::shared_ptr<ManualExecutor>& executor : all()) {
      executor->dropAll();
      executor->dropTimers();
    }
  }

  std::shared_ptr<AsyncExecutor> createQueue() override { return create(queues_); }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return create(workQueues_); }

  // The i-th queue that `createQueue` made; throws std::out_of_range when there are fewer.
  std::shared_ptr<ManualExecutor> queue(std::size_t i) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return queues_.at(i);
  }
  // The i-th queue that `createWorkQueue` made; throws std::out_of_range when there are fewer.
  std::shared_ptr<ManualExecutor> workQueue(std::size_t i) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return workQueues_.at(i);
  }
  std::size_t queueCount() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return queues_.size();
  }
  std::size_t workQueueCount() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return workQueues_.size();
  }

  // The queues, then the work queues, each in the order of their creation.
  std::vector<std::shared_ptr<ManualExecutor>> all() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::shared_ptr<ManualExecutor>> executors = queues_;
    executors.insert(executors.end(), workQueues_.begin(), workQueues_.end());
    return executors;
  }

  // Runs one task of each queue in turn until all are empty, queues created meanwhile too; the number of tasks run.
  std::size_t runAll() {
    std::size_t count = 0;
    for (std::size_t ran = 1; ran > 0; count += ran) {
      ran = 0;
      for (const std::shared_ptr<ManualExecutor>& executor : all()) {
        if (executor->runNext()) ++ran;
      }
    }
    return count;
  }

 private:
  using Executors = std::vector<std::shared_ptr<ManualExecutor>>;

  std::shared_ptr<AsyncExecutor> create(Executors& executors) {
    const std::lock_guard<std::mutex> lock(mutex_);
    executors.push_back(std::make_shared<ManualExecutor>());
    return executors.back();
  }

  mutable std::mutex mutex_;  // guards both lists
  Executors queues_;
  Executors workQueues_;
};

}  // namespace velmora::mobile::xplat::cellar::test
