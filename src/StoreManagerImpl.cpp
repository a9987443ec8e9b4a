#include "StoreManagerImpl.h"

#include <glog/logging.h>

#include <exception>
#include <stdexcept>
#include <utility>

#include "Clock.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "Incident.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "Store.h"
#include "TrashCollector.h"

namespace velmora::mobile::xplat::cellar {

// One store of a round, as it was when the round was decided.
struct StoreManagerImpl::PruneRequest {
  std::string identifier;
  std::shared_ptr<Store> store;
  std::string name;
  std::uint32_t currentSize;
  std::uint32_t maxSize;
  bool survivalMode;
};

StoreManagerImpl::StoreManagerImpl(const std::string& parentPath, const StoreManagerDefinition& definition,
                                   std::shared_ptr<StoreDirectoryNameBuilder> nameBuilder,
                                   std::shared_ptr<TrashCollector> trashCollector,
                                   std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                   std::shared_ptr<DiskSizeCalculator> diskSizeCalculator,
                                   std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                   std::shared_ptr<FileUtils> fileUtils, std::shared_ptr<AttributeStore> attributeStore,
                                   std::shared_ptr<LazyDispatcher> lazyDispatcher, bool maintenanceEnabled)
    : maintenanceEnabled_(maintenanceEnabled),
      analyticsReporter_(std::move(analyticsReporter)),
      diskSizeCalculator_(std::move(diskSizeCalculator)),
      fileUtils_(std::move(fileUtils)),
      lazyDispatcher_(std::move(lazyDispatcher)),
      taskQueueFactory_(std::move(taskQueueFactory)),
      trashCollector_(std::move(trashCollector)),
      common_(parentPath, trashCollector_, fileUtils_, std::move(nameBuilder), std::move(attributeStore), definition),
      queue_(taskQueueFactory_->createQueue()) {}

StoreManagerImpl::~StoreManagerImpl() = default;

std::shared_ptr<Store> StoreManagerImpl::getStoreImpl(const std::string& identifier, PruneStrategyIdentifier strategy) {
  std::shared_ptr<const StoreDefinition> definition;
  try {
    definition = common_.getStoreDefinition(identifier);
  } catch (const std::logic_error& error) {
    LOG(ERROR) << error.what();
  }
  if (definition == nullptr) return nullptr;

  const auto onSizeChanged = [self = shared_from_this(), identifier](unsigned int size) {
    self->onStoreSizeChanged(identifier, size);
  };
  bool created = false;
  auto store = common_.getStore(identifier, taskQueueFactory_, trashCollector_, analyticsReporter_, onSizeChanged,
                                strategy, created);
  if (created && store != nullptr && !definition->isManaged) measureNewUnmanagedStore(identifier, definition);
  return store;
}

// The library does not see what the host writes there, so this is when the size of such a store is looked at.
void StoreManagerImpl::measureNewUnmanagedStore(const std::string& identifier,
                                                const std::shared_ptr<const StoreDefinition>& definition) {
  const std::string path = getStorePath(definition);
  long long size = diskSizeCalculator_->fetchDirectorySize(path);
  const auto report = [&](StoreManagerEvent::Type type) {
    reportEventToAnalytics(definition->name, type, static_cast<unsigned int>(size), definition->maxSize);
  };
  report(StoreManagerEvent::Type::Initialization);
  if (definition->isCache && size > static_cast<long long>(definition->maxSize) && trashCollector_->collectPath(path)) {
    fileUtils_->createDirectory(path, true);
    report(StoreManagerEvent::Type::Eviction);
    size = 0;
  }
  queue_->dispatch([self = shared_from_this(), identifier, size] {
    self->onStoreSizeChanged(identifier, static_cast<unsigned int>(size));
  });
}

void StoreManagerImpl::retryFailedCreations() { common_.retryFailedCreations(); }

std::string StoreManagerImpl::getTemporaryDirectory() { return common_.getTemporaryDirectory(); }

void StoreManagerImpl::trashStoreOnStartup(const std::string& identifier) { common_.trashStoreOnStartup(identifier); }

void StoreManagerImpl::cleanupOldStores() { common_.cleanupOldStores(); }

void StoreManagerImpl::cleanupParentDirectory() { common_.cleanupParentDirectory(); }

std::string StoreManagerImpl::getStorePath(std::shared_ptr<const StoreDefinition> definition) {
  return common_.getStorePath(std::move(definition));
}

void StoreManagerImpl::invalidate() {
  if (common_.isInvalidatingHere()) return;
  common_.invalidate();
  // No other thread's clean-up is under way any more when this returns.
  const std::lock_guard<std::recursive_mutex> lock(cleanupMutex_);
}

void StoreManagerImpl::close() { common_.close(); }

bool StoreManagerImpl::isValid() { return common_.isValid(); }

void StoreManagerImpl::cleanseIfNecessary(bool force) {
  if (!fileUtils_->pathExists(common_.managerPath())) return;
  const std::string reason = whyFileSystemIsTooSmall();
  if (!force && reason.empty()) return;
  const bool isDiscarded = trashCollector_->collectPath(common_.managerPath());
  if (force || !isDiscarded || incidents_ == nullptr) return;
  incidents_->report({Incident::Kind::ManagerDiscarded, common_.managerPath(), "", reason});
}

// Empty if it is not. Logs it: what is discarded for it may be the only copy.
std::string StoreManagerImpl::whyFileSystemIsTooSmall() {
  const std::string& path = common_.managerPath();
  try {
    const std::int64_t size = fileUtils_->getDiskSpace(path).total;
    if (size >= kCleanseMinimumFreeSizeTrash) return "";
    std::string reason = "Discarding manager directory \"" + path + "\": its file system of " + std::to_string(size) +
                         " bytes is smaller than the limit of " + std::to_string(kCleanseMinimumFreeSizeTrash) +
                         " bytes.";
    LOG(ERROR) << reason;
    return reason;
  } catch (const LarderException& error) {
    LOG(ERROR) << "Could not read disk space: " << error.what();
    return "";
  }
}

void StoreManagerImpl::startCleanup() {
  queue_->dispatch([self = shared_from_this()] {
    const IncidentDeferral deferral;
    // One that comes late would take the next session's directories for stale.
    const std::lock_guard<std::recursive_mutex> lock(self->cleanupMutex_);
    if (!self->isValid()) return;
    self->cleanupOldStores();
    self->cleanupParentDirectory();
  });
}

void StoreManagerImpl::startCalculatingUnmanagedStoresSize() {
  for (const auto& [identifier, definition] : common_.definition().stores) {
    if (definition == nullptr || definition->isManaged) continue;
    const std::string path = getStorePath(definition);
    if (fileUtils_->pathExists(path)) diskSizeCalculator_->addDirectory(path, DiskSizeCalculator::STALE_INTERVAL);
  }
}

void StoreManagerImpl::initAllStoresLazy() {
  if (lazyDispatcher_ == nullptr) return;
  const auto createStores = [weakThis = weak_from_this()] {
    if (const auto self = weakThis.lock()) self->createAllStores();
  };
  lazyDispatcher_->addTask(createStores, taskQueueFactory_->createWorkQueue());
}

void StoreManagerImpl::createAllStores() {
  for (const auto& [identifier, definition] : common_.definition().stores) {
    try {
      getStoreImpl(identifier, PruneStrategyIdentifier::LRU);
    } catch (const LarderException& error) {
      LOG(ERROR) << "Could not initialize store " << identifier << ": " << error.what();
    }
  }
}

void StoreManagerImpl::onStoreSizeChanged(const std::string& identifier, unsigned int size) {
  const auto item = common_.getExistingStore(identifier);  // empty also when the manager is invalid
  if (item == nullptr) return;

  std::uint32_t oldSize = 0;
  {
    const std::lock_guard<std::mutex> lock(item->mutex);
    oldSize = item->currentSize;
    if (!item->sizeReported) {
      reportEventToAnalytics(item->name, StoreManagerEvent::Type::Initialization, size, item->maxSize);
      item->sizeReported = true;
    }
    item->currentSize = size;
  }

  std::shared_ptr<const SizeListener> listener;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    totalSize_ = size + (totalSize_ - oldSize);
    listener = sizeListener_;
  }
  if (listener != nullptr) (*listener)(identifier, size);
  if (maintenanceEnabled_) checkLimitsSoon();
}

std::uint32_t StoreManagerImpl::sizeOf(const std::string& identifier) {
  const auto item = common_.getExistingStore(identifier);
  if (item == nullptr) return 0;
  const std::lock_guard<std::mutex> lock(item->mutex);
  return item->currentSize;
}

void StoreManagerImpl::setSizeListener(std::shared_ptr<const SizeListener> listener) {
  const std::lock_guard<std::mutex> lock(mutex_);
  sizeListener_.swap(listener);
}

void StoreManagerImpl::pruneNow() {
  if (!maintenanceEnabled_) return;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    isRoundRequested_ = true;
  }
  checkLimitsSoon();
}

void StoreManagerImpl::checkLimitsSoon() {
  queue_->dispatch([self = shared_from_this()] { self->pruneStoresIfNecessary(); });
}

void StoreManagerImpl::pruneStoresIfNecessary() {
  // A store may finish at once, on this thread, and report back: no lock is held while it is asked.
  for (const PruneRequest& request : beginPruneRound()) startPruning(request);
}

// Decides which stores to prune and marks them. From then on, if there are any, the round is in progress. One that was
// requested waits neither for the interval nor for the manager's own limit.
std::vector<StoreManagerImpl::PruneRequest> StoreManagerImpl::beginPruneRound() {
  const std::lock_guard<std::mutex> lock(mutex_);
  const StoreManagerDefinition& definition = common_.definition();
  // A store that is destroyed in the middle of its prune does not say so.
  if (pruneInProgress_) noteIfRoundIsOver(lock);
  if (!common_.isValid() || pruneInProgress_ || definition.pruneInterval == 0) return {};
  const bool isRequested = std::exchange(isRoundRequested_, false);
  const auto nextPruneTime = lastPruneTime_ + definition.pruneInterval;
  if (!isRequested && lastPruneTime_ != 0 && Clock::now() < nextPruneTime) return {};
  const bool survivalMode = isInSurvivalMode();
  if (!isRequested && totalSize_ <= definition.maxSize && !survivalMode) return {};

  std::vector<PruneRequest> requests;
  for (const auto& [identifier, item] : common_.copyStoreMap()) {
    const std::lock_guard<std::mutex> itemLock(item->mutex);
    const auto store = item->getStore();
    if (store == nullptr || !store->isPrunable() || item->isPruning) continue;
    if (item->currentSize <= item->maxSize && !survivalMode) continue;
    item->isPruning = true;
    requests.push_back({identifier, store, item->name, item->currentSize, item->maxSize, survivalMode});
  }
  pruneInProgress_ = !requests.empty();
  return requests;
}

bool StoreManagerImpl::isInSurvivalMode() const {
  try {
    return fileUtils_->getDiskSpace(common_.managerPath()).total < kMinimumFreeSizeSurvivalMode;
  } catch (const LarderException& error) {
    LOG(ERROR) << "Could not read disk space: " << error.what();
    return false;
  }
}

void StoreManagerImpl::startPruning(const PruneRequest& request) {
  const auto onSuccess = [self = shared_from_this(), identifier = request.identifier] {
    self->onStorePruneBackToNormalComplete(identifier);
  };
  const auto onError = [self = shared_from_this(), identifier = request.identifier](const std::exception& error) {
    self->onStorePruneBackToNormalComplete(identifier);
    LOG(ERROR) << "Failed to prune store " << error.what();
  };
  try {
    reportEventToAnalytics(request.name, StoreManagerEvent::Type::Pruning, request.currentSize, request.maxSize);
    request.store->pruneBackToNormal(onSuccess, onError, request.survivalMode);
  } catch (const std::exception& error) {
    onError(error);
  } catch (...) {
    onError(std::runtime_error("unknown exception"));
  }
}

void StoreManagerImpl::onStorePruneBackToNormalComplete(const std::string& identifier) {
  if (const auto item = common_.getExistingStore(identifier)) {
    const std::lock_guard<std::mutex> lock(item->mutex);
    item->isPruning = false;
  }
  checkPruneCompletion();
}

void StoreManagerImpl::checkPruneCompletion() {
  // Looking and noting under one lock: of two stores that finish at once, the later to note has seen both.
  const std::lock_guard<std::mutex> lock(mutex_);
  noteIfRoundIsOver(lock);
}

void StoreManagerImpl::noteIfRoundIsOver(const std::lock_guard<std::mutex>& /*lock*/) {
  bool anyIsPruning = false;
  for (const auto& [identifier, item] : common_.copyStoreMap()) {
    const std::lock_guard<std::mutex> itemLock(item->mutex);
    anyIsPruning = anyIsPruning || (item->isPruning && item->getStore() != nullptr);
  }
  pruneInProgress_ = anyIsPruning;
  if (!anyIsPruning) lastPruneTime_ = Clock::now();
}

void StoreManagerImpl::reportEventToAnalytics(const std::string& storeName, StoreManagerEvent::Type type,
                                              unsigned int currentSize, unsigned int maxSize) {
  if (analyticsReporter_ == nullptr) return;
  analyticsReporter_->reportEvent(StoreManagerEvent(type, storeName, currentSize, maxSize));
}

void StoreManagerImpl::setIncidents(std::shared_ptr<const IncidentReporter> incidents) {
  incidents_ = incidents;
  common_.setIncidents(std::move(incidents));
}

}  // namespace velmora::mobile::xplat::cellar
