#pragma once

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "Export.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

class AttributeStore;
class IncidentReporter;
class StoreDirectoryNameBuilder;

// What the lite and the full manager share: one manager's directory tree and its stores, each created once and handed
// to every caller.
//
//   <parent path>/                       the area, given by the host
//     <manager directory name>/          "_store_" + session tag, or "_sessionlessStore"
//       <store directory name>/          one for each store
//       tmp/                             the temporary directory, emptied whenever a manager is built
//
// Any thread may call. Lock order: the manager mutex, then one item's. Neither is held while a store is created, waited
// for or invalidated.
class CELLAR_EXPORT StoreManagerImplCommon {
 public:
  static const std::string TemporaryDirectoryName;  // "tmp"
  static const std::string TrashOnStartupKey;       // "trash_on_start_up", in the attributes of a store's directory

  // The slot of one store, shared by the store map and everybody who waits for the store.
  struct CELLAR_EXPORT Item {
    std::shared_ptr<Store> store;       // empty until the store has been created, and once the manager is closed
    std::weak_ptr<Store> weakStore;     // in a closed manager: the store, while somebody else holds it
    std::uint32_t currentSize = 0;      // bytes that the store reported last
    std::uint32_t maxSize = 0;          // bytes, the definition's
    std::string name;                   // the definition's
    bool isPruning = false;             // a prune of the store is under way
    bool sizeReported = false;          // its first size has been reported
    bool isAbandoned = false;           // nobody need wait: creating failed beside an invalidation, or it is closed
    bool hasFailed = false;             // the last attempt to create the store
    std::mutex mutex;                   // guards all of the above; held by the caller of the below
    std::condition_variable condition;  // signalled when `store` has been set, creating failed, or it is abandoned

    // The store, if it has been created and is still there.
    std::shared_ptr<Store> getStore() const { return store != nullptr ? store : weakStore.lock(); }
  };

  // Moves a temporary directory that an earlier run left behind to the trash and creates a fresh one, with the manager
  // directory and its parents. Throws what the file utilities throw.
  StoreManagerImplCommon(const std::string& parentPath, std::shared_ptr<TrashCollector> trashCollector,
                         std::shared_ptr<FileUtils> fileUtils, std::shared_ptr<StoreDirectoryNameBuilder> nameBuilder,
                         std::shared_ptr<AttributeStore> attributeStore, const StoreManagerDefinition& definition);
  ~StoreManagerImplCommon();
  StoreManagerImplCommon(const StoreManagerImplCommon&) = delete;
  StoreManagerImplCommon& operator=(const StoreManagerImplCommon&) = delete;

  // The store of that identifier, created by the first caller while the others wait; `created` is set to true only in
  // the call that created it. Empty once the manager is invalid. What creating throws reaches the first caller, and
  // then later callers of that identifier wait without end (there is deliberately no timeout) unless the manager was
  // being invalidated (they get an empty pointer then) or `retryFailedCreations` was called before.
  std::shared_ptr<Store> getStore(const std::string& identifier, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                  std::shared_ptr<TrashCollector> trashCollector,
                                  std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                  std::function<void(unsigned int)> sizeChangedCallback,
                                  PruneStrategyIdentifier pruneStrategy, bool& created);

  // From now on nobody waits for a store whose creation has failed: the next caller of `getStore`, or the next of those
  // who wait already, creates it again.
  void retryFailedCreations();

  // The slot of that identifier; empty when nobody has asked for the store or the manager is invalid.
  std::shared_ptr<Item> getExistingStore(const std::string& identifier);

  // Creates the store, in an emptied directory when it was marked for trashing, publishes it in `item` and wakes who
  // waits for it. If the manager has been invalidated meanwhile the store is invalidated too. Called by `getStore`
  // only.
  std::shared_ptr<Store> createStore(const std::string& identifier, std::shared_ptr<Item> item,
                                     std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                     std::shared_ptr<TrashCollector> trashCollector,
                                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy);

  // Throws `std::logic_error` that names identifier and manager when the manager has no such store.
  std::shared_ptr<const StoreDefinition> getStoreDefinition(const std::string& identifier);

  // The directory of a store of that definition.
  std::string getStorePath(std::shared_ptr<const StoreDefinition> definition);

  // The slots as they are now; the slots themselves are shared.
  std::unordered_map<std::string, std::shared_ptr<Item>> copyStoreMap();

  // Makes the next creation of the store, normally at the next start, begin with an empty directory. Nothing is deleted
  // now, and nothing happens when the directory does not exist. The mark replaces whatever else the directory's
  // attributes held, a kept size among them, and the next measurement of the directory replaces the mark.
  void trashStoreOnStartup(const std::string& identifier);

  // Moves every directory in the manager's directory to the trash that is not the current name of a configured store:
  // what another version or locale, or a store that is no longer configured, left behind. A failure is one error line.
  void cleanupOldStores();

  // Moves the manager directories of other sessions to the trash. A failure is one error line.
  void cleanupParentDirectory();

  // Moves those of `names` that are not in `keep` from `parent` to the trash.
  void trashDirectories(const std::string& parent, const std::vector<std::string>& names,
                        const std::vector<std::string>& keep);

  // Invalidates all stores and moves the manager's directory with all its data to the trash. Waits until the stores
  // have finished what they were writing, so it must not be called on one of their queues. A second call does nothing
  // but wait until the first is over; made from within the first, on its thread, it returns at once.
  void invalidate();

  // Whether this thread is in the midst of `invalidate`.
  bool isInvalidatingHere();

  // Leaves all stores to whoever else holds them and hands out no more, without touching their data: the manager's
  // handle was released. Each store finishes what it has accepted before it is destroyed. A store's size callback keeps
  // the manager, so the two would keep each other for ever. What is held is measured and pruned as before.
  void close();

  bool isValid();

  const StoreManagerDefinition& definition() const;
  const std::string& parentPath() const;
  const std::string& managerPath() const;
  const std::string& managerDirectoryName() const;
  const std::string& getTemporaryDirectory() const;

  // Where the manager, and the stores that it creates afterwards, report incidents; null, as at first: nowhere. To be
  // called before several threads use the manager. `CreationFailed` is reported once for each attempt to create a store
  // that throws, with the exception's text. Not for an identifier that the manager does not have, nor once the manager
  // is invalid: that takes the directory away from under the creator.
  void setIncidents(std::shared_ptr<const IncidentReporter> incidents);

 private:
  using StoreMap = std::unordered_map<std::string, std::shared_ptr<Item>>;

  class Invalidation;

  void discard(StoreMap slots);
  static void abandon(Item& item);
  static void noteFailure(Item& item);
  void reportFailure(const std::string& identifier) const;
  static std::shared_ptr<Store> releaseOwnership(Item& item);
  bool isClosed();
  bool isMarkedForTrashing(const std::string& storePath);

  const StoreManagerDefinition definition_;
  const std::string parentPath_;
  const std::shared_ptr<TrashCollector> trashCollector_;
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<StoreDirectoryNameBuilder> nameBuilder_;
  const std::shared_ptr<AttributeStore> attributeStore_;
  const std::string managerDirectoryName_;
  const std::string managerPath_;
  const std::string temporaryDirectoryPath_;
  std::shared_ptr<const IncidentReporter> incidents_;

  std::mutex mutex_;  // guards all below
  StoreMap stores_;   // by identifier; emptied by invalidation, which parts manager and stores
  bool invalid_ = false;
  bool closed_ = false;
  bool retriesFailedCreations_ = false;
  std::thread::id invalidatingThread_;    // while an invalidation is under way
  std::condition_variable invalidation_;  // signalled when it is over
};

}  // namespace velmora::mobile::xplat::cellar
