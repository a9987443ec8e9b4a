#include "host/memory/SieveTable.h"

#include <utility>

namespace velmora::mobile::xplat::cellar::host {

SieveTable::Value SieveTable::find(const std::string& key) {
  const auto found = entries_.find(key);
  if (found == entries_.end()) return nullptr;
  found->second.isVisited = true;
  return found->second.value;
}

void SieveTable::put(const std::string& key, Value value) {
  const std::size_t cost = key.size() + value->capacity() + MemoryTier::kEntryOverhead;
  const bool isKept = cost <= maxBytes_ / MemoryTier::kLargestPart;
  auto found = entries_.find(key);
  if (found != entries_.end() && isKept) return replace(found, std::move(value), cost);
  erase(found);
  if (!isKept) return;
  trim(maxBytes_ - cost);
  add(key, std::move(value), cost);
}

// In its place, and others make room for it: an entry of no cost is not evicted.
void SieveTable::replace(Entries::iterator found, Value value, std::size_t cost) {
  Entry& entry = found->second;
  bytes_ -= entry.cost;
  entry.cost = 0;
  entry.value = std::move(value);
  trim(maxBytes_ - cost);
  entry.isVisited = true;
  entry.cost = cost;
  bytes_ += cost;
}

void SieveTable::add(const std::string& key, Value value, std::size_t cost) {
  const auto added = entries_.try_emplace(key).first;
  Entry& entry = added->second;
  entry.key = &added->first;
  entry.value = std::move(value);
  entry.cost = cost;
  entry.older = newest_;
  (newest_ != nullptr ? newest_->newer : oldest_) = &entry;
  newest_ = &entry;
  bytes_ += cost;
}

void SieveTable::trim(std::size_t bytes) {
  while (bytes_ > bytes) evict();
}

void SieveTable::clear() {
  Entries().swap(entries_);  // assigning {} would keep its buckets
  newest_ = oldest_ = hand_ = nullptr;
  bytes_ = 0;
}

void SieveTable::evict() {
  Entry* entry = hand_ != nullptr ? hand_ : oldest_;
  while (entry->isVisited || entry->cost == 0) {
    entry->isVisited = false;
    entry = entry->newer != nullptr ? entry->newer : oldest_;
  }
  hand_ = entry->newer;
  erase(entries_.find(*entry->key));
}

void SieveTable::erase(Entries::iterator found) {
  if (found == entries_.end()) return;
  Entry& entry = found->second;
  if (hand_ == &entry) hand_ = entry.newer;
  (entry.newer != nullptr ? entry.newer->older : newest_) = entry.older;
  (entry.older != nullptr ? entry.older->newer : oldest_) = entry.newer;
  bytes_ -= entry.cost;
  entries_.erase(found);
}

}  // namespace velmora::mobile::xplat::cellar::host
