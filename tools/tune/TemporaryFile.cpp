#include "tune/TemporaryFile.h"

#include <unistd.h>

#include <cerrno>
#include <string>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

[[noreturn]] void fail(const char* what, int code) {
  throw InputError(std::string(what) + ": " + std::generic_category().message(code));
}

}  // namespace

TemporaryFile::TemporaryFile() : file_(std::tmpfile()) {
  if (file_ == nullptr) fail("cannot create a temporary file for the accesses", errno);
}

TemporaryFile::~TemporaryFile() = default;

void TemporaryFile::append(const void* data, std::size_t size) {
  if (std::fwrite(data, size, 1, file_.get()) != 1) fail("cannot keep the accesses", errno);
}

void TemporaryFile::writeAt(std::uint64_t offset, const void* data, std::size_t size) {
  const char* from = static_cast<const char*>(data);
  while (size > 0) {
    const ssize_t written = ::pwrite(fileno(file_.get()), from, size, static_cast<off_t>(offset));
    if (written <= 0 && errno != EINTR) fail("cannot keep the accesses", errno);
    if (written <= 0) continue;
    from += written;
    offset += static_cast<std::uint64_t>(written);
    size -= static_cast<std::size_t>(written);
  }
}

void TemporaryFile::readAt(std::uint64_t offset, void* data, std::size_t size) const {
  if (std::fflush(file_.get()) != 0) fail("cannot keep the accesses", errno);
  char* to = static_cast<char*>(data);
  while (size > 0) {
    errno = EIO;  // of a file that is too short
    const ssize_t count = ::pread(fileno(file_.get()), to, size, static_cast<off_t>(offset));
    if (count <= 0 && errno != EINTR) fail("cannot read the accesses again", errno);
    if (count <= 0) continue;
    to += count;
    offset += static_cast<std::uint64_t>(count);
    size -= static_cast<std::size_t>(count);
  }
}

void TemporaryFile::CloseFile::operator()(std::FILE* file) const { (void)std::fclose(file); }

}  // namespace velmora::mobile::xplat::cellar::tools
