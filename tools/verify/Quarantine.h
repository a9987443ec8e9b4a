#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// Where repairs put what they take out of stores: a directory beside the managers' directories, in which everything
// keeps its place. Nothing in it is ever replaced.
class Quarantine {
 public:
  // `base`: the directory that holds the managers', or a store's that stands by itself.
  explicit Quarantine(std::string base);

  // Moves a file or directory that lies somewhere below the base; where it is now. Throws
  // `std::filesystem::filesystem_error`.
  std::string take(const std::string& path) const;

 private:
  const std::string base_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
