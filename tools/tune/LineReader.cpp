#include "tune/LineReader.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kStandardInput = "-";

[[noreturn]] void failToRead(const std::string& name, int code) {
  throw InputError("cannot read '" + name + "': " + std::generic_category().message(code));
}

}  // namespace

LineReader::LineReader(const std::string& path)
    : name_(path == kStandardInput ? "standard input" : path),
      file_(path == kStandardInput ? stdin : std::fopen(path.c_str(), "rbe")) {
  if (file_ == nullptr) failToRead(name_, errno);
  struct stat info {};
  if (fstat(fileno(file_.get()), &info) == 0 && S_ISREG(info.st_mode)) {
    bytesInAll_ = static_cast<std::uint64_t>(info.st_size);
  }
}

LineReader::~LineReader() = default;

bool LineReader::next(std::string& line) {
  char* raw = buffer_.release();
  errno = 0;
  const auto length = getline(&raw, &bufferSize_, file_.get());
  buffer_.reset(raw);
  if (length < 0) {
    if (std::feof(file_.get()) == 0) failToRead(name_, errno);
    return false;
  }
  ++lineNumber_;
  bytesRead_ += static_cast<std::uint64_t>(length);
  line.assign(raw, static_cast<std::size_t>(length));
  if (!line.empty() && line.back() == '\n') line.pop_back();
  if (!line.empty() && line.back() == '\r') line.pop_back();
  return true;
}

void LineReader::fail(const std::string& text) const {
  throw InputError(name_ + ":" + std::to_string(lineNumber_) + ": " + text);
}

void LineReader::CloseFile::operator()(std::FILE* file) const {
  if (file != stdin) (void)std::fclose(file);
}

void LineReader::FreeBuffer::operator()(char* buffer) const {
  std::free(buffer);  // NOLINT(cppcoreguidelines-no-malloc): getline has made it
}

}  // namespace velmora::mobile::xplat::cellar::tools
