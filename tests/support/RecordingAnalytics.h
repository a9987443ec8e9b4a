#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "JsonValue.h"
#include "XAnalytics.h"

namespace velmora::mobile::xplat::cellar::test {

// One call of the analytics sink, as it came.
struct LoggedEvent {
  std::string name;
  std::string category;
  std::string payload;
  std::string time;

  JsonValue json() const { return JsonValue::parse(payload); }
};

// Remembers events in the order in which they arrived. Thread-safe.
class EventLog {
 public:
  void add(LoggedEvent event) {
    const std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back(std::move(event));
  }

  std::vector<LoggedEvent> events() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return events_;
  }

  std::vector<LoggedEvent> named(const std::string& name) const {
    std::vector<LoggedEvent> found;
    for (const LoggedEvent& event : events()) {
      if (event.name == name) found.push_back(event);
    }
    return found;
  }

  void clear() {
    const std::lock_guard<std::mutex> lock(mutex_);
    events_.clear();
  }

 private:
  mutable std::mutex mutex_;  // guards the events
  std::vector<LoggedEvent> events_;
};

// A sink that writes into an event log, which the test keeps.
class RecordingAnalytics : public XAnalytics {
 public:
  explicit RecordingAnalytics(std::shared_ptr<EventLog> log) : log_(std::move(log)) {}

  void logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                const std::string& time) override {
    log_->add({eventName, category, payload, time});
  }

 private:
  std::shared_ptr<EventLog> log_;
};

inline std::shared_ptr<AnalyticsEventReporter> recordingReporter(std::shared_ptr<EventLog> log) {
  return std::make_shared<AnalyticsEventReporter>(std::make_unique<RecordingAnalytics>(std::move(log)));
}

}  // namespace velmora::mobile::xplat::cellar::test
