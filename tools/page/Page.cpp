#include "page/Page.h"

namespace velmora::mobile::xplat::cellar::tools {

// Made at build time, too.
extern const char* const kChartLibrary;

namespace {

// A "<" stands only in strings of a document, where it may be written so: no text can end the element that it is in.
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
  // The document stands in front, and may hold whatever looks like a mark.
  fill(filled, "@CHARTS@", kChartLibrary);
  fill(filled, "@DOCUMENT@", withoutMarkup(document));
  return filled;
}

}  // namespace velmora::mobile::xplat::cellar::tools
