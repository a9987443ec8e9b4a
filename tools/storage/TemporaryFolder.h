#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// An empty directory of the program's own, where the system keeps such things, gone with everything in it at the end.
// Throws `InputError` when it cannot be made.
class TemporaryFolder {
 public:
  TemporaryFolder();
  ~TemporaryFolder();
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;

  const std::string& path() const { return path_; }

 private:
  const std::string path_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
