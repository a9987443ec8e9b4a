#include "keyvalue/ValueFetcher.h"

#include <algorithm>
#include <exception>
#include <limits>
#include <utility>

#include "AnalyticsEventReporter.h"
#include "Clock.h"
#include "FileUtils.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/ReservedKeys.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WorkQueue.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

namespace {

using Hit = PersistentKeyValueStoreEvent::Hit;

// The seconds since then as an event reports them: where `long` has 32 bits, the greatest it holds at most.
long ageSince(std::int64_t date) {
  return static_cast<long>(std::min<std::int64_t>(Clock::now() - date, std::numeric_limits<long>::max()));
}

}  // namespace

// A fetch, on its way through the queues.
struct ValueFetcher::Fetch {
  const std::vector<std::string> keys;
  const Loader loader;
  const std::weak_ptr<ValueFetcher> fetcher;
  const Token operation;
  std::shared_ptr<const DiskCacheItem> item;  // once it is found
  Promise<Fetched> promise;

  Fetch(std::vector<std::string> keys_, Loader loader_, std::weak_ptr<ValueFetcher> fetcher_, Token operation_)
      : keys(std::move(keys_)),
        loader(std::move(loader_)),
        fetcher(std::move(fetcher_)),
        operation(std::move(operation_)) {}
};

Future<ValueFetcher::Fetched> ValueFetcher::fetchFirst(std::vector<std::string> keys, Loader loader) {
  const auto fetch =
      std::make_shared<Fetch>(std::move(keys), std::move(loader), context_.weak(*this), context_.operation);
  Future<Fetched> future = fetch->promise.getFuture();
  workQueue_.dispatch(KeyRange(fetch->keys), fetch->promise, [fetch] {
    if (const auto self = fetch->fetcher.lock()) {
      self->find(fetch);
    } else {
      fetch->promise.setValue(nullptr);
    }
  });
  return future;
}

void ValueFetcher::find(const std::shared_ptr<Fetch>& fetch) {
  try {
    {
      const StoreLock lock = context_.lock();
      context_.throwIfInvalid();
      fetch->item = manifest_.lookUp(lock, KeyRange(fetch->keys));
    }
    if (!fetch->keys.empty()) {
      StoreContext::count(fetch->item != nullptr ? context_.hits : context_.misses);
      reportAccess(fetch->item.get(), fetch->keys.front());
    }
    if (fetch->item != nullptr) {
      fileQueue_.dispatch([fetch] {
        if (const auto self = fetch->fetcher.lock()) {
          self->load(*fetch);
        } else {
          fetch->promise.setValue(nullptr);
        }
      });
      return;
    }
  } catch (...) {
    return fetch->promise.setException(std::current_exception());
  }
  fetch->promise.setValue(nullptr);
}

void ValueFetcher::load(Fetch& fetch) {
  const auto& item = fetch.item;
  Fetched result;
  try {
    context_.throwIfClosed();
    auto fetched = std::make_unique<PersistentKeyValueStore::FetchResult>(
        PersistentKeyValueStore::FetchResult{item->key, {}, item->modificationDate});
    if (fetch.loader(item, files_.pathOf(item->filename), fetched->value)) {
      const StoreLock lock = context_.lock();
      manifest_.purgingIfDamaged(lock, [&] { manifest_.get()->updateLastAccessDate(item->key); });
      result = std::move(fetched);
    }
  } catch (...) {
    if (context_.isClosed || !hasLostItem(*item)) return fetch.promise.setException(std::current_exception());
  }
  fetch.promise.setValue(std::move(result));
}

// Whether the store itself has taken the item away since it was looked up: removed it, or removed it and stored it
// again.
bool ValueFetcher::hasLostItem(const DiskCacheItem& item) {
  try {
    const StoreLock lock = context_.lock();
    if (manifest_.lookUp(lock, KeyRange(item.key)) == nullptr) return true;
    return writes_.contains(item.key) && !context_.files->pathExists(files_.pathOf(item.filename));
  } catch (const std::exception&) {
    return false;
  }
}

bool ValueFetcher::readValue(const DiskCacheItem& item, const std::string& path, std::vector<unsigned char>& value) {
  if (!item.hasInlineData) {
    value = context_.files->readFile(path);
    return true;
  }
  const StoreLock lock = context_.lock();  // record and value are written one after the other
  bool isThere = false;
  manifest_.purgingIfDamaged(lock, [&] {
    const auto manifest = manifest_.get();
    value = manifest->getInlineData(item.key);
    isThere = !value.empty();
    if (isThere) return;
    const auto current = manifest->getItem(item.key);
    isThere = current != nullptr && current->size == 0;  // an empty value, not one that has vanished
  });
  return isThere;
}

std::optional<std::int32_t> ValueFetcher::modificationDate(const std::string& key) {
  if (!context_.options.inlineData) throwIfReserved(key);
  const StoreLock lock = context_.lock();  // no purge and no invalidation comes in between
  context_.throwIfInvalid();
  std::optional<std::int32_t> date;
  manifest_.purgingIfDamaged(lock, [&] {
    manifest_.finishPurge(lock);
    date = manifest_.get()->getModificationDate(key);
  });
  return date;
}

Future<void> ValueFetcher::updateLastAccessDate(const std::string& key) {
  const auto promise = std::make_shared<Promise<void>>();
  Future<void> future = promise->getFuture();
  workQueue_.dispatch(KeyRange(key), *promise,
                      [weakThis = context_.weak(*this), operation = context_.operation, key, promise] {
                        settle(*promise, [&] {
                          if (const auto self = weakThis.lock()) self->noteAccess(key);
                        });
                      });
  return future;
}

void ValueFetcher::noteAccess(const std::string& key) {
  context_.throwIfInvalid();
  if (context_.analytics != nullptr) {
    const PersistentKeyValueStoreEventBuilder event(Hit::Found, context_.options.name, key);
    context_.analytics->reportEvent(event.get());
  }
  const StoreLock lock = context_.lock();
  manifest_.purgingIfDamaged(lock, [&] { manifest_.get()->updateLastAccessDate(key); });
}

// A hit carries the item found; a miss, the key that was looked for first.
void ValueFetcher::reportAccess(const DiskCacheItem* item, const std::string& key) {
  if (context_.analytics == nullptr) return;
  PersistentKeyValueStoreEventBuilder event(item != nullptr ? Hit::Found : Hit::Missing, context_.options.name,
                                            item != nullptr ? item->key : key);
  if (item != nullptr) event.age(ageSince(item->modificationDate)).size(item->size);
  context_.analytics->reportEvent(event.get());
}

}  // namespace velmora::mobile::xplat::cellar
