#include "tune/ForesightCache.h"

#include <algorithm>
#include <cstddef>

namespace velmora::mobile::xplat::cellar::tools {

bool ForesightCache::access(const Access& access, std::uint64_t nextFetch) {
  if (access.kind == AccessKind::Clear) {
    clear();
    return false;
  }
  if (access.key >= items_.size()) items_.resize(std::size_t{access.key} + 1);
  Item& item = items_[access.key];
  const bool isFound = item.size != kGone;
  if (isFound) remove(item);
  if (access.kind == AccessKind::Remove) return isFound;
  item = {nextFetch, access.size};
  total_ += access.size;
  ++count_;
  note({nextFetch, access.key});
  prune();
  return isFound;
}

void ForesightCache::remove(Item& item) {
  total_ -= item.size;
  item.size = kGone;
  --count_;
}

void ForesightCache::clear() {
  for (const Entry& entry : last_) {
    if (isCurrent(entry)) remove(items_[entry.second]);
  }
  last_.clear();
}

void ForesightCache::prune() {
  while (total_ > limit_) {
    const Entry last = last_.front();
    std::pop_heap(last_.begin(), last_.end());
    last_.pop_back();
    if (isCurrent(last)) remove(items_[last.second]);
  }
}

bool ForesightCache::isCurrent(const Entry& entry) const {
  const Item& item = items_[entry.second];
  return item.size != kGone && item.nextFetch == entry.first;
}

// Entries that are not current are dropped when they are the greater part.
void ForesightCache::note(const Entry& entry) {
  last_.push_back(entry);
  std::push_heap(last_.begin(), last_.end());
  if (last_.size() < 2 * count_ + 64) return;
  last_.erase(std::remove_if(last_.begin(), last_.end(), [this](const Entry& each) { return !isCurrent(each); }),
              last_.end());
  std::make_heap(last_.begin(), last_.end());
}

}  // namespace velmora::mobile::xplat::cellar::tools
