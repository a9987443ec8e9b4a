#include "host/figures/MeasuredSizes.h"

#include <cstdint>
#include <iterator>
#include <optional>

#include "host/figures/StoreFigures.h"

namespace velmora::mobile::xplat::cellar::host {

MeasuredSizes::~MeasuredSizes() = default;

void MeasuredSizes::watch(const std::string& path, const std::shared_ptr<StoreFigures>& figures) {
  const std::lock_guard<std::mutex> lock(mutex_);
  for (auto entry = watched_.begin(); entry != watched_.end();) {
    entry = entry->second.expired() ? watched_.erase(entry) : std::next(entry);
  }
  watched_[path] = figures;
}

std::shared_ptr<StoreFigures> MeasuredSizes::figuresOf(const std::string& path) {
  const std::lock_guard<std::mutex> lock(mutex_);
  const auto found = watched_.find(path);
  return found == watched_.end() ? nullptr : found->second.lock();
}

// 0 says that nothing is known.
long long MeasuredSizes::fetchDirectorySize(const std::string& path) {
  const long long size = DiskSizeCalculator::fetchDirectorySize(path);
  const auto figures = figuresOf(path);
  if (figures != nullptr && size > 0) figures->noteMeasured(static_cast<std::uint64_t>(size), std::nullopt);
  return size;
}

// All zeros, the time too, say that it has failed.
DiskSizeCalculator::Stats MeasuredSizes::calculateDirectorySize(const std::string& path) {
  const Stats stats = DiskSizeCalculator::calculateDirectorySize(path);
  if (stats.valid || stats.timeSpent > 0) noteMeasured(path, stats);
  return stats;
}

void MeasuredSizes::noteMeasured(const std::string& path, const Stats& stats) {
  const auto figures = figuresOf(path);
  if (figures == nullptr || stats.size < 0) return;
  figures->noteMeasured(static_cast<std::uint64_t>(stats.size), static_cast<std::uint64_t>(stats.fileCount));
}

}  // namespace velmora::mobile::xplat::cellar::host
