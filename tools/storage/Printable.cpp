#include "storage/Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kDigits = "0123456789abcdef";

bool isControl(unsigned char byte) { return byte < 0x20 || byte == 0x7f; }

}  // namespace

std::string printable(const std::string& text) {
  std::string result;
  for (const char character : text) {
    const auto byte = static_cast<unsigned char>(character);
    if (isControl(byte)) {
      result += std::string("\\x") + kDigits[byte >> 4U] + kDigits[byte & 0xfU];
    } else {
      result += character;
    }
  }
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::tools
