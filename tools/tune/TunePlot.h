#pragma once

#include <string>

#include "tune/TuneReport.h"

namespace velmora::mobile::xplat::cellar::tools {

// The hit rate over the limit as an SVG image that needs nothing else, light or dark as the reader's screen is.
std::string tuningAsSvg(const TuneReport& report);

}  // namespace velmora::mobile::xplat::cellar::tools
