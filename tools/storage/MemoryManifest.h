#pragma once

#include <memory>
#include <vector>

#include "DiskCacheManifest.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar::tools {

// A loaded manifest that has these records and writes nothing anywhere: what a store's would answer. One thread.
std::shared_ptr<DiskCacheManifest> memoryManifest(const std::vector<DiskCacheItem>& items,
                                                  PruneStrategyIdentifier strategy);

}  // namespace velmora::mobile::xplat::cellar::tools
