#include "inspect/OrderOfEviction.h"

#include <algorithm>
#include <cstdint>
#include <limits>
#include <utility>

#include "storage/MemoryManifest.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Of one that goes although others have not been used for longer.
const char* reasonBesideUse(PruneStrategyIdentifier strategy) {
  return strategy == PruneStrategyIdentifier::GreedyDual
             ? "its size: smaller ones that were used less recently stay longer"
             : "its priority: others that were used less recently have a higher one";
}

}  // namespace

std::vector<EvictedItem> orderOfEviction(const std::vector<ManifestSnapshot::Record>& records,
                                         PruneStrategyIdentifier strategy) {
  std::vector<DiskCacheItem> items;
  items.reserve(records.size());
  for (const auto& record : records) items.push_back(record.item);
  const auto manifest = memoryManifest(items, strategy);
  std::vector<EvictedItem> order;
  order.reserve(records.size());
  for (auto& item : manifest->pruneToSize(0, std::numeric_limits<std::uint32_t>::max())) {
    order.push_back({std::move(item), ""});
  }
  // A prune has no need for those without a size that are left then.
  while (auto item = manifest->pruneOldestItem()) order.push_back({std::move(*item), ""});
  std::int32_t oldest = std::numeric_limits<std::int32_t>::max();
  for (auto place = order.rbegin(); place != order.rend(); ++place) {
    oldest = std::min(oldest, place->item.lastAccessDate);
    place->reason =
        place->item.lastAccessDate == oldest ? "the least recently used of those left" : reasonBesideUse(strategy);
  }
  return order;
}

std::string nameOfOrder(PruneStrategyIdentifier strategy) {
  switch (strategy) {
    case PruneStrategyIdentifier::VideoDownload:
      return "video_download";
    case PruneStrategyIdentifier::GreedyDual:
      return "greedy_dual";
    case PruneStrategyIdentifier::LRU:
    case PruneStrategyIdentifier::Null:
      break;
  }
  return "lru";
}

}  // namespace velmora::mobile::xplat::cellar::tools
