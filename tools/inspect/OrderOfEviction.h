#pragma once

#include <string>
#include <vector>

#include "Configuration.h"
#include "ManifestSnapshot.h"

namespace velmora::mobile::xplat::cellar::tools {

// An item with the reason why it goes before those behind it.
struct EvictedItem {
  DiskCacheItem item;
  std::string reason;
};

// All items in the order in which a cache of that strategy evicts them when it has just read these records. What the
// strategy has learnt from the accesses of a running application is not on the disk.
std::vector<EvictedItem> orderOfEviction(const std::vector<ManifestSnapshot::Record>& records,
                                         PruneStrategyIdentifier strategy);

// As it is written in a configuration; "lru" for what is the same.
std::string nameOfOrder(PruneStrategyIdentifier strategy);

}  // namespace velmora::mobile::xplat::cellar::tools
