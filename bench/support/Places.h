#pragma once

#include <cstddef>
#include <string>

namespace velmora::mobile::xplat::cellar::bench {

// A directory to measure in, and the file system that tables name for it.
struct Place {
  std::string name;
  std::string directory;
};

// Writes out what the file system of `path` still holds in memory, so that what comes next does not wait for it.
void settle(const std::string& path);

// An empty directory on a settled file system; the destructor removes it with its contents.
class Scratch {
 public:
  explicit Scratch(const Place& place);
  ~Scratch();
  Scratch(const Scratch&) = delete;
  Scratch& operator=(const Scratch&) = delete;

  const std::string& path() const { return path_; }
  std::string operator/(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// Writes files of `bytes` bytes in total and deletes them again, for the reason that `warmMemory` has: the system takes
// the memory for files from other places.
void warmFiles(const Place& place, std::size_t bytes);

// Keeps this thread, and every thread that it starts meanwhile, on one processor.
class Pinned {
 public:
  explicit Pinned(bool pinned);
  ~Pinned();
  Pinned(const Pinned&) = delete;
  Pinned& operator=(const Pinned&) = delete;

 private:
  bool pinned_;
};

// What tables call the two.
inline std::string cpuName(bool pinned) { return pinned ? "one CPU" : "all CPUs"; }

}  // namespace velmora::mobile::xplat::cellar::bench
