#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The text, made `printable`, escaped for an SVG image.
std::string escapedMarkup(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
