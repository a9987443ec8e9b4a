#include "Markup.h"

namespace velmora::mobile::xplat::cellar::tools {

std::string escapedMarkup(const std::string& text) {
  std::string result;
  for (const char character : text) {
    switch (character) {
      case '&':
        result += "&amp;";
        break;
      case '<':
        result += "&lt;";
        break;
      case '>':
        result += "&gt;";
        break;
      default:
        result += static_cast<unsigned char>(character) < 0x20 ? ' ' : character;
    }
  }
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::tools
