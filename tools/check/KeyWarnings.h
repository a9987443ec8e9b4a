#pragma once

#include <string>

#include "check/ConfigurationDocument.h"
#include "check/Remarks.h"

namespace velmora::mobile::xplat::cellar::tools {

// What can be said of single keys and values: unknown and ignored ones, numbers that wrapped, text that counts for
// nothing. `manager` is the manager's object, `store` the store's, each at its pointer.
void warnOfManagerKeys(const std::string& pointer, const OrderedJson& manager, Remarks& findings);
void warnOfStoreKeys(const std::string& pointer, const OrderedJson& store, Remarks& findings);

}  // namespace velmora::mobile::xplat::cellar::tools
