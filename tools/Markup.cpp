#include "Markup.h"

#include "Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

std::string escapedMarkup(const std::string& text) {
  std::string result;
  for (const char character : printable(text)) {
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
      case '"':
        result += "&quot;";
        break;
      default:
        result += character;
    }
  }
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::tools
