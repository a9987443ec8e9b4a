#include "DiskCacheManifest.h"

#include <glog/logging.h>

#include <algorithm>
#include <ctime>
#include <exception>
#include <utility>

#include "LarderException.h"
#include "SQLiteManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::int64_t kFlushIntervalNanoseconds = 120'000'000'000;
constexpr std::size_t kMaxPendingAccessDates = 512;

std::int32_t now() { return static_cast<std::int32_t>(std::time(nullptr)); }

// Yields items in the order of a comparator, one by one. A heap: taking the first few of many does not sort the rest,
// and with a comparator that is no consistent order, which a host's may be, it still yields every item once. (The
// standard algorithms are undefined then.)
class ItemQueue {
 public:
  ItemQueue(std::vector<const DiskCacheItem*> items, const Comparator& before)
      : heap_(std::move(items)), before_(before) {
    for (std::size_t i = heap_.size() / 2; i-- > 0;) siftDown(i);
  }

  bool empty() const { return heap_.empty(); }

  const DiskCacheItem* first() const { return heap_.front(); }

  void pop() {
    std::swap(heap_.front(), heap_.back());
    heap_.pop_back();
    siftDown(0);
  }

 private:
  void siftDown(std::size_t parent) {
    for (std::size_t child = 2 * parent + 1; child < heap_.size(); child = 2 * parent + 1) {
      if (child + 1 < heap_.size() && before_(heap_[child + 1], heap_[child])) ++child;
      if (!before_(heap_[child], heap_[parent])) return;
      std::swap(heap_[child], heap_[parent]);
      parent = child;
    }
  }

  std::vector<const DiskCacheItem*> heap_;
  const Comparator& before_;
};

}  // namespace

DiskCacheManifestInterface::~DiskCacheManifestInterface() = default;

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
    : persistence_(std::move(persistence)), executor_(std::move(executor)), strategyOrder_(std::move(strategy)) {}

DiskCacheManifest::~DiskCacheManifest() {
  try {
    commitAccessTimeUpdates(pendingAccessDates_);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not write access dates: " << error.what();
  }
}

void DiskCacheManifest::clear() {
  const std::lock_guard<std::mutex> loadLock(loadMutex_);
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  items_.clear();
  pendingAccessDates_.clear();
  totalSize_ = 0;
  persistence_->clearItems();
  loaded_ = true;
}

void DiskCacheManifest::load() {
  {
    const std::lock_guard<std::mutex> loadLock(loadMutex_);
    auto records = persistence_->getAllItems();
    const std::lock_guard<std::mutex> lock(itemsMutex_);
    if (!loaded_) {
      items_.reserve(records.size());
      for (auto& record : records) {
        if (items_.count(record->key) == 0) storeInMemory(std::move(record));
      }
      loaded_ = true;
    }
  }
  armFlushTimer();
}

void DiskCacheManifest::invalidate() {
  std::unique_ptr<AsyncTimer> timer;
  {
    const std::lock_guard<std::mutex> lock(itemsMutex_);
    invalidated_ = true;
    timer = std::move(flushTimer_);
  }
  persistence_->invalidate();
}

void DiskCacheManifest::setItem(const DiskCacheItem& item) {
  auto record = std::make_unique<DiskCacheItem>(item);
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  persistence_->setItem(item);
  pendingAccessDates_.erase(item.key);
  storeInMemory(std::move(record));
}

std::unique_ptr<DiskCacheItem> DiskCacheManifest::getItem(const std::string& key) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  const DiskCacheItem* item = findOrRead(key);
  return item == nullptr ? nullptr : std::make_unique<DiskCacheItem>(*item);
}

void DiskCacheManifest::updateLastAccessDate(const std::string& key) {
  auto due = std::make_shared<AccessDates>();
  {
    const std::lock_guard<std::mutex> lock(itemsMutex_);
    DiskCacheItem* item = findOrRead(key);
    if (item == nullptr) return;
    item->lastAccessDate = now();
    pendingAccessDates_[key] = item->lastAccessDate;
    if (!loaded_ || pendingAccessDates_.size() <= kMaxPendingAccessDates) return;
    due->swap(pendingAccessDates_);
  }
  try {
    executor_->dispatch([weakThis = weak_from_this<DiskCacheManifest>(), due] {
      if (const auto self = weakThis.lock()) self->commitAccessTimeUpdates(*due);
    });
  } catch (...) {
    const std::lock_guard<std::mutex> lock(itemsMutex_);
    pendingAccessDates_.insert(due->begin(), due->end());  // those used again meanwhile stay as they are
    throw;
  }
}

std::optional<std::int32_t> DiskCacheManifest::getModificationDate(const std::string& key) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  const DiskCacheItem* item = findOrRead(key);
  return item == nullptr ? std::nullopt : std::make_optional(item->modificationDate);
}

void DiskCacheManifest::removeItem(const std::string& key) {
  const std::lock_guard<std::mutex> loadLock(loadMutex_);
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  const auto found = items_.find(key);
  if (found != items_.end()) {
    remove(found);
  } else if (!loaded_) {
    persistence_->removeItem(key);
  }
}

std::vector<unsigned char> DiskCacheManifest::getInlineData(const std::string& key) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  const auto found = items_.find(key);
  const bool hasInlineData = found == items_.end() ? !loaded_ : found->second->hasInlineData;
  return hasInlineData ? persistence_->getInlineData(key) : std::vector<unsigned char>();
}

void DiskCacheManifest::setInlineData(const std::string& key, const std::vector<unsigned char>& data) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  persistence_->setInlineData(key, data);
  if (DiskCacheItem* item = findOrRead(key)) item->hasInlineData = true;
}

void DiskCacheManifest::removeInlineData(const std::string& key) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  persistence_->removeInlineData(key);
  if (DiskCacheItem* item = findOrRead(key)) item->hasInlineData = false;
}

std::vector<DiskCacheItem> DiskCacheManifest::pruneToSize(std::uint32_t size, std::uint32_t count) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  if (totalSize_ <= size) return {};
  return prune(strategyOrder_, count, [&](const DiskCacheItem&) { return totalSize_ > size; });
}

std::vector<DiskCacheItem> DiskCacheManifest::pruneOldEntries(long date, std::uint32_t count) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  return prune(accessDateOrder_, count, [&](const DiskCacheItem& item) { return item.lastAccessDate < date; });
}

std::unique_ptr<DiskCacheItem> DiskCacheManifest::pruneOldestItem() {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  if (!loaded_ || items_.empty()) return nullptr;
  return remove(std::min_element(items_.begin(), items_.end(), [](const auto& a, const auto& b) {
    return a.second->lastAccessDate < b.second->lastAccessDate;
  }));
}

std::vector<std::string> DiskCacheManifest::getAllKeys() {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  if (!loaded_) {
    throw DiskCacheManifestException("Manifest hasn't been loaded from disk yet", "QZDiskCacheManifestErrorDomain", 0);
  }
  std::vector<std::string> keys;
  keys.reserve(items_.size());
  for (const auto& item : items_) keys.push_back(item.first);
  return keys;
}

std::uint32_t DiskCacheManifest::size() {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  return totalSize_;
}

std::uint32_t DiskCacheManifest::count() {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  return static_cast<std::uint32_t>(items_.size());
}

bool DiskCacheManifest::isLoaded() {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  return loaded_;
}

// The record in memory, read into it first when the manifest is not loaded yet.
DiskCacheItem* DiskCacheManifest::findOrRead(const std::string& key) {
  const auto found = items_.find(key);
  if (found != items_.end()) return found->second.get();
  if (loaded_) return nullptr;
  auto item = persistence_->getItem(key);
  return item == nullptr ? nullptr : storeInMemory(std::move(item));
}

DiskCacheItem* DiskCacheManifest::storeInMemory(std::unique_ptr<DiskCacheItem> item) {
  auto& slot = items_[item->key];
  if (slot != nullptr) totalSize_ -= slot->size;
  totalSize_ += item->size;
  slot = std::move(item);
  return slot.get();
}

// The persistence first: when it fails, nothing has changed.
std::unique_ptr<DiskCacheItem> DiskCacheManifest::remove(Items::iterator position) {
  persistence_->removeItem(position->first);
  auto item = std::move(position->second);
  items_.erase(position);
  pendingAccessDates_.erase(item->key);
  totalSize_ -= item->size;
  return item;
}

// Removes items in the given order, at most `count`, up to the first that may not go.
template <class MayGo>
std::vector<DiskCacheItem> DiskCacheManifest::prune(const Comparator& order, std::uint32_t count, MayGo mayGo) {
  std::vector<DiskCacheItem> removed;
  if (!loaded_ || count == 0) return removed;
  std::vector<const DiskCacheItem*> items;
  items.reserve(items_.size());
  for (const auto& item : items_) items.push_back(item.second.get());

  for (ItemQueue queue(std::move(items), order); !queue.empty(); queue.pop()) {
    if (removed.size() == count || !mayGo(*queue.first())) break;
    try {
      removed.push_back(std::move(*remove(items_.find(queue.first()->key))));
    } catch (const LarderException&) {
      if (removed.empty()) throw;
      break;  // the files of those that went must go too; the next call meets the failure at its first item
    }
  }
  return removed;
}

// Some hosts' timers repeat and some fire once. Replacing the handle each time does right by both.
void DiskCacheManifest::armFlushTimer() {
  const auto onTimer = [weakThis = weak_from_this<DiskCacheManifest>()] {
    const auto self = weakThis.lock();
    if (self == nullptr) return;
    self->flush();
    self->armFlushTimer();
  };
  std::unique_ptr<AsyncTimer> timer;  // the old one is destroyed without the lock
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  if (invalidated_) return;
  timer = std::exchange(flushTimer_, executor_->scheduleAfter(kFlushIntervalNanoseconds, onTimer, nullptr));
}

void DiskCacheManifest::flush() {
  AccessDates dates;
  {
    const std::lock_guard<std::mutex> lock(itemsMutex_);
    dates.swap(pendingAccessDates_);
  }
  commitAccessTimeUpdates(dates);
}

// Dates of items that have been used or set again meanwhile, or have gone, are not written; those that cannot be
// written now wait for the next time.
void DiskCacheManifest::commitAccessTimeUpdates(const AccessDates& dates) {
  auto next = dates.begin();
  try {
    for (; next != dates.end(); ++next) {
      if (isAccessDate(next->first, next->second)) persistence_->updateLastAccessDate(next->first, next->second);
    }
  } catch (const LarderException& error) {
    LOG(ERROR) << "Could not write access dates: " << error.what();
    for (; next != dates.end(); ++next) {
      if (!isAccessDate(next->first, next->second)) continue;
      const std::lock_guard<std::mutex> lock(itemsMutex_);
      pendingAccessDates_.insert(*next);
    }
  }
}

bool DiskCacheManifest::isAccessDate(const std::string& key, std::int32_t date) {
  const std::lock_guard<std::mutex> lock(itemsMutex_);
  const auto found = items_.find(key);
  return found != items_.end() && found->second->lastAccessDate == date;
}

}  // namespace velmora::mobile::xplat::cellar
