#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// Where repairs move what they remove from stores: a directory beside the managers' directories, in which everything
// keeps its place. Nothing in it is ever replaced.
class Quarantine {
 public:
  // `base`: the directory of the managers' directories, or that of a store that is verified alone.
  explicit Quarantine(std::string base);

  // Moves a file, a link or a directory below the base; returns its new path. Throws `std::runtime_error`, also when a
  // link is on the way to it or to the quarantine.
  std::string take(const std::string& path) const;

  // Writes bytes into a file there, as if it had been moved from `path`; returns its path. Throws the same.
  std::string keep(const std::string& path, const std::vector<unsigned char>& bytes) const;

 private:
  const std::string base_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
