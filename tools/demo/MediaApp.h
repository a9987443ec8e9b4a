#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The text of examples/media-app.json, the application that the demonstration plays.
extern const std::string kMediaAppConfiguration;

}  // namespace velmora::mobile::xplat::cellar::tools
