#include "StoreManagerImplCommon.h"

#include <glog/logging.h>

#include <algorithm>
#include <exception>
#include <stdexcept>
#include <utility>

#include "AttributeStore.h"
#include "FileUtils.h"
#include "Incident.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "Store.h"
#include "StoreDirectoryNameBuilder.h"
#include "StoreOptions.h"
#include "TrashCollector.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// What the exception that is being handled says.
std::string currentExceptionText() {
  try {
    throw;
  } catch (const std::exception& error) {
    return error.what();
  } catch (...) {
    return "unknown exception";
  }
}

}  // namespace

const std::string StoreManagerImplCommon::TemporaryDirectoryName = "tmp";
const std::string StoreManagerImplCommon::TrashOnStartupKey = "trash_on_start_up";

StoreManagerImplCommon::StoreManagerImplCommon(const std::string& parentPath,
                                               std::shared_ptr<TrashCollector> trashCollector,
                                               std::shared_ptr<FileUtils> fileUtils,
                                               std::shared_ptr<StoreDirectoryNameBuilder> nameBuilder,
                                               std::shared_ptr<AttributeStore> attributeStore,
                                               const StoreManagerDefinition& definition)
    : definition_(definition),
      parentPath_(parentPath),
      trashCollector_(std::move(trashCollector)),
      fileUtils_(std::move(fileUtils)),
      nameBuilder_(std::move(nameBuilder)),
      attributeStore_(std::move(attributeStore)),
      managerDirectoryName_(nameBuilder_->buildStoreManagerName()),
      managerPath_(fileUtils_->combinePath(parentPath_, managerDirectoryName_)),
      temporaryDirectoryPath_(fileUtils_->combinePath(managerPath_, TemporaryDirectoryName)) {
  if (fileUtils_->pathExists(temporaryDirectoryPath_)) trashCollector_->collectPath(temporaryDirectoryPath_);
  fileUtils_->createDirectory(temporaryDirectoryPath_, true);
}

StoreManagerImplCommon::~StoreManagerImplCommon() = default;

std::shared_ptr<Store> StoreManagerImplCommon::getStore(const std::string& identifier,
                                                        std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                                        std::shared_ptr<TrashCollector> trashCollector,
                                                        std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                                        std::function<void(unsigned int)> sizeChangedCallback,
                                                        PruneStrategyIdentifier pruneStrategy, bool& created) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (invalid_ || closed_) return nullptr;
  std::shared_ptr<Item>& slot = stores_[identifier];
  const bool isNew = slot == nullptr;
  if (isNew) slot = std::make_shared<Item>();
  const std::shared_ptr<Item> item = slot;
  const bool retries = retriesFailedCreations_;
  lock.unlock();
  if (!isNew) {
    std::unique_lock<std::mutex> itemLock(item->mutex);
    const auto mayBeCreated = [&] { return retries && item->hasFailed; };
    item->condition.wait(itemLock, [&] { return item->getStore() != nullptr || item->isAbandoned || mayBeCreated(); });
    if (!mayBeCreated()) return item->getStore();
    item->hasFailed = false;  // this caller creates it now, and the others wait again
  }

  created = true;
  try {
    return createStore(identifier, item, std::move(taskQueueFactory), std::move(trashCollector),
                       std::move(analyticsReporter), std::move(sizeChangedCallback), pruneStrategy);
  } catch (...) {
    if (isValid()) {
      noteFailure(*item);
      reportFailure(identifier);
    } else {
      abandon(*item);
    }
    throw;
  }
}

void StoreManagerImplCommon::retryFailedCreations() {
  const std::lock_guard<std::mutex> lock(mutex_);
  retriesFailedCreations_ = true;
}

void StoreManagerImplCommon::noteFailure(Item& item) {
  {
    const std::lock_guard<std::mutex> lock(item.mutex);
    item.hasFailed = item.getStore() == nullptr;
  }
  item.condition.notify_all();
}

// Called where the exception is handled.
void StoreManagerImplCommon::reportFailure(const std::string& identifier) const {
  const auto found = definition_.stores.find(identifier);
  if (incidents_ == nullptr || found == definition_.stores.end() || found->second == nullptr) return;
  const std::string& name = found->second->name;
  incidents_->report(
      {Incident::Kind::CreationFailed, name, "", "Could not create store \"" + name + "\": " + currentExceptionText()});
}

// The directory was removed under the creator. Whoever waits for the store gets what later callers get: none.
void StoreManagerImplCommon::abandon(Item& item) {
  {
    const std::lock_guard<std::mutex> lock(item.mutex);
    item.isAbandoned = true;
  }
  item.condition.notify_all();
}

std::shared_ptr<StoreManagerImplCommon::Item> StoreManagerImplCommon::getExistingStore(const std::string& identifier) {
  const std::lock_guard<std::mutex> lock(mutex_);
  if (invalid_) return nullptr;
  const auto found = stores_.find(identifier);
  return found == stores_.end() ? nullptr : found->second;
}

std::shared_ptr<Store> StoreManagerImplCommon::createStore(const std::string& identifier, std::shared_ptr<Item> item,
                                                           std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                                           std::shared_ptr<TrashCollector> trashCollector,
                                                           std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                                           std::function<void(unsigned int)> sizeChangedCallback,
                                                           PruneStrategyIdentifier pruneStrategy) {
  const auto storeDefinition = getStoreDefinition(identifier);
  const std::string storePath = getStorePath(storeDefinition);
  if (isMarkedForTrashing(storePath)) trashCollector_->collectPath(storePath);
  fileUtils_->createDirectory(storePath, true);
  if (!isValid()) {
    abandon(*item);  // the next manager of this directory may be opening the same files by now
    return nullptr;
  }
  const StoreServices services{std::move(taskQueueFactory), std::move(trashCollector), fileUtils_,
                               std::move(analyticsReporter), incidents_};
  auto store = storeDefinition->createStore(storePath, temporaryDirectoryPath_, services,
                                            std::move(sizeChangedCallback), pruneStrategy, storeDefinition);
  {
    const std::lock_guard<std::mutex> lock(item->mutex);
    item->store = store;
    item->maxSize = storeDefinition->maxSize;
    item->name = storeDefinition->name;
  }
  item->condition.notify_all();

  // Whoever invalidated or closed the manager meanwhile could not see this store. Without waiting: this thread may be
  // the one that the store's queues run on, and there is nothing yet to wait for.
  if (!isValid()) store->invalidateSoon();
  if (isClosed()) releaseOwnership(*item);
  return store;
}

std::shared_ptr<const StoreDefinition> StoreManagerImplCommon::getStoreDefinition(const std::string& identifier) {
  const auto found = definition_.stores.find(identifier);
  if (found == definition_.stores.end()) {
    throw std::logic_error("Definition not defined for store with identifier " + identifier +
                           " in StoreManager with name '" + definition_.name + "'");
  }
  return found->second;
}

std::string StoreManagerImplCommon::getStorePath(std::shared_ptr<const StoreDefinition> definition) {
  return fileUtils_->combinePath(managerPath_, nameBuilder_->buildStoreName(*definition));
}

StoreManagerImplCommon::StoreMap StoreManagerImplCommon::copyStoreMap() {
  const std::lock_guard<std::mutex> lock(mutex_);
  return stores_;
}

void StoreManagerImplCommon::trashStoreOnStartup(const std::string& identifier) {
  const std::string storePath = getStorePath(getStoreDefinition(identifier));
  if (fileUtils_->pathExists(storePath)) attributeStore_->set(storePath, {{TrashOnStartupKey, true}});
}

void StoreManagerImplCommon::cleanupOldStores() {
  try {
    if (!fileUtils_->pathExists(managerPath_)) return;
    std::vector<std::string> keep;
    for (const auto& [identifier, store] : definition_.stores) {
      if (store != nullptr) keep.push_back(nameBuilder_->buildStoreName(*store));
    }
    keep.push_back(TemporaryDirectoryName);
    trashDirectories(managerPath_, fileUtils_->listDirectories(managerPath_), keep);
  } catch (const LarderException& error) {
    LOG(ERROR) << "Cleanup of old stores failed " << error.what();
  }
}

void StoreManagerImplCommon::cleanupParentDirectory() {
  try {
    if (!nameBuilder_->hasStaleNamesInParent(definition_)) return;
    const auto names = nameBuilder_->filterStoreManagerNames(definition_, fileUtils_->listDirectories(parentPath_));
    trashDirectories(parentPath_, names, {managerDirectoryName_});
  } catch (const LarderException& error) {
    LOG(ERROR) << "Cleanup of parent directory failed " << error.what();
  }
}

void StoreManagerImplCommon::trashDirectories(const std::string& parent, const std::vector<std::string>& names,
                                              const std::vector<std::string>& keep) {
  for (const std::string& name : names) {
    if (std::find(keep.begin(), keep.end(), name) != keep.end()) continue;
    trashCollector_->collectPath(fileUtils_->combinePath(parent, name));
  }
}

// An invalidation under way. Its end, however it comes, wakes whoever waits for it.
class StoreManagerImplCommon::Invalidation {
 public:
  explicit Invalidation(StoreManagerImplCommon& manager) : manager_(manager) {}
  ~Invalidation() {
    const std::lock_guard<std::mutex> lock(manager_.mutex_);
    manager_.invalidatingThread_ = std::thread::id();
    manager_.invalidation_.notify_all();
  }
  Invalidation(const Invalidation&) = delete;
  Invalidation& operator=(const Invalidation&) = delete;

 private:
  StoreManagerImplCommon& manager_;
};

void StoreManagerImplCommon::invalidate() {
  if (isInvalidatingHere()) return;
  StoreMap slots;
  {
    std::unique_lock<std::mutex> lock(mutex_);
    invalidation_.wait(lock, [this] { return invalidatingThread_ == std::thread::id(); });
    if (invalid_) return;
    invalid_ = true;
    invalidatingThread_ = std::this_thread::get_id();
    slots.swap(stores_);
  }
  const Invalidation invalidation(*this);
  discard(std::move(slots));
}

// Also releases the stores, before the invalidation is over: their directory may be somebody else's after it.
void StoreManagerImplCommon::discard(StoreMap slots) {
  const StoreMap released = std::move(slots);
  std::vector<std::shared_ptr<Store>> stores;
  for (const auto& [identifier, item] : released) {
    const std::lock_guard<std::mutex> lock(item->mutex);
    if (auto store = item->getStore()) stores.push_back(std::move(store));
  }
  // Waiting for a store under a lock would hang when its queue needs that lock to get on.
  for (const auto& store : stores) {
    try {
      store->invalidate();
    } catch (const std::exception& error) {
      LOG(ERROR) << "Could not invalidate store at \"" << store->path << "\": " << error.what();
    }
  }
  trashCollector_->collectPath(managerPath_);
}

bool StoreManagerImplCommon::isInvalidatingHere() {
  const std::lock_guard<std::mutex> lock(mutex_);
  return invalidatingThread_ == std::this_thread::get_id();
}

void StoreManagerImplCommon::close() {
  StoreMap slots;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    closed_ = true;
    slots = stores_;
  }
  for (const auto& [identifier, item] : slots) {
    if (const auto store = releaseOwnership(*item)) store->keepUntilIdle();
  }
}

// Returns the store, so that the caller can release what may be the last reference after unlocking.
std::shared_ptr<Store> StoreManagerImplCommon::releaseOwnership(Item& item) {
  const std::lock_guard<std::mutex> lock(item.mutex);
  if (item.store == nullptr) return nullptr;
  item.weakStore = item.store;
  item.isAbandoned = true;
  return std::exchange(item.store, nullptr);
}

bool StoreManagerImplCommon::isClosed() {
  const std::lock_guard<std::mutex> lock(mutex_);
  return closed_;
}

bool StoreManagerImplCommon::isValid() {
  const std::lock_guard<std::mutex> lock(mutex_);
  return !invalid_;
}

bool StoreManagerImplCommon::isMarkedForTrashing(const std::string& storePath) {
  const JsonValue attributes = attributeStore_->get(storePath);
  if (!attributes.is_object()) return false;
  const auto mark = attributes.find(TrashOnStartupKey);
  return mark != attributes.end() && mark->is_boolean() && mark->get<bool>();
}

const StoreManagerDefinition& StoreManagerImplCommon::definition() const { return definition_; }
const std::string& StoreManagerImplCommon::parentPath() const { return parentPath_; }
const std::string& StoreManagerImplCommon::managerPath() const { return managerPath_; }
const std::string& StoreManagerImplCommon::managerDirectoryName() const { return managerDirectoryName_; }
const std::string& StoreManagerImplCommon::getTemporaryDirectory() const { return temporaryDirectoryPath_; }

void StoreManagerImplCommon::setIncidents(std::shared_ptr<const IncidentReporter> incidents) {
  incidents_ = std::move(incidents);
}

}  // namespace velmora::mobile::xplat::cellar
