#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The text as it stands in an SVG image or a page; control characters, which these have no signs for, as blanks.
std::string escapedMarkup(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
