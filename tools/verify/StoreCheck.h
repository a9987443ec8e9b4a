#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "storage/UntouchedFiles.h"
#include "verify/Finding.h"

namespace velmora::mobile::xplat::cellar::tools {

struct StorePlace;

// What the configuration says of a store; nothing, if it does not have it.
struct Configured {
  bool hasKeys = false;  // it has a manifest once there is a value
  bool isSafe = false;   // or synced
};

using OnFile = std::function<void(std::uint64_t bytes)>;  // called for each file that is looked at

// Holds records and files of a store against each other; a store without a manifest has nothing to be held against.
// `temporaryDirectory` is for the copy of the manifest: nothing else is written. What cannot be read is a finding.
Findings checkStore(const StorePlace& place, const Configured& configured, const std::string& temporaryDirectory,
                    const OnFile& onFile);

// The finding that this cannot be read.
Finding findingOf(const Unreadable& unreadable);

// The attributes files of a tree that are not JSON, and what of it cannot be read, `directory` being where the tree
// begins.
Findings checkAttributes(const std::string& directory);

}  // namespace velmora::mobile::xplat::cellar::tools
