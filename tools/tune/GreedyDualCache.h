#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "DiskCacheManifest.h"
#include "tune/SimulatedCache.h"

namespace velmora::mobile::xplat::cellar::tools {

// A manifest of the library, without a medium, says what goes. Sizes have 32 bits there: for limits from 2 GB on they
// are counted in units of some bytes, rounded up.
class GreedyDualCache : public SimulatedCache {
 public:
  explicit GreedyDualCache(std::int64_t limit);
  bool access(const Access& access, std::uint64_t nextFetch) override;

 private:
  static constexpr std::int64_t kAbsent = -1;

  void store(std::uint32_t key, std::int64_t size);
  void remove(std::uint32_t key);
  void prune();

  int unit_ = 0;  // binary digits
  std::uint32_t limit_ = 0;
  std::shared_ptr<DiskCacheManifest> manifest_;
  std::vector<std::int64_t> sizes_;  // by key, of the items that are there
};

}  // namespace velmora::mobile::xplat::cellar::tools
