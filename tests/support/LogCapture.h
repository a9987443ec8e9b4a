#pragma once

#include <glog/logging.h>

#include <algorithm>
#include <cstddef>
#include <mutex>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::test {

struct LogLine {
  std::string message;
  std::string file;  // base name
  int severity;      // google::GLOG_ERROR and its like
};

// Remembers every line that the process logs while it lives. Thread-safe.
class LogCapture : private google::LogSink {
 public:
  LogCapture() { google::AddLogSink(this); }
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;
  ~LogCapture() override { google::RemoveLogSink(this); }

  std::vector<LogLine> lines() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return lines_;
  }

  std::vector<std::string> messages() const {
    std::vector<std::string> messages;
    for (const LogLine& line : lines()) messages.push_back(line.message);
    return messages;
  }

  // Whether some line has the text in it.
  bool contains(const std::string& text) const {
    const std::vector<LogLine> all = lines();
    return std::any_of(all.begin(), all.end(),
                       [&](const LogLine& line) { return line.message.find(text) != std::string::npos; });
  }

  std::size_t errorCount() const {
    const std::vector<LogLine> all = lines();
    return static_cast<std::size_t>(
        std::count_if(all.begin(), all.end(), [](const LogLine& line) { return line.severity == google::GLOG_ERROR; }));
  }

 private:
  using google::LogSink::send;
  void send(google::LogSeverity severity, const char* /*path*/, const char* file, int /*line*/,
            const google::LogMessageTime& /*time*/, const char* message, std::size_t length) override {
    const std::lock_guard<std::mutex> lock(mutex_);
    lines_.push_back({std::string(message, length), file, severity});
  }

  mutable std::mutex mutex_;  // guards the lines
  std::vector<LogLine> lines_;
};

}  // namespace velmora::mobile::xplat::cellar::test
