#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

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
    CreationFailed = 6      // a store could not be created
  };

  Kind kind;
  std::string name;         // of the store; of a discarded manager or a stuck trash, the path of its directory
  std::string key;          // of a damaged value; empty otherwise
  std::string description;  // what has happened and why, as in the log
};

// Hands incidents to a host. Any thread may call, with any lock held.
class CELLAR_EXPORT IncidentReporter {
 public:
  using Handler = std::function<void(const Incident& incident)>;

  // `handler` is called on `queue`, one incident at a time, with no lock held.
  IncidentReporter(std::shared_ptr<executor::AsyncExecutor> queue, Handler handler);

  // Never throws: a queue that takes no task is one line in the log.
  void report(Incident incident) const noexcept;

 private:
  const std::shared_ptr<executor::AsyncExecutor> queue_;
  const std::shared_ptr<const Handler> handler_;
};

}  // namespace velmora::mobile::xplat::cellar
