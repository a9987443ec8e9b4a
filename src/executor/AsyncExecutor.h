#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "AsyncTimer.h"

namespace velmora::mobile::xplat::executor {

// A queue of the host's. The library expects tasks dispatched on one queue to run one at a time, in the order of
// dispatch. Exceptions that leave a task are the executor's affair. All operations may be called from any thread.
struct CELLAR_EXPORT AsyncExecutor {
  virtual ~AsyncExecutor() = default;

  // Runs `task` once, later. A queue that is shut down may destroy it without running it.
  virtual void dispatch(std::function<void()> task) = 0;

  // Runs `task` once after `delayNanoseconds`, unless the handle is destroyed before. The library always passes an
  // empty `companion`.
  [[nodiscard]] virtual std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds,
                                                                  std::function<void()> task,
                                                                  std::function<void()> companion) = 0;

  // The same contract as `dispatchAfter`. A host may let these timers repeat until their handle is destroyed: the
  // library replaces the handle each time the task has run.
  [[nodiscard]] virtual std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds,
                                                                  std::function<void()> task,
                                                                  std::function<void()> companion) = 0;
};

}  // namespace velmora::mobile::xplat::executor

namespace velmora::mobile::xplat::cellar {
using executor::AsyncExecutor;
}
