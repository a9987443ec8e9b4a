#include "demo/ErrorLog.h"

#include <utility>

namespace velmora::mobile::xplat::cellar::tools {

ErrorLog::ErrorLog(const std::string& file) : file_(file) { google::AddLogSink(this); }

ErrorLog::~ErrorLog() { google::RemoveLogSink(this); }

std::vector<std::string> ErrorLog::takeErrors() {
  const std::lock_guard<std::mutex> lock(mutex_);
  return std::exchange(errors_, {});
}

void ErrorLog::send(google::LogSeverity severity, const char* /*path*/, const char* file, int line,
                    const google::LogMessageTime& /*time*/, const char* message, std::size_t length) {
  const std::lock_guard<std::mutex> lock(mutex_);
  const std::string text(message, length);
  file_ << google::LogSeverityNames[severity] << ' ' << file << ':' << line << ' ' << text << std::endl;
  if (severity >= google::GLOG_ERROR) errors_.push_back(text);
}

}  // namespace velmora::mobile::xplat::cellar::tools
