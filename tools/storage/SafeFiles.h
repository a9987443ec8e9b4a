#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// The name of a value's file in a safe store: "letter%20one.17.92a993c0", or with ".part" behind it until its writer
// has finished.
struct SafeFileName {
  std::optional<std::string> key;  // empty when it is too long to be in the name
  std::uint64_t number = 0;        // greater than that of each value that was written before
  std::uint32_t checksum = 0;      // of key and value
  bool isUnfinished = false;
};

// Empty for a name that a safe store does not give.
std::optional<SafeFileName> parseSafeFileName(const std::string& name);

// The checksum of a value under its key, as a safe store computes it.
std::uint32_t checksumOf(const std::string& key, const std::vector<unsigned char>& value);

// The same of a value in a file, which is read without changing its access date where the system allows that. Throws
// `FileUtilsIoException`.
std::uint32_t checksumOfFile(const std::string& key, const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::tools
