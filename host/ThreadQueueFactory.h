#pragma once

#include <chrono>
#include <memory>
#include <string>

#include <cellar/Export.h>
#include <cellar/executor/TaskQueueFactory.h>

namespace velmora::mobile::xplat::cellar::host {

// Serial queues with one thread each, for applications that have no queues of their own. Threads are named after their
// role and number ("cellar-file-1", "cellar-work-2") where the system can show it; one more ("cellar-timer") serves the
// timers of all queues. Any thread may call, and a queue may be used from its own tasks.
//
// Queues: tasks of one queue run one at a time in the order of dispatch; an exception that leaves a task is one error
// line in the log, and the queue goes on. A queue whose last owner lets go finishes what was dispatched and then ends
// its thread; letting go never waits, so a task may drop its own queue. Queues may outlive the factory: they are closed
// then.
//
// A thread that has nothing to do sleeps; where tasks follow each other closely it looks out for the next one for up to
// 200 microseconds first. On Linux the threads are batch threads: waking one never takes the processor from who did.
//
// Timers: they fire once, on their queue, however they were armed; a delay of 0 or less is due at once, one that is
// longer than the clock can say never comes. Companions are ignored. When the handle's destructor returns, the task
// either runs already (or has run) or never will, and in the latter case what it captured is gone; a running task is
// not waited for, so a handle may be destroyed under a lock and by the task itself. A timer does not keep its queue
// open.
//
// Closing (`shutDown`, `abandon`, the destructor): what was dispatched before still runs, timers that have not fired
// are dropped, and what is dispatched afterwards, by those tasks too, is destroyed unrun on the caller's thread, which
// fails the promises that it holds. To have work that goes from queue to queue finished first, `refuseNewWork` and
// `drain`.
class CELLAR_EXPORT ThreadQueueFactory : public TaskQueueFactory {
 public:
  // Starts the timer thread. Throws `std::system_error` when the system gives no thread.
  ThreadQueueFactory();

  // `shutDown` where threads can be waited for. On a thread of its own (a task held the last reference) it is
  // `abandon`.
  ~ThreadQueueFactory() override;

  ThreadQueueFactory(const ThreadQueueFactory&) = delete;
  ThreadQueueFactory& operator=(const ThreadQueueFactory&) = delete;

  // A new queue, with a thread of the file or of the work role. After closing, a queue that is closed. Throws
  // `std::system_error` when the system gives no thread.
  std::shared_ptr<AsyncExecutor> createQueue() override;
  std::shared_ptr<AsyncExecutor> createWorkQueue() override;

  // Throws `std::logic_error` on a thread of whichever factory: what `operation` waits for may have to be done there.
  // The text names the operation and ends with the advice.
  static void refuseOnQueueThread(const std::string& operation, const std::string& advice);

  // Waits until no queue has anything to run, what tasks hand on to other queues included; false when that has not come
  // about after `patience`. Armed timers do not count. Tells nothing about what other threads dispatch meanwhile.
  // Called from a task of these queues it would wait for itself: false at once.
  bool drain(std::chrono::milliseconds patience);

  // From now on what other threads dispatch is destroyed unrun, on their threads, and timers are dropped; what was
  // dispatched before runs, and so does what that dispatches. So `drain` ends, however busy other threads are; tasks
  // that keep dispatching further ones without end hold it up.
  void refuseNewWork();

  // Closes and waits for the threads: no task runs any more when it returns. From a task of these queues it closes and
  // returns at once. Calling it again does no harm.
  void shutDown();

  // Closes and waits for nobody: the threads end by themselves when they have run what was dispatched. For queues with
  // a task that is stuck.
  void abandon();

 private:
  class Threads;

  const std::unique_ptr<Threads> threads_;
};

}  // namespace velmora::mobile::xplat::cellar::host
