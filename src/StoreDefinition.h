#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>

#include "Durability.h"
#include "Export.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class FileUtils;
class Store;
class TrashCollector;
struct StoreServices;

// Where a manager's directory lives; the host says which directory each area is.
enum class Area : int { Caches = 0, Documents = 1, Shared = 2 };

// In which order a disk cache gives up its items. `Null` means "as the store's definition says".
enum class PruneStrategyIdentifier : int { LRU = 0, Null = 1, VideoDownload = 2, GreedyDual = 16 };

// What a disk cache remembers about an item beside its size and dates.
enum class ExtendedMetadataFactoryIdentifier : int { Null = 0, VideoDownload = 1 };

// One configured store. Immutable, shared as pointer to const; the store that it creates keeps it alive.
class CELLAR_EXPORT StoreDefinition {
 public:
  enum class Type : int { Unmanaged = 0, PKVS = 1, DiskCache = 2 };

  StoreDefinition(Type type, const std::string& name, const std::string& managerName, bool localeSensitive,
                  bool hasVersion, unsigned int version, unsigned int maxSize, bool isCache, bool isManaged);

  // Creates the store of this definition over `storePath`. Called by a manager, once per store, with the manager's
  // temporary directory, its services, a callback for the store's size in bytes, and this definition itself in
  // shared ownership. Throws what the file utilities throw; an unmanaged store ignores everything but its path and
  // definition.
  virtual std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                             std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                             std::shared_ptr<TrashCollector> trashCollector,
                                             std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                             std::shared_ptr<FileUtils> fileUtils,
                                             std::function<void(unsigned int)> sizeChangedCallback,
                                             PruneStrategyIdentifier pruneStrategy,
                                             std::shared_ptr<const StoreDefinition> definition) const = 0;

  // The same with all services of the manager, its incidents among them: what managers call. A definition that
  // overrides only the one above is called through it, and its stores report no incidents.
  virtual std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                             const StoreServices& services,
                                             std::function<void(unsigned int)> sizeChangedCallback,
                                             PruneStrategyIdentifier pruneStrategy,
                                             std::shared_ptr<const StoreDefinition> definition) const;

  const Type type;
  const std::string name;         // names the store's directory; the store's identifier unless configured otherwise
  const std::string managerName;  // the manager whose "stores" holds this store
  const bool localeSensitive;     // the directory name carries the locale
  const bool hasVersion;          // the directory name carries this version alone, instead of the host's version tag
  const std::uint32_t version;
  const std::uint32_t maxSize;  // bytes
  const bool isCache;
  const bool isManaged;  // false: the library measures the directory from outside

 protected:
  ~StoreDefinition() = default;
};

// A directory that the host fills as it likes.
class CELLAR_EXPORT UnmanagedStoreDefinition : public StoreDefinition {
 public:
  UnmanagedStoreDefinition(const std::string& name, const std::string& managerName, bool localeSensitive,
                           bool hasVersion, unsigned int version, unsigned int maxSize, bool isCache);

  using StoreDefinition::createStore;
  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                     std::shared_ptr<TrashCollector> trashCollector,
                                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                     std::shared_ptr<FileUtils> fileUtils,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;
};

// A persistent key-value store.
class CELLAR_EXPORT PKVSDefinition : public StoreDefinition {
 public:
  PKVSDefinition(const std::string& name, const std::string& managerName, bool localeSensitive, bool hasVersion,
                 unsigned int version, std::optional<std::int64_t> capacity, bool inlineData, std::uint32_t staleAge,
                 Durability durability = Durability::Relaxed);

  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                     std::shared_ptr<TrashCollector> trashCollector,
                                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                     std::shared_ptr<FileUtils> fileUtils,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;
  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     const StoreServices& services,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;

  const std::optional<std::int64_t> capacity;  // items; absent: no limit
  const bool inlineData;                       // values live in the manifest instead of in files
  const std::uint32_t staleAge;                // seconds without access after which an item expires
  const Durability durability;
};

// A key-value store with a size limit. Its `maxSize` is `lruSizeLimit`.
class CELLAR_EXPORT DiskCacheDefinition : public StoreDefinition {
 public:
  DiskCacheDefinition(const std::string& name, const std::string& managerName, bool localeSensitive, bool hasVersion,
                      unsigned int version, std::optional<std::int64_t> capacity, std::uint32_t staleAge,
                      bool inlineData, std::uint32_t lruSizeLimit, std::uint32_t survivalSize,
                      ExtendedMetadataFactoryIdentifier metadataFactory, PruneStrategyIdentifier pruneStrategy,
                      Durability durability = Durability::Relaxed);

  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                     std::shared_ptr<TrashCollector> trashCollector,
                                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                     std::shared_ptr<FileUtils> fileUtils,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;
  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     const StoreServices& services,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;

  const std::optional<std::int64_t> capacity;  // items; absent: no limit
  const std::uint32_t staleAge;                // seconds without access after which an item expires
  const bool inlineData;                       // values live in the manifest instead of in files
  const std::uint32_t lruSizeLimit;            // bytes that a normal prune leaves
  const std::uint32_t survivalSize;            // bytes that a prune leaves when the device is short of space
  const ExtendedMetadataFactoryIdentifier metadataFactory;
  const PruneStrategyIdentifier pruneStrategy;  // GreedyDual: whatever strategy the store is asked for with
  const Durability durability;
};

// One configured manager: a directory in an area, holding stores.
struct StoreManagerDefinition {
  std::string name;
  Area area;
  std::uint32_t maxSize;        // bytes; the manager's stores are pruned when their total is above it
  std::uint32_t pruneInterval;  // seconds between two rounds of pruning; 0: never prune
  std::unordered_map<std::string, std::shared_ptr<const StoreDefinition>> stores;  // by store identifier
  bool sessionScoped;  // the data belongs to a session and is removed when another one's manager starts
};

}  // namespace velmora::mobile::xplat::cellar
