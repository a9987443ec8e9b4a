#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

#include "support/Places.h"

namespace velmora::mobile::xplat::cellar::bench {

// Databases with many records, created once and copied for each use.
class Manifests {
 public:
  static constexpr std::size_t kItemSize = 200;  // bytes of each item, by its record

  explicit Manifests(const Place& place) : scratch_(place) {}

  // Puts a manifest of the first `count` items into the directory, which need not be there. Item 0 was used first, and
  // each one a second after the one before it.
  void copyTo(const std::string& directory, std::size_t count);

 private:
  const Scratch scratch_;
  std::map<std::size_t, std::string> files_;
};

// Creates the files of the first `count` items.
void fillFiles(const std::string& directory, std::size_t count);

// Creates `count` files of 100 bytes in `directories` sub-directories.
void fillTree(const std::string& directory, std::size_t count, std::size_t directories);

// The number of files (of any kind but directories) in the tree, and the bytes that it takes on disk.
struct TreeFigures {
  std::size_t files;
  std::uint64_t bytes;
};
TreeFigures figuresOf(const std::string& directory);

}  // namespace velmora::mobile::xplat::cellar::bench
