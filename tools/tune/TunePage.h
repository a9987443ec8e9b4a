#pragma once

#include <string>

#include "tune/TuneReport.h"

namespace velmora::mobile::xplat::cellar::tools {

// The report as one page that needs no other files: the curve, the advice and the table.
std::string tuningAsPage(const TuneReport& report);

}  // namespace velmora::mobile::xplat::cellar::tools
