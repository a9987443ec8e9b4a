#pragma once

#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include "Export.h"
#include "session/Invalidatable.h"

namespace velmora::mobile::xplat::executor {
struct TaskQueueFactory;
}

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class AttributeStore;
class Configuration;
class DiskSizeCalculator;
class FileUtils;
class IncidentReporter;
class LazyDispatcher;
class StoreDirectoryNameBuilderFactory;
class StoreManager;
class TrashCollector;
struct PathLocations;

// Start here. Holds the configuration and every service, builds each manager on its first request, hands the same one
// to every later request, and invalidates them all at once when the session ends. A host keeps one for the managers of
// a session and one for those that belong to no session.
//
// Any thread may call. A manager is built on the thread that asks first, while others who ask for it wait and requests
// for other managers go on.
class CELLAR_EXPORT StoreManagerFactory : public session::Invalidatable {
 public:
  // Builds only managers whose `sessionScoped` is `servesSessionScoped`. `sessionTagMapper` makes the tag that names a
  // session's directories out of the session key; empty: the tag is empty. `analyticsReporter` and `lazyDispatcher` may
  // be null.
  StoreManagerFactory(bool servesSessionScoped, const std::shared_ptr<AnalyticsEventReporter>& analyticsReporter,
                      const std::shared_ptr<AttributeStore>& attributeStore,
                      const std::shared_ptr<const Configuration>& configuration,
                      const std::shared_ptr<DiskSizeCalculator>& diskSizeCalculator,
                      const std::shared_ptr<FileUtils>& fileUtils,
                      const std::shared_ptr<LazyDispatcher>& lazyDispatcher,
                      const std::shared_ptr<PathLocations>& pathLocations,
                      const std::shared_ptr<StoreDirectoryNameBuilderFactory>& nameBuilderFactory,
                      const std::shared_ptr<executor::TaskQueueFactory>& taskQueueFactory,
                      const std::shared_ptr<TrashCollector>& trashCollector,
                      const std::function<std::string(const std::string&)>& sessionTagMapper);
  ~StoreManagerFactory() override;
  StoreManagerFactory(const StoreManagerFactory&) = delete;
  StoreManagerFactory& operator=(const StoreManagerFactory&) = delete;

  // The manager of that name. The first request decides: later ones get the same manager, whatever their session key
  // and flag. Empty when this factory does not serve the manager's scope (one error line) or its area is not available,
  // and that is final too, until `invalidate`. Throws `ConfigurationException` for a name that the configuration does
  // not have, and whatever else building the manager throws, to the first caller; later callers then get
  // `std::future_error` (broken promise). Without key and flag: the empty session key, with maintenance.
  std::shared_ptr<StoreManager> managerForIdentifier(const std::string& managerName, const std::string& sessionKey,
                                                     bool runMaintenance);
  std::shared_ptr<StoreManager> managerForIdentifier(const std::string& managerName);

  // The manager that owns the store. Empty (and one error line) for a store that the configuration does not have;
  // otherwise as `managerForIdentifier`.
  std::shared_ptr<StoreManager> managerForStoreIdentifier(const std::string& storeIdentifier,
                                                          const std::string& sessionKey, bool runMaintenance);
  std::shared_ptr<StoreManager> managerForStoreIdentifier(const std::string& storeIdentifier);

  // Invalidates every manager built so far, discarding all its data, and forgets them: the next request builds a new
  // one. Waits for managers still being built, for what their stores are writing and for an invalidation by another
  // thread; must not be called on one of their queues. Managers that could not be had are skipped, but one whose
  // building threw makes this throw `std::future_error` (broken promise), and the managers after it stay valid.
  void invalidate() override;

  // Where managers that are built afterwards, and their stores, report incidents; null, as at first: nowhere. To be
  // called before several threads use the factory. The handler may ask for a manager: even a queue that runs tasks at
  // once calls it only when the building, or the invalidation, is over. The trash collector has a setter of its own.
  void setIncidents(std::shared_ptr<const IncidentReporter> incidents);

 private:
  std::shared_ptr<StoreManager> buildManager(const std::string& managerName, const std::string& sessionKey,
                                             bool runMaintenance);

  const std::shared_ptr<AnalyticsEventReporter> analyticsReporter_;
  const std::shared_ptr<AttributeStore> attributeStore_;
  const std::shared_ptr<const Configuration> configuration_;
  const std::shared_ptr<DiskSizeCalculator> diskSizeCalculator_;
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<LazyDispatcher> lazyDispatcher_;
  const std::shared_ptr<PathLocations> pathLocations_;
  const std::shared_ptr<StoreDirectoryNameBuilderFactory> nameBuilderFactory_;
  const std::shared_ptr<executor::TaskQueueFactory> taskQueueFactory_;
  const std::shared_ptr<TrashCollector> trashCollector_;
  const std::function<std::string(const std::string&)> sessionTagMapper_;
  const bool servesSessionScoped_;
  std::shared_ptr<const IncidentReporter> incidents_;

  std::recursive_mutex invalidationMutex_;  // held by an invalidation, within which another may begin

  std::mutex mutex_;
  std::unordered_map<std::string, std::shared_future<std::shared_ptr<StoreManager>>> managers_;  // guarded by mutex_
};

}  // namespace velmora::mobile::xplat::cellar
