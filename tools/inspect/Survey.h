#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

class ConfiguredStores;
struct Layout;

// A part of the items, by age or by size.
struct Bucket {
  std::string label;
  std::uint64_t items = 0;
  std::uint64_t bytes = 0;
};

struct ItemFigures {
  std::string key;  // of a store with keys; of an unmanaged one the path of the file
  std::uint64_t bytes = 0;
  std::int64_t lastAccess = 0;  // seconds since the Unix epoch
  bool isInline = false;
  std::string reason = {};  // of one that goes next: why
};

enum class StoreKind { Unmanaged, Keyed, KeyValue, DiskCache };  // Keyed: one of the two after it, unknown which

enum class LeftoverKind { OtherVersion, OtherSession, NotConfigured, Temporary, Trash, Quarantine };

// The contents of one store's directory. Dates are of the last access for items with records, else of the last change.
struct StoreSurvey {
  std::string path;  // below the root
  std::string name;  // of the directory
  std::string identifier;
  StoreKind kind = StoreKind::Unmanaged;
  std::optional<LeftoverKind> leftover;
  std::vector<std::string> damages;  // of the manifest: the figures below are of the files then

  std::uint64_t items = 0;
  std::optional<std::uint64_t> recordedBytes;  // by the records, or by the kept result of a measurement
  std::uint64_t files = 0;                     // of values
  std::uint64_t fileBytes = 0;
  std::uint64_t inlineBytes = 0;
  std::uint64_t manifestBytes = 0;  // with its companions
  std::uint64_t allocatedBytes = 0;

  std::optional<std::uint64_t> limitBytes;
  std::optional<std::uint64_t> survivalBytes;
  std::optional<std::uint64_t> capacity;  // items
  std::optional<std::uint64_t> staleAge;  // seconds

  std::optional<std::int64_t> oldestAccess;
  std::optional<std::int64_t> newestAccess;
  std::optional<std::uint64_t> staleItems;
  std::optional<std::uint64_t> staleBytes;

  std::vector<ItemFigures> largest;
  std::string order;                          // of eviction, of stores with keys: "lru"
  bool isOrderConfigured = false;             // else it is assumed
  std::vector<ItemFigures> nextToGo;          // in the order of a prune, of stores with keys
  std::optional<std::uint64_t> itemsToPrune;  // of a disk cache with a limit: what a prune would remove now
  std::optional<std::uint64_t> bytesToPrune;

  std::vector<Bucket> ages;
  std::vector<Bucket> sizes;

  bool isUnread = false;               // its manifest could not be read: the items are its files
  std::string durability;              // by the configuration; else "checksums" when there are some, or empty
  std::uint64_t quarantinedFiles = 0;  // that a safe store could not use, in its own directory: not values
  std::uint64_t quarantinedBytes = 0;

  std::vector<std::uint64_t> keyHashes;  // of all items, ascending; if they were asked for

  std::uint64_t heldBytes() const { return fileBytes + inlineBytes; }  // of values
};

struct ManagerSurvey {
  std::string path;  // below the root; ".." for the manager of a store that is inspected alone
  std::string directory;
  std::string name;  // by the configuration
  std::string area;
  std::string session;
  bool isSessionless = false;
  std::optional<std::uint64_t> limitBytes;
  std::uint64_t countedBytes = 0;    // what counts for the limit: recorded, or measured in unmanaged stores
  std::uint64_t unmanagedBytes = 0;  // the latter part
  std::vector<StoreSurvey> stores;
};

struct Leftover {
  std::string path;  // below the root
  LeftoverKind kind;
  std::uint64_t files = 0;
  std::uint64_t bytes = 0;
  std::uint64_t allocatedBytes = 0;
};

struct Survey {
  std::string root;
  std::string depth;         // "root", "area", "manager", "store" or "empty"
  std::int64_t inspectedAt;  // seconds since the Unix epoch
  std::vector<ManagerSurvey> managers;
  std::vector<Leftover> leftovers;
  std::vector<Unreadable> unreadable;           // not in any figure; paths below the root
  std::optional<std::int64_t> fileSystemBytes;  // the size of the whole file system, if it was asked for
};

using OnFile = std::function<void(std::uint64_t bytes)>;  // called for each file that is looked at

// Inspects everything in the layout without changing it. `top`: how many of the largest items, and of the next to be
// evicted, are listed for each store. `hashesKeys`: whether stores have the hashes of all keys, too.
Survey makeSurvey(const Layout& layout, const ConfiguredStores& configured, std::size_t top, std::int64_t now,
                  const OnFile& onFile, bool hashesKeys = false);

const char* textOf(StoreKind kind);
const char* textOf(LeftoverKind kind);

}  // namespace velmora::mobile::xplat::cellar::tools
