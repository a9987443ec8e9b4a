#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "verify/Finding.h"

namespace velmora::mobile::xplat::cellar::tools {

struct StorePlace;

using OnFile = std::function<void(std::uint64_t bytes)>;  // called for each file that is looked at

// Holds records and files of a store against each other; a store without a manifest has nothing to be held against.
// `temporaryDirectory` is for the copy of the manifest: nothing else is written. Throws `LarderException` for what
// cannot be read.
Findings checkStore(const StorePlace& place, const std::string& temporaryDirectory, const OnFile& onFile);

// The attributes files of a tree that are not JSON, `directory` being where the tree begins.
Findings checkAttributes(const std::string& directory);

}  // namespace velmora::mobile::xplat::cellar::tools
