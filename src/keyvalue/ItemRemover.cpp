#include "keyvalue/ItemRemover.h"

#include <optional>

#include "FileUtils.h"
#include "LarderException.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

void ItemRemover::remove(const std::string& key, const std::shared_ptr<Promise<void>>& promise) {
  bool isOver = false;
  try {
    isOver = removeNow(key, promise);
  } catch (...) {
    return promise->setException(std::current_exception());
  }
  if (isOver) promise->setValue();
}

// False when a write that is on its way is left to delete the file: the promise is kept when the file queue has got
// past it.
bool ItemRemover::removeNow(const std::string& key, const std::shared_ptr<Promise<void>>& promise) {
  const std::lock_guard<std::mutex> removal(removalMutex_);
  std::optional<std::string> path;
  {
    const StoreLock lock = context_.lock();
    context_.throwIfInvalid();
    const auto item = manifest_.lookUp(lock, KeyRange(key));
    if (item != nullptr && manifest_.purgingIfDamaged(lock, [&] { manifest_.get()->removeItem(key); })) {
      path = files_.fileOf(*item);
    }
    if (writes_.revoke(key)) {
      fileQueue_.dispatch([promise] { promise->setValue(); });
      return false;
    }
  }
  if (path) context_.files->deleteFile(*path);
  return true;
}

void ItemRemover::evictOldestIfFull(const StoreLock& /*lock*/) {
  const auto manifest = manifest_.get();
  const auto& capacity = context_.options.capacity;
  if (!capacity || manifest->count() < *capacity) return;
  const auto item = manifest->pruneOldestItem();
  if (item == nullptr) return;
  StoreContext::count(context_.evictions);
  const auto path = files_.fileOf(*item);
  if (!path || writes_.revoke(item->key)) return;
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
    deleteIt();  // its record is gone already
    throw;
  }
}

bool ItemRemover::makeRoom(const StoreLock& lock) {
  manifest_.get();  // one that cannot be opened now fails this operation, and purges nothing
  manifest_.finishPurge(lock);
  return !context_.options.capacity || manifest_.purgingIfUnwritable(lock, [&] { evictOldestIfFull(lock); });
}

void ItemRemover::finish() { const std::lock_guard<std::mutex> removal(removalMutex_); }

}  // namespace velmora::mobile::xplat::cellar
