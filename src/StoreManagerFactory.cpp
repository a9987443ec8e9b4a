#include "StoreManagerFactory.h"

#include <glog/logging.h>

#include <exception>
#include <stdexcept>
#include <utility>

#include "Configuration.h"
#include "Incident.h"
#include "PathLocations.h"
#include "StoreDirectoryNameBuilder.h"
#include "StoreManager.h"

namespace velmora::mobile::xplat::cellar {

StoreManagerFactory::StoreManagerFactory(
    bool servesSessionScoped, const std::shared_ptr<AnalyticsEventReporter>& analyticsReporter,
    const std::shared_ptr<AttributeStore>& attributeStore, const std::shared_ptr<const Configuration>& configuration,
    const std::shared_ptr<DiskSizeCalculator>& diskSizeCalculator, const std::shared_ptr<FileUtils>& fileUtils,
    const std::shared_ptr<LazyDispatcher>& lazyDispatcher, const std::shared_ptr<PathLocations>& pathLocations,
    const std::shared_ptr<StoreDirectoryNameBuilderFactory>& nameBuilderFactory,
    const std::shared_ptr<executor::TaskQueueFactory>& taskQueueFactory,
    const std::shared_ptr<TrashCollector>& trashCollector,
    const std::function<std::string(const std::string&)>& sessionTagMapper)
    : analyticsReporter_(analyticsReporter),
      attributeStore_(attributeStore),
      configuration_(configuration),
      diskSizeCalculator_(diskSizeCalculator),
      fileUtils_(fileUtils),
      lazyDispatcher_(lazyDispatcher),
      pathLocations_(pathLocations),
      nameBuilderFactory_(nameBuilderFactory),
      taskQueueFactory_(taskQueueFactory),
      trashCollector_(trashCollector),
      sessionTagMapper_(sessionTagMapper),
      servesSessionScoped_(servesSessionScoped) {}

StoreManagerFactory::~StoreManagerFactory() = default;

std::shared_ptr<StoreManager> StoreManagerFactory::managerForIdentifier(const std::string& managerName,
                                                                        const std::string& sessionKey,
                                                                        bool runMaintenance) {
  const IncidentDeferral deferral;  // who asks for this manager meanwhile waits for the promise
  std::promise<std::shared_ptr<StoreManager>> promise;
  std::shared_future<std::shared_ptr<StoreManager>> future;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    auto& entry = managers_[managerName];
    if (entry.valid()) {
      future = entry;
    } else {
      entry = promise.get_future().share();
    }
  }
  if (future.valid()) return future.get();

  // The promise breaks when building throws: that request stays failed for everybody who asks later.
  auto manager = buildManager(managerName, sessionKey, runMaintenance);
  promise.set_value(manager);
  return manager;
}

std::shared_ptr<StoreManager> StoreManagerFactory::managerForIdentifier(const std::string& managerName) {
  return managerForIdentifier(managerName, "", true);
}

std::shared_ptr<StoreManager> StoreManagerFactory::managerForStoreIdentifier(const std::string& storeIdentifier,
                                                                             const std::string& sessionKey,
                                                                             bool runMaintenance) {
  std::string managerName;
  try {
    const auto definition = configuration_->getStore(storeIdentifier);
    if (definition == nullptr) throw std::logic_error("Store '" + storeIdentifier + "' has no definition.");
    managerName = definition->managerName;
  } catch (const std::exception& error) {
    LOG(ERROR) << error.what();
    return nullptr;
  }
  return managerForIdentifier(managerName, sessionKey, runMaintenance);
}

std::shared_ptr<StoreManager> StoreManagerFactory::managerForStoreIdentifier(const std::string& storeIdentifier) {
  return managerForStoreIdentifier(storeIdentifier, "", true);
}

void StoreManagerFactory::invalidate() {
  const IncidentDeferral deferral;
  const std::lock_guard<std::recursive_mutex> invalidation(invalidationMutex_);
  decltype(managers_) managers;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    managers.swap(managers_);
  }
  for (const auto& [name, future] : managers) {
    if (const auto manager = future.get()) manager->invalidate();
  }
}

std::shared_ptr<StoreManager> StoreManagerFactory::buildManager(const std::string& managerName,
                                                                const std::string& sessionKey, bool runMaintenance) {
  const auto definition = configuration_->getManager(managerName);
  if (definition == nullptr || definition->sessionScoped != servesSessionScoped_) {
    LOG(ERROR) << "Invalid manager identifier: manager definition not in container.";
    return nullptr;
  }
  std::string parentPath;
  try {
    parentPath = pathLocations_->pathForArea(definition->area, sessionKey);
  } catch (...) {
    return nullptr;  // the area is not available: the host knows why
  }
  const std::string sessionTag = sessionTagMapper_ ? sessionTagMapper_(sessionKey) : "";
  const auto nameBuilder = servesSessionScoped_ ? nameBuilderFactory_->createStoreDirectoryNameBuilder(sessionTag)
                                                : nameBuilderFactory_->createStoreDirectoryNameBuilder();
  return std::make_shared<StoreManager>(parentPath, *definition, StoreManager::forceCleanseOnInit(), nameBuilder,
                                        trashCollector_, taskQueueFactory_, diskSizeCalculator_, analyticsReporter_,
                                        fileUtils_, attributeStore_, lazyDispatcher_, runMaintenance, incidents_);
}

void StoreManagerFactory::setIncidents(std::shared_ptr<const IncidentReporter> incidents) {
  incidents_ = std::move(incidents);
}

}  // namespace velmora::mobile::xplat::cellar
