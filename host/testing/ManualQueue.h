#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include <cellar/Export.h>
#include <cellar/executor/AsyncExecutor.h>
#include <cellar/executor/TaskQueueFactory.h>

namespace velmora::mobile::xplat::cellar::test {

// A timer that was armed on a ManualExecutor.
struct TimerInfo {
  std::int64_t delayNanoseconds;
  bool viaSchedule;  // armed with scheduleAfter, not with dispatchAfter
  bool cancelled;    // its handle was destroyed before it fired
  bool fired;
};

// A serial queue under the test's control: nothing runs until the test says so. Tasks then run on the calling thread,
// one at a time even when several threads run the queue. A task that runs its own queue (as `onDispatch` may) nests.
// Thread-safe. An exception that leaves a task is passed to the caller; the task is destroyed by then.
class CELLAR_EXPORT ManualExecutor : public AsyncExecutor {
 public:
  // Called after each dispatch on the dispatching thread, without a lock. With
  // `queue.onDispatch = [&] { queue.runAll(); }` the queue runs everything at once. Set it before other threads use the
  // queue.
  std::function<void()> onDispatch;

  // The same before the task is added: what it dispatches comes first, as another thread's may.
  std::function<void()> beforeDispatch;

  ManualExecutor();
  ManualExecutor(const ManualExecutor&) = delete;
  ManualExecutor& operator=(const ManualExecutor&) = delete;
  ~ManualExecutor() override;

  // Throws std::runtime_error and drops the task while `throwOnDispatch` is set.
  void dispatch(std::function<void()> task) override;

  [[nodiscard]] std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                                          std::function<void()> companion) override;
  [[nodiscard]] std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                                          std::function<void()> companion) override;

  // The number of waiting tasks.
  std::size_t pending() const;

  // Runs the oldest task; false if there is none. Waits while another thread runs one.
  bool runNext();

  // Runs tasks until none is left, including those added meanwhile; returns the number of tasks run.
  std::size_t runAll();

  // Destroys the waiting tasks without running them, like a queue that is shut down. Timers remain armed.
  void dropAll();

  // Every timer that was ever armed, oldest first.
  std::vector<TimerInfo> timers() const;

  // The delays of the timers that are neither cancelled nor fired, oldest first.
  std::vector<std::int64_t> armedDelays() const;

  // Runs the oldest armed timer with that delay on the calling thread; false if there is none.
  bool fireTimer(std::int64_t delayNanoseconds);

  // Cancels every armed timer, like a queue that is shut down. Their handles may continue to exist.
  void dropTimers();

  void throwOnDispatch(bool throws);

  // The number of timers that were armed with a companion function.
  std::size_t companions() const;

 private:
  struct Entry;
  struct State;
  class Turn;
  class Timer;

  std::unique_ptr<AsyncTimer> arm(const TimerInfo& info, std::function<void()> task,
                                  const std::function<void()>& companion);

  std::shared_ptr<State> state_;
};

// Creates manual queues and keeps them in the order of their creation. Its destructor drops their waiting tasks, so
// that a task that holds its own queue cannot keep it alive forever. Thread-safe.
class CELLAR_EXPORT ManualQueueFactory : public TaskQueueFactory {
 public:
  ManualQueueFactory();
  ManualQueueFactory(const ManualQueueFactory&) = delete;
  ManualQueueFactory& operator=(const ManualQueueFactory&) = delete;
  ~ManualQueueFactory() override;

  std::shared_ptr<AsyncExecutor> createQueue() override;
  std::shared_ptr<AsyncExecutor> createWorkQueue() override;

  // The i-th queue that `createQueue` made; throws std::out_of_range when there are fewer.
  std::shared_ptr<ManualExecutor> queue(std::size_t i) const;

  // The i-th queue that `createWorkQueue` made; throws std::out_of_range when there are fewer.
  std::shared_ptr<ManualExecutor> workQueue(std::size_t i) const;

  std::size_t queueCount() const;
  std::size_t workQueueCount() const;

  // The queues, then the work queues, each in the order of their creation.
  std::vector<std::shared_ptr<ManualExecutor>> all() const;

  // Runs one task of each queue in turn until all are empty, including queues created meanwhile; returns the number of
  // tasks run.
  std::size_t runAll();

 private:
  using Executors = std::vector<std::shared_ptr<ManualExecutor>>;

  std::shared_ptr<AsyncExecutor> create(Executors& executors);

  mutable std::mutex mutex_;  // guards both lists
  Executors queues_;
  Executors workQueues_;
};

}  // namespace velmora::mobile::xplat::cellar::test
