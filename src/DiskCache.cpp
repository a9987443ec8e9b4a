#include "DiskCache.h"

#include <utility>
#include <vector>

#include "DiskCacheManifest.h"

namespace velmora::mobile::xplat::cellar {

namespace {

DiskCacheOptions optionsOf(const std::string& directory, const std::string& temporaryDirectoryPath,
                           const std::string& name, std::optional<std::uint64_t> capacity, long staleAge,
                           unsigned int normalSize, unsigned int survivalSize, bool inlineData,
                           std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
                           std::shared_ptr<PruneStrategyBase> pruneStrategy,
                           std::shared_ptr<DiskCacheManifestInterface> manifest,
                           std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize) {
  return {{directory, temporaryDirectoryPath, name, capacity, staleAge, inlineData, batchSize,
           std::move(sizeChangedCallback), std::move(manifest), std::move(extendedMetadataFactory),
           std::move(pruneStrategy)},
          normalSize,
          survivalSize};
}

}  // namespace

std::shared_ptr<DiskCache> DiskCache::create(const DiskCacheOptions& options, const StoreServices& services) {
  auto cache = std::make_shared<DiskCache>(options, services);
  cache->loadManifest();
  return cache;
}

std::shared_ptr<DiskCache> DiskCache::createDiskCache(
    const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
    std::optional<std::uint64_t> capacity, long staleAge, unsigned int normalSize, unsigned int survivalSize,
    bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
    std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<PruneStrategyBase> pruneStrategy, std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
    std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize) {
  return create(
      optionsOf(directory, temporaryDirectoryPath, name, capacity, staleAge, normalSize, survivalSize, inlineData,
                std::move(extendedMetadataFactory), std::move(pruneStrategy), std::move(manifest),
                std::move(sizeChangedCallback), batchSize),
      {std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils), std::move(analyticsReporter)});
}

DiskCache::DiskCache(const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
                     std::optional<std::uint64_t> capacity, long staleAge, unsigned int normalSize,
                     unsigned int survivalSize, bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                     std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
                     std::shared_ptr<TrashCollector> trashCollector, std::shared_ptr<PruneStrategyBase> pruneStrategy,
                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                     std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
                     std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize)
    : DiskCache(optionsOf(directory, temporaryDirectoryPath, name, capacity, staleAge, normalSize, survivalSize,
                          inlineData, std::move(extendedMetadataFactory), std::move(pruneStrategy), std::move(manifest),
                          std::move(sizeChangedCallback), batchSize),
                {std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils),
                 std::move(analyticsReporter)}) {}

DiskCache::DiskCache(const DiskCacheOptions& options, const StoreServices& services)
    : PersistentKeyValueStore(static_cast<const KeyValueStoreOptions&>(options), services),
      normalSize_(options.normalSize),
      survivalSize_(options.survivalSize) {}

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

}  // namespace velmora::mobile::xplat::cellar
