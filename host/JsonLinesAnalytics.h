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
// "payload" is the payload as an object, or as a text if it is not a JSON object; "time" is a number if the time is
// one, else a text. Text that is not UTF-8 is written with replacement characters. Any thread; lines never mix.
//
// Lines are written to the system one by one: those written before the process is killed are kept. A line that cannot
// be written (for example on a full disk) is lost, and nothing is thrown. The first of several failures in a row is
// one error line in the log. The next line begins on a new line.
class CELLAR_EXPORT JsonLinesAnalytics : public XAnalytics {
 public:
  // Writes to a stream and flushes it after each line. The caller keeps the stream alive and does not use it otherwise.
  explicit JsonLinesAnalytics(std::ostream& stream);

  // Appends to a file, which is created if it does not exist. Throws `FileUtilsIoException` "Could not open file: " +
  // the system's text if that fails; its code is the `errno`.
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

  std::mutex mutex_;          // guards everything below
  const std::string target_;  // for the log: the file, or "a stream"
  std::ostream* const stream_;
  const std::unique_ptr<std::FILE, CloseFile> file_;  // used when there is no stream
  bool failing_ = false;
};

}  // namespace velmora::mobile::xplat::cellar::host
