#pragma once

#include <glog/logging.h>

#include <cstddef>
#include <fstream>
#include <mutex>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// Sends the process's log to a file instead of the terminal while it lives, and keeps the lines of errors. Any thread.
class ErrorLog : private google::LogSink {
 public:
  explicit ErrorLog(const std::string& file);
  ~ErrorLog() override;
  ErrorLog(const ErrorLog&) = delete;
  ErrorLog& operator=(const ErrorLog&) = delete;

  // The error lines since the last call, but for one that is no failure.
  std::vector<std::string> takeErrors();

 private:
  using google::LogSink::send;
  void send(google::LogSeverity severity, const char* path, const char* file, int line,
            const google::LogMessageTime& time, const char* message, std::size_t length) override;

  std::mutex mutex_;  // guards the two below
  std::vector<std::string> errors_;
  std::ofstream file_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
