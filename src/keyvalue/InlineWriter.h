#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Future.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class Clearing;
class GroupCommit;
class ItemRemover;
class Rollback;
class StoreManifest;
class ValueFiles;
class WritesInFlight;
struct ReplacedItem;

// Writes values into the manifest, record and bytes one after the other, on the work queue.
class InlineWriter {
 public:
  InlineWriter(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, ValueFiles& files,
               ItemRemover& remover, Clearing& clearing, Rollback& rollback, GroupCommit& groupCommit)
      : context_(context),
        manifest_(manifest),
        writes_(writes),
        files_(files),
        remover_(remover),
        clearing_(clearing),
        rollback_(rollback),
        groupCommit_(groupCommit) {}

  Future<void> store(const std::string& key, std::vector<unsigned char> data,
                     std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata);

 private:
  struct Value;

  void writeAlone(Value& value);
  bool writeRow(const StoreLock& lock, Value& value);
  void setRow(Value& value);
  void noteRow(const StoreLock& lock, Value& value);
  void takeBack(const StoreLock& lock, const std::string& key, ReplacedItem replaced);
  void fulfil(Value& value);
  void deleteReplacedFile(const std::string& path, const std::shared_ptr<Value>& value);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  ValueFiles& files_;
  ItemRemover& remover_;
  Clearing& clearing_;
  Rollback& rollback_;
  GroupCommit& groupCommit_;
};

}  // namespace velmora::mobile::xplat::cellar
