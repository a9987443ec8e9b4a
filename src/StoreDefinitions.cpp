// How the definitions of a configuration make their stores.

#include <utility>

#include "DiskCache.h"
#include "ExtendedMetadata.h"
#include "PersistentKeyValueStore.h"
#include "PruneStrategy.h"
#include "Store.h"
#include "StoreDefinition.h"
#include "StoreOptions.h"
#include "base/StaleAge.h"

namespace velmora::mobile::xplat::cellar {

namespace {

template <class Definition> void setOptions(KeyValueStoreOptions& options, const Definition& definition,
                                            const std::string& storePath, const std::string& temporaryDirectoryPath,
                                            std::function<void(unsigned int)> sizeChangedCallback) {
  options.directory = storePath;
  options.temporaryDirectory = temporaryDirectoryPath;
  options.name = definition.name;
  options.capacity = definition.capacity;
  options.staleAge = staleAgeOf(definition.staleAge);
  options.inlineData = definition.inlineData;
  options.durability = definition.durability;
  options.onSizeChanged = std::move(sizeChangedCallback);
}

}  // namespace

std::shared_ptr<Store> StoreDefinition::createStore(const std::string& storePath,
                                                    const std::string& temporaryDirectoryPath,
                                                    const StoreServices& services,
                                                    std::function<void(unsigned int)> sizeChangedCallback,
                                                    PruneStrategyIdentifier pruneStrategy,
                                                    std::shared_ptr<const StoreDefinition> definition) const {
  return createStore(storePath, temporaryDirectoryPath, services.queues, services.trash, services.analytics,
                     services.files, std::move(sizeChangedCallback), pruneStrategy, std::move(definition));
}

std::shared_ptr<Store> UnmanagedStoreDefinition::createStore(
    const std::string& storePath, const std::string& /*temporaryDirectoryPath*/,
    std::shared_ptr<TaskQueueFactory> /*taskQueueFactory*/, std::shared_ptr<TrashCollector> /*trashCollector*/,
    std::shared_ptr<AnalyticsEventReporter> /*analyticsReporter*/, std::shared_ptr<FileUtils> /*fileUtils*/,
    std::function<void(unsigned int)> /*sizeChangedCallback*/, PruneStrategyIdentifier /*pruneStrategy*/,
    std::shared_ptr<const StoreDefinition> definition) const {
  return std::make_shared<UnmanagedStore>(storePath, std::move(definition));
}

std::shared_ptr<Store> PKVSDefinition::createStore(
    const std::string& storePath, const std::string& temporaryDirectoryPath,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, PruneStrategyIdentifier pruneStrategy,
    std::shared_ptr<const StoreDefinition> definition) const {
  const StoreServices services{std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils),
                               std::move(analyticsReporter)};
  return createStore(storePath, temporaryDirectoryPath, services, std::move(sizeChangedCallback), pruneStrategy,
                     std::move(definition));
}

std::shared_ptr<Store> PKVSDefinition::createStore(const std::string& storePath,
                                                   const std::string& temporaryDirectoryPath,
                                                   const StoreServices& services,
                                                   std::function<void(unsigned int)> sizeChangedCallback,
                                                   PruneStrategyIdentifier /*pruneStrategy*/,
                                                   std::shared_ptr<const StoreDefinition> /*definition*/) const {
  KeyValueStoreOptions options;
  setOptions(options, *this, storePath, temporaryDirectoryPath, std::move(sizeChangedCallback));
  return PersistentKeyValueStore::create(std::move(options), services);
}

std::shared_ptr<Store> DiskCacheDefinition::createStore(
    const std::string& storePath, const std::string& temporaryDirectoryPath,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, PruneStrategyIdentifier pruneStrategyOverride,
    std::shared_ptr<const StoreDefinition> definition) const {
  const StoreServices services{std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils),
                               std::move(analyticsReporter)};
  return createStore(storePath, temporaryDirectoryPath, services, std::move(sizeChangedCallback), pruneStrategyOverride,
                     std::move(definition));
}

std::shared_ptr<Store> DiskCacheDefinition::createStore(const std::string& storePath,
                                                        const std::string& temporaryDirectoryPath,
                                                        const StoreServices& services,
                                                        std::function<void(unsigned int)> sizeChangedCallback,
                                                        PruneStrategyIdentifier pruneStrategyOverride,
                                                        std::shared_ptr<const StoreDefinition> /*definition*/) const {
  DiskCacheOptions options;
  setOptions(options, *this, storePath, temporaryDirectoryPath, std::move(sizeChangedCallback));
  options.normalSize = lruSizeLimit;
  options.survivalSize = survivalSize;
  options.extendedMetadataFactory = ExtendedMetadataFactoryFactory(metadataFactory);
  // A cache that a manager creates in the background, before anybody asks for it, is asked for with LRU.
  const bool isFixed = pruneStrategy == PruneStrategyIdentifier::GreedyDual;
  options.pruneStrategy = PruneStrategyFactory(
      isFixed || pruneStrategyOverride == PruneStrategyIdentifier::Null ? pruneStrategy : pruneStrategyOverride);
  return DiskCache::create(options, services);
}

}  // namespace velmora::mobile::xplat::cellar
