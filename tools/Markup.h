#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The text escaped for an SVG image or a page; control characters become spaces.
std::string escapedMarkup(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
