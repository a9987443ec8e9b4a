#include "EncodedFileName.h"

#include <cstddef>
#include <stdexcept>

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::size_t kLongestName = 255;
constexpr char kDigits[] = "0123456789abcdef";
const std::string kNameOfNothing = "%";

bool standsForItself(char byte, bool isFirst) {
  return (byte >= 'a' && byte <= 'z') || (byte >= '0' && byte <= '9') || byte == '-' || (byte == '.' && !isFirst);
}

std::string encoded(const std::string& bytes) {
  if (bytes.empty()) return kNameOfNothing;
  std::string name;
  for (const char character : bytes) {
    if (standsForItself(character, name.empty())) {
      name += character;
      continue;
    }
    const auto byte = static_cast<unsigned char>(character);
    name += {'%', kDigits[byte / 16], kDigits[byte % 16]};
  }
  return name;
}

// 0 for a character that is not a digit: the caller encodes the result again and compares.
std::size_t valueOf(char digit) {
  const std::size_t value = std::string(kDigits).find(digit);
  return value == std::string::npos ? 0 : value;
}

}  // namespace

std::string encodeFileName(const std::string& bytes) {
  std::string name = encoded(bytes);
  if (name.size() > kLongestName) {
    throw std::length_error("'" + name + "' would be too long for a file name: " + std::to_string(name.size()) +
                            " bytes of at most " + std::to_string(kLongestName) + ".");
  }
  return name;
}

std::string decodeFileName(const std::string& name) {
  std::string bytes;
  for (std::size_t i = 0; i < name.size(); ++i) {
    if (name[i] != '%') {
      bytes += name[i];
    } else if (i + 2 < name.size()) {
      bytes += static_cast<char>(valueOf(name[i + 1]) * 16 + valueOf(name[i + 2]));
      i += 2;
    }
  }
  if (encoded(bytes) != name || name.size() > kLongestName) {
    throw std::invalid_argument("'" + name + "' is not an encoded file name.");
  }
  return bytes;
}

}  // namespace velmora::mobile::xplat::cellar
