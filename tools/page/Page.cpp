#include "page/Page.h"

namespace velmora::mobile::xplat::cellar::tools {

// Generated at build time, too.
extern const char* const kChartLibrary;

namespace {

// In JSON a "<" occurs only in strings, where it may be escaped: so no text can end its HTML element.
std::string withoutMarkup(const std::string& json) {
  std::string text;
  for (const char character : json) {
    if (character == '<') {
      text += "\\u003c";
    } else {
      text += character;
    }
  }
  return text;
}

void fill(std::string& page, const std::string& mark, const std::string& text) {
  page.replace(page.find(mark), mark.size(), text);
}

}  // namespace

std::string pageOf(const char* page, const std::string& document) {
  std::string filled = page;
  // Last, because the document may contain text that looks like a mark.
  fill(filled, "@CHARTS@", kChartLibrary);
  fill(filled, "@DOCUMENT@", withoutMarkup(document));
  return filled;
}

}  // namespace velmora::mobile::xplat::cellar::tools
