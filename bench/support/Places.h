#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::bench {

// A directory to measure in, and the file system that tables name for it.
struct Place {
  std::string name;
  std::string directory;
};

// An empty directory that goes away with everything in it.
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
