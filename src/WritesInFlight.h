#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

namespace velmora::mobile::xplat::cellar {

// The file writes of a store that have a provisional record in the manifest but no finished file. A removal that finds
// one for its key cannot delete a file that may not be there yet: it revokes the write, which then leaves neither file
// nor record behind. Called with the store's mutex held, all but `start`, so that a write need not wait for the
// manifest before it begins.
class WritesInFlight {
 public:
  struct Write {
    const std::string key;
    bool hasRecord = true;   // the provisional one
    bool isRunning = false;  // the writer has been called
    bool isRevoked = false;
    bool isOver = false;
  };

  std::shared_ptr<Write> begin(const std::string& key) {
    const std::lock_guard<std::mutex> lock(mutex_);
    auto write = std::make_shared<Write>(Write{key});
    writes_.emplace(key, write);
    return write;
  }

  // The writer may be called now. False when the write has been revoked.
  bool start(Write& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    write.isRunning = !write.isRevoked;
    return write.isRunning;
  }

  void end(const std::shared_ptr<Write>& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    write->isOver = true;
    const auto range = writes_.equal_range(write->key);
    for (auto it = range.first; it != range.second; ++it) {
      if (it->second == write) {
        writes_.erase(it);
        return;
      }
    }
  }

  bool contains(const std::string& key) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return writes_.count(key) > 0;
  }

  // Revokes all writes of the key. False when there are none.
  bool revoke(const std::string& key) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto range = writes_.equal_range(key);
    for (auto it = range.first; it != range.second; ++it) it->second->isRevoked = true;
    return range.first != range.second;
  }

  void revoke(Write& write) {
    const std::lock_guard<std::mutex> lock(mutex_);
    write.isRevoked = true;
  }

  // All records and files are about to go. Revokes the writes whose file may be taken away under their writer; no other
  // starts as long as the answer lives.
  std::unique_lock<std::mutex> loseRecords() {
    std::unique_lock<std::mutex> lock(mutex_);
    for (const auto& write : writes_) {
      write.second->hasRecord = false;
      write.second->isRevoked = write.second->isRevoked || write.second->isRunning;
    }
    return lock;
  }

  std::vector<std::shared_ptr<Write>> all() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::shared_ptr<Write>> writes;
    for (const auto& write : writes_) writes.push_back(write.second);
    return writes;
  }

 private:
  mutable std::mutex mutex_;  // taken after the store's
  std::unordered_multimap<std::string, std::shared_ptr<Write>> writes_;
};

}  // namespace velmora::mobile::xplat::cellar
