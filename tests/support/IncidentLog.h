#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "Incident.h"
#include "host/testing/ManualQueue.h"

namespace velmora::mobile::xplat::cellar::test {

// "CreationFailed thumbs: description", with " of key" before the colon if there is one.
inline std::string textOf(const Incident& incident) {
  static const std::vector<std::string> kinds = {"StorePurged",    "StoreSalvaged",    "ValuesQuarantined",
                                                 "DamagedValue",   "ManagerDiscarded", "TrashStuck",
                                                 "CreationFailed", "OverLimit"};
  return kinds.at(static_cast<std::size_t>(incident.kind)) + " " + incident.name +
         (incident.key.empty() ? "" : " of " + incident.key) + ": " + incident.description;
}

// A reporter on a manual queue of its own, and what its handler has been given. Not thread-safe.
class IncidentLog {
 public:
  // Called by the handler, behind the recording. May throw.
  std::function<void(const Incident& incident)> onIncident;

  const std::shared_ptr<ManualExecutor> queue = std::make_shared<ManualExecutor>();
  const std::shared_ptr<const IncidentReporter> reporter =
      std::make_shared<const IncidentReporter>(queue, [this](const Incident& incident) {
        texts_.push_back(textOf(incident));
        if (onIncident) onIncident(incident);
      });

  IncidentLog() = default;
  IncidentLog(const IncidentLog&) = delete;
  IncidentLog& operator=(const IncidentLog&) = delete;

  // From now on the queue runs each task as it is dispatched, on the thread that dispatches it.
  void runAtOnce() {
    queue->onDispatch = [raw = queue.get()] { raw->runAll(); };
  }

  // Runs the queue. What has been handed over since the last call.
  std::vector<std::string> take() {
    queue->runAll();
    return std::exchange(texts_, {});
  }

 private:
  std::vector<std::string> texts_;
};

}  // namespace velmora::mobile::xplat::cellar::test
