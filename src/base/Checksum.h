#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar {

// Of a value under its key, so that the value of another key does not pass for it: the CRC-32 of both.
class Checksum {
 public:
  explicit Checksum(const std::string& key) { add(reinterpret_cast<const unsigned char*>(key.data()), key.size()); }

  void add(const unsigned char* bytes, std::size_t count);
  std::uint32_t value() const { return value_; }

  static std::uint32_t of(const std::string& key, const std::vector<unsigned char>& value);

 private:
  std::uint32_t value_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar
