#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "keyvalue/Chain.h"
#include "keyvalue/StoreContext.h"
#include "keyvalue/WritePath.h"

namespace velmora::mobile::xplat::cellar {

class Clearing;
class FileQueue;
class GroupCommit;
class ItemRemover;
class StoreManifest;
class ValueFiles;
class VersionedFiles;
class WorkQueue;

// Those of a safe store. A value is written into a new file, on the file queue; then one row of the manifest replaces
// the record, on the work queue; then the file of the former value is deleted. An inline value needs the row alone.
// Until the row is written nothing has changed, and nothing has to be taken back when it cannot be.
class ReplacingWrites final : public WritePath {
 public:
  ReplacingWrites(StoreContext& context, StoreManifest& manifest, WorkQueue& workQueue, FileQueue& fileQueue,
                  ValueFiles& files, VersionedFiles& versions, ItemRemover& remover, Clearing& clearing,
                  GroupCommit& groupCommit)
      : context_(context),
        manifest_(manifest),
        workQueue_(workQueue),
        fileQueue_(fileQueue),
        files_(files),
        versions_(versions),
        remover_(remover),
        clearing_(clearing),
        groupCommit_(groupCommit) {}

  Future<void> store(const std::string& key, const std::vector<unsigned char>& value, Metadata metadata) override;
  Future<void> store(const std::string& key, PersistentKeyValueStore::Writer writer, Metadata metadata) override;

 private:
  struct Write;
  using Writes = std::vector<std::shared_ptr<Write>>;

  Future<void> begin(const std::shared_ptr<Write>& write);
  void writeFiles(const std::shared_ptr<Write>& first);
  Writes takeBehind(const std::shared_ptr<Write>& first);
  void writeFile(Write& write);
  void sync(const Writes& writes);
  void replaceAlone(Write& write);
  void replaceRecord(const StoreLock& lock, Write& write);
  void noteReplaced(const StoreLock& lock, Write& write);
  void fulfil(Write& write);
  void giveUpFile(Write& write);
  void deleteFiles(std::vector<std::string> paths);

  StoreContext& context_;
  StoreManifest& manifest_;
  WorkQueue& workQueue_;
  FileQueue& fileQueue_;
  ValueFiles& files_;
  VersionedFiles& versions_;
  ItemRemover& remover_;
  Clearing& clearing_;
  GroupCommit& groupCommit_;
  Chain<Write> writes_;
  std::vector<std::string> doubtfulFiles_;  // that a record may name after all; guarded by the store's mutex
};

}  // namespace velmora::mobile::xplat::cellar
