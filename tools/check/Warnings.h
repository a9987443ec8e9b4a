#pragma once

#include "check/ConfigurationDocument.h"
#include "check/Diagnostic.h"
#include "check/ResolvedConfiguration.h"

namespace velmora::mobile::xplat::cellar::tools {

// What the library accepts silently but that is probably a mistake, in the order of the document.
Diagnostics findWarnings(const ConfigurationDocument& document, const ResolvedConfiguration& resolved);

}  // namespace velmora::mobile::xplat::cellar::tools
