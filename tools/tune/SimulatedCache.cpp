#include "tune/SimulatedCache.h"

#include <stdexcept>

#include "tune/ForesightCache.h"
#include "tune/GreedyDualCache.h"
#include "tune/VideoCache.h"

namespace velmora::mobile::xplat::cellar::tools {

SimulatedCache::~SimulatedCache() = default;

std::unique_ptr<SimulatedCache> simulatedCache(const std::string& strategy, std::int64_t limit) {
  if (strategy == strategies::kGreedyDual) return std::make_unique<GreedyDualCache>(limit);
  if (strategy == strategies::kVideoDownload) return std::make_unique<VideoCache>(limit);
  if (strategy == strategies::kForesight) return std::make_unique<ForesightCache>(limit);
  throw std::invalid_argument("'" + strategy + "' cannot be simulated.");
}

}  // namespace velmora::mobile::xplat::cellar::tools
