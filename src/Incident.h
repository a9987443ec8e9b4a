#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "Export.h"
#include "executor/AsyncExecutor.h"

namespace velmora::mobile::xplat::cellar {

// Something that has happened to stored data, or may, and that nobody has asked for.
struct CELLAR_EXPORT Incident {
  enum class Kind : int {
    StorePurged = 0,        // a relaxed store's manifest was damaged or could not be written: all its values are gone
    StoreSalvaged = 1,      // a safe store's manifest was damaged: what could be read of it was kept
    ValuesQuarantined = 2,  // what could not be read was moved to the store's quarantine
    DamagedValue = 3,       // a value's bytes are not those that were stored
    ManagerDiscarded = 4,   // at start, because the file system is too small
    TrashStuck = 5,         // something in the trash cannot be deleted
    CreationFailed = 6,     // a store could not be created
    OverLimit = 7           // an unmanaged cache was measured with more than its limit
  };

  Kind kind;
  std::string name;         // of the store; of a discarded manager or a stuck trash, the path of its directory
  std::string key;          // of a damaged value; empty otherwise
  std::string description;  // what has happened and why, as in the log
};

// Hands incidents to a host. Any thread may call, with any lock held.
//
// The handler is called on the queue. If that runs tasks later, no lock of the library is held then. If it runs a task
// at once, on the thread that dispatches it, managers report without a lock too; but a store reports with its mutex
// held, and on such queues an operation of a store may also run a pass of the trash. A handler must not use stores
// there.
class CELLAR_EXPORT IncidentReporter {
 public:
  using Handler = std::function<void(const Incident& incident)>;

  // `handler` is called on `queue`, one incident at a time as the queue is serial. What it throws is one error line in
  // the log. Neither may be empty. The reporter keeps both.
  IncidentReporter(std::shared_ptr<executor::AsyncExecutor> queue, Handler handler);

  // Returns without waiting for the handler, unless the queue runs its tasks at once. Never throws: a queue that takes
  // no task is one error line in the log, and the incident is lost.
  void report(Incident incident) const noexcept;

 private:
  const std::shared_ptr<executor::AsyncExecutor> queue_;
  const std::shared_ptr<const Handler> handler_;
};

// While one exists, the incidents that its thread reports wait. They are dispatched, in their order, when the thread's
// outermost one is destroyed. Create it before you take a lock that a handler may need: a queue that runs tasks at once
// would call the handler with that lock held. It is destroyed on the thread that has created it.
class CELLAR_EXPORT IncidentDeferral {
 public:
  IncidentDeferral();
  ~IncidentDeferral();
  IncidentDeferral(const IncidentDeferral&) = delete;
  IncidentDeferral& operator=(const IncidentDeferral&) = delete;

 private:
  friend class IncidentReporter;

  mutable std::vector<std::function<void()>> reports_;  // so that a deferral may be declared const
};

}  // namespace velmora::mobile::xplat::cellar
