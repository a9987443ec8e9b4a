#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <memory>
#include <optional>
#include <string>

#include <cellar/DiskCache.h>
#include <cellar/Durability.h>
#include <cellar/StoreDefinition.h>
#include <cellar/host/ThreadQueueFactory.h>

#include "support/Places.h"
#include "support/Values.h"

namespace velmora::mobile::xplat::cellar::bench {

struct StoreOptions {
  bool inlineData = false;
  std::optional<std::uint64_t> capacity{};
  std::uint32_t normalSize = std::numeric_limits<std::uint32_t>::max();  // bytes that a prune leaves
  Durability durability = Durability::Relaxed;
  PruneStrategyIdentifier strategy = PruneStrategyIdentifier::LRU;
  bool load = true;
  std::shared_ptr<AnalyticsEventReporter> reporter{};
};

// A disk cache on the host kit's queues, as a manager would make it.
class StoreUnderTest {
 public:
  explicit StoreUnderTest(const std::string& directory, const StoreOptions& options = {});
  ~StoreUnderTest();
  StoreUnderTest(const StoreUnderTest&) = delete;
  StoreUnderTest& operator=(const StoreUnderTest&) = delete;

  DiskCache* operator->() const { return cache_.get(); }

  // Waits until the queues have nothing to do; the manifest is loaded then.
  void settle();

  // Prunes down to the normal size and waits for the end.
  void prune();

  // The same until nothing is left.
  void clear();
  void expireAll();

  // Throws unless the store has the first `count` items.
  void verify(std::size_t count, std::size_t size);

 private:
  const std::shared_ptr<host::ThreadQueueFactory> queues_;
  std::shared_ptr<DiskCache> cache_;
};

}  // namespace velmora::mobile::xplat::cellar::bench
