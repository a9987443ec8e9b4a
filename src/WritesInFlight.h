#pragma once

#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

namespace velmora::mobile::xplat::cellar {

// The file writes of a store that have a provisional record in the manifest but no finished file. A removal that finds
// one for its key cannot delete a file that may not be there yet: it revokes the write, which then leaves neither file
// nor record behind. Guarded by its store's mutex.
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
    auto write = std::make_shared<Write>(Write{key});
    writes_.emplace(key, write);
    return write;
  }

  void end(const std::shared_ptr<Write>& write) {
    write->isOver = true;
    const auto range = writes_.equal_range(write->key);
    for (auto it = range.first; it != range.second; ++it) {
      if (it->second == write) {
        writes_.erase(it);
        return;
      }
    }
  }

  bool contains(const std::string& key) const { return writes_.count(key) > 0; }

  // Revokes all writes of the key. False when there are none.
  bool revoke(const std::string& key) {
    const auto range = writes_.equal_range(key);
    for (auto it = range.first; it != range.second; ++it) it->second->isRevoked = true;
    return range.first != range.second;
  }

  // All records and files have gone. Revokes the writes whose file may have been taken away under their writer.
  void loseRecords() {
    for (const auto& write : writes_) {
      write.second->hasRecord = false;
      write.second->isRevoked = write.second->isRevoked || write.second->isRunning;
    }
  }

  std::vector<std::shared_ptr<Write>> all() const {
    std::vector<std::shared_ptr<Write>> writes;
    for (const auto& write : writes_) writes.push_back(write.second);
    return writes;
  }

 private:
  std::unordered_multimap<std::string, std::shared_ptr<Write>> writes_;
};

}  // namespace velmora::mobile::xplat::cellar
