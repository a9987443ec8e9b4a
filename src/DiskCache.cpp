#include "DiskCache.h"

#include <utility>
#include <vector>

#include "Configuration.h"
#include "DiskCacheManifest.h"
#include "ExtendedMetadata.h"
#include "PruneStrategy.h"
#include "StoreDefaults.h"

namespace velmora::mobile::xplat::cellar {

std::shared_ptr<DiskCache> DiskCache::createDiskCache(
    const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
    std::optional<std::uint64_t> capacity, long staleAge, unsigned int normalSize, unsigned int survivalSize,
    bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
    std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<PruneStrategyBase> pruneStrategy, std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
    std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize) {
  auto cache =
      std::make_shared<DiskCache>(directory, temporaryDirectoryPath, name, capacity, staleAge, normalSize, survivalSize,
                                  inlineData, std::move(taskQueueFactory), std::move(extendedMetadataFactory),
                                  std::move(trashCollector), std::move(pruneStrategy), std::move(analyticsReporter),
                                  std::move(manifest), std::move(fileUtils), std::move(sizeChangedCallback), batchSize);
  cache->loadManifest();
  return cache;
}

DiskCache::DiskCache(const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
                     std::optional<std::uint64_t> capacity, long staleAge, unsigned int normalSize,
                     unsigned int survivalSize, bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                     std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
                     std::shared_ptr<TrashCollector> trashCollector, std::shared_ptr<PruneStrategyBase> pruneStrategy,
                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                     std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
                     std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize)
    : PersistentKeyValueStore(directory, temporaryDirectoryPath, name, capacity, staleAge, inlineData,
                              std::move(taskQueueFactory), std::move(extendedMetadataFactory),
                              std::move(trashCollector), std::move(pruneStrategy), std::move(analyticsReporter),
                              std::move(manifest), std::move(fileUtils), std::move(sizeChangedCallback), batchSize),
      normalSize_(normalSize),
      survivalSize_(survivalSize) {}

DiskCache::~DiskCache() = default;

bool DiskCache::isPrunable() { return true; }

void DiskCache::pruneBackToNormal(std::function<void()> onSuccess, std::function<void(const std::exception&)> onError,
                                  bool survivalMode) {
  std::uint32_t target = survivalSize_;
  if (!survivalMode) {
    const std::lock_guard<std::mutex> lock(mutex());
    target = normalSize_;
  }
  const auto takeNextBatch = [weakThis = weak_from_this<DiskCache>(), target]() -> std::vector<DiskCacheItem> {
    const auto self = weakThis.lock();
    if (self == nullptr) return {};
    return self->evictBatch(
        [&](DiskCacheManifestInterface& manifest) { return manifest.pruneToSize(target, self->batchSize()); });
  };
  deleteFilesInBatches(takeNextBatch, std::move(onSuccess), std::move(onError));
}

std::shared_ptr<PruneStrategyBase> DiskCache::getPruneStrategy() { return pruneStrategy(); }

void DiskCache::overrideConfiguration(long staleAge, unsigned int normalSize) {
  {
    const std::lock_guard<std::mutex> lock(mutex());
    normalSize_ = normalSize;
  }
  overrideConfiguration(staleAge);
}

std::shared_ptr<Store> DiskCacheDefinition::createStore(
    const std::string& storePath, const std::string& temporaryDirectoryPath,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, PruneStrategyIdentifier pruneStrategyOverride,
    std::shared_ptr<const StoreDefinition> /*definition*/) const {
  const PruneStrategyIdentifier strategy =
      pruneStrategyOverride == PruneStrategyIdentifier::Null ? pruneStrategy : pruneStrategyOverride;
  return DiskCache::createDiskCache(storePath, temporaryDirectoryPath, name, capacity, staleAgeOf(staleAge),
                                    lruSizeLimit, survivalSize, inlineData, std::move(taskQueueFactory),
                                    ExtendedMetadataFactoryFactory(metadataFactory), std::move(trashCollector),
                                    PruneStrategyFactory(strategy), std::move(analyticsReporter), nullptr,
                                    std::move(fileUtils), std::move(sizeChangedCallback), kDefaultBatchSize);
}

}  // namespace velmora::mobile::xplat::cellar
