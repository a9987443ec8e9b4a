#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include <cellar/Export.h>
#include <cellar/StoreDefinition.h>

namespace velmora::mobile::xplat::cellar::host {

// What `Host::metrics` returns: plain values without a tie to the host. Absent is what is not known, or does not apply.
// docs/metrics.md has the same as JSON.
//
// What it costs. The library counts accesses anyway, and `metrics` reads these counters, so nothing has to be switched
// on and no code is added to a fetch: 14,898 instructions for one of an inline value, against 14,887 without all this,
// which is less than the difference between two runs. Whenever a store reports its size, after a write for example, a
// task on its work queue notes size and items: about 400 of the 71,800 instructions of a write.
//
// Sizes of stores with keys are the library's: unsigned 32-bit, and wrap.

// A prune of a disk cache that its manager has asked for.
struct PruneMetrics {
  std::int64_t time = 0;        // when it began, in seconds since the Unix epoch
  std::uint64_t fromBytes = 0;  // the cache's size by which the manager has decided
  // The first size at or below the prune's target that was reported afterwards; absent until then. What is written
  // meanwhile is part of it.
  std::optional<std::uint64_t> toBytes{};
};

struct StoreMetrics {
  std::string identifier;  // as in the configuration
  std::string name;        // the name in the log, events and incidents; several stores may have the same
  StoreDefinition::Type type = StoreDefinition::Type::Unmanaged;
  bool isCreated = false;  // since its manager was built, by a request or in the background

  // The limits that the configuration sets.
  std::optional<std::uint64_t> maxBytes{};  // what a prune leaves; of an unmanaged store its limit, 0 if it has none
  std::optional<std::uint64_t> survivalBytes{};  // what a prune leaves on a very small file system; disk caches only
  std::optional<std::uint64_t> maxItems{};       // absent: no limit
  std::optional<std::uint32_t> staleAge{};       // seconds without access after which an item expires

  // What the store has reported last: when it was loaded, and after each write, prune, expiry and clear. A removal of
  // single keys shows in the next report. For an unmanaged store bytes and files as they were last measured, perhaps
  // by an earlier run, which keeps no number of files.
  std::optional<std::uint64_t> bytes{};
  std::optional<std::uint64_t> items{};

  // Since the store was created; absent before, and for an unmanaged store. `evictions` are items that were removed for
  // the capacity, by prunes and by expiry. Their bytes are not known.
  std::optional<std::uint64_t> hits{};
  std::optional<std::uint64_t> misses{};
  std::optional<std::uint64_t> writes{};
  std::optional<std::uint64_t> evictions{};

  // Since the store was created. Absent, too, if the manager has another disk cache of that name and limit: events do
  // not tell them apart.
  std::optional<PruneMetrics> lastPrune{};
};

struct ManagerMetrics {
  std::string name;
  bool isSessionScoped = false;
  std::optional<std::string> session{};  // the tag of its session, never the key; absent without one
  bool isBuilt = false;                  // by a request for it or one of its stores, and not ended since

  std::uint64_t maxBytes = 0;            // the manager's stores are pruned when their total is above it
  std::uint32_t pruneInterval = 0;       // seconds between two rounds of pruning; 0: never
  std::optional<std::uint64_t> bytes{};  // the sum of its stores, as far as they are known; absent if none is
  std::vector<StoreMetrics> stores{};    // all that are configured, by identifier
};

// The tasks of all queues of the host together. Timers do not count.
struct QueueMetrics {
  std::size_t waiting = 0;
  std::size_t running = 0;
};

// What has been discarded and is not deleted yet.
struct TrashMetrics {
  std::uint64_t entries = 0;             // files and directories that were discarded, each with all that it contains
  std::optional<std::uint64_t> bytes{};  // of all their files; absent if a part of the trash cannot be read
};

struct HostMetrics {
  std::int64_t time = 0;  // seconds since the Unix epoch

  // All that are configured, by name and then by tag: one with session scope once for each open session, or once
  // without a session if none is open.
  std::vector<ManagerMetrics> managers{};

  std::optional<QueueMetrics> queues{};  // absent if the queues came with the options
  std::optional<TrashMetrics> trash{};   // absent unless it was to be measured, and if the trash cannot be read
};

// As a JSON object in one line, with the members in docs/metrics.md; what is absent has no member. Text that is not
// UTF-8 gets replacement characters.
[[nodiscard]] CELLAR_EXPORT std::string toJson(const HostMetrics& metrics);

}  // namespace velmora::mobile::xplat::cellar::host
