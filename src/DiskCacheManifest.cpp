#include "DiskCacheManifest.h"

#include <glog/logging.h>

#include <exception>
#include <string_view>
#include <unordered_set>
#include <utility>

#include "Clock.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "base/StoreTime.h"
#include "manifest/AccessDates.h"
#include "manifest/ManifestRecords.h"
#include "manifest/ManifestUndo.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::int64_t kFlushIntervalNanoseconds = 120'000'000'000;

// A key with two rows has a damaged index, by which its former row was not found when it was replaced.
void throwIfAmbiguous(const std::vector<std::unique_ptr<DiskCacheItem>>& records) {
  std::unordered_set<std::string_view> keys;
  keys.reserve(records.size());
  for (const auto& record : records) keys.insert(record->key);
  if (keys.size() < records.size()) throw ManifestCorruptedException("There are two rows for a key.", -1);
}

}  // namespace

std::shared_ptr<DiskCacheManifest> DiskCacheManifest::createDiskCacheManifest(
    const std::string& path, std::shared_ptr<AsyncExecutor> executor, std::shared_ptr<ExtendedMetadataFactory> factory,
    std::shared_ptr<PruneStrategyBase> strategy) {
  return std::make_shared<DiskCacheManifest>(
      std::make_unique<SQLiteManifestPersistence>(path, std::move(factory), SQLiteStoreFactory()), std::move(executor),
      std::move(strategy));
}

DiskCacheManifest::DiskCacheManifest(std::unique_ptr<ManifestPersistence> persistence,
                                     std::shared_ptr<AsyncExecutor> executor,
                                     std::shared_ptr<PruneStrategyBase> strategy)
    : DiskCacheManifest(std::move(persistence), std::move(executor), std::move(strategy), Durability::Relaxed) {}

DiskCacheManifest::DiskCacheManifest(std::unique_ptr<ManifestPersistence> persistence,
                                     std::shared_ptr<AsyncExecutor> executor,
                                     std::shared_ptr<PruneStrategyBase> strategy, Durability durability)
    : persistence_(std::move(persistence)),
      executor_(std::move(executor)),
      records_(std::make_unique<ManifestRecords>(std::move(strategy))),
      time_(durability == Durability::Relaxed ? nullptr : std::make_unique<StoreTime>()),
      accessDates_(
          std::make_unique<AccessDates>(*persistence_, *records_, itemsMutex_, durability != Durability::Relaxed)) {}

DiskCacheManifest::~DiskCacheManifest() {
  try {
    accessDates_->flush();
  } catch (...) {
    LOG(ERROR) << "Could not write access dates as the manifest was destroyed.";
  }
}

void DiskCacheManifest::clear() {
  const std::lock_guard<std::mutex> loadLock(loadMutex_);
  const ItemsLock lock(itemsMutex_);
  records_->clear();
  accessDates_->clear(lock);
  persistence_->clearItems();
  loaded_ = true;
}

void DiskCacheManifest::load() {
  {
    const std::lock_guard<std::mutex> loadLock(loadMutex_);
    auto records = persistence_->getAllItems();
    if (time_ != nullptr) throwIfAmbiguous(records);
    const ItemsLock lock(itemsMutex_);
    if (!loaded_) {
      records_->reserve(records.size());
      for (auto& record : records) {
        if (records_->find(record->key) == nullptr) records_->store(*record);
        if (time_ != nullptr) time_->noteDateOf(*record);
        record.reset();  // so that the two forms of all records are never in memory together
      }
      records_->loaded();
      loaded_ = true;
    }
  }
  armFlushTimer();
}

void DiskCacheManifest::invalidate() {
  std::unique_ptr<AsyncTimer> timer;
  {
    const ItemsLock lock(itemsMutex_);
    invalidated_ = true;
    timer = std::move(flushTimer_);
  }
  persistence_->invalidate();
}

void DiskCacheManifest::setItem(const DiskCacheItem& item) {
  const ItemsLock lock(itemsMutex_);
  set(lock, item);
}

std::optional<ReplacedItem> DiskCacheManifest::replaceItem(const DiskCacheItem& item, bool withInlineData) {
  const ItemsLock lock(itemsMutex_);
  auto replaced = whatIsReplaced(lock, item.key, withInlineData);
  set(lock, item);
  return replaced;
}

bool DiskCacheManifest::changeTogether(const std::function<void()>& changes) {
  try {
    return change(changes);
  } catch (...) {  // whoever makes the changes one by one finds out for which of them it matters
    return false;
  }
}

void DiskCacheManifest::changeTogetherOrThrow(const std::function<void()>& changes) {
  if (!change(changes)) changes();
}

bool DiskCacheManifest::change(const std::function<void()>& changes) {
  const ItemsLock lock(itemsMutex_);
  if (!loaded_) return false;
  undo_ = std::make_unique<ManifestUndo>();
  bool haveChanged = false;
  try {
    haveChanged = persistence_->performTogether(changes);
  } catch (...) {
    std::exchange(undo_, nullptr)->takeBack(*records_, accessDates_->waiting(lock));
    throw;
  }
  undo_.reset();
  return haveChanged;
}

void DiskCacheManifest::storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData) {
  const ItemsLock lock(itemsMutex_);
  persistence_->storeItem(item, inlineData);
  noteFormer(lock, item.key);
  accessDates_->waiting(lock).erase(item.key);
  records_->store(item);
}

std::int32_t DiskCacheManifest::now(const ItemsLock& /*lock*/) {
  return static_cast<std::int32_t>(time_ == nullptr ? Clock::now() : time_->now());
}

std::int64_t DiskCacheManifest::currentDate() {
  const ItemsLock lock(itemsMutex_);
  return time_ == nullptr ? Clock::now() : time_->now();
}

bool DiskCacheManifest::hasMoved() { return persistence_->hasMoved(); }

bool DiskCacheManifest::isSound() { return persistence_->isSound(); }

void DiskCacheManifest::release() { persistence_->release(); }

void DiskCacheManifest::suspend() { persistence_->suspend(); }

void DiskCacheManifest::resume() { persistence_->resume(); }

void DiskCacheManifest::reload() {
  {
    const std::lock_guard<std::mutex> loadLock(loadMutex_);
    const ItemsLock lock(itemsMutex_);
    persistence_->resume();
    const auto records = persistence_->getAllItems();
    records_->clear();
    accessDates_->waiting(lock).clear();
    for (const auto& record : records) {
      records_->store(*record);
      if (time_ != nullptr) time_->noteDateOf(*record);
    }
    records_->loaded();
    loaded_ = true;
  }
  armFlushTimer();
}

// To be called before a record in memory changes.
void DiskCacheManifest::noteFormer(const ItemsLock& lock, const std::string& key) {
  if (undo_ != nullptr) undo_->note(key, *records_, accessDates_->waiting(lock));
}

void DiskCacheManifest::set(const ItemsLock& lock, const DiskCacheItem& item) {
  persistence_->setItem(item);
  noteFormer(lock, item.key);
  accessDates_->waiting(lock).erase(item.key);
  records_->store(item);
}

std::optional<ReplacedItem> DiskCacheManifest::whatIsReplaced(const ItemsLock& lock, const std::string& key,
                                                              bool withInlineData) {
  try {
    const ManifestRecord* const record = findOrRead(lock, key);
    if (record == nullptr) return ReplacedItem();
    ReplacedItem replaced{std::make_unique<DiskCacheItem>(record->item()), {}};
    if (withInlineData && record->hasInlineData) replaced.inlineData = persistence_->getInlineData(key);
    return replaced;
  } catch (const ManifestCorruptedException&) {
    throw;
  } catch (const ManifestPersistenceException&) {
    if (undo_ != nullptr) throw;  // what has failed within a transaction may have ended it
    return std::nullopt;          // not being able to read must not keep the item from being written
  }
}

std::unique_ptr<DiskCacheItem> DiskCacheManifest::getItem(const std::string& key) {
  const ItemsLock lock(itemsMutex_);
  const ManifestRecord* const record = findOrRead(lock, key);
  return record == nullptr ? nullptr : std::make_unique<DiskCacheItem>(record->item());
}

void DiskCacheManifest::updateLastAccessDate(const std::string& key) {
  std::shared_ptr<AccessDates::Dates> due;
  {
    const ItemsLock lock(itemsMutex_);
    if (findOrRead(lock, key) == nullptr) return;
    const std::int32_t date = now(lock);
    records_->setLastAccessDate(key, date);
    accessDates_->waiting(lock)[key] = date;
    if (loaded_) due = accessDates_->takeDue(lock);
    if (due == nullptr) return;
  }
  try {
    executor_->dispatch([weakThis = weak_from_this<DiskCacheManifest>(), due] {
      if (const auto self = weakThis.lock()) self->accessDates_->flush(*due);
    });
  } catch (...) {
    accessDates_->giveBack(ItemsLock(itemsMutex_), *due);
    throw;
  }
}

std::optional<std::int32_t> DiskCacheManifest::getModificationDate(const std::string& key) {
  const ItemsLock lock(itemsMutex_);
  const ManifestRecord* const record = findOrRead(lock, key);
  return record == nullptr ? std::nullopt : std::make_optional(record->modificationDate);
}

void DiskCacheManifest::removeItem(const std::string& key) {
  const auto removeIt = [&](const ItemsLock& lock) {
    if (const ManifestRecord* const record = records_->find(key)) {
      remove(lock, *record);
    } else if (!loaded_) {
      persistence_->removeItem(key);
    }
  };
  {
    const ItemsLock lock(itemsMutex_);
    if (loaded_) return removeIt(lock);
  }
  const std::lock_guard<std::mutex> loadLock(loadMutex_);
  removeIt(ItemsLock(itemsMutex_));
}

std::vector<unsigned char> DiskCacheManifest::getInlineData(const std::string& key) {
  const ItemsLock lock(itemsMutex_);
  const ManifestRecord* const record = records_->find(key);
  const bool hasInlineData = record == nullptr ? !loaded_ : record->hasInlineData;
  return hasInlineData ? persistence_->getInlineData(key) : std::vector<unsigned char>();
}

void DiskCacheManifest::setInlineData(const std::string& key, const std::vector<unsigned char>& data) {
  const ItemsLock lock(itemsMutex_);
  persistence_->setInlineData(key, data);
  if (findOrRead(lock, key) == nullptr) return;
  noteFormer(lock, key);
  records_->setHasInlineData(key, true);
}

void DiskCacheManifest::removeInlineData(const std::string& key) {
  const ItemsLock lock(itemsMutex_);
  persistence_->removeInlineData(key);
  if (findOrRead(lock, key) == nullptr) return;
  noteFormer(lock, key);
  records_->setHasInlineData(key, false);
}

std::vector<DiskCacheItem> DiskCacheManifest::pruneToSize(std::uint32_t size, std::uint32_t count) {
  const ItemsLock lock(itemsMutex_);
  if (!loaded_ || records_->totalSize() <= size) return {};
  auto removed = prune(
      lock, [&] { return records_->byStrategy(); }, count,
      [&](const ManifestRecord&) { return records_->totalSize() > size; });
  if (size > 0 && !removed.empty()) records_->evicted(removed);  // of a prune of everything there is nothing to learn
  return removed;
}

std::vector<DiskCacheItem> DiskCacheManifest::pruneOldEntries(long date, std::uint32_t count) {
  const ItemsLock lock(itemsMutex_);
  if (!loaded_) return {};
  return prune(
      lock, [&] { return records_->leastRecentlyUsed(); }, count,
      [&](const ManifestRecord& record) { return record.lastAccessDate < date; });
}

std::unique_ptr<DiskCacheItem> DiskCacheManifest::pruneOldestItem() {
  const ItemsLock lock(itemsMutex_);
  const ManifestRecord* const oldest = loaded_ ? records_->leastRecentlyUsed()() : nullptr;
  return oldest == nullptr ? nullptr : std::make_unique<DiskCacheItem>(remove(lock, *oldest));
}

std::vector<std::string> DiskCacheManifest::getAllKeys() {
  const ItemsLock lock(itemsMutex_);
  if (!loaded_) {
    throw DiskCacheManifestException("Manifest hasn't been loaded from disk yet", "QZDiskCacheManifestErrorDomain", 0);
  }
  return records_->keys();
}

std::uint32_t DiskCacheManifest::size() {
  const ItemsLock lock(itemsMutex_);
  return records_->totalSize();
}

std::uint32_t DiskCacheManifest::count() {
  const ItemsLock lock(itemsMutex_);
  return static_cast<std::uint32_t>(records_->count());
}

bool DiskCacheManifest::isLoaded() {
  const ItemsLock lock(itemsMutex_);
  return loaded_;
}

// The record in memory, read into it first when the manifest is not loaded yet.
const ManifestRecord* DiskCacheManifest::findOrRead(const ItemsLock& /*lock*/, const std::string& key) {
  const ManifestRecord* const record = records_->find(key);
  if (record != nullptr || loaded_) return record;
  const auto item = persistence_->getItem(key);
  if (item == nullptr) return nullptr;
  if (time_ != nullptr) time_->noteDateOf(*item);
  return records_->store(*item);
}

// The persistence first: when it fails, nothing has changed.
DiskCacheItem DiskCacheManifest::remove(const ItemsLock& lock, const ManifestRecord& record) {
  const std::string key(record.key());
  persistence_->removeItem(key);
  noteFormer(lock, key);
  accessDates_->waiting(lock).erase(key);
  return records_->remove(record);
}

// Removes records in the order, at most `count`, up to the first that may not go: together, or, where that fails, as
// far as one by one gets.
template <class Order, class MayGo>
std::vector<DiskCacheItem> DiskCacheManifest::prune(const ItemsLock& lock, Order order, std::uint32_t count,
                                                    MayGo mayGo) {
  if (count == 0) return {};
  Next next = order();
  const ManifestRecord* first = next();
  if (first == nullptr || !mayGo(*first)) return {};
  std::vector<DiskCacheItem> removed;
  bool wasTried = false;
  const auto removeTogether = [&] {
    wasTried = true;
    removeInOrder(lock, first, next, count, mayGo, removed);
  };
  if (changeTogether(removeTogether)) return removed;
  removed.clear();
  if (wasTried) {  // the records in memory may be others now
    next = order();
    first = next();
  }
  try {
    removeInOrder(lock, first, next, count, mayGo, removed);
  } catch (...) {
    if (removed.empty()) throw;  // otherwise the files of those that went must go too
  }
  return removed;
}

// From `record` on.
template <class MayGo> void DiskCacheManifest::removeInOrder(const ItemsLock& lock, const ManifestRecord* record,
                                                             const Next& next, std::uint32_t count, MayGo mayGo,
                                                             std::vector<DiskCacheItem>& removed) {
  while (record != nullptr && mayGo(*record)) {
    removed.push_back(remove(lock, *record));
    if (removed.size() == count) return;
    try {
      record = next();
    } catch (...) {  // of a strategy that is the host's: the next call meets it at its first item
      return;
    }
  }
}

// Some hosts' timers repeat and some fire once. Replacing the handle each time does right by both.
void DiskCacheManifest::armFlushTimer() {
  const auto onTimer = [weakThis = weak_from_this<DiskCacheManifest>()] {
    const auto self = weakThis.lock();
    if (self == nullptr) return;
    self->accessDates_->flush();
    self->armFlushTimer();
  };
  std::unique_ptr<AsyncTimer> timer;  // the old one is destroyed without the lock
  const ItemsLock lock(itemsMutex_);
  if (invalidated_) return;
  timer = std::exchange(flushTimer_, executor_->scheduleAfter(kFlushIntervalNanoseconds, onTimer, nullptr));
}

}  // namespace velmora::mobile::xplat::cellar
