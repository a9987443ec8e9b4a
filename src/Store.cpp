#include "Store.h"

#include <stdexcept>
#include <utility>

#include "Configuration.h"

namespace velmora::mobile::xplat::cellar {

Store::Store(const std::string& path_) : path(path_) {}

Store::~Store() = default;

void Store::pruneBackToNormal(std::function<void()> /*onSuccess*/,
                              std::function<void(const std::exception&)> /*onError*/, bool /*survivalMode*/) {
  throw std::logic_error("pruneBackToNormal not implemented or invalid call");
}

void Store::invalidateSoon() { invalidate(); }

void Store::keepUntilIdle() {}

UnmanagedStore::UnmanagedStore(const std::string& path_, std::shared_ptr<const StoreDefinition> definition_)
    : Store(path_), definition(std::move(definition_)) {}

UnmanagedStore::~UnmanagedStore() = default;

std::uint32_t UnmanagedStore::getMaxSize() const { return definition->maxSize; }

bool UnmanagedStore::isPrunable() { return false; }

void UnmanagedStore::invalidate() {}

std::shared_ptr<Store> UnmanagedStoreDefinition::createStore(
    const std::string& storePath, const std::string& /*temporaryDirectoryPath*/,
    std::shared_ptr<TaskQueueFactory> /*taskQueueFactory*/, std::shared_ptr<TrashCollector> /*trashCollector*/,
    std::shared_ptr<AnalyticsEventReporter> /*analyticsReporter*/, std::shared_ptr<FileUtils> /*fileUtils*/,
    std::function<void(unsigned int)> /*sizeChangedCallback*/, PruneStrategyIdentifier /*pruneStrategy*/,
    std::shared_ptr<const StoreDefinition> definition) const {
  return std::make_shared<UnmanagedStore>(storePath, std::move(definition));
}

}  // namespace velmora::mobile::xplat::cellar
