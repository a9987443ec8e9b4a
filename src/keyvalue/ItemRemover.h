#pragma once

#include <memory>
#include <string>

#include "DiskCacheItem.h"
#include "Future.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class FileQueue;
class GroupCommit;
class StoreManifest;
class ValueFiles;
class WritesInFlight;

// Removes single items: the one of a key, and the one used least recently.
class ItemRemover {
 public:
  ItemRemover(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, FileQueue& fileQueue,
              ValueFiles& files, GroupCommit& groupCommit)
      : context_(context),
        manifest_(manifest),
        writes_(writes),
        fileQueue_(fileQueue),
        files_(files),
        groupCommit_(groupCommit) {}

  // Removes record and file.
  Future<void> remove(const std::string& key);

  // Evicts the item used least recently if the store is at its capacity.
  void evictOldestIfFull(const StoreLock& lock);

  // Whether there is no room for another item.
  bool isFull(const StoreLock& lock);

  // The same in steps: its record, null when the store has room, and then, when it is gone for good, the rest. The
  // second does not throw.
  std::unique_ptr<DiskCacheItem> takeOldestIfFull(const StoreLock& lock);
  void noteEvicted(const StoreLock& lock, const DiskCacheItem* item);

  // Makes room for a write. False when the store was purged instead. Throws when the manifest cannot be opened.
  bool makeRoom(const StoreLock& lock);

  // Waits for the removal that has begun.
  void finish();

 private:
  struct Removal;

  void removeAlone(Removal& removal);
  void removeRecord(const StoreLock& lock, Removal& removal);
  void noteRemoved(const StoreLock& lock, Removal& removal);
  void deleteFile(Removal& removal);
  void fulfil(Removal& removal);
  void discard(const DiskCacheItem& item);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  FileQueue& fileQueue_;
  ValueFiles& files_;
  GroupCommit& groupCommit_;
};

}  // namespace velmora::mobile::xplat::cellar
