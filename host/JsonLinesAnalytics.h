#pragma once

#include <cstdio>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>

#include <cellar/Export.h>
#include <cellar/XAnalytics.h>

namespace velmora::mobile::xplat::cellar::host {

// Writes every event as one line, a JSON object:
//   {"event":"qztrash_collector","category":"perf","payload":{"time_spent":1.5,"file_count":4},"time":1753920000}
// "payload" is the payload's object, or its text when it is not a JSON object; "time" is a number when it is one, else
// the text. What is not UTF-8 is written with replacement characters. Any thread; lines never mix.
//
// Lines are handed to the system one by one: those written before the process is killed are kept. When a line cannot be
// written (a full disk, say) it is lost, nothing is thrown, and the first failure of a row is one error line in the
// log; the line after it starts on a line of its own.
class CELLAR_EXPORT JsonLinesAnalytics : public XAnalytics {
 public:
  // Writes to a stream, which the caller keeps alive and leaves to this sink, and flushes it after each line.
  explicit JsonLinesAnalytics(std::ostream& stream);

  // Appends to a file, creating it if need be. Throws `FileUtilsIoException` "Could not open file: " + the system's
  // text when that fails; its code is the `errno`.
  explicit JsonLinesAnalytics(const std::string& path);

  ~JsonLinesAnalytics() override;
  JsonLinesAnalytics(const JsonLinesAnalytics&) = delete;
  JsonLinesAnalytics& operator=(const JsonLinesAnalytics&) = delete;

  // Never throws.
  void logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                const std::string& time) override;

 private:
  struct CloseFile {
    void operator()(std::FILE* file) const;
  };

  using Lock = std::lock_guard<std::mutex>;

  bool write(const Lock& lock, const std::string& line);
  void noteFailure(const Lock& lock, const std::string& reason);

  std::mutex mutex_;  // guards all below
  std::ostream* const stream_;
  const std::unique_ptr<std::FILE, CloseFile> file_;  // used when there is no stream
  bool failing_ = false;
};

}  // namespace velmora::mobile::xplat::cellar::host
