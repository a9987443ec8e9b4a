#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "keyvalue/KeyRange.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class WritesInFlight;

// The manifest of a store: opened on first use, and replaced by an empty one together with all files when it is damaged
// (a purge). One that cannot be opened fails the operation at hand, and is opened again by the next one.
class StoreManifest {
 public:
  StoreManifest(StoreContext& context, WritesInFlight& writes);

  // Any thread. A file that is not a manifest purges the store.
  std::shared_ptr<DiskCacheManifestInterface> get();

  // Reads all records.
  void load(const StoreLock& lock);

  // The record of the first key that has one; null for a miss, and when looking for it purged the store.
  std::unique_ptr<DiskCacheItem> lookUp(const StoreLock& lock, KeyRange keys);

  // Runs what uses the manifest. A damaged one purges the store: false then. Throws what else goes wrong, and the
  // damage itself when the store cannot be purged.
  template <class Operation> bool purgingIfDamaged(const StoreLock& lock, Operation operation) {
    try {
      operation();
      return true;
    } catch (const ManifestCorruptedException& error) {
      if (!purge(lock, error)) throw;
      return false;
    }
  }

  // The same for what writes a value's record: a manifest that cannot be written purges too, unless it is only that it
  // could not be opened for writing, which is true for the moment.
  template <class Operation> bool purgingIfUnwritable(const StoreLock& lock, Operation operation) {
    try {
      operation();
      return true;
    } catch (const ManifestPersistenceException& error) {
      if (error.code() == kReadOnly || !purge(lock, error)) throw;
      return false;
    }
  }

  // Makes the changes in one transaction. False when nothing has changed: they can be made one by one then.
  bool changeTogether(const StoreLock& lock, const std::function<void()>& changes);

  // Moves the directory to the trash and begins again. False, and nothing has changed, when the directory cannot be
  // collected: what the old manifest says would be back at the next start. Throws once the store is closed.
  bool purge(const StoreLock& lock, const LarderException& error);

  // The second half of a purge. On a full disk it can fail; the next operation then tries it again.
  void finishPurge(const StoreLock& lock);

  // The total bytes of all items; empty when nobody wants to know it, and before the manifest is loaded. Any thread.
  std::optional<std::uint32_t> totalToReport();

  // Tells the size callback, on the work queue. Any thread.
  void dispatchReport(std::uint32_t total);
  void reportSize();

  // What changes from now on is not written.
  void close();

 private:
  static constexpr int kReadOnly = 8;  // the code of a write to a manifest that could be opened for reading only

  std::shared_ptr<DiskCacheManifestInterface> open();
  void logPurge(const LarderException& error) const;

  StoreContext& context_;
  WritesInFlight& writes_;
  bool isPurgePending_ = false;  // the directory has gone to the trash, and no new one is there; guarded by the store's

  std::mutex creationMutex_;  // guards the creation of the manifest
  std::atomic<bool> isCreated_{false};
  std::shared_ptr<DiskCacheManifestInterface> manifest_;
};

}  // namespace velmora::mobile::xplat::cellar
