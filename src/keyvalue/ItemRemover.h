#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "Future.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class FileQueue;
class StoreManifest;
class ValueFiles;
class WritesInFlight;

// Removes single items: the one of a key, and the one used least recently.
class ItemRemover {
 public:
  ItemRemover(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, FileQueue& fileQueue,
              ValueFiles& files)
      : context_(context), manifest_(manifest), writes_(writes), fileQueue_(fileQueue), files_(files) {}

  // Removes record and file, on the caller's thread.
  void remove(const std::string& key, const std::shared_ptr<Promise<void>>& promise);

  // Evicts the item used least recently if the store is at its capacity.
  void evictOldestIfFull(const StoreLock& lock);

  // Makes room for a write. False when the store was purged instead. Throws when the manifest cannot be opened.
  bool makeRoom(const StoreLock& lock);

  // Waits for the removal that has begun.
  void finish();

 private:
  bool removeNow(const std::string& key, const std::shared_ptr<Promise<void>>& promise);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  FileQueue& fileQueue_;
  ValueFiles& files_;

  std::mutex removalMutex_;  // held until a removal has deleted its file: invalidation waits for it
};

}  // namespace velmora::mobile::xplat::cellar
