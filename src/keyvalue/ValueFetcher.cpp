#include "keyvalue/ValueFetcher.h"

#include <algorithm>
#include <cerrno>
#include <exception>
#include <limits>
#include <utility>

#include "AnalyticsEventReporter.h"
#include "Clock.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "base/Checksum.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/ReservedKeys.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/VersionedName.h"
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
  const bool isSafe;
  Promise<Fetched> promise;

  Fetch(std::vector<std::string> keys_, Loader loader_, std::weak_ptr<ValueFetcher> fetcher_, Token operation_,
        bool isSafe_)
      : keys(std::move(keys_)),
        loader(std::move(loader_)),
        fetcher(std::move(fetcher_)),
        operation(std::move(operation_)),
        isSafe(isSafe_) {}

  void endWithoutStore() { isSafe ? promise.setException(StoreContext::storeIsGone()) : promise.setValue(nullptr); }
};

Future<ValueFetcher::Fetched> ValueFetcher::fetchFirst(std::vector<std::string> keys, Loader loader) {
  const auto fetch = std::make_shared<Fetch>(std::move(keys), std::move(loader), context_.weak(*this),
                                             context_.operation, context_.isSafe());
  Future<Fetched> future = fetch->promise.getFuture();
  workQueue_.dispatch(KeyRange(fetch->keys), fetch->promise, [fetch] {
    if (const auto self = fetch->fetcher.lock()) {
      self->find(fetch);
    } else {
      fetch->endWithoutStore();
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
          fetch->endWithoutStore();
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
    if (load(fetch, files_.pathOf(item->filename), fetched->value)) {
      const StoreLock lock = context_.lock();
      manifest_.recoveringFromDamage(lock, [&] { manifest_.get()->updateLastAccessDate(item->key); });
      result = std::move(fetched);
    }
  } catch (...) {
    const auto failure = std::current_exception();
    if (context_.isClosed || !isMiss(*item, failure)) return fetch.promise.setException(failure);
  }
  fetch.promise.setValue(std::move(result));
}

// What a host's own loader is given has been checked before.
bool ValueFetcher::load(Fetch& fetch, const std::string& path, std::vector<unsigned char>& value) {
  const DiskCacheItem& item = *fetch.item;
  if (!fetch.loader) return readValue(item, path, value);
  if (checksumOf(item)) {
    std::vector<unsigned char> inlineValue;
    const bool isThere = item.hasInlineData ? readValue(item, path, inlineValue) : checkFile(item, path);
    if (!isThere) return false;
  }
  return fetch.loader(fetch.item, path, value);
}

bool ValueFetcher::isMiss(const DiskCacheItem& item, const std::exception_ptr& failure) {
  if (hasLostItem(item)) return true;
  if (!context_.isSafe() || !context_.isCache()) return false;
  try {
    std::rethrow_exception(failure);
  } catch (const FileUtilsIoException& error) {
    if (error.code() != ENOENT) return false;
    drop(item);  // a cache does without a file that somebody has removed
    return true;
  } catch (...) {
    return false;
  }
}

// Whether the store itself has taken the item away since it was looked up: removed it, or removed it and stored it
// again.
bool ValueFetcher::hasLostItem(const DiskCacheItem& item) {
  try {
    const StoreLock lock = context_.lock();
    manifest_.prepareChange(lock);
    const auto current = manifest_.lookUp(lock, KeyRange(item.key));
    if (current == nullptr) return true;
    if (context_.isSafe()) return current->filename != item.filename;
    if (current->hasInlineData != item.hasInlineData) return true;
    return writes_.contains(item.key) && !context_.files->pathExists(files_.pathOf(item.filename));
  } catch (const std::exception&) {
    return false;
  }
}

// Of a file whose record has lost it, the name has it still.
std::optional<std::uint32_t> ValueFetcher::checksumOf(const DiskCacheItem& item) const {
  if (item.checksum || item.hasInlineData || !context_.isSafe()) return item.checksum;
  const auto version = VersionedName::parse(item.filename);
  return version && version->key == item.key ? std::make_optional(version->checksum) : std::nullopt;
}

// A value that is not what it should be is read once more: the fault may lie in the reading.
bool ValueFetcher::readValue(const DiskCacheItem& item, const std::string& path, std::vector<unsigned char>& value) {
  std::optional<std::uint32_t> checksum = checksumOf(item);
  for (int attempt = 0; attempt < 2; ++attempt) {
    if (item.hasInlineData) {
      if (!readInlineValue(item.key, value, checksum)) return false;
    } else {
      value = context_.files->readFile(path);
    }
    if (!checksum || Checksum::of(item.key, value) == *checksum) return true;
    if (attempt == 0) manifest_.get()->release();
  }
  value.clear();
  return handleDamage(item);
}

// Record and value are read together: both may have been replaced.
bool ValueFetcher::readInlineValue(const std::string& key, std::vector<unsigned char>& value,
                                   std::optional<std::uint32_t>& checksum) {
  const StoreLock lock = context_.lock();
  bool isThere = false;
  manifest_.recoveringFromDamage(lock, [&] {
    const auto manifest = manifest_.get();
    value = manifest->getInlineData(key);
    isThere = !value.empty();
    if (isThere && !checksum) return;
    const auto current = manifest->getItem(key);
    const bool isRowMissing = value.empty() && current != nullptr && current->hasInlineData && current->size > 0;
    if (isRowMissing && context_.isSafe()) throw ManifestCorruptedException("A row is not found by its key.", -1);
    isThere = current != nullptr && (isThere || checksum || current->size == 0);  // not one that has vanished
    checksum = isThere ? current->checksum : std::nullopt;
  });
  return isThere;
}

bool ValueFetcher::checkFile(const DiskCacheItem& item, const std::string& path) {
  for (int attempt = 0; attempt < 2; ++attempt) {
    Checksum checksum(item.key);
    context_.files->readPieces(path,
                               [&](const unsigned char* bytes, std::size_t count) { checksum.add(bytes, count); });
    if (checksum.value() == *checksumOf(item)) return true;
  }
  return handleDamage(item);
}

// A cache does without the item: false, for a miss.
bool ValueFetcher::handleDamage(const DiskCacheItem& item) {
  const std::string& name = context_.options.name;
  const std::string text = DamagedValueException(name, item.key).description();
  errorLine(__LINE__).stream() << text;
  context_.report({Incident::Kind::DamagedValue, name, item.key, text});
  if (!context_.isCache()) throw DamagedValueException(name, item.key);
  drop(item);
  return false;
}

// Unless it has been stored again.
void ValueFetcher::drop(const DiskCacheItem& item) {
  {
    const StoreLock lock = context_.lock();
    const auto manifest = manifest_.get();
    const auto current = manifest->getItem(item.key);
    if (current == nullptr || current->filename != item.filename || current->checksum != item.checksum) return;
    manifest_.recoveringFromDamage(lock, [&] { manifest->removeItem(item.key); });
  }
  const auto path = files_.fileOf(item);
  if (path && context_.files->pathExists(*path)) files_.deleteAll({*path});
}

std::optional<std::int32_t> ValueFetcher::modificationDate(const std::string& key) {
  if (!context_.options.inlineData && !context_.isSafe()) throwIfReserved(key);
  const StoreLock lock = context_.lock();  // no purge and no invalidation comes in between
  context_.throwIfInvalid();
  std::optional<std::int32_t> date;
  manifest_.recoveringFromDamage(lock, [&] {
    manifest_.prepareReading(lock);
    date = manifest_.get()->getModificationDate(key);
  });
  return date;
}

Future<void> ValueFetcher::updateLastAccessDate(const std::string& key) {
  const auto promise = std::make_shared<Promise<void>>();
  Future<void> future = promise->getFuture();
  workQueue_.dispatch(
      KeyRange(key), *promise,
      [weakThis = context_.weak(*this), operation = context_.operation, key, promise, isSafe = context_.isSafe()] {
        settle(*promise, [&] {
          const auto self = weakThis.lock();
          if (self != nullptr) return self->noteAccess(key);
          if (isSafe) std::rethrow_exception(StoreContext::storeIsGone());
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
  manifest_.recoveringFromDamage(lock, [&] { manifest_.get()->updateLastAccessDate(key); });
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
