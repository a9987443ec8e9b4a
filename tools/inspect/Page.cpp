#include "inspect/Page.h"

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

const std::string kMark = "@SURVEY@";

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

}  // namespace

void requirePage() {
  if (*kPageTemplate != '\0') return;
  throw InputError(
      "this build has no page for --html: its chart library was not there when it was built (see ./dev page)");
}

std::string pageOf(const std::string& survey) {
  std::string page = kPageTemplate;
  const auto place = page.find(kMark);
  return page.replace(place, kMark.size(), withoutMarkup(survey));
}

}  // namespace velmora::mobile::xplat::cellar::tools
