#pragma once

#include <cstdint>
#include <set>
#include <tuple>
#include <vector>

#include "tune/SimulatedCache.h"

namespace velmora::mobile::xplat::cellar::tools {

// Evicts items in the order of the library's video-download strategy. That order cannot be computed for all limits at
// once: an item may be evicted while less recently used ones of high priority remain.
class VideoCache : public SimulatedCache {
 public:
  explicit VideoCache(std::int64_t limit) : limit_(limit) {}
  bool access(const Access& access, std::uint64_t nextFetch) override;

 private:
  // The date that the strategy compares; for items of one date, the order of their uses.
  using Rank = std::tuple<std::int32_t, std::uint64_t, std::uint32_t>;

  struct Item {
    bool isThere = false;
    std::int64_t size = 0;
    Rank rank;
  };

  void remove(Item& item);
  void clear();
  void prune();

  const std::int64_t limit_;
  std::int64_t total_ = 0;
  std::uint64_t uses_ = 0;
  std::set<Rank> order_;
  std::vector<Item> items_;  // by key
};

}  // namespace velmora::mobile::xplat::cellar::tools
