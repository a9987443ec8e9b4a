#include "host/testing/RecordingAnalytics.h"

#include <utility>

namespace velmora::mobile::xplat::cellar::test {

JsonValue LoggedEvent::json() const { return JsonValue::parse(payload); }

void EventLog::add(LoggedEvent event) {
  const std::lock_guard<std::mutex> lock(mutex_);
  events_.push_back(std::move(event));
}

std::vector<LoggedEvent> EventLog::events() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return events_;
}

std::vector<LoggedEvent> EventLog::named(const std::string& name) const {
  std::vector<LoggedEvent> found;
  for (const LoggedEvent& event : events()) {
    if (event.name == name) found.push_back(event);
  }
  return found;
}

void EventLog::clear() {
  const std::lock_guard<std::mutex> lock(mutex_);
  events_.clear();
}

RecordingAnalytics::RecordingAnalytics(std::shared_ptr<EventLog> log) : log_(std::move(log)) {}

void RecordingAnalytics::logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                                  const std::string& time) {
  log_->add({eventName, category, payload, time});
}

std::shared_ptr<AnalyticsEventReporter> recordingReporter(std::shared_ptr<EventLog> log) {
  return std::make_shared<AnalyticsEventReporter>(std::make_unique<RecordingAnalytics>(std::move(log)));
}

}  // namespace velmora::mobile::xplat::cellar::test
