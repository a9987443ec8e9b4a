#include "host/JsonLinesAnalytics.h"

#include <glog/logging.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <exception>
#include <nlohmann/json.hpp>
#include <system_error>

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

// Keeps the members in their order.
using OrderedJson = nlohmann::ordered_json;

OrderedJson payloadValue(const std::string& payload) {
  OrderedJson parsed = OrderedJson::parse(payload, nullptr, false);
  return parsed.is_object() ? parsed : OrderedJson(payload);
}

OrderedJson timeValue(const std::string& time) {
  std::int64_t seconds = 0;
  const char* const end = time.data() + time.size();
  const auto [parsedTo, error] = std::from_chars(time.data(), end, seconds);
  const bool isNumber = error == std::errc() && parsedTo == end;
  return isNumber ? OrderedJson(seconds) : OrderedJson(time);
}

std::FILE* openForAppending(const std::string& path) {
  std::FILE* const file = std::fopen(path.c_str(), "ab");
  if (file == nullptr) {
    const int code = errno;
    throw FileUtilsIoException(code, "Could not open file: " + std::generic_category().message(code));
  }
  std::setvbuf(file, nullptr, _IONBF, 0);  // so that each line is written, or fails, at once
  return file;
}

}  // namespace

JsonLinesAnalytics::JsonLinesAnalytics(std::ostream& stream) : target_("a stream"), stream_(&stream) {}

JsonLinesAnalytics::JsonLinesAnalytics(const std::string& path)
    : target_("'" + path + "'"), stream_(nullptr), file_(openForAppending(path)) {}

JsonLinesAnalytics::~JsonLinesAnalytics() = default;

void JsonLinesAnalytics::logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                                  const std::string& time) {
  const Lock lock(mutex_);
  try {
    OrderedJson event;
    event["event"] = eventName;
    event["category"] = category;
    event["payload"] = payloadValue(payload);
    event["time"] = timeValue(time);
    const std::string line = event.dump(-1, ' ', false, OrderedJson::error_handler_t::replace) + "\n";
    // A part that a failed write may have left is ended first, so that it is not the beginning of this line.
    if (write(lock, failing_ ? "\n" + line : line)) {
      failing_ = false;
    } else {
      noteFailure(lock, stream_ == nullptr ? std::generic_category().message(errno) : "stream failed");
    }
  } catch (const std::exception& exception) {
    noteFailure(lock, exception.what());
  } catch (...) {
    noteFailure(lock, "unknown exception");
  }
}

bool JsonLinesAnalytics::write(const Lock& /*lock*/, const std::string& line) {
  if (stream_ == nullptr) return std::fwrite(line.data(), 1, line.size(), file_.get()) == line.size();
  stream_->clear();  // the cause of an earlier failure may be over
  stream_->write(line.data(), static_cast<std::streamsize>(line.size()));
  stream_->flush();
  return stream_->good();
}

void JsonLinesAnalytics::noteFailure(const Lock& /*lock*/, const std::string& reason) {
  if (!failing_) LOG(ERROR) << "Cannot write analytics to " << target_ << ": " << reason;
  failing_ = true;
}

void JsonLinesAnalytics::CloseFile::operator()(std::FILE* file) const { std::fclose(file); }

}  // namespace velmora::mobile::xplat::cellar::host
