#include "PruneStrategy.h"

#include <cstdint>
#include <utility>

#include "DiskCacheItem.h"
#include "StoreDefinition.h"
#include "base/VideoPruneDate.h"

namespace velmora::mobile::xplat::cellar {

namespace {

bool lessRecentlyUsed(const DiskCacheItem& a, const DiskCacheItem& b) { return a.lastAccessDate < b.lastAccessDate; }

const VideoDownloadExtendedMetadata* videoMetadata(const DiskCacheItem& item) {
  return dynamic_cast<const VideoDownloadExtendedMetadata*>(item.extendedMetadata.get());
}

}  // namespace

bool LRUPruneStrategy::compare(const DiskCacheItem* a, const DiskCacheItem* b) const {
  return lessRecentlyUsed(*a, *b);
}

int VideoDownloadPruneStrategy::priorityWeight = 0;
int VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 0;

bool VideoDownloadPruneStrategy::compare(const DiskCacheItem* a, const DiskCacheItem* b) const {
  const auto* ofA = videoMetadata(*a);
  const auto* ofB = videoMetadata(*b);
  if (ofA == nullptr || ofB == nullptr) return lessRecentlyUsed(*a, *b);
  return videoPruneDate(a->lastAccessDate, *ofA) < videoPruneDate(b->lastAccessDate, *ofB);
}

// Unsigned, because the host may choose a weight that leaves the range of a date: that wraps, and signed it would be
// undefined.
std::int32_t videoPruneDate(std::int32_t lastAccessDate, const VideoDownloadExtendedMetadata& metadata) {
  const int priority = VideoDownloadPruneStrategy().VideoDownloadExtendedMetadataToPriority(
      metadata.getExtendedMetadata(), metadata.getItemType());
  const auto weight = static_cast<std::uint32_t>(VideoDownloadPruneStrategy::priorityWeight);
  return static_cast<std::int32_t>(static_cast<std::uint32_t>(lastAccessDate) +
                                   weight * static_cast<std::uint32_t>(priority));
}

int VideoDownloadPruneStrategy::VideoDownloadExtendedMetadataToPriority(
    const int& chunkSecond, const VideoDownloadExtendedMetadata::ItemType& itemType) const {
  const int type = static_cast<int>(itemType);
  if (type >= 1 && type <= 3) return highPriority;
  if (itemType != VideoDownloadExtendedMetadata::ItemType::VideoChunk || chunkSecond < 0) return lowPriority;
  return chunkSecond <= highPriorityVideoSecondCutoff ? highPriority : lowPriority;
}

bool GreedyDualPruneStrategy::compare(const DiskCacheItem* a, const DiskCacheItem* b) const {
  return lessRecentlyUsed(*a, *b);
}

Comparator::Comparator(std::shared_ptr<PruneStrategyBase> strategy) : strategy_(std::move(strategy)) {
  if (strategy_ == nullptr) strategy_ = std::make_shared<LRUPruneStrategy>();
}

bool Comparator::operator()(const DiskCacheItem* a, const DiskCacheItem* b) const { return strategy_->compare(a, b); }

std::shared_ptr<PruneStrategyBase> PruneStrategyFactory(PruneStrategyIdentifier identifier) {
  switch (identifier) {
    case PruneStrategyIdentifier::LRU:
      return std::make_shared<LRUPruneStrategy>();
    case PruneStrategyIdentifier::VideoDownload:
      return std::make_shared<VideoDownloadPruneStrategy>();
    case PruneStrategyIdentifier::GreedyDual:
      return std::make_shared<GreedyDualPruneStrategy>();
    case PruneStrategyIdentifier::Null:
      break;
  }
  return nullptr;
}

}  // namespace velmora::mobile::xplat::cellar
