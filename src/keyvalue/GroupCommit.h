#pragma once

#include <exception>
#include <functional>
#include <memory>
#include <vector>

#include "Future.h"
#include "keyvalue/KeyRange.h"
#include "keyvalue/ManifestChange.h"
#include "keyvalue/StoreContext.h"
#include "keyvalue/WorkQueue.h"

namespace velmora::mobile::xplat::cellar {

class StoreManifest;

// Runs changes of the manifest on the work queue. The first of several that wait there also does the manifest work of
// those behind it, in one transaction: a statement in a transaction takes a quarter of the time of one on its own.
// Nothing is delivered before the transaction is complete. If anything in it fails, all of it is rolled back, and each
// change runs alone instead, as if there were no groups.
class GroupCommit {
 public:
  GroupCommit(StoreContext& context, StoreManifest& manifest, WorkQueue& workQueue)
      : context_(context), manifest_(manifest), workQueue_(workQueue) {}

  // Hands the change to the work queue. It has a key, a promise, and a weak pointer to its owner, which is a part of
  // the same store; when that is gone, nothing is done, and the promise is fulfilled, but not that of a safe store.
  template <class Change> Future<void> submit(const std::shared_ptr<Change>& change) {
    Future<void> future = change->promise.getFuture();
    workQueue_.dispatchChange(KeyRange(change->key), change, taskOf(change));
    return future;
  }

  // The same for a change that has just come from the file queue.
  template <class Change> void submitHere(const std::shared_ptr<Change>& change) {
    workQueue_.dispatchChangeHere(change, taskOf(change));
  }

 private:
  using Group = std::vector<std::shared_ptr<ManifestChange>>;

  template <class Change> std::function<void()> taskOf(const std::shared_ptr<Change>& change) {
    return [this, change, isSafe = context_.isSafe()] {
      if (const auto owner = change->owner.lock()) {  // whoever locks it keeps this alive, too
        run(change);
      } else if (change->take()) {
        isSafe ? change->promise.setException(StoreContext::storeIsGone()) : change->promise.setValue();
      }
    };
  }

  void run(const std::shared_ptr<ManifestChange>& change);
  Group groupBehind(const std::shared_ptr<ManifestChange>& first);
  bool commit(const Group& group);
  static void note(const StoreLock& lock, ManifestChange& change);

  StoreContext& context_;
  StoreManifest& manifest_;
  WorkQueue& workQueue_;
};

}  // namespace velmora::mobile::xplat::cellar
