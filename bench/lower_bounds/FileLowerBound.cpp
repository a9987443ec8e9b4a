#include "lower_bounds/FileLowerBound.h"

#include <cerrno>
#include <cstdio>
#include <system_error>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

[[noreturn]] void fail(const std::string& path) { throw std::system_error(errno, std::generic_category(), path); }

}  // namespace

void writeFile(const std::string& path, const Bytes& value) {
  std::FILE* const file = std::fopen(path.c_str(), "wb");
  if (file == nullptr) fail(path);
  const bool isWritten = std::fwrite(value.data(), 1, value.size(), file) == value.size();
  if (std::fclose(file) != 0 || !isWritten) fail(path);
}

Bytes readFile(const std::string& path, std::size_t size) {
  std::FILE* const file = std::fopen(path.c_str(), "rb");
  if (file == nullptr) fail(path);
  Bytes value(size);
  const bool isRead = std::fread(value.data(), 1, size, file) == size;
  if (std::fclose(file) != 0 || !isRead) fail(path);
  return value;
}

}  // namespace velmora::mobile::xplat::cellar::bench
