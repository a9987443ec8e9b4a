#include "manifest/VideoEvictionOrder.h"

#include <utility>

#include "PruneStrategy.h"
#include "base/VideoPruneDate.h"

namespace velmora::mobile::xplat::cellar {

namespace {

bool hasVideoMetadata(const ManifestRecord& record) {
  return dynamic_cast<const VideoDownloadExtendedMetadata*>(record.extendedMetadata.get()) != nullptr;
}

}  // namespace

VideoEvictionOrder::Basis VideoEvictionOrder::basis(std::size_t recordCount) const {
  if (VideoDownloadPruneStrategy::priorityWeight == 0 || recordsWithMetadata_ == 0) return Basis::AccessDate;
  return recordsWithMetadata_ == recordCount ? Basis::Priority : Basis::Comparison;
}

const ManifestRecord* VideoEvictionOrder::first() {
  watchTunables();
  if (std::exchange(isOutdated_, false)) order_.allChanged();
  return order_.first();
}

void VideoEvictionOrder::added(ManifestRecord& record) {
  watchTunables();
  if (hasVideoMetadata(record)) ++recordsWithMetadata_;
  order_.added(record);
}

void VideoEvictionOrder::changed(const ManifestRecord& record) {
  watchTunables();
  order_.changed(record);
}

void VideoEvictionOrder::removed(const ManifestRecord& record) {
  if (hasVideoMetadata(record)) --recordsWithMetadata_;
  order_.removed(record);
}

void VideoEvictionOrder::clear() {
  recordsWithMetadata_ = 0;
  order_.clear();
}

void VideoEvictionOrder::watchTunables() {
  const int weight = VideoDownloadPruneStrategy::priorityWeight;
  const int cutoff = VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff;
  if (weight != priorityWeight_ || cutoff != highPriorityVideoSecondCutoff_) isOutdated_ = true;
  priorityWeight_ = weight;
  highPriorityVideoSecondCutoff_ = cutoff;
}

std::int32_t VideoEvictionOrder::dateOf(const ManifestRecord& record) {
  const auto* const metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(record.extendedMetadata.get());
  return metadata == nullptr ? record.lastAccessDate : videoPruneDate(record.lastAccessDate, *metadata);
}

}  // namespace velmora::mobile::xplat::cellar
