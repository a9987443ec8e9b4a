#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "DiskCacheItem.h"

namespace velmora::mobile::xplat::cellar {

// What a key has when the writes in flight are left out of account: the record of its last finished value, or none.
struct SettledValue {
  std::unique_ptr<DiskCacheItem> record;
  std::vector<unsigned char> inlineData{};  // of a record that has some
  bool isUnknown = false;                   // the manifest did not tell: what lies in the key's place is the value
  bool isReplaced = false;                  // by the record of a write that was dropped since
  bool hasStrayFile = false;  // a file may lie in the key's place that has no record any more: to be deleted

  static SettledValue lost() { return {nullptr, {}, false, false, true}; }
  bool isPlainMiss() const { return record == nullptr && !isUnknown && !hasStrayFile; }
};

// The file writes of a store that have a provisional record in the manifest but no finished file, and what their keys
// go back to if none of them comes about. A removal that finds a write for its key cannot delete a file that may not be
// there yet: it revokes the write, which then leaves neither file nor record behind. Called with the store's mutex
// held, all but `start`, so that a write need not wait for the manifest before it begins.
class WritesInFlight {
 public:
  struct Write {
    const std::string key;
    bool hasRecord = true;   // the provisional one
    bool isRunning = false;  // the writer has been called
    bool isRevoked = false;
    bool isOver = false;
  };

  // `settled` counts for the first write in flight of a key only: the next ones find a provisional record.
  std::shared_ptr<Write> begin(const std::string& key, SettledValue settled) {
    const std::lock_guard<std::mutex> lock(mutex_);
    auto write = std::make_shared<Write>(Write{key});
    if (!settled.isPlainMiss() && writes_.count(key) == 0) settled_[key] = std::move(settled);
    writes_.emplace(key, write);
    return write;
  }

  // The writer may be called now. False when the write has been revoked.
  bool start(Write& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    write.isRunning = !write.isRevoked;
    return write.isRunning;
  }

  // The write has come about. True when another write of its key is in flight.
  bool end(const std::shared_ptr<Write>& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (!erase(write)) return false;
    if (writes_.count(write->key) > 0) return true;
    settled_.erase(write->key);
    return false;
  }

  // What the key goes back to from now on, if it is in flight.
  void settle(const std::string& key, SettledValue settled) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (writes_.count(key) > 0) settled_[key] = std::move(settled);
  }

  // The write will not come about, or was revoked. What its key goes back to; empty when that is not due, because
  // another write of the key is in flight or this one is over.
  std::optional<SettledValue> drop(const std::shared_ptr<Write>& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (!erase(write)) return std::nullopt;
    if (writes_.count(write->key) > 0) {
      settled_[write->key].isReplaced = true;
      return std::nullopt;
    }
    const auto settled = settled_.find(write->key);
    if (settled == settled_.end()) return SettledValue();
    SettledValue result = std::move(settled->second);
    settled_.erase(settled);
    return result;
  }

  // Drops all writes. What each of their keys goes back to.
  std::unordered_map<std::string, SettledValue> dropAll() {
    const std::lock_guard<std::mutex> lock(mutex_);
    auto settled = std::exchange(settled_, {});
    for (const auto& [key, write] : writes_) {
      write->isOver = true;
      settled.try_emplace(key);
    }
    writes_.clear();
    return settled;
  }

  bool contains(const std::string& key) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return writes_.count(key) > 0;
  }

  // Revokes all writes of the key, and with them what it would go back to. False when there are none.
  bool revoke(const std::string& key) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto range = writes_.equal_range(key);
    for (auto it = range.first; it != range.second; ++it) it->second->isRevoked = true;
    if (range.first == range.second) return false;
    settled_[key] = SettledValue::lost();
    return true;
  }

  // No write starts as long as the answer lives.
  std::unique_lock<std::mutex> holdStarts() const { return std::unique_lock<std::mutex>(mutex_); }

  // All records and files are gone. Revokes the writes whose file was taken away under their writer.
  void loseRecords(const std::unique_lock<std::mutex>& /*startsAreHeld*/) {
    settled_.clear();
    for (const auto& write : writes_) {
      write.second->hasRecord = false;
      write.second->isRevoked = write.second->isRevoked || write.second->isRunning;
    }
  }

  // Each key once.
  std::vector<std::string> keys() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::string> keys;
    for (auto it = writes_.begin(); it != writes_.end(); it = writes_.equal_range(it->first).second) {
      keys.push_back(it->first);
    }
    return keys;
  }

 private:
  bool erase(const std::shared_ptr<Write>& write) {
    write->isOver = true;
    const auto range = writes_.equal_range(write->key);
    for (auto it = range.first; it != range.second; ++it) {
      if (it->second != write) continue;
      writes_.erase(it);
      return true;
    }
    return false;
  }

  mutable std::mutex mutex_;  // taken after the store's; guards the two below
  std::unordered_multimap<std::string, std::shared_ptr<Write>> writes_;
  std::unordered_map<std::string, SettledValue>
      settled_;  // of keys in flight; those that go back to nothing are left out
};

}  // namespace velmora::mobile::xplat::cellar
