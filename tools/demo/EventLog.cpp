#include "demo/EventLog.h"

namespace velmora::mobile::xplat::cellar::tools {

class EventLog::Sink : public XAnalytics {
 public:
  explicit Sink(EventLog& log) : log_(log) {}

  void logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                const std::string& time) override {
    log_.file_.logEvent(eventName, category, payload, time);
    const std::lock_guard<std::mutex> lock(log_.mutex_);
    log_.events_.push_back({eventName, payload});
  }

 private:
  EventLog& log_;
};

EventLog::EventLog(const std::string& file) : file_(file) {}

std::unique_ptr<XAnalytics> EventLog::sink() { return std::make_unique<Sink>(*this); }

std::map<std::string, std::size_t> EventLog::countsByName() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  std::map<std::string, std::size_t> counts;
  for (const Event& event : events_) ++counts[event.name];
  return counts;
}

std::vector<JsonValue> EventLog::payloads(const std::string& name) const {
  const std::lock_guard<std::mutex> lock(mutex_);
  std::vector<JsonValue> payloads;
  for (const Event& event : events_) {
    if (event.name == name) payloads.push_back(JsonValue::parse(event.payload));
  }
  return payloads;
}

}  // namespace velmora::mobile::xplat::cellar::tools
