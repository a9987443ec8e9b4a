#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

#include <cellar/Export.h>
#include <cellar/executor/TaskQueueFactory.h>

namespace velmora::mobile::xplat::cellar::host {

namespace detail {

// Rounded up, from 0 to 100 years, so that longer durations of coarser units do not overflow.
template <class Rep, class Period>
std::chrono::milliseconds inMilliseconds(std::chrono::duration<Rep, Period> duration) {
  constexpr std::chrono::hours longest(24 * 365 * 100);
  if (duration >= longest) return longest;
  if (duration <= std::chrono::hours::zero()) return std::chrono::milliseconds::zero();
  return std::chrono::ceil<std::chrono::milliseconds>(duration);
}

}  // namespace detail

// Serial queues on a few threads, for applications that have no queues of their own. However many queues there are, the
// threads are one for each processor that the creating thread may use, named "cellar-1", "cellar-2" and so on, one more
// because tasks wait for the disk, and one for all timers ("cellar-timer"). Any thread may call, and a queue may be
// used from its own tasks.
//
// Queues: tasks of one queue run one at a time in the order of dispatch, each time on any of the threads. An exception
// that leaves a task is one error line in the log, which names the queue ("cellar-file-1", "cellar-work-2"), and the
// queue continues. A queue whose last reference is released runs what was dispatched; releasing never waits, so a task
// may release its own queue. Queues may outlive the factory: they are closed then.
//
// A task that takes long, or waits, takes a thread from all queues. If as many tasks wait for other queues as there are
// processors, and one more, nothing else runs.
//
// A thread without tasks sleeps. If tasks follow each other closely, one thread first looks out for the next for up to
// 100 microseconds, and no other is woken. On Linux the threads run as SCHED_BATCH, so that waking one does not preempt
// its waker.
//
// Timers: `dispatchAfter` and `scheduleAfter` both fire once, on their queue. A delay of 0 or less is due at once; a
// delay beyond the range of the clock never ends. Companions are ignored. When the handle's destructor returns, the
// task is running, has run, or will never run; in the last case its captures are destroyed, or another thread is
// just destroying them. The destructor does not wait for a running task, so a handle may be destroyed under a lock and
// by the task itself. A timer does not keep its queue open.
//
// Closing (`shutDown`, `abandon`, the destructor): tasks that were dispatched before still run, timers that have not
// fired are dropped, and tasks that are dispatched afterwards, also by those tasks, are destroyed without running, on
// the caller's thread, which breaks their promises. To finish work that passes from queue to queue first, call
// `refuseNewWork` and `drain`.
class CELLAR_EXPORT ThreadQueueFactory : public TaskQueueFactory {
 public:
  // Starts the threads. Throws `std::system_error` if the system cannot start one.
  ThreadQueueFactory();

  // As `shutDown`; on a thread of its own (a task held the last reference) as `abandon`.
  ~ThreadQueueFactory() override;

  ThreadQueueFactory(const ThreadQueueFactory&) = delete;
  ThreadQueueFactory& operator=(const ThreadQueueFactory&) = delete;

  // A new queue, which is one object and no thread. After closing, a closed queue.
  std::shared_ptr<AsyncExecutor> createQueue() override;
  std::shared_ptr<AsyncExecutor> createWorkQueue() override;

  // Whether the calling thread is one of this factory's.
  bool isOwnThread() const;

  // Throws `std::logic_error` on a thread of any factory and under a `QueueThreadMark`: what `operation` waits for may
  // have to run there. The text names the operation and ends with the advice.
  static void refuseOnQueueThread(const std::string& operation, const std::string& advice);

  // Tasks of all queues together, as a snapshot. Does not wait for them. A thread on its way to sleep counts as one
  // that runs a task, for some microseconds, if there are tasks.
  struct Load {
    std::size_t waiting;
    std::size_t running;
  };
  Load load() const;

  // Waits until no queue has anything to run, including what tasks dispatch to other queues; false if that takes longer
  // than `patience`. Armed timers do not count. Says nothing about what other threads dispatch during the call. Called
  // from a task of these queues it would deadlock, so it returns false at once.
  bool drain(std::chrono::milliseconds patience);

  // The same, in any unit; rounded up to milliseconds.
  template <class Rep, class Period> bool drain(std::chrono::duration<Rep, Period> patience) {
    return drain(detail::inMilliseconds(patience));
  }

  // From now on tasks that other threads dispatch are destroyed without running, on those threads, and timers are
  // dropped; tasks that were dispatched before run, and so do those that they dispatch. So `drain` ends, however busy
  // other threads are, unless tasks keep dispatching further ones forever.
  void refuseNewWork();

  // Closes and waits for the threads: when it returns, no task is running (unless `abandon` was called before). From a
  // task of these queues it closes and returns at once. May be called again.
  void shutDown();

  // Closes without waiting: the threads are detached, and end when they have run what was dispatched. For queues with a
  // task that is stuck.
  void abandon();

 private:
  class Threads;

  const std::unique_ptr<Threads> threads_;
};

}  // namespace velmora::mobile::xplat::cellar::host
