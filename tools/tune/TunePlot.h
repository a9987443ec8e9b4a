#pragma once

#include <string>

#include "tune/TuneReport.h"

namespace velmora::mobile::xplat::cellar::tools {

// The hit rate over the limit as an SVG image that needs no other files; light or dark like the reader's screen.
std::string tuningAsSvg(const TuneReport& report);

}  // namespace velmora::mobile::xplat::cellar::tools
