#pragma once

#include <cstdint>
#include <set>
#include <tuple>
#include <vector>

#include "tune/Access.h"

namespace velmora::mobile::xplat::cellar::tools {

// Caches of several limits that evict items in the order of the library's video-download strategy. That order cannot be
// computed for all limits at once: an item may be evicted while less recently used ones of high priority remain. So
// each limit is simulated separately. One thread.
class VideoCaches {
 public:
  explicit VideoCaches(const std::vector<std::int64_t>& limits);

  void access(const Access& access);

  struct Result {
    std::int64_t limit = 0;
    std::uint64_t hits = 0;
  };
  std::vector<Result> results() const;

 private:
  // The date that the strategy compares; for items of one date, the order of their uses.
  using Rank = std::tuple<std::int32_t, std::uint64_t, std::uint32_t>;

  struct Item {
    bool isThere = false;
    std::int64_t size = 0;
    Rank rank;
  };

  struct Cache {
    Result result;
    std::int64_t total = 0;
    std::set<Rank> order{};
    std::vector<Item> items{};  // by key
  };

  static void takeOut(Cache& cache, Item& item);
  static void prune(Cache& cache);

  std::vector<Cache> caches_;
  std::uint64_t uses_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::tools
