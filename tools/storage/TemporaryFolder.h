#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// An empty temporary directory, removed with its contents by the destructor. Its name begins with `name`. Throws
// `InputError` if it cannot be created.
class TemporaryFolder {
 public:
  explicit TemporaryFolder(const std::string& name = "cellar");
  ~TemporaryFolder();
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;

  const std::string& path() const { return path_; }

 private:
  const std::string path_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
