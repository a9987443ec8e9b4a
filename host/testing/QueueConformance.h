#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <cellar/Export.h>
#include <cellar/executor/TaskQueueFactory.h>

namespace velmora::mobile::xplat::cellar::test {

struct QueueConformanceOptions {
  // How long the check waits for something that has to happen, at most one hour. Correct queues never use it up, so it
  // can be long for machines under load; it is what a failure costs.
  std::chrono::milliseconds patience = std::chrono::seconds(30);

  // What these queues promise beyond the contract of `AsyncExecutor`, each a further check. `host::ThreadQueueFactory`
  // promises all of it.
  bool continueAfterExceptions = false;  // an exception out of a task or timer does not stop its queue
  bool finishReleasedQueues = false;     // a queue whose last reference is released runs what was dispatched
  bool fireScheduledTimersOnce = false;  // timers of `scheduleAfter` do not repeat
  bool destroyCancelledTasks = false;    // before the destructor of the handle returns, unless the task has begun
  bool closeWithFactory = false;         // when the factory's destructor has returned, what was dispatched has run,
                                         // timers were dropped, and `dispatch` destroys its task without running it
};

// Checks the queues of a host against the contract of `AsyncExecutor`: order, one task at a time, each exactly once and
// later; tasks that dispatch, that create and release queues, and whose destruction dispatches; timers that are due at
// once or never, that are cancelled from everywhere; queues that are released with tasks and timers on them. Returns a
// sentence for each violation, which begins with the situation in which it was seen; empty: none was found.
//
// `make` returns a new factory at each call, owned by the check, and is called some twenty times, on other threads. Its
// queues have to run by themselves, but need not have threads of their own: one thread for all is in order.
//
// It takes well below a second with correct queues, and its verdict does not depend on the speed of the machine: a
// violation is reported only where no delay can explain it. The reverse is not certain: a queue that fails rarely may
// pass. What does not end (a call that deadlocks) is a violation, and left behind on a thread of its own.
[[nodiscard]] CELLAR_EXPORT std::vector<std::string> checkConformance(
    const std::function<std::shared_ptr<TaskQueueFactory>()>& make, const QueueConformanceOptions& options = {});

}  // namespace velmora::mobile::xplat::cellar::test
