#pragma once

#include "check/ConfigurationDocument.h"
#include "check/Remarks.h"

namespace velmora::mobile::xplat::cellar::tools {

// Why the library refuses the document: every fault with its place, as far as one can be given to it, in the parser's
// own words. Empty when the library takes the document.
Remarks findFaults(const ConfigurationDocument& document);

}  // namespace velmora::mobile::xplat::cellar::tools
