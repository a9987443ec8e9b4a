#pragma once

#include <memory>
#include <vector>

#include "keyvalue/ManifestChange.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class StoreManifest;
class WorkQueue;

// Runs changes of the manifest on the work queue. The first of several that wait there also does the manifest work of
// those behind it, in one transaction: a statement in a transaction takes a quarter of the time of one on its own.
// Nothing is delivered before the transaction is complete. If anything in it fails, all of it is rolled back, and each
// change runs alone instead, as if there were no groups.
class GroupCommit {
 public:
  GroupCommit(StoreContext& context, StoreManifest& manifest, WorkQueue& workQueue)
      : context_(context), manifest_(manifest), workQueue_(workQueue) {}

  // The task of a change. Does nothing when an earlier one has run it.
  void run(const std::shared_ptr<ManifestChange>& change);

 private:
  using Group = std::vector<std::shared_ptr<ManifestChange>>;

  Group groupBehind(const std::shared_ptr<ManifestChange>& first);
  bool commit(const Group& group);
  static void note(const StoreLock& lock, ManifestChange& change);

  StoreContext& context_;
  StoreManifest& manifest_;
  WorkQueue& workQueue_;
};

}  // namespace velmora::mobile::xplat::cellar
