#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "tune/Access.h"

namespace velmora::mobile::xplat::cellar::tools {

// A cache of one limit that is pruned after each access, in the order of one strategy. One thread.
class SimulatedCache {
 public:
  SimulatedCache() = default;
  SimulatedCache(const SimulatedCache&) = delete;
  SimulatedCache& operator=(const SimulatedCache&) = delete;
  virtual ~SimulatedCache();

  // `nextFetch`: the number of the next access that fetches what this one leaves, or `kNever`. Only an order that knows
  // the future asks for it. Whether the item was there.
  virtual bool access(const Access& access, std::uint64_t nextFetch) = 0;

  static constexpr std::uint64_t kNever = ~std::uint64_t{0};
};

namespace strategies {

inline constexpr const char* kLeastRecentlyUsed = "lru";
inline constexpr const char* kGreedyDual = "greedy_dual";
inline constexpr const char* kVideoDownload = "video_download";
inline constexpr const char* kForesight = "foresight";  // of no application: evicts what is fetched again last

}  // namespace strategies

// For every strategy named above but the first, of which all limits are computed at once.
std::unique_ptr<SimulatedCache> simulatedCache(const std::string& strategy, std::int64_t limit);

}  // namespace velmora::mobile::xplat::cellar::tools
