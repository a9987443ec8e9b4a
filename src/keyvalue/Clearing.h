#pragma once

#include <memory>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "keyvalue/BatchRemoval.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class StoreManifest;
class WritesInFlight;

// Removes all items, but for those that are stored after a clear has taken its first batch.
class Clearing {
 public:
  Clearing(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, BatchRemoval& batches)
      : context_(context), manifest_(manifest), writes_(writes), batches_(batches) {}

  void clear(BatchRemoval::OnSuccess onSuccess, BatchRemoval::OnError onError);

  // Keeps the clears that are under way from the key. Whether one of them would have taken its present value yet.
  bool noteStored(const StoreLock& lock, const std::string& key);

 private:
  using Items = BatchRemoval::Items;
  struct Clear;

  Items take(const StoreLock& lock, const std::shared_ptr<Clear>& clear);
  Items begin(const StoreLock& lock, const std::shared_ptr<Clear>& clear);
  Items takeNext(const StoreLock& lock, Clear& clear);
  Items takeAllBut(const StoreLock& lock, Clear& clear);
  void takeItem(const std::string& key, Items& items);
  Items cancelWrites(const StoreLock& lock);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  BatchRemoval& batches_;
  std::vector<std::weak_ptr<Clear>> underWay_;  // guarded by the store's mutex
};

}  // namespace velmora::mobile::xplat::cellar
