#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace velmora::mobile::xplat::cellar {

// The name of a file in a safe store, where each value of a key has a file of its own:
//
//   <key, encoded>.<number>.<checksum, 8 hexadecimal digits>    "letter%20one.17.5f3a00c1"
//   <beginning of the key, encoded>~.<number>.<checksum>        where the key is too long for a file name
//
// So the file tells whose value it is, and whether it is complete, without the manifest.
struct VersionedName {
  std::optional<std::string> key;  // empty when it is too long to be in the name
  std::uint64_t number;            // greater than that of each value that the store has written before
  std::uint32_t checksum;          // of key and value

  static std::string format(const std::string& key, std::uint64_t number, std::uint32_t checksum);

  // Empty for a name that `format` cannot return.
  static std::optional<VersionedName> parse(const std::string& name);
};

}  // namespace velmora::mobile::xplat::cellar
