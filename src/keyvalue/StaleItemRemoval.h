#pragma once

#include <memory>
#include <optional>

#include "executor/AsyncTimer.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class BatchRemoval;
class StoreManifest;

// Loads the manifest and removes what has not been used for long, 300 seconds later and then every hour.
class StaleItemRemoval {
 public:
  StaleItemRemoval(StoreContext& context, StoreManifest& manifest, BatchRemoval& batches)
      : context_(context), manifest_(manifest), batches_(batches), staleAge_(context.options.staleAge) {}

  void loadThenArm();  // on the work queue

  // Expires what is stale now, and arms the next expiry. On the work queue.
  void start();

  // In place of the timer that is armed. Nothing once the store is invalidated.
  void arm(const StoreLock& lock, long delaySeconds);
  void disarm(const StoreLock& /*lock*/) { timer_.reset(); }

  void setStaleAge(const StoreLock& /*lock*/, long seconds) { staleAge_ = seconds; }

 private:
  std::optional<long> prepare();
  void armNext();

  StoreContext& context_;
  StoreManifest& manifest_;
  BatchRemoval& batches_;

  // Guarded by the store's mutex.
  long staleAge_;
  std::unique_ptr<AsyncTimer> timer_;
};

}  // namespace velmora::mobile::xplat::cellar
