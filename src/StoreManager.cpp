#include "StoreManager.h"

#include <cxxabi.h>

#include <cstdlib>
#include <mutex>
#include <utility>

#include "StoreManagerImpl.h"

namespace velmora::mobile::xplat::cellar {

namespace {

std::mutex forceCleanseMutex;
bool forceCleanseAtStart = false;  // guarded by forceCleanseMutex

std::string demangle(const std::type_info& type) {
  int status = 0;
  const std::unique_ptr<char, void (*)(void*)> name(abi::__cxa_demangle(type.name(), nullptr, nullptr, &status),
                                                    &std::free);
  return status == 0 ? name.get() : type.name();
}

}  // namespace

void detail::throwStoreTypeMismatch(const std::string& identifier, const std::type_info& wanted, const Store& store) {
  throw std::logic_error("Store '" + identifier + "' is a " + demangle(typeid(store)) + ", not a " + demangle(wanted) +
                         ". Ask for the class that belongs to its \"type\".");
}

StoreManager::StoreManager(const std::string& parentPath, const StoreManagerDefinition& definition, bool forceCleanse,
                           const std::shared_ptr<StoreDirectoryNameBuilder>& nameBuilder,
                           const std::shared_ptr<TrashCollector>& trashCollector,
                           const std::shared_ptr<TaskQueueFactory>& taskQueueFactory,
                           const std::shared_ptr<DiskSizeCalculator>& diskSizeCalculator,
                           const std::shared_ptr<AnalyticsEventReporter>& analyticsReporter,
                           const std::shared_ptr<FileUtils>& fileUtils,
                           const std::shared_ptr<AttributeStore>& attributeStore,
                           const std::shared_ptr<LazyDispatcher>& lazyDispatcher, bool runMaintenance)
    : StoreManager(parentPath, definition, forceCleanse, nameBuilder, trashCollector, taskQueueFactory,
                   diskSizeCalculator, analyticsReporter, fileUtils, attributeStore, lazyDispatcher, runMaintenance,
                   nullptr) {}

StoreManager::StoreManager(const std::string& parentPath, const StoreManagerDefinition& definition, bool forceCleanse,
                           const std::shared_ptr<StoreDirectoryNameBuilder>& nameBuilder,
                           const std::shared_ptr<TrashCollector>& trashCollector,
                           const std::shared_ptr<TaskQueueFactory>& taskQueueFactory,
                           const std::shared_ptr<DiskSizeCalculator>& diskSizeCalculator,
                           const std::shared_ptr<AnalyticsEventReporter>& analyticsReporter,
                           const std::shared_ptr<FileUtils>& fileUtils,
                           const std::shared_ptr<AttributeStore>& attributeStore,
                           const std::shared_ptr<LazyDispatcher>& lazyDispatcher, bool runMaintenance,
                           std::shared_ptr<const IncidentReporter> incidents)
    : impl_(std::make_shared<StoreManagerImpl>(parentPath, definition, nameBuilder, trashCollector, taskQueueFactory,
                                               diskSizeCalculator, analyticsReporter, fileUtils, attributeStore,
                                               lazyDispatcher, runMaintenance)) {
  impl_->setIncidents(std::move(incidents));
  if (runMaintenance) {
    impl_->cleanseIfNecessary(forceCleanse);
    impl_->startCleanup();
  }
  impl_->startCalculatingUnmanagedStoresSize();
  impl_->initAllStoresLazy();
}

StoreManager::~StoreManager() { impl_->close(); }

std::shared_ptr<Store> StoreManager::getStoreImpl(const std::string& identifier, PruneStrategyIdentifier strategy) {
  return impl_->getStoreImpl(identifier, strategy);
}

std::string StoreManager::getTemporaryDirectory() { return impl_->getTemporaryDirectory(); }

void StoreManager::trashStoreOnStartup(const std::string& identifier) { impl_->trashStoreOnStartup(identifier); }

void StoreManager::invalidate() { impl_->invalidate(); }

bool StoreManager::isValid() { return impl_->isValid(); }

void StoreManager::retryFailedCreations() { impl_->retryFailedCreations(); }

void StoreManager::pruneNow() { impl_->pruneNow(); }

std::uint32_t StoreManager::sizeOf(const std::string& identifier) { return impl_->sizeOf(identifier); }

void StoreManager::setSizeListener(std::shared_ptr<const SizeListener> listener) {
  impl_->setSizeListener(std::move(listener));
}

bool StoreManager::forceCleanseOnInit() {
  const std::lock_guard<std::mutex> lock(forceCleanseMutex);
  return forceCleanseAtStart;
}

void StoreManager::setForceCleanseOnInit(bool force) {
  const std::lock_guard<std::mutex> lock(forceCleanseMutex);
  forceCleanseAtStart = force;
}

}  // namespace velmora::mobile::xplat::cellar
