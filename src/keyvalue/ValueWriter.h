#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Future.h"
#include "keyvalue/FileWrite.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class Clearing;
class FileQueue;
class GroupCommit;
class ItemRemover;
class Rollback;
class StoreManifest;
class ValueFiles;
class WritesInFlight;

// Writes values into files: a provisional record on the work queue, then the file and its final record on the file
// queue.
class ValueWriter {
 public:
  ValueWriter(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, FileQueue& fileQueue,
              ValueFiles& files, ItemRemover& remover, Clearing& clearing, Rollback& rollback, GroupCommit& groupCommit)
      : context_(context),
        manifest_(manifest),
        writes_(writes),
        fileQueue_(fileQueue),
        files_(files),
        remover_(remover),
        clearing_(clearing),
        rollback_(rollback),
        groupCommit_(groupCommit) {}

  Future<void> store(const std::string& key, std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata,
                     PersistentKeyValueStore::Writer writer, bool isGroupable);

  // Ends a write that was dropped.
  void rollBack(FileWrite& write);

  // A write begins, alone or in steps.
  void begin(const std::shared_ptr<FileWrite>& write);
  void change(const StoreLock& lock, FileWrite& write);
  void note(const StoreLock& lock, FileWrite& write);
  void dispatch(const std::shared_ptr<FileWrite>& write);

 private:
  using Group = std::vector<std::shared_ptr<FileWrite>>;

  bool beginRecord(const StoreLock& lock, FileWrite& write);
  void setProvisionalRecord(FileWrite& write);
  void noteProvisionalRecord(const StoreLock& lock, FileWrite& write);
  void handToFileQueue(const std::shared_ptr<FileWrite>& write);
  void commitGroup(const std::shared_ptr<FileWrite>& first);
  void extendGroup(Group& group);
  void deliver(const Group& group);
  void writeFile(FileWrite& write);
  unsigned int runWriter(FileWrite& write);
  void setFinalRecords(const StoreLock& lock, const Group& group);
  void setFinalRecord(FileWrite& write);
  void setFinalRecordAlone(const StoreLock& lock, FileWrite& write);
  void recordWritten(const StoreLock& lock, FileWrite& write);
  void noteTotal(FileWrite& write);
  void reportTotal(FileWrite& write);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  FileQueue& fileQueue_;
  ValueFiles& files_;
  ItemRemover& remover_;
  Clearing& clearing_;
  Rollback& rollback_;
  GroupCommit& groupCommit_;
};

}  // namespace velmora::mobile::xplat::cellar
