#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "JsonValue.h"
#include "XAnalytics.h"
#include "host/JsonLinesAnalytics.h"

namespace velmora::mobile::xplat::cellar::tools {

// Remembers the analytics events of all runs of an application, and writes them to a file as well. Any thread.
class EventLog {
 public:
  explicit EventLog(const std::string& file);

  // A sink for one run of the application. The log must outlive it.
  std::unique_ptr<XAnalytics> sink();

  std::map<std::string, std::size_t> countsByName() const;

  // The payloads of the events of that name, oldest first.
  std::vector<JsonValue> payloads(const std::string& name) const;

 private:
  class Sink;

  struct Event {
    std::string name;
    std::string payload;
  };

  mutable std::mutex mutex_;  // guards the events
  std::vector<Event> events_;
  host::JsonLinesAnalytics file_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
