#pragma once

#include <atomic>
#include <cstdint>
#include <exception>
#include <memory>
#include <mutex>
#include <string>
#include <utility>

#include "Future.h"
#include "Incident.h"
#include "Store.h"
#include "StoreOptions.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

// The store's mutex, held: one operation on the manifest and its bookkeeping at a time. What needs it takes this as a
// parameter.
class StoreLock {
 public:
  explicit StoreLock(std::mutex& mutex) : lock_(mutex) {}

  // Not held when another thread has the mutex.
  static StoreLock tryTo(std::mutex& mutex) { return StoreLock(std::unique_lock<std::mutex>(mutex, std::try_to_lock)); }

  bool isHeld() const { return lock_.owns_lock(); }
  void lock() { lock_.lock(); }
  void unlock() { lock_.unlock(); }

 private:
  explicit StoreLock(std::unique_lock<std::mutex> lock) : lock_(std::move(lock)) {}

  std::unique_lock<std::mutex> lock_;
};

// Whoever holds a copy of one stands for something under way: the number of owners tells whether there is any.
using Token = std::shared_ptr<const char>;

// What the parts of a key-value store share: what it was made from, its mutex, and how far its life has come.
//
// Locks are taken in this order: that of removals, the store's, then one of those that are held for a
// moment (WritesInFlight, FileQueue, the creation of the manifest).
class StoreContext {
 public:
  // Creates the directory and the two queues. The store must be owned by a shared pointer before any part is used.
  StoreContext(Store& store, KeyValueStoreOptions storeOptions, const StoreServices& services);
  StoreContext(const StoreContext&) = delete;
  StoreContext& operator=(const StoreContext&) = delete;

  const KeyValueStoreOptions options;
  const std::shared_ptr<FileUtils> files;
  const std::shared_ptr<TrashCollector> trash;
  const std::shared_ptr<AnalyticsEventReporter> analytics;  // may be null
  const std::shared_ptr<const IncidentReporter> incidents;  // may be null
  const std::string manifestPath;
  const std::shared_ptr<AsyncExecutor> fileQueue;
  const std::shared_ptr<AsyncExecutor> workQueue;

  std::mutex removalMutex;  // held until what is removed has no file any more: invalidation waits for it
  std::mutex mutex;

  std::atomic<bool> isInvalidated{false};  // set with the mutex held
  // Set on the file queue, behind what an invalidation finds there: from then on the paths may be those of another
  // store.
  std::atomic<bool> isClosed{false};

  const Token operation = std::make_shared<const char>();     // an operation that was accepted and is not over
  const Token fileDeletion = std::make_shared<const char>();  // a deletion of files that waits on the file queue

  // Relaxed: they are added to and read, and order nothing.
  using Counter = std::atomic<std::uint64_t>;
  Counter hits{0};
  Counter misses{0};
  Counter stores{0};
  Counter evictions{0};
  static void count(Counter& counter, std::uint64_t occurrences = 1) {
    counter.fetch_add(occurrences, std::memory_order_relaxed);
  }

  StoreLock lock() { return StoreLock(mutex); }

  void throwIfInvalid() const;
  void throwIfClosed() const;

  // Of an operation on a safe store that was released before.
  static std::exception_ptr storeIsGone();

  bool isCache() const { return store_.isPrunable(); }
  bool isSafe() const { return options.durability != Durability::Relaxed; }

  // Tells the host, on one of its queues, if it wants to know.
  void report(Incident incident) const;

  // For the tasks of a part: whoever locks it keeps the store alive.
  template <class Part> std::weak_ptr<Part> weak(Part& part) const {
    return std::shared_ptr<Part>(store_.weak_from_this().lock(), &part);
  }

 private:
  Store& store_;
};

// Fulfils the promise with what the operation does or throws. No lock may be held: an inline callback runs here.
template <class Operation> void settle(Promise<void>& promise, Operation operation) {
  try {
    operation();
  } catch (...) {
    promise.setException(std::current_exception());
    return;
  }
  promise.setValue();
}

}  // namespace velmora::mobile::xplat::cellar
