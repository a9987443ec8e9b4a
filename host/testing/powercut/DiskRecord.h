#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <sys/stat.h>

#include <cellar/FileUtils.h>
#include <cellar/host/testing/powercut/TreeHistory.h>

namespace velmora::mobile::xplat::cellar::test {

// The history of a real tree of directories. It is told what is done through the two layers under which the tree is
// used, and finds out by looking what was done without them. Paths outside the tree are ignored. Not thread-safe.
class DiskRecord {
 public:
  // All that is there now is durable. Throws FileUtilsIoException if it cannot be read.
  explicit DiskRecord(const std::string& directory);

  // Whether a path leads to the root or to something below, with the links on the way to its last component followed.
  // What is there need not exist. May be called by any thread at any time.
  bool contains(const std::string& path) const { return relative(path).has_value(); }

  // Looks at an entry and at what a file contains. Null where nothing is, and outside. `observeTarget` follows a link.
  NodePtr observe(const std::string& path);
  NodePtr observeTarget(const std::string& path);

  // A file that may have been there has been emptied and written.
  void replaced(const std::string& path, const std::vector<unsigned char>& data);

  // An entry that `observe` has been told of has been renamed.
  void renamed(const std::string& from, const std::string& to);

  // A file or a directory has been synced: what it has at this moment is durable.
  void synced(const std::string& path);

  // The directory that holds an entry has been synced.
  void syncedParentOf(const std::string& path);

  // A file that SQLite has opened, from now on told of each write. Null if it is not a file of this tree.
  NodePtr openedAsDatabase(const std::string& path);

  // The file of that name is not one that outlives a power cut.
  void disregard(const std::string& path);

  // What there may be after a power cut at this moment.
  std::vector<Remains> afterPowerCut(std::uint32_t seed);

  // The root as the system knows it: absolute and without links.
  const std::string& root() const { return root_; }

 private:
  std::optional<std::string> relative(const std::string& path) const;
  NodePtr directoryOf(const std::string& path, std::string& directoryPath, std::string& name);
  NodePtr observeEntry(const NodePtr& directory, const std::string& directoryPath, const std::string& name);
  std::vector<std::string> observeEntries(const NodePtr& directory, const std::string& path);
  void syncEntries(const NodePtr& directory, const std::string& path);
  void observeTree(const NodePtr& directory, const std::string& path);
  void observeContent(Node& file, const std::string& path);

  FileUtils disk_;
  std::string root_;
  TreeHistory history_;
};

// A record that threads share.
class SharedDiskRecord {
 public:
  explicit SharedDiskRecord(const std::string& directory) : record_(directory) {}

  bool contains(const std::string& path) const { return record_.contains(path); }

  // Changes the tree and records it, with no other change and no power cut between; then calls what was set, unless
  // `operation` has thrown.
  template <class Operation> void perform(const Operation& operation) {
    std::function<void()> callback;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      operation(record_);
      callback = callback_;
    }
    if (callback) callback();
  }

  std::vector<Remains> afterPowerCut(std::uint32_t seed) {
    const std::lock_guard<std::mutex> lock(mutex_);
    return record_.afterPowerCut(seed);
  }

  const std::string& root() const { return record_.root(); }

  void setCallback(std::function<void()> callback) {
    const std::lock_guard<std::mutex> lock(mutex_);
    callback_ = std::move(callback);
  }

 private:
  std::mutex mutex_;  // guards all of it, but for the root
  DiskRecord record_;
  std::function<void()> callback_;
};

}  // namespace velmora::mobile::xplat::cellar::test
