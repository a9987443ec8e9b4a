#pragma once

#include <cstdint>

#include "DiskCacheItem.h"

namespace velmora::mobile::xplat::cellar {

// The time by which a safe store dates its items and lets them expire: that of the clock, as long as it can be right. A
// clock that is behind the latest date in the store, or more than a year ahead of it, is not believed; time then goes
// on from the latest date. So nothing expires because a clock was wrong, and a store that has really not been used for
// more than a year keeps its items for longer. Guarded by its manifest.
class StoreTime {
 public:
  // The latest date in the store may be this item's.
  void noteDateOf(const DiskCacheItem& item);

  // Seconds since the Unix epoch, at most what a record can hold; never earlier than before.
  std::int64_t now();

 private:
  bool isBelievable(std::int64_t time) const;

  bool hasLatest_ = false;   // otherwise the store is empty, and any time will do
  std::int64_t latest_ = 0;  // date
  std::int64_t lag_ = 0;     // of the store's time behind the clock's
};

}  // namespace velmora::mobile::xplat::cellar
