#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The directory that a demonstration has to itself while it runs. A directory of the user's that is neither empty nor
// marked as one of ours is never touched.
class DemoRoot {
 public:
  // Takes `path`, created if need be, and clears what an earlier demonstration left there; an empty `path` is a fresh
  // temporary directory that goes away at the end. Throws `InputError` when the directory cannot be had or belongs to
  // something else.
  explicit DemoRoot(const std::string& path);
  ~DemoRoot();
  DemoRoot(const DemoRoot&) = delete;
  DemoRoot& operator=(const DemoRoot&) = delete;

  const std::string& path() const;  // absolute
  bool isTemporary() const;

  // Throws `InputError` when `directory` lies in here, where it would be cleared.
  static void requireOutside(const std::string& root, const std::string& directory);

 private:
  void lock();
  void clear() const;

  const bool isTemporary_;
  const std::string path_;
  int lock_ = -1;  // file descriptor of the marker, locked
};

}  // namespace velmora::mobile::xplat::cellar::tools
