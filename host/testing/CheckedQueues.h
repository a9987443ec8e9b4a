#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <cellar/Export.h>
#include <cellar/executor/AsyncExecutor.h>
#include <cellar/executor/TaskQueueFactory.h>

namespace velmora::mobile::xplat::cellar::test {

struct CheckedQueuesOptions {
  // Tasks may run inside the call that dispatches them and inside each other, on one thread: for queues that run their
  // tasks at once on purpose.
  bool allowInline = false;

  // Timers may fire before they are due by the real clock: for queues under a test's control, as `ManualExecutor`.
  bool allowEarlyTimers = false;

  // Called with each violation as soon as it is seen, on the thread that sees it and without a lock. What it throws is
  // ignored. Empty: violations are only kept.
  std::function<void(const std::string& violation)> onViolation;
};

// Hands out the queues of another factory and reports where they break the contract of `AsyncExecutor`, on which the
// library relies without noticing: with a pool that is not serial it stores wrong values and throws nothing. Run your
// tests on it. Thread-safe.
//
// A violation is a sentence that names the queue by its role and its number within the role, from 1: "Work queue 2:
// task 7 began before task 6 had ended, on another thread. Tasks of a queue run one at a time." Tasks and timers are
// numbered per queue, in the order of the calls. What is reported, each with certainty:
// - a task or timer that begins while another one of its queue is running;
// - a task that begins before one whose `dispatch` had returned when its own was called;
// - a task or timer that runs inside the call that was given it, on the caller's thread;
// - a task, or a timer of `dispatchAfter`, that runs again (timers of `scheduleAfter` may repeat);
// - a timer that begins before its delay is over, by `std::chrono::steady_clock`;
// - a timer that begins although its handle was destroyed before. A destruction that races with the beginning of the
//   run is in order, so only these are reported: a handle that was destroyed before the timer was due, or while a task
//   of the queue was running, or before another task of the queue began;
// - what is refused in a task with a `host::QueueThreadMark`, as `host::await` and `Host::logOut`: these throw
//   `std::logic_error` in tasks of checked queues, whatever threads the queues have. A wait that the host kit does not
//   know (`Future::get`, a condition variable) is not seen;
// - a factory that returns null (the null pointer is passed on).
// Tasks that the host drops are not violations. Nothing else is changed: exceptions of tasks and of the host's calls
// pass through, and tasks are destroyed where the host destroys them. Queues and handles may outlive this factory.
class CELLAR_EXPORT CheckedQueues : public TaskQueueFactory {
 public:
  // `queues` must not be null.
  explicit CheckedQueues(std::shared_ptr<TaskQueueFactory> queues, CheckedQueuesOptions options = {});
  ~CheckedQueues() override;
  CheckedQueues(const CheckedQueues&) = delete;
  CheckedQueues& operator=(const CheckedQueues&) = delete;

  std::shared_ptr<AsyncExecutor> createQueue() override;
  std::shared_ptr<AsyncExecutor> createWorkQueue() override;

  // The violations so far, oldest first; of more than 100 the first 100.
  [[nodiscard]] std::vector<std::string> violations() const;

 private:
  class Log;

  const std::shared_ptr<TaskQueueFactory> queues_;
  const std::shared_ptr<Log> log_;
};

}  // namespace velmora::mobile::xplat::cellar::test
