#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "manifest/EvictionOrder.h"
#include "manifest/GreedyDualOrder.h"
#include "manifest/VideoEvictionOrder.h"

namespace velmora::mobile::xplat::cellar {

class PruneStrategyBase;

// The records of a manifest in memory, with the total of their sizes and the orders in which they are evicted. Guarded
// by its manifest. Pointers to a record are good until it is replaced or removed; what changes one goes through here.
class ManifestRecords {
 public:
  // Yields the record to remove next; null when there are no more. Each is removed before the next is asked for.
  using Next = std::function<const ManifestRecord*()>;

  // Null: least recently used first.
  explicit ManifestRecords(std::shared_ptr<PruneStrategyBase> strategy);

  std::size_t count() const { return records_.size(); }
  std::uint32_t totalSize() const { return totalSize_; }
  std::vector<std::string> keys() const;

  // Null when there is none.
  const ManifestRecord* find(const std::string& key) const;

  // Replaces the record of the key.
  const ManifestRecord* store(const DiskCacheItem& item);

  void setLastAccessDate(const std::string& key, std::int32_t date);
  void setHasInlineData(const std::string& key, bool hasInlineData);

  DiskCacheItem remove(const ManifestRecord& record);

  // A record as it is now, and that it is so again, among those of the same date too.
  struct Copy {
    DiskCacheItem item;
    std::uint32_t turnByAccessDate;
    std::uint32_t turnByPriority;
    std::int32_t priority;
  };
  Copy copyOf(const ManifestRecord& record) const;
  void restore(const Copy& copy);

  void clear();
  void reserve(std::size_t count);

  // Of those stored with the same access date and not used since, those first that were stored first.
  Next leastRecentlyUsed();
  Next byStrategy();

  // To be called when a prune by strategy has come about and left room for items, and when all records of the medium
  // are here.
  void evicted(const std::vector<DiskCacheItem>& items);
  void loaded();

 private:
  using Map = std::unordered_map<std::string_view, ManifestRecord::Owner>;

  void leaveOrders(const ManifestRecord& record);
  Next byComparison() const;

  const std::shared_ptr<PruneStrategyBase> strategy_;
  const bool isVideoStrategy_;
  const bool isOwnStrategy_;  // a host's own class, derived from ours or not, which can only be asked
  Map records_;
  EvictionOrder byAccessDate_;
  VideoEvictionOrder byVideoPriority_;                   // kept with the video strategy only
  const std::unique_ptr<GreedyDualOrder> byGreedyDual_;  // null with every other strategy
  std::uint32_t totalSize_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar
