#pragma once

#include <memory>

#include "AsyncExecutor.h"

namespace velmora::mobile::xplat::executor {

// Where the library gets its queues: it starts no threads of its own. May be called from any thread; never returns
// null.
struct CELLAR_EXPORT TaskQueueFactory {
  virtual ~TaskQueueFactory() = default;

  // A serial queue for file work: writing and deleting value files, emptying the trash, maintenance of a manager.
  virtual std::shared_ptr<AsyncExecutor> createQueue() = 0;

  // A serial queue for manifest work, for the creation of stores in the background, and for a host's handler of
  // incidents.
  virtual std::shared_ptr<AsyncExecutor> createWorkQueue() = 0;
};

}  // namespace velmora::mobile::xplat::executor

namespace velmora::mobile::xplat::cellar {
using executor::TaskQueueFactory;
}
