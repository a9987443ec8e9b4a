#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "base/FunctionReference.h"
#include "keyvalue/KeyRange.h"
#include "keyvalue/ManifestRecovery.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

// The manifest of a store: opened on first use. One that cannot be opened fails the operation at hand, and is opened
// again by the next one. What is done about a damaged one is the recovery's business.
class StoreManifest {
 public:
  using Outcome = ManifestRecovery::Outcome;

  explicit StoreManifest(StoreContext& context);

  // To be called once, before any use.
  void setRecovery(ManifestRecovery& recovery) { recovery_ = &recovery; }

  // Any thread. A file that is not a manifest is recovered from.
  std::shared_ptr<DiskCacheManifestInterface> get();

  // The same, but null before the manifest is opened.
  std::shared_ptr<DiskCacheManifestInterface> opened() const { return isCreated_ ? manifest_ : nullptr; }

  // Reads all records.
  void load(const StoreLock& lock);

  // The record of the first key that has one; null for a miss, and when looking for it emptied the store.
  std::unique_ptr<DiskCacheItem> lookUp(const StoreLock& lock, KeyRange keys);

  // Runs what uses the manifest, again when it was damaged and could be recovered. False when the store has been
  // emptied instead. Throws what else goes wrong, and the damage itself when nothing can be done about it.
  bool recoveringFromDamage(const StoreLock& lock, FunctionReference operation);

  // The same for what writes a value's record.
  bool recoveringFromFailedWrite(const StoreLock& lock, FunctionReference operation);

  // Makes the changes in one transaction. False when nothing has changed: they can be made one by one then.
  bool changeTogether(const StoreLock& lock, const std::function<void()>& changes);

  // The manifest is about to be read, or changed, without one of the above.
  void prepareReading(const StoreLock& lock) { recovery_->prepareReading(lock); }
  void prepareChange(const StoreLock& lock) { recovery_->prepareChange(lock); }

  // As if an operation had found it damaged by `error`. Throws when nothing can be done about it.
  void recover(const StoreLock& lock, const LarderException& error);

  // The total bytes of all items; empty when nobody wants to know it, and before the manifest is loaded. Any thread.
  std::optional<std::uint32_t> totalToReport();

  // Tells the size callback, on the work queue. Any thread.
  void dispatchReport(std::uint32_t total);
  void reportSize();

  // What changes from now on is not written.
  void close();

 private:
  std::shared_ptr<DiskCacheManifestInterface> openRecovering();
  std::shared_ptr<DiskCacheManifestInterface> open();

  StoreContext& context_;
  ManifestRecovery* recovery_ = nullptr;

  std::mutex creationMutex_;  // guards the creation of the manifest
  std::atomic<bool> isCreated_{false};
  std::shared_ptr<DiskCacheManifestInterface> manifest_;
};

// Whether the file cannot become a manifest that works, however often it is opened: it is damaged, or holds a table of
// another program's that the manifest's own statements do not fit.
bool isNotAManifest(const ManifestPersistenceException& error);

}  // namespace velmora::mobile::xplat::cellar
