#pragma once

#include <cstdint>
#include <vector>

#include "DiskCacheItem.h"
#include "manifest/GreedyDualOrder.h"
#include "manifest/ManifestRecord.h"
#include "tune/SimulatedCache.h"

namespace velmora::mobile::xplat::cellar::tools {

// Driven by the library's own order of eviction, called as a manifest calls it.
class GreedyDualCache : public SimulatedCache {
 public:
  explicit GreedyDualCache(std::int64_t limit) : limit_(limit) {}
  bool access(const Access& access, std::uint64_t nextFetch) override;

 private:
  struct Item {
    ManifestRecord::Owner record;  // null: not there
    std::int64_t size = 0;
  };

  void store(Item& item, std::uint32_t key, std::int64_t size);
  Item& itemOf(const ManifestRecord& record);
  void remove(Item& item);
  void clear();
  void prune();

  const std::int64_t limit_;
  std::int64_t total_ = 0;
  GreedyDualOrder order_;
  std::vector<Item> items_;  // by key
  std::vector<DiskCacheItem> evicted_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
