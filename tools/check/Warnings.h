#pragma once

#include "check/ConfigurationDocument.h"
#include "check/Remarks.h"
#include "check/Understood.h"

namespace velmora::mobile::xplat::cellar::tools {

// What the library accepts without a word though nobody can mean it, in the order of the document.
Remarks findWarnings(const ConfigurationDocument& document, const Understood& understood);

}  // namespace velmora::mobile::xplat::cellar::tools
