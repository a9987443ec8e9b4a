#pragma once

#include <exception>
#include <functional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Future.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class DiskCacheManifestInterface;
class FileQueue;
class StoreManifest;
class ValueFiles;
class WorkQueue;
class WritesInFlight;

// Removes items batch by batch: their records on the work queue, then their files on the file queue, then the next
// batch. So other operations come in between.
class BatchRemoval {
 public:
  using Items = std::vector<DiskCacheItem>;
  using Provider = std::function<const Items()>;
  using OnSuccess = std::function<void()>;
  using OnError = std::function<void(const std::exception&)>;

  // Takes items out of the manifest.
  using Prune = std::function<Items(const StoreLock& lock, DiskCacheManifestInterface& manifest)>;

  BatchRemoval(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, WorkQueue& workQueue,
               FileQueue& fileQueue, ValueFiles& files)
      : context_(context),
        manifest_(manifest),
        writes_(writes),
        workQueue_(workQueue),
        fileQueue_(fileQueue),
        files_(files) {}

  // A batch for `run`. Takes the mutex; a damaged manifest purges the store and yields an empty batch.
  Items take(const Prune& prune);

  // The same, and counts the items as evicted.
  Items evict(const Prune& prune);

  // Deletes the files of what `provider` yields until a batch is empty, then calls one of the two on the work queue. No
  // lock is held around any of the three.
  void run(Provider provider, OnSuccess onSuccess, OnError onError);

  // One step of it, on the work queue.
  void step(const Provider& provider, const OnSuccess& onSuccess, const OnError& onError);

  // Deletes the files on the file queue.
  Future<void> deleteFiles(const std::vector<std::string>& paths);

 private:
  void deleteThenStep(const Items& batch, const Provider& provider, const OnSuccess& onSuccess, const OnError& onError);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  WorkQueue& workQueue_;
  FileQueue& fileQueue_;
  ValueFiles& files_;
};

}  // namespace velmora::mobile::xplat::cellar
