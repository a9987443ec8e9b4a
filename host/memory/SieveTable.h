#pragma once

#include <cstddef>
#include <string>
#include <unordered_map>

#include "host/MemoryTier.h"

namespace velmora::mobile::xplat::cellar::host {

// The values that a memory tier keeps, at most so many bytes. SIEVE decides which one goes: entries stand in the order
// in which they came, a hit only marks its entry, and a hand that moves from the oldest to the newest removes the first
// one without a mark and takes the marks of those that it passes. Not thread-safe.
class SieveTable {
 public:
  using Value = MemoryTier::Value;

  explicit SieveTable(std::size_t maxBytes) : maxBytes_(maxBytes) {}

  // Null when it is not there.
  Value find(const std::string& key);

  // Replaces what the key has; only removes it when the value is too large to be kept.
  void put(const std::string& key, Value value);

  void erase(const std::string& key) { erase(entries_.find(key)); }

  // Evicts until at most so many bytes are left.
  void trim(std::size_t bytes);

  void clear();

  std::size_t size() const { return entries_.size(); }
  std::size_t bytes() const { return bytes_; }

 private:
  struct Entry {
    const std::string* key = nullptr;
    Value value;
    std::size_t cost = 0;  // bytes
    bool isVisited = false;
    Entry* newer = nullptr;
    Entry* older = nullptr;
  };
  using Entries = std::unordered_map<std::string, Entry>;

  void replace(Entries::iterator found, Value value, std::size_t cost);
  void add(const std::string& key, Value value, std::size_t cost);
  void evict();
  void erase(Entries::iterator found);

  const std::size_t maxBytes_;
  Entries entries_;
  Entry* newest_ = nullptr;
  Entry* oldest_ = nullptr;
  Entry* hand_ = nullptr;  // where the next eviction begins; null: at the oldest
  std::size_t bytes_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::host
