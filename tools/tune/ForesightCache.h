#pragma once

#include <cstdint>
#include <utility>
#include <vector>

#include "tune/SimulatedCache.h"

namespace velmora::mobile::xplat::cellar::tools {

// Evicts what is fetched again last, whatever its size. With items of one size, no order finds more; with items of
// different sizes, an order that goes by size may.
class ForesightCache : public SimulatedCache {
 public:
  explicit ForesightCache(std::int64_t limit) : limit_(limit) {}
  bool access(const Access& access, std::uint64_t nextFetch) override;

 private:
  struct Item {
    std::uint64_t nextFetch = 0;
    std::int64_t size = kGone;
  };
  using Entry = std::pair<std::uint64_t, std::uint32_t>;  // next fetch and key
  static constexpr std::int64_t kGone = -1;

  void remove(Item& item);
  void clear();
  void prune();
  bool isCurrent(const Entry& entry) const;
  void note(const Entry& entry);

  const std::int64_t limit_;
  std::int64_t total_ = 0;
  std::size_t count_ = 0;
  std::vector<Item> items_;  // by key
  std::vector<Entry> last_;  // a heap, the last one first; may have entries that are not current any more
};

}  // namespace velmora::mobile::xplat::cellar::tools
