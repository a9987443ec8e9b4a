#pragma once

#include <functional>
#include <string>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar::host {

// Tells the host kit that the calling thread runs a task of a queue, as long as the mark exists: what
// `ThreadQueueFactory::refuseOnQueueThread` guards (`await`, `Host::logOut`, `Host::invalidate`) throws there as on the
// kit's own threads, instead of waiting for work that may have to run on this thread. For queues that are not the
// kit's: create a mark around each task. Marks of a thread nest; each is destroyed on the thread that created it.
class CELLAR_EXPORT QueueThreadMark {
 public:
  // `onRefusal` may be empty. Otherwise it is called with the name of an operation before that is refused, on this
  // thread, if this is the thread's innermost mark. What it throws leaves the operation instead of the refusal.
  explicit QueueThreadMark(std::function<void(const std::string& operation)> onRefusal = nullptr);
  ~QueueThreadMark();
  QueueThreadMark(const QueueThreadMark&) = delete;
  QueueThreadMark& operator=(const QueueThreadMark&) = delete;

  // Calls the function of the calling thread's innermost mark; false if the thread has no mark.
  static bool tell(const std::string& operation);

 private:
  const std::function<void(const std::string&)> onRefusal_;
  const QueueThreadMark* const outer_;
};

}  // namespace velmora::mobile::xplat::cellar::host
