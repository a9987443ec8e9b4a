#pragma once

#include "check/ConfigurationDocument.h"
#include "check/Diagnostic.h"

namespace velmora::mobile::xplat::cellar::tools {

// Why the library refuses the document: every fault with its position, as far as it is known, in the parser's own
// words. Empty if the library accepts the document.
Diagnostics findFaults(const ConfigurationDocument& document);

}  // namespace velmora::mobile::xplat::cellar::tools
