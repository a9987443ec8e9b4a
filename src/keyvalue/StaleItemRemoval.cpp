#include "keyvalue/StaleItemRemoval.h"

#include <algorithm>
#include <cstdint>
#include <optional>
#include <utility>

#include "Clock.h"
#include "keyvalue/BatchRemoval.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr long kFirstDelay = 300;  // seconds
constexpr long kInterval = 3600;   // seconds
constexpr std::uint64_t kNanosecondsPerSecond = 1'000'000'000;

// The time before which what was used last is stale.
long cutoffOf(std::int64_t now, long staleAge) {
  if (staleAge > now) return 0;
  return static_cast<long>(static_cast<std::uint64_t>(now) - static_cast<std::uint64_t>(staleAge));
}

}  // namespace

void StaleItemRemoval::loadThenArm() {
  const StoreLock lock = context_.lock();
  if (context_.isInvalidated) return;
  // Armed whatever happens: a load that fails for a passing reason is tried again then.
  std::exception_ptr failure;
  try {
    manifest_.load(lock);
  } catch (...) {
    failure = std::current_exception();
  }
  arm(lock, kFirstDelay);
  if (failure != nullptr) std::rethrow_exception(failure);
}

void StaleItemRemoval::arm(const StoreLock& /*lock*/, long delaySeconds) {
  if (context_.isInvalidated) return;
  const auto delay = static_cast<std::int64_t>(static_cast<std::uint64_t>(delaySeconds) * kNanosecondsPerSecond);
  const auto onTimer = [weakThis = context_.weak(*this)] {
    if (const auto self = weakThis.lock()) self->start();
  };
  timer_ = context_.workQueue->scheduleAfter(delay, onTimer, nullptr);
}

void StaleItemRemoval::armNext() { arm(context_.lock(), kInterval); }

void StaleItemRemoval::start() {
  const auto onSuccess = [weakThis = context_.weak(*this)] {
    if (const auto self = weakThis.lock()) self->armNext();
  };
  const auto onError = [onSuccess](const std::exception& error) {
    onSuccess();
    errorLine(__LINE__).stream() << "Failed to delete stale items: " << error.what();
  };
  try {
    const auto cutoff = prepare();
    if (!cutoff) return;
    const auto takeStaleItems = [weakThis = context_.weak(*this), cutoff = *cutoff]() -> BatchRemoval::Items {
      const auto self = weakThis.lock();
      if (self == nullptr) return {};
      return self->batches_.evict([&](const StoreLock&, DiskCacheManifestInterface& manifest) {
        return manifest.pruneOldEntries(cutoff, self->context_.options.batchSize);
      });
    };
    batches_.run(takeStaleItems, onSuccess, onError);
  } catch (const std::exception& error) {
    onError(error);
  }
}

// Loads the manifest if that has failed so far. The date before which items are stale; empty once the store is
// invalidated.
std::optional<long> StaleItemRemoval::prepare() {
  const StoreLock lock = context_.lock();
  if (context_.isInvalidated) return std::nullopt;
  manifest_.recoveringFromDamage(lock, [&] {
    const auto manifest = manifest_.get();
    if (!manifest->isLoaded()) manifest->load();
  });
  manifest_.reportSize();
  return cutoffOf(std::min(manifest_.get()->currentDate(), Clock::now()), staleAge_);
}

}  // namespace velmora::mobile::xplat::cellar
