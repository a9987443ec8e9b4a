#pragma once

#include <string>

#include "check/ConfigurationDocument.h"
#include "check/Diagnostic.h"

namespace velmora::mobile::xplat::cellar::tools {

// Warnings about single keys and values: unknown and ignored ones, numbers that wrapped, text that is ignored.
// `manager` is the manager's object, `store` the store's, each at its pointer.
void warnOfManagerKeys(const std::string& pointer, const OrderedJson& manager, Diagnostics& findings);
void warnOfStoreKeys(const std::string& pointer, const OrderedJson& store, Diagnostics& findings);

}  // namespace velmora::mobile::xplat::cellar::tools
