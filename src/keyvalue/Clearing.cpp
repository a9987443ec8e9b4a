#include "keyvalue/Clearing.h"

#include <algorithm>
#include <optional>
#include <unordered_set>
#include <utility>

#include "LarderException.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

// One that is under way.
struct Clearing::Clear {
  bool hasBegun = false;
  std::unordered_set<std::string> storedSince;         // keys that it leaves alone
  std::optional<std::vector<std::string>> keysLeft{};  // to be looked at, once pruning does not get on
};

void Clearing::clear(BatchRemoval::OnSuccess onSuccess, BatchRemoval::OnError onError) {
  auto takeNextBatch = [weakThis = context_.weak(*this), clear = std::make_shared<Clear>()]() -> Items {
    const auto self = weakThis.lock();
    if (self == nullptr) return {};
    return self->batches_.take(
        [&](const StoreLock& lock, DiskCacheManifestInterface&) { return self->take(lock, clear); });
  };
  batches_.run(std::move(takeNextBatch), std::move(onSuccess), std::move(onError));
}

bool Clearing::noteStored(const StoreLock& /*lock*/, const std::string& key) {
  bool isDueToBeCleared = false;
  for (const auto& clear : underWay_) {
    if (const auto state = clear.lock()) isDueToBeCleared = state->storedSince.insert(key).second || isDueToBeCleared;
  }
  return isDueToBeCleared;
}

// The next items to be deleted.
Clearing::Items Clearing::take(const StoreLock& lock, const std::shared_ptr<Clear>& clear) {
  Items items;
  if (!clear->hasBegun) items = begin(lock, clear);
  for (DiskCacheItem& item : takeNext(lock, *clear)) items.push_back(std::move(item));
  // What somebody else has removed, a prune say, may have its files still: the file queue has to pass them.
  if (items.empty() && context_.fileDeletion.use_count() > 1) items.emplace_back();
  return items;
}

Clearing::Items Clearing::begin(const StoreLock& lock, const std::shared_ptr<Clear>& clear) {
  const auto isOver = [](const std::weak_ptr<Clear>& other) { return other.expired(); };
  underWay_.erase(std::remove_if(underWay_.begin(), underWay_.end(), isOver), underWay_.end());
  underWay_.push_back(clear);
  clear->hasBegun = true;
  return cancelWrites(lock);
}

// Not in their turn like other items: a write that is cancelled must not leave its record to a later batch. Returns
// items without a file, so that the file queue has passed these writes before the next batch.
Clearing::Items Clearing::cancelWrites(const StoreLock& /*lock*/) {
  Items cancelled;
  const auto keys = writes_.keys();
  const auto manifest = manifest_.get();
  try {
    if (!manifest->isLoaded()) manifest->load();
    for (const std::string& key : keys) {
      manifest->removeItem(key);
      writes_.revoke(key);
      cancelled.emplace_back(key, std::string(), 0, false, 0, 0, nullptr);
    }
  } catch (const ManifestCorruptedException&) {
    for (const std::string& key : keys) writes_.revoke(key);  // the purge takes their records
    throw;
  }
  return cancelled;
}

// Pruning to nothing leaves items of no size, and would take what has been stored since the clear began.
Clearing::Items Clearing::takeNext(const StoreLock& lock, Clear& clear) {
  if (clear.storedSince.empty() && !clear.keysLeft) {
    const auto manifest = manifest_.get();
    auto items = manifest->pruneToSize(0, context_.options.batchSize);
    if (!items.empty() || manifest->count() == 0) return items;
  }
  return takeAllBut(lock, clear);
}

// What is stored from here on is in `storedSince`, so one look at all keys is enough.
Clearing::Items Clearing::takeAllBut(const StoreLock& lock, Clear& clear) {
  if (!clear.keysLeft) clear.keysLeft = manifest_.get()->getAllKeys();
  auto& keys = *clear.keysLeft;
  Items items;
  std::size_t left = keys.size();
  const auto takeBatch = [&] {
    for (; left > 0 && items.size() < context_.options.batchSize; --left) {
      if (clear.storedSince.count(keys[left - 1]) == 0) takeItem(keys[left - 1], items);
    }
  };
  if (!manifest_.changeTogether(lock, takeBatch)) {
    left = keys.size();
    items.clear();
    try {
      takeBatch();
    } catch (const ManifestPersistenceException&) {
      if (items.empty()) throw;  // otherwise the files of those that are removed must be deleted too
    }
  }
  keys.resize(left);
  return items;
}

void Clearing::takeItem(const std::string& key, Items& items) {
  const auto manifest = manifest_.get();
  const auto item = manifest->getItem(key);
  if (item == nullptr) return;
  manifest->removeItem(key);
  items.push_back(*item);
}

}  // namespace velmora::mobile::xplat::cellar
