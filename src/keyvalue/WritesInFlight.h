#pragma once

#include <atomic>
#include <cstdint>
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
// held, all but `claim`, so that a write need not wait for the manifest before it begins.
class WritesInFlight {
 public:
  //   New --begin--> Queued --claim--> Writing ----> Done
  //                    |                  |           ^
  //                  revoke             revoke        |
  //                    v                  v           |
  //                 Revoked --claim--> Discarded -----+
  //
  // and from each of them but New to Done when the write fails or its queue drops it.
  enum class State : std::uint8_t {
    New,        // has no record yet
    Queued,     // has a provisional record, and is among the writes in flight
    Revoked,    // the same, but its writer will not be called
    Writing,    // the writer is called, or was
    Discarded,  // what lies in its place has to be deleted
    Done        // is not among the writes in flight any more
  };

  struct Write {
    const std::string key;
    std::atomic<State> state{State::New};
    bool hasRecord = true;  // the provisional one

    explicit Write(std::string key_) : key(std::move(key_)) {}

    // By a task of the file queue: its own, or that of an earlier write.
    bool isClaimed() const { return state != State::New && state != State::Queued && state != State::Revoked; }
  };

  // The write has its provisional record. `settled` counts for the first write in flight of a key only: the next ones
  // find a provisional record.
  void begin(Write& write, SettledValue settled) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (!settled.isPlainMiss() && writes_.count(write.key) == 0) settled_[write.key] = std::move(settled);
    writes_.emplace(write.key, &write);
    write.state = State::Queued;
  }

  // Takes the write for the caller, who is to run its writer unless it was discarded. False when it is somebody else's
  // already.
  bool claim(Write& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    switch (write.state) {
      case State::New:
        return true;
      case State::Queued:
        write.state = State::Writing;
        return true;
      case State::Revoked:
        write.state = State::Discarded;
        return true;
      default:
        return false;
    }
  }

  // The write has come about. True when another write of its key is in flight.
  bool end(Write& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (!erase(write)) return false;
    if (writes_.count(write.key) > 0) return true;
    settled_.erase(write.key);
    return false;
  }

  // What the key goes back to from now on, if it is in flight.
  void settle(const std::string& key, SettledValue settled) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (writes_.count(key) > 0) settled_[key] = std::move(settled);
  }

  // The write will not come about, or was revoked. What its key goes back to; empty when that is not due, because
  // another write of the key is in flight or this one is over.
  std::optional<SettledValue> drop(Write& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (!erase(write)) return std::nullopt;
    if (writes_.count(write.key) > 0) {
      settled_[write.key].isReplaced = true;
      return std::nullopt;
    }
    const auto settled = settled_.find(write.key);
    if (settled == settled_.end()) return SettledValue();
    SettledValue result = std::move(settled->second);
    settled_.erase(settled);
    return result;
  }

  // Drops all writes. What each of their keys goes back to.
  std::unordered_map<std::string, SettledValue> dropAll() {
    const std::lock_guard<std::mutex> lock(mutex_);
    auto settled = std::exchange(settled_, {});
    for (const auto& [key, write] : writes_) settled.try_emplace(key);
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
    if (range.first == range.second) return false;
    for (auto it = range.first; it != range.second; ++it) {
      Write& write = *it->second;
      if (write.state == State::Queued) write.state = State::Revoked;
      if (write.state == State::Writing) write.state = State::Discarded;
    }
    settled_[key] = SettledValue::lost();
    return true;
  }

  // No write is claimed as long as the result lives.
  std::unique_lock<std::mutex> holdClaims() const { return std::unique_lock<std::mutex>(mutex_); }

  // All records and files are gone. Discards the writes whose file was taken away under their writer.
  void detachRecords(const std::unique_lock<std::mutex>& /*claimsAreHeld*/) {
    settled_.clear();
    for (const auto& [key, write] : writes_) {
      write->hasRecord = false;
      if (write->state == State::Writing) write->state = State::Discarded;
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
  bool erase(Write& write) {
    const auto range = writes_.equal_range(write.key);
    for (auto it = range.first; it != range.second; ++it) {
      if (it->second != &write) continue;
      writes_.erase(it);
      write.state = State::Done;
      return true;
    }
    return false;
  }

  mutable std::mutex mutex_;                             // guards the two below, and `state` and `hasRecord` of writes
  std::unordered_multimap<std::string, Write*> writes_;  // each leaves before it is destroyed
  std::unordered_map<std::string, SettledValue> settled_;  // without the keys that go back to nothing
};

}  // namespace velmora::mobile::xplat::cellar
