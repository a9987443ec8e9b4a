#pragma once

#include "keyvalue/InlineWriter.h"
#include "keyvalue/ValueWriter.h"
#include "keyvalue/WritePath.h"

namespace velmora::mobile::xplat::cellar {

// Those of a relaxed store: a value is written into the place of the one that it replaces.
class InPlaceWrites final : public WritePath {
 public:
  InPlaceWrites(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, FileQueue& fileQueue,
                ValueFiles& files, ItemRemover& remover, Clearing& clearing, Rollback& rollback,
                GroupCommit& groupCommit)
      : context_(context),
        writer_(context, manifest, writes, fileQueue, files, remover, clearing, rollback, groupCommit),
        inlineWriter_(context, manifest, writes, files, remover, clearing, rollback, groupCommit) {}

  Future<void> store(const std::string& key, const std::vector<unsigned char>& value, Metadata metadata) override;
  Future<void> store(const std::string& key, PersistentKeyValueStore::Writer writer, Metadata metadata) override;

 private:
  StoreContext& context_;
  ValueWriter writer_;
  InlineWriter inlineWriter_;
};

}  // namespace velmora::mobile::xplat::cellar
