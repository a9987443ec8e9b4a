#include "base/StoreTime.h"

#include <algorithm>
#include <limits>

#include "Clock.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::int64_t kLatestDate = std::numeric_limits<std::int32_t>::max();
constexpr std::int64_t kLongestAbsence = 365LL * 86400;  // seconds

}  // namespace

void StoreTime::noteDateOf(const DiskCacheItem& item) {
  const std::int64_t date = std::max(item.lastAccessDate, item.modificationDate);
  latest_ = hasLatest_ ? std::max(latest_, date) : date;
  hasLatest_ = true;
}

std::int64_t StoreTime::now() {
  const std::int64_t clock = std::clamp<std::int64_t>(Clock::now(), 0, kLatestDate);
  if (!hasLatest_ || isBelievable(clock)) {
    lag_ = 0;
  } else if (!isBelievable(clock - lag_)) {
    lag_ = clock - latest_;
  }
  latest_ = std::min(clock - lag_, kLatestDate);
  hasLatest_ = true;
  return latest_;
}

bool StoreTime::isBelievable(std::int64_t time) const { return time >= latest_ && time - latest_ <= kLongestAbsence; }

}  // namespace velmora::mobile::xplat::cellar
