#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "Export.h"
#include "StoreDefinition.h"
#include "StoreManagerImplCommon.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

class DiskSizeCalculator;
class LazyDispatcher;

// The manager behind every `StoreManager`: the stores of the common core, and the maintenance that keeps them within
// their limits. It knows the size that each store last reported and their total. When the total is above the manager's
// limit (or the device is short of space), and the prune interval has passed since the last round ended, every prunable
// store that is above its own limit is asked to prune itself. A store over its own limit inside a manager that is not
// over its own is left alone, unless a round is requested by `pruneNow`.
//
// Limits are checked when a size is reported, that is after a write: they can be passed by what is written until the
// round has run. Sizes and totals are unsigned 32-bit and wrap.
//
// Always held by shared pointers. Any thread may call. Maintenance runs on a queue of the manager's own and never lets
// an exception of the file system escape: it is one line in the log. Lock order: this manager's mutex, then one item's;
// neither is held while a store is asked to prune.
class CELLAR_EXPORT StoreManagerImpl : public std::enable_shared_from_this<StoreManagerImpl> {
 public:
  using SizeListener = std::function<void(const std::string& identifier, std::uint32_t size)>;

  // Bytes. The figure they are compared with is the file system's total size, not what is available on it: they take
  // effect on very small file systems only.
  static constexpr std::int64_t kMinimumFreeSizeSurvivalMode = 104857600;  // below: survival mode
  static constexpr std::int64_t kCleanseMinimumFreeSizeTrash = 78643200;   // below: the manager's directory is trashed
  static constexpr std::int64_t kCleanseMinimumFreeSizePurge = 52428800;   // consulted by nothing

  // Creates the manager's directories; throws what the file utilities throw. `analyticsReporter` may be null (nothing
  // is reported) and so may `lazyDispatcher` (stores are created when they are asked for).
  StoreManagerImpl(const std::string& parentPath, const StoreManagerDefinition& definition,
                   std::shared_ptr<StoreDirectoryNameBuilder> nameBuilder,
                   std::shared_ptr<TrashCollector> trashCollector, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                   std::shared_ptr<DiskSizeCalculator> diskSizeCalculator,
                   std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<FileUtils> fileUtils,
                   std::shared_ptr<AttributeStore> attributeStore, std::shared_ptr<LazyDispatcher> lazyDispatcher,
                   bool maintenanceEnabled);
  ~StoreManagerImpl();

  // The store of that identifier, created on first request; `strategy` counts only then, and only for a disk cache. An
  // unmanaged cache that is larger than its limit as it is created is emptied first, by its last measured size. Empty
  // for an identifier that the manager does not have (one error line) and once the manager is invalid. Throws what
  // creating the store throws.
  std::shared_ptr<Store> getStoreImpl(const std::string& identifier, PruneStrategyIdentifier strategy);

  // As the common core's.
  void retryFailedCreations();
  std::string getTemporaryDirectory();
  void trashStoreOnStartup(const std::string& identifier);
  void cleanupOldStores();
  void cleanupParentDirectory();
  std::string getStorePath(std::shared_ptr<const StoreDefinition> definition);
  void invalidate();
  void close();
  bool isValid();

  // Moves the manager's whole directory to the trash when forced, or when the file system is smaller than
  // `kCleanseMinimumFreeSizeTrash`: all data in any area, documents too, at each start, with an error line that names
  // directory, size and limit. So no data lasts on such a file system. The temporary directory is also removed, until
  // something creates it again.
  void cleanseIfNecessary(bool force);

  // Cleans up what other versions and sessions left behind, on the manager's queue.
  void startCleanup();

  // Registers the directories of the unmanaged stores, those that exist, with the size calculator.
  void startCalculatingUnmanagedStoresSize();

  // Has all configured stores created in the background when the lazy dispatcher releases its work. A disk cache first
  // created so gets the least-recently-used order, whatever its definition names.
  void initAllStoresLazy();

  // Takes note of a store's size in bytes, and has the limits checked on the manager's queue. The first one is reported
  // as the store's initialization. Not an error: a store that nobody asked for, or an invalid manager; nothing happens
  // then.
  void onStoreSizeChanged(const std::string& identifier, unsigned int size);

  // Starts a round of pruning, if it is time and there is need, or it was requested. At most one round is under way.
  void pruneStoresIfNecessary();

  // As those of `StoreManager`.
  void pruneNow();
  std::uint32_t sizeOf(const std::string& identifier);
  void setSizeListener(std::shared_ptr<const SizeListener> listener);

  // Takes note that a store has finished pruning, well or not.
  void onStorePruneBackToNormalComplete(const std::string& identifier);

  // Ends the round when no store is pruning any more; the next may start one prune interval later.
  void checkPruneCompletion();

  // Reports to analytics, if there is a reporter.
  void reportEventToAnalytics(const std::string& storeName, StoreManagerEvent::Type type, unsigned int currentSize,
                              unsigned int maxSize);

  // As the common core's. `cleanseIfNecessary` reports `ManagerDiscarded`, with the path of the manager's directory as
  // the name, when the directory was moved to the trash because of its file system's size: not when it was forced, and
  // not when it could not be moved.
  void setIncidents(std::shared_ptr<const IncidentReporter> incidents);

 private:
  struct PruneRequest;

  void measureNewUnmanagedStore(const std::string& identifier,
                                const std::shared_ptr<const StoreDefinition>& definition);
  void createAllStores();
  void checkLimitsSoon();
  std::vector<PruneRequest> beginPruneRound();
  std::string whyFileSystemIsTooSmall();
  bool isInSurvivalMode() const;
  void noteIfRoundIsOver(const std::lock_guard<std::mutex>& lock);
  void startPruning(const PruneRequest& request);

  std::mutex mutex_;  // guards the five below
  std::uint32_t totalSize_ = 0;
  std::int64_t lastPruneTime_ = 0;
  bool pruneInProgress_ = false;
  bool isRoundRequested_ = false;  // by `pruneNow`; it has not begun yet
  std::shared_ptr<const SizeListener> sizeListener_;

  std::recursive_mutex cleanupMutex_;  // held by a clean-up in the background, which may lead to an invalidation

  const bool maintenanceEnabled_;
  const std::shared_ptr<AnalyticsEventReporter> analyticsReporter_;
  const std::shared_ptr<DiskSizeCalculator> diskSizeCalculator_;
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<LazyDispatcher> lazyDispatcher_;
  const std::shared_ptr<TaskQueueFactory> taskQueueFactory_;
  const std::shared_ptr<TrashCollector> trashCollector_;
  StoreManagerImplCommon common_;
  const std::shared_ptr<AsyncExecutor> queue_;
  std::shared_ptr<const IncidentReporter> incidents_;
};

}  // namespace velmora::mobile::xplat::cellar
