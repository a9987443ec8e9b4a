#include "tune/GreedyDualCache.h"

#include <algorithm>
#include <cstddef>
#include <limits>

namespace velmora::mobile::xplat::cellar::tools {

bool GreedyDualCache::access(const Access& access, std::uint64_t /*nextFetch*/) {
  if (access.kind == AccessKind::Clear) {
    clear();
    return false;
  }
  if (access.key >= items_.size()) items_.resize(std::size_t{access.key} + 1);
  Item& item = items_[access.key];
  const bool isFound = item.record != nullptr;
  if (access.kind == AccessKind::Remove) {
    if (isFound) remove(item);
    return isFound;
  }
  const bool isFetch = access.kind == AccessKind::Fetch;
  if (isFound && isFetch) order_.used(*item.record);
  if (isFound && isFetch && item.size == access.size) return true;
  store(item, access.key, access.size);
  prune();
  return isFound;
}

// The record notes the key where the library has a date, which this order reads after a start only.
void GreedyDualCache::store(Item& item, std::uint32_t key, std::int64_t size) {
  if (item.record != nullptr) remove(item);
  constexpr std::int64_t most = std::numeric_limits<std::uint32_t>::max();
  DiskCacheItem stored;
  stored.size = static_cast<std::uint32_t>(std::min(size, most));
  stored.modificationDate = static_cast<std::int32_t>(key);
  order_.reserveOneMore();
  item.record = ManifestRecord::create(stored);
  item.size = size;
  total_ += size;
  order_.added(*item.record);
}

GreedyDualCache::Item& GreedyDualCache::itemOf(const ManifestRecord& record) {
  return items_[static_cast<std::uint32_t>(record.modificationDate)];
}

void GreedyDualCache::remove(Item& item) {
  order_.removed(*item.record);
  item.record.reset();
  total_ -= item.size;
}

// As a disk cache is emptied at the end of a session: another one begins, which has learnt nothing.
void GreedyDualCache::clear() {
  while (const ManifestRecord* const first = order_.first()) remove(itemOf(*first));
  order_.clear();
}

void GreedyDualCache::prune() {
  if (total_ <= limit_) return;
  evicted_.clear();
  order_.begin();
  while (total_ > limit_) {
    const ManifestRecord& first = *order_.first();
    evicted_.emplace_back();
    evicted_.back().size = first.size;
    remove(itemOf(first));
  }
  if (limit_ > 0) order_.evicted(evicted_);
}

}  // namespace velmora::mobile::xplat::cellar::tools
