#include "tune/VideoCache.h"

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

bool VideoCache::access(const Access& access, std::uint64_t /*nextFetch*/) {
  if (access.kind == AccessKind::Clear) {
    clear();
    return false;
  }
  if (access.key >= items_.size()) items_.resize(std::size_t{access.key} + 1);
  Item& item = items_[access.key];
  const bool isFound = item.isThere;
  if (isFound) remove(item);
  if (access.kind == AccessKind::Remove) return isFound;
  item = {true, access.size, {weightedDate(access), uses_++, access.key}};
  order_.insert(item.rank);
  total_ += access.size;
  prune();
  return isFound;
}

void VideoCache::remove(Item& item) {
  order_.erase(item.rank);
  total_ -= item.size;
  item.isThere = false;
}

void VideoCache::clear() {
  while (!order_.empty()) remove(items_[std::get<std::uint32_t>(*order_.begin())]);
}

void VideoCache::prune() {
  while (total_ > limit_) remove(items_[std::get<std::uint32_t>(*order_.begin())]);
}

}  // namespace velmora::mobile::xplat::cellar::tools
