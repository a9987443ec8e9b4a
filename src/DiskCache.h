#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Export.h"
#include "PersistentKeyValueStore.h"

namespace velmora::mobile::xplat::cellar {

// A key-value store with a size limit, which its manager has pruned back when the manager as a whole is over its own
// limit. The prune strategy says which items go first. Between two rounds of pruning the limit can be passed by
// whatever is written.
class CELLAR_EXPORT DiskCache : public PersistentKeyValueStore {
 public:
  // As `PersistentKeyValueStore::create`.
  static std::shared_ptr<DiskCache> create(const DiskCacheOptions& options, const StoreServices& services);

  // The same, with each option as a parameter.
  static std::shared_ptr<DiskCache> createDiskCache(
      const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
      std::optional<std::uint64_t> capacity, long staleAge, unsigned int normalSize, unsigned int survivalSize,
      bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
      std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory, std::shared_ptr<TrashCollector> trashCollector,
      std::shared_ptr<PruneStrategyBase> pruneStrategy, std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
      std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
      std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize);

  // As the two above, but loads nothing. The store must be owned by a shared pointer.
  DiskCache(const DiskCacheOptions& options, const StoreServices& services);
  DiskCache(const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
            std::optional<std::uint64_t> capacity, long staleAge, unsigned int normalSize, unsigned int survivalSize,
            bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
            std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
            std::shared_ptr<TrashCollector> trashCollector, std::shared_ptr<PruneStrategyBase> pruneStrategy,
            std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
            std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
            std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize);
  ~DiskCache() override;

  bool isPrunable() override;  // always

  // Removes items in the strategy's order until the cache is at or below its normal or survival size as it is now, in
  // batches, and calls one of the two on the work queue when that is done. Any thread.
  void pruneBackToNormal(std::function<void()> onSuccess, std::function<void(const std::exception&)> onError,
                         bool survivalMode) override;

  // Null when the cache removes the least recently used first.
  std::shared_ptr<PruneStrategyBase> getPruneStrategy();

  // Replaces the stale age (seconds) and the normal size (bytes), from the next expiry and prune on.
  void overrideConfiguration(long staleAge, unsigned int normalSize);
  using PersistentKeyValueStore::overrideConfiguration;

 private:
  std::uint32_t normalSize_;  // guarded by the store's mutex
  const std::uint32_t survivalSize_;
};

}  // namespace velmora::mobile::xplat::cellar
