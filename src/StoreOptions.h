#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Durability.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class DiskCacheManifestInterface;
class ExtendedMetadataFactory;
class FileUtils;
class IncidentReporter;
class PruneStrategyBase;
class TrashCollector;

// What the stores of an application share.
struct StoreServices {
  std::shared_ptr<TaskQueueFactory> queues;
  std::shared_ptr<TrashCollector> trash;
  std::shared_ptr<FileUtils> files;
  std::shared_ptr<AnalyticsEventReporter> analytics;    // null: nothing is reported
  std::shared_ptr<const IncidentReporter> incidents{};  // null: incidents are only logged
};

struct KeyValueStoreOptions {
  std::string directory;           // created if it is not there
  std::string temporaryDirectory;  // for the host's own use; the store only hands the path out
  std::string name;                // in log lines and events

  // Items. Checked before each write, which then evicts the one item used least recently, also when it overwrites.
  // Absent: no limit.
  std::optional<std::uint64_t> capacity;

  // Seconds without access after which an item expires. Checked 300 seconds after loading and then every hour.
  long staleAge = 50L * 365 * 86400;

  bool inlineData = false;      // values lie inside the manifest, not in files
  unsigned int batchSize = 50;  // items that an expiry, a clear or a prune removes at a time; at least 1

  // Called on the work queue with the total bytes of all items, whenever they may have changed. May be empty.
  std::function<void(unsigned int)> onSizeChanged;

  std::shared_ptr<DiskCacheManifestInterface> manifest;              // null: one in the directory, created on first use
  std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory;  // null: metadata is not read back
  std::shared_ptr<PruneStrategyBase> pruneStrategy;                  // null: least recently used first

  // A safe or synced store keeps its own manifest: with one of yours its creation throws `std::invalid_argument`.
  Durability durability = Durability::Relaxed;
};

struct DiskCacheOptions : KeyValueStoreOptions {
  unsigned int normalSize = 0;    // bytes that a prune leaves
  unsigned int survivalSize = 0;  // bytes that a prune leaves when the device is short of space
};

}  // namespace velmora::mobile::xplat::cellar
