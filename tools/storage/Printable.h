#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The text with control characters as "\x1b", so that a key or a file name cannot control a terminal or break a line.
std::string printable(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
