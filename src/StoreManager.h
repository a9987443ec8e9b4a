#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <typeinfo>

#include "Export.h"
#include "Store.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

class AttributeStore;
class DiskSizeCalculator;
class IncidentReporter;
class LazyDispatcher;
class StoreDirectoryNameBuilder;
class StoreManagerImpl;

namespace detail {
[[noreturn]] CELLAR_EXPORT void throwStoreTypeMismatch(const std::string& identifier, const std::type_info& wanted,
                                                       const Store& store);

// The store, which may be null, as a store of that type. Throws `std::logic_error` for one of another type.
template <class StoreType>
std::shared_ptr<StoreType> storeAs(const std::string& identifier, const std::shared_ptr<Store>& store) {
  static_assert(std::is_base_of_v<Store, StoreType>,
                "A store is a DiskCache, a PersistentKeyValueStore or an UnmanagedStore.");
  auto typed = std::dynamic_pointer_cast<StoreType>(store);
  if (store != nullptr && typed == nullptr) throwStoreTypeMismatch(identifier, typeid(StoreType), *store);
  return typed;
}
}  // namespace detail

// The host's handle on one manager: a directory of stores that are kept within their limits. Obtained from a
// `StoreManagerFactory`. Any thread may call. Letting the last handle go loses no data and stops no write that is under
// way: a store that is still held works on, and is measured and pruned.
class CELLAR_EXPORT StoreManager {
 public:
  // Builds the manager and starts it. With `runMaintenance` all its data, in any area, is discarded first if that is
  // forced, or (with an error line) if the file system has less than 75 MiB in total; what other versions and sessions
  // left behind is cleaned up in the background, and stores are pruned. Always: unmanaged stores are registered for
  // measuring, and the configured stores are created in the background when the lazy dispatcher says so. Throws what
  // creating the manager's directories throws. `analyticsReporter` and `lazyDispatcher` may be null.
  StoreManager(const std::string& parentPath, const StoreManagerDefinition& definition, bool forceCleanse,
               const std::shared_ptr<StoreDirectoryNameBuilder>& nameBuilder,
               const std::shared_ptr<TrashCollector>& trashCollector,
               const std::shared_ptr<TaskQueueFactory>& taskQueueFactory,
               const std::shared_ptr<DiskSizeCalculator>& diskSizeCalculator,
               const std::shared_ptr<AnalyticsEventReporter>& analyticsReporter,
               const std::shared_ptr<FileUtils>& fileUtils, const std::shared_ptr<AttributeStore>& attributeStore,
               const std::shared_ptr<LazyDispatcher>& lazyDispatcher, bool runMaintenance);

  // The same. The manager and its stores report incidents to `incidents`, which may be null; so does this, when it
  // discards the data because of the file system's size.
  StoreManager(const std::string& parentPath, const StoreManagerDefinition& definition, bool forceCleanse,
               const std::shared_ptr<StoreDirectoryNameBuilder>& nameBuilder,
               const std::shared_ptr<TrashCollector>& trashCollector,
               const std::shared_ptr<TaskQueueFactory>& taskQueueFactory,
               const std::shared_ptr<DiskSizeCalculator>& diskSizeCalculator,
               const std::shared_ptr<AnalyticsEventReporter>& analyticsReporter,
               const std::shared_ptr<FileUtils>& fileUtils, const std::shared_ptr<AttributeStore>& attributeStore,
               const std::shared_ptr<LazyDispatcher>& lazyDispatcher, bool runMaintenance,
               std::shared_ptr<const IncidentReporter> incidents);
  ~StoreManager();
  StoreManager(const StoreManager&) = delete;
  StoreManager& operator=(const StoreManager&) = delete;

  // The store of that identifier, created by the first call; concurrent callers wait for it. `strategy` counts only in
  // the call that creates a disk cache; `Null` takes what its definition names, and so does a cache whose definition
  // names `GreedyDual`. Empty for an identifier that the manager does not have (one error line) and once the manager is
  // invalid. Throws what creating the store throws; later callers of that identifier then wait without end, unless
  // `retryFailedCreations` was called.
  std::shared_ptr<Store> getStoreImpl(const std::string& identifier, PruneStrategyIdentifier strategy);

  // The same, as a store of that type. Empty only where `getStoreImpl` is; a store of another type throws
  // `std::logic_error`.
  template <class StoreType>
  std::shared_ptr<StoreType> getStore(const std::string& identifier,
                                      PruneStrategyIdentifier strategy = PruneStrategyIdentifier::Null) {
    return detail::storeAs<StoreType>(identifier, getStoreImpl(identifier, strategy));
  }

  // A directory of the manager's for short-lived files: emptied whenever the manager is built.
  std::string getTemporaryDirectory();

  // Makes the store begin empty the next time it is created, normally at the next start of the application. Nothing is
  // deleted now. Throws `std::logic_error` for an identifier that the manager does not have.
  void trashStoreOnStartup(const std::string& identifier);

  // Invalidates all stores and discards the manager's directory with all its data. Waits until the stores have finished
  // what they were writing: must not be called on one of their queues. A second call does nothing but wait until the
  // first is over; made from within the first, on its thread, it returns at once.
  void invalidate();

  bool isValid();

  // From now on a store whose creation has failed, on request or in the background, is created again by the next
  // request for it, and nobody waits for it without end.
  void retryFailedCreations();

  // Starts a round of pruning in the background, whatever the interval and the manager's own limit say: every disk
  // cache that is over its limit is pruned. If a round is under way, the next begins when that is over and a store
  // reports its size. The interval begins at the end of this round, too. Does nothing without maintenance, with an
  // interval of 0, and once the manager is invalid. Throws what the queue throws; the next size that is reported starts
  // the round then.
  void pruneNow();

  // The bytes that the store of that identifier reported last. 0 if it has not been created or has not reported yet,
  // and once the manager is invalid.
  std::uint32_t sizeOf(const std::string& identifier);

  using SizeListener = std::function<void(const std::string& identifier, std::uint32_t size)>;

  // `listener` is called from now on with each size that a store reports, after each write for example: on a queue of
  // the store's or the manager's, before the limits are checked, and for different stores at the same time. No lock is
  // held then. It should take little time, and must not throw. It replaces an earlier one, which may still be called by
  // who has begun to. Null: nobody is told. The manager keeps it, also when this handle is gone; it must not keep the
  // manager. An invalid manager calls nobody.
  void setSizeListener(std::shared_ptr<const SizeListener> listener);

  // Whether managers built from now on discard their directories as they start. One flag for the process, off at first
  // and never reset by the library.
  static bool forceCleanseOnInit();
  static void setForceCleanseOnInit(bool force);

 private:
  const std::shared_ptr<StoreManagerImpl> impl_;
};

}  // namespace velmora::mobile::xplat::cellar
