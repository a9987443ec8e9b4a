#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <cellar/AnalyticsEventReporter.h>
#include <cellar/Export.h>
#include <cellar/JsonValue.h>
#include <cellar/XAnalytics.h>

namespace velmora::mobile::xplat::cellar::test {

// One call of the analytics sink, unchanged.
struct CELLAR_EXPORT LoggedEvent {
  std::string name;
  std::string category;
  std::string payload;
  std::string time;

  // The parsed payload. Throws what parsing throws.
  JsonValue json() const;
};

// Records events in the order of their arrival. Thread-safe.
class CELLAR_EXPORT EventLog {
 public:
  void add(LoggedEvent event);
  std::vector<LoggedEvent> events() const;
  std::vector<LoggedEvent> named(const std::string& name) const;
  void clear();

 private:
  mutable std::mutex mutex_;  // guards the events
  std::vector<LoggedEvent> events_;
};

// A sink that writes into an event log of the test.
class CELLAR_EXPORT RecordingAnalytics : public XAnalytics {
 public:
  explicit RecordingAnalytics(std::shared_ptr<EventLog> log);

  void logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                const std::string& time) override;

 private:
  std::shared_ptr<EventLog> log_;
};

// A reporter with such a sink.
CELLAR_EXPORT std::shared_ptr<AnalyticsEventReporter> recordingReporter(std::shared_ptr<EventLog> log);

}  // namespace velmora::mobile::xplat::cellar::test
