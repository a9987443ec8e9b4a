#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

#include "Export.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

// Holds back work that is not urgent at start-up, until a delay has passed or the host says that the moment has come;
// then every task goes to the executor it was added with, in the order of adding. Once released, later tasks go
// straight through. Destroying the dispatcher cancels the delay and drops the tasks that it still holds.
class CELLAR_EXPORT LazyDispatcher : public std::enable_shared_from_this<LazyDispatcher> {
 public:
  // A dispatcher whose delay (seconds) has begun to run on a work queue of its own. With 0 the tasks are still released
  // by the timer, not by this call.
  static std::shared_ptr<LazyDispatcher> createLazyDispatcher(const std::shared_ptr<TaskQueueFactory>& taskQueueFactory,
                                                              long delaySeconds);

  // Takes its queue and arms nothing; `createLazyDispatcher` is the usual way.
  explicit LazyDispatcher(const std::shared_ptr<TaskQueueFactory>& taskQueueFactory);
  ~LazyDispatcher();
  LazyDispatcher(const LazyDispatcher&) = delete;
  LazyDispatcher& operator=(const LazyDispatcher&) = delete;

  // Holds the task back, or hands it over at once when the moment has passed; a task is never both held and forgotten.
  // Any thread. Throws `std::invalid_argument` for a null executor, and what the executor's `dispatch` throws (called
  // under the dispatcher's lock: it must not come back here).
  void addTask(const std::function<void()>& task, const std::shared_ptr<AsyncExecutor>& executor);

  // Restarts the delay, cancelling the one that runs.
  void scheduleDispatch(long delaySeconds);

  // Releases all held tasks now. Any thread; calling it again does no harm. When an executor's `dispatch` throws, the
  // tasks that come after it are lost.
  void dispatchNow();

  // Cancels the delay: the host promises to call `dispatchNow` itself. Any thread.
  void willBeTriggeredExternally();

 private:
  using Task = std::pair<std::function<void()>, std::shared_ptr<AsyncExecutor>>;

  std::mutex mutex_;  // guards the three below
  std::vector<Task> tasks_;
  bool triggeredExternally_ = false;
  bool dispatched_ = false;

  const std::shared_ptr<AsyncExecutor> queue_;

  std::mutex timerMutex_;  // guards the timer; never held while a timer is destroyed
  std::unique_ptr<AsyncTimer> timer_;

  void replaceTimer(std::unique_ptr<AsyncTimer> timer);
};

}  // namespace velmora::mobile::xplat::cellar
