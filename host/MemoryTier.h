#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <cellar/DiskCacheItem.h>
#include <cellar/Export.h>
#include <cellar/Future.h>
#include <cellar/PersistentKeyValueStore.h>

namespace velmora::mobile::xplat::cellar::host {

// Values in memory, in front of a key-value store or a disk cache. A hit shares the value with the caller and copies
// nothing. Fetches of one key that wait at the same time share one fetch from the store, and `fetchOrCompute` shares
// one run of a producer. With a bound of 0 nothing is kept in memory, and the sharing remains.
//
// Threads. Any thread may call. Calls only take their arguments in, as those of the store do, and no lock is held while
// the store or a callback runs. Another thread's call that comes at the same moment may be handed to the store on this
// one, so the store is asked in the order in which the calls took effect here.
//
// Consistency. What is stored, removed or cleared through the tier is seen by everyone as soon as the call has
// returned, before its future is ready: a fetch is answered from memory, or behind the change in the store's order. If
// the change then fails, the value is no longer in memory, and fetches return what the store has. A fetch that was
// under way when its key was changed returns the older or the newer value, and does not put it into memory. While a
// clear is under way nothing is put into memory; as with the store, what is stored meanwhile may be cleared too, and a
// fetch may return what is not cleared yet.
//
// What happens in the store without the tier is not noticed. A value that has expired, was pruned, or was lost with a
// damaged manifest is served from memory as long as it stays there; so is the old value of a key that was stored or
// removed directly in the store: change a store through one tier only. A hit in memory is not a use of the item in the
// store and not an event: what is only read from memory expires and is pruned there as if it were not used, unless you
// call the store's `updateLastAccessDate`. An invalidated store (a log-out) is noticed: the first access afterwards
// empties the memory, and no value is returned any more.
//
// Destroyed while work is under way: the tier releases its store and its memory, and the futures are fulfilled by the
// store as if nothing had happened. A producer that runs then reaches its callers, but its value is not stored.
//
// Errors of the store name it and the key, as `naming` of host/Errors.h makes them; those of producers are passed on as
// they are.
class CELLAR_EXPORT MemoryTier {
 public:
  using Bytes = std::vector<unsigned char>;
  using Value = std::shared_ptr<const Bytes>;
  using Metadata = std::shared_ptr<DiskCacheItem::ExtendedMetadata>;

  // Begins to make a value, for example a download, and returns at once. Called once, on the caller's thread or on a
  // queue of the store, which it would block. For work that blocks there is `dispatchTask<Bytes>(queue, work)`.
  using Producer = std::function<Future<Bytes>()>;

  // What an entry takes besides its key and its value, in bytes: its place in the table and what the allocator adds. On
  // 64-bit Linux 204 to 214 were measured, and 172 to 182 for keys of at most 15 bytes.
  static constexpr std::size_t kEntryOverhead = 26 * sizeof(void*);

  // A value whose entry would take more than the bound divided by this is not kept in memory.
  static constexpr std::size_t kLargestPart = 4;

  struct CELLAR_EXPORT Counts {
    std::uint64_t hits;    // values that `find`, `fetch` and `fetchOrCompute` have returned from memory
    std::uint64_t misses;  // calls of `fetch` and `fetchOrCompute` that had to wait, for the store or for others
    std::size_t entries;   // that are in memory now
    std::size_t bytes;     // that they take: keys, values (their capacity) and overhead
  };

  // Keeps at most `maxBytes` in memory. Shares the store, which must not be null (`std::invalid_argument`). Values that
  // a caller holds do not count once they have left the tier.
  MemoryTier(std::shared_ptr<PersistentKeyValueStore> store, std::size_t maxBytes);
  ~MemoryTier();
  MemoryTier(const MemoryTier&) = delete;
  MemoryTier& operator=(const MemoryTier&) = delete;

  // The value if it is in memory, else null. Never asks the store for values.
  [[nodiscard]] Value find(const std::string& key);

  // The value, from memory or from the store; null for a miss. A hit in memory returns a future that is ready. Fails
  // where the store's fetch does.
  [[nodiscard]] Future<Value> fetch(const std::string& key);

  // Stores the value in memory and in the store, which copies it. Ready, or failed, when the store's future is. A null
  // value throws `std::invalid_argument`.
  Future<void> store(const std::string& key, Bytes bytes, Metadata metadata = nullptr);
  Future<void> store(const std::string& key, const Value& value, Metadata metadata = nullptr);

  // Removes the key from both. Not an error: a key that is not there.
  Future<void> remove(const std::string& key);

  // Removes everything from both. Ready when the store has deleted its files; fails with the store's error, or with a
  // broken promise when the store's queues drop the work.
  Future<void> clear();

  // The value as `fetch` returns it, or for a miss the one that `producer` makes, which is stored. Everyone who asks
  // for the key meanwhile gets the value of the same run, or its exception; a failure is not stored, and the next call
  // tries again. A producer whose future is broken fails its callers with `std::future_error` (broken promise).
  //
  // The future is ready when the value is made, not when it is stored. If storing it fails the callers have it
  // nevertheless, and the failure is one error line. When the key was stored, removed or cleared through the tier after
  // the call, the value reaches those who waited for it but is not stored, and later calls do not wait for it.
  //
  // A value that the store has but cannot read counts as a miss, with an error line. An invalidated store fails the
  // call, and so does a key that it refuses. A producer must not wait for its own key.
  [[nodiscard]] Future<Value> fetchOrCompute(const std::string& key, Producer producer);

  // Removes values from memory, the least useful first, until they take at most so many bytes: for a warning that
  // memory is short. 0 removes all. The store keeps them, and the bound stays as it is.
  void trim(std::size_t bytes);

  [[nodiscard]] Counts counts() const;

 private:
  class State;

  const std::shared_ptr<State> state_;
};

}  // namespace velmora::mobile::xplat::cellar::host
