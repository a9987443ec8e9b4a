#include "VideoEvictionOrder.h"

#include "PruneStrategy.h"
#include "VideoPruneDate.h"

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

const ManifestRecord* VideoEvictionOrder::first(const ManifestRecordMap& records) {
  const int weight = VideoDownloadPruneStrategy::priorityWeight;
  const int cutoff = VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff;
  if (weight != priorityWeight_ || cutoff != highPriorityVideoSecondCutoff_) order_.clear();
  priorityWeight_ = weight;
  highPriorityVideoSecondCutoff_ = cutoff;
  return order_.first(records);
}

void VideoEvictionOrder::added(ManifestRecord& record) {
  if (hasVideoMetadata(record)) ++recordsWithMetadata_;
  order_.added(record);
}

void VideoEvictionOrder::changed(const ManifestRecord& record) { order_.changed(record); }

void VideoEvictionOrder::removed(const ManifestRecord& record) {
  if (hasVideoMetadata(record)) --recordsWithMetadata_;
  order_.removed(record);
}

void VideoEvictionOrder::clear() {
  recordsWithMetadata_ = 0;
  order_.clear();
}

std::int32_t VideoEvictionOrder::dateOf(const ManifestRecord& record) {
  const auto* const metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(record.extendedMetadata.get());
  return metadata == nullptr ? record.lastAccessDate : videoPruneDate(record.lastAccessDate, *metadata);
}

}  // namespace velmora::mobile::xplat::cellar
