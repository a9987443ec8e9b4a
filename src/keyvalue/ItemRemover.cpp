#include "keyvalue/ItemRemover.h"

#include <exception>
#include <mutex>
#include <optional>
#include <utility>

#include "FileUtils.h"
#include "LarderException.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/GroupCommit.h"
#include "keyvalue/ManifestChange.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

// A removal, on its way through the queues.
struct ItemRemover::Removal final : ManifestChange, std::enable_shared_from_this<Removal> {
  const std::string key;
  const std::weak_ptr<ItemRemover> owner;
  const Token operation;
  Promise<void> promise;

  std::unique_ptr<DiskCacheItem> item;  // that was removed
  bool isLeftToWrite = false;           // a write that is on its way deletes the file

  Removal(std::string key_, std::weak_ptr<ItemRemover> owner_, Token operation_)
      : key(std::move(key_)), owner(std::move(owner_)), operation(std::move(operation_)) {}

  // Whoever runs a removal holds the store.
  void runAlone() override { owner.lock()->removeAlone(*this); }
  void change(const StoreLock& lock) override { owner.lock()->removeRecord(lock, *this); }
  void note(const StoreLock& lock) override { owner.lock()->noteRemoved(lock, *this); }
  void deleteFile() override { owner.lock()->deleteFile(*this); }
  void finish() override { owner.lock()->fulfil(*this); }
};

Future<void> ItemRemover::remove(const std::string& key) {
  return groupCommit_.submit(std::make_shared<Removal>(key, context_.weak(*this), context_.operation));
}

void ItemRemover::removeAlone(Removal& removal) {
  try {
    const std::lock_guard<std::mutex> removing(context_.removalMutex);
    {
      const StoreLock lock = context_.lock();
      context_.throwIfInvalid();
      manifest_.prepareChange(lock);
      removal.item = manifest_.lookUp(lock, KeyRange(removal.key));
      const auto removeIt = [&] { manifest_.get()->removeItem(removal.key); };
      if (removal.item != nullptr && !manifest_.recoveringFromDamage(lock, removeIt)) removal.item.reset();
      noteRemoved(lock, removal);
    }
    deleteFile(removal);
  } catch (...) {
    removal.failure = std::current_exception();
  }
  fulfil(removal);
}

void ItemRemover::removeRecord(const StoreLock& /*lock*/, Removal& removal) {
  const auto manifest = manifest_.get();
  removal.item = manifest->getItem(removal.key);
  if (removal.item != nullptr) manifest->removeItem(removal.key);
}

void ItemRemover::noteRemoved(const StoreLock& /*lock*/, Removal& removal) {
  removal.isLeftToWrite = writes_.revoke(removal.key);
}

void ItemRemover::deleteFile(Removal& removal) {
  if (removal.item == nullptr || removal.isLeftToWrite) return;
  if (context_.isClosed) return;  // the path may be another store's by now
  try {
    if (const auto path = files_.fileOf(*removal.item)) files_.deleteOne(*path);
  } catch (...) {
    removal.failure = std::current_exception();
  }
}

// Where a write is left to delete the file, the promise is kept when the file queue has got past it.
void ItemRemover::fulfil(Removal& removal) {
  if (removal.failure != nullptr) return removal.promise.setException(removal.failure);
  if (!removal.isLeftToWrite) return removal.promise.setValue();
  try {
    fileQueue_.dispatch([self = removal.shared_from_this()] { self->promise.setValue(); });
  } catch (...) {
    removal.promise.setException(std::current_exception());
  }
}

void ItemRemover::evictOldestIfFull(const StoreLock& lock) {
  const auto item = takeOldestIfFull(lock);
  if (item != nullptr) discard(*item);
}

bool ItemRemover::isFull(const StoreLock& /*lock*/) {
  const auto& capacity = context_.options.capacity;
  return capacity && manifest_.get()->count() >= *capacity;
}

std::unique_ptr<DiskCacheItem> ItemRemover::takeOldestIfFull(const StoreLock& lock) {
  return isFull(lock) ? manifest_.get()->pruneOldestItem() : nullptr;
}

// A file queue that refuses the deletion refuses the write, too, that the item was evicted for.
void ItemRemover::noteEvicted(const StoreLock& /*lock*/, const DiskCacheItem* item) {
  if (item == nullptr) return;
  try {
    discard(*item);
  } catch (...) {
    errorLine(__LINE__).stream() << "Store \"" << context_.options.name << "\" deleted the file of evicted \""
                                 << item->key << "\" on its work queue: the file queue takes no tasks.";
  }
}

// The file of an evicted item, whose record is gone.
void ItemRemover::discard(const DiskCacheItem& item) {
  StoreContext::count(context_.evictions);
  const auto path = files_.fileOf(item);
  if (!path || writes_.revoke(item.key)) return;
  const auto deleteIt = [weakContext = context_.weak(context_), deletion = context_.fileDeletion, path = *path] {
    const auto context = weakContext.lock();
    if (context == nullptr || context->isClosed) return;  // the path may be another store's by now
    try {
      context->files->deleteFile(path);
    } catch (const LarderException& error) {
      errorLine(__LINE__).stream() << "Failed to remove the oldest item " << error.what();
    }
  };
  try {
    fileQueue_.dispatch(deleteIt);
  } catch (...) {
    deleteIt();
    throw;
  }
}

bool ItemRemover::makeRoom(const StoreLock& lock) {
  manifest_.get();  // one that cannot be opened now fails this operation, and purges nothing
  manifest_.prepareReading(lock);
  return !context_.options.capacity || manifest_.recoveringFromFailedWrite(lock, [&] { evictOldestIfFull(lock); });
}

void ItemRemover::finish() { const std::lock_guard<std::mutex> removing(context_.removalMutex); }

}  // namespace velmora::mobile::xplat::cellar
