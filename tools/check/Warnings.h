#pragma once

#include "check/ConfigurationDocument.h"
#include "check/Diagnostic.h"
#include "check/ResolvedConfiguration.h"

namespace velmora::mobile::xplat::cellar::tools {

// What the library accepts silently but that is probably a mistake, in the order of the document.
Diagnostics findWarnings(const ConfigurationDocument& document, const ResolvedConfiguration& resolved);

// The same of a document that the library refuses: what can be said in spite of these faults. Of a store with one, and
// of a manager with one outside of its stores, that is what is wrong with single keys.
Diagnostics findWarningsBeside(const Diagnostics& faults, const ConfigurationDocument& document, const NameTags& tags);

}  // namespace velmora::mobile::xplat::cellar::tools
