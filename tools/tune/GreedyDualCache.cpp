#include "tune/GreedyDualCache.h"

#include <algorithm>
#include <cstring>
#include <limits>
#include <string>

#include "DiskCacheItem.h"
#include "storage/MemoryManifest.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// So that a full cache and one more item still have 32 bits.
constexpr std::int64_t kMost = std::int64_t{1} << 31;

std::shared_ptr<DiskCacheManifest> emptyManifest() { return memoryManifest({}, PruneStrategyIdentifier::GreedyDual); }

// Short, so that it takes no memory of its own.
std::string nameOf(std::uint32_t key) {
  std::string name(sizeof key, '\0');
  std::memcpy(name.data(), &key, sizeof key);
  return name;
}

std::uint32_t keyOf(const std::string& name) {
  std::uint32_t key = 0;
  std::memcpy(&key, name.data(), sizeof key);
  return key;
}

}  // namespace

GreedyDualCache::GreedyDualCache(std::int64_t limit) : manifest_(emptyManifest()) {
  while ((limit >> unit_) >= kMost) ++unit_;
  limit_ = static_cast<std::uint32_t>(limit >> unit_);
}

bool GreedyDualCache::access(const Access& access, std::uint64_t /*nextFetch*/) {
  if (access.kind == AccessKind::Clear) {  // another session's store, which has learnt nothing
    for (const std::string& name : manifest_->getAllKeys()) sizes_[keyOf(name)] = kAbsent;
    manifest_ = emptyManifest();
    return false;
  }
  if (access.key >= sizes_.size()) sizes_.resize(std::size_t{access.key} + 1, kAbsent);
  const std::int64_t found = sizes_[access.key];
  if (access.kind == AccessKind::Remove) {
    remove(access.key);
    return found != kAbsent;
  }
  const bool isFetched = access.kind == AccessKind::Fetch && found != kAbsent;
  if (isFetched) manifest_->updateLastAccessDate(nameOf(access.key));
  if (!isFetched || found != access.size) store(access.key, access.size);
  return found != kAbsent;
}

void GreedyDualCache::store(std::uint32_t key, std::int64_t size) {
  const std::int64_t units = (size + (std::int64_t{1} << unit_) - 1) >> unit_;
  DiskCacheItem item;
  item.key = item.filename = nameOf(key);
  item.size = static_cast<std::uint32_t>(std::min(units, kMost));
  manifest_->setItem(item);
  sizes_[key] = size;
  prune();
}

void GreedyDualCache::remove(std::uint32_t key) {
  manifest_->removeItem(nameOf(key));
  sizes_[key] = kAbsent;
}

void GreedyDualCache::prune() {
  for (const DiskCacheItem& item : manifest_->pruneToSize(limit_, std::numeric_limits<std::uint32_t>::max())) {
    sizes_[keyOf(item.key)] = kAbsent;
  }
}

}  // namespace velmora::mobile::xplat::cellar::tools
