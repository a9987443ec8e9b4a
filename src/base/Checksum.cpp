#include "base/Checksum.h"

#include <zlib.h>

namespace velmora::mobile::xplat::cellar {

// Without bytes it would start again.
void Checksum::add(const unsigned char* bytes, std::size_t count) {
  if (count > 0) value_ = static_cast<std::uint32_t>(crc32_z(value_, bytes, count));
}

std::uint32_t Checksum::of(const std::string& key, const std::vector<unsigned char>& value) {
  Checksum checksum(key);
  checksum.add(value.data(), value.size());
  return checksum.value();
}

}  // namespace velmora::mobile::xplat::cellar
