#include "tune/VideoCaches.h"

#include <cstddef>

#include "PruneStrategy.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Items without metadata are ranked by their dates alone.
int priorityOf(const Access& access) {
  if (access.itemType == Access::kNoMetadata) return VideoDownloadPruneStrategy::lowPriority;
  const VideoDownloadPruneStrategy strategy;
  return strategy.VideoDownloadExtendedMetadataToPriority(
      access.chunkSecond, static_cast<VideoDownloadExtendedMetadata::ItemType>(access.itemType));
}

// In 32 bits, as the strategy does it.
std::int32_t weightedDate(const Access& access) {
  const auto weight = static_cast<std::uint32_t>(VideoDownloadPruneStrategy::priorityWeight);
  const auto priority = static_cast<std::uint32_t>(priorityOf(access));
  return static_cast<std::int32_t>(static_cast<std::uint32_t>(access.date) + weight * priority);
}

}  // namespace

VideoCaches::VideoCaches(const std::vector<std::int64_t>& limits) {
  for (const std::int64_t limit : limits) {
    Cache cache;
    cache.result.limit = limit;
    caches_.push_back(std::move(cache));
  }
}

void VideoCaches::access(const Access& access) {
  const Rank rank{weightedDate(access), uses_++, access.key};
  for (Cache& cache : caches_) {
    if (access.key >= cache.items.size()) cache.items.resize(std::size_t{access.key} + 1);
    Item& item = cache.items[access.key];
    if (item.isThere && access.kind == AccessKind::Fetch) ++cache.result.hits;
    if (item.isThere) takeOut(cache, item);
    if (access.kind == AccessKind::Remove) continue;
    item = {true, access.size, rank};
    cache.order.insert(rank);
    cache.total += access.size;
    prune(cache);
  }
}

std::vector<VideoCaches::Result> VideoCaches::results() const {
  std::vector<Result> results;
  results.reserve(caches_.size());
  for (const Cache& cache : caches_) results.push_back(cache.result);
  return results;
}

void VideoCaches::takeOut(Cache& cache, Item& item) {
  cache.order.erase(item.rank);
  cache.total -= item.size;
  item.isThere = false;
}

void VideoCaches::prune(Cache& cache) {
  while (cache.total > cache.result.limit) takeOut(cache, cache.items[std::get<std::uint32_t>(*cache.order.begin())]);
}

}  // namespace velmora::mobile::xplat::cellar::tools
