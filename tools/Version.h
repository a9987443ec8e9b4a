#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The version of the program, and how and with what it was built.
std::string versionText();

}  // namespace velmora::mobile::xplat::cellar::tools
