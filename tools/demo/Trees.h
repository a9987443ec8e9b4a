#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

struct TreeSize {
  std::uint64_t files = 0;
  std::uint64_t bytes = 0;

  TreeSize& operator+=(const TreeSize& other);
};

// What a directory tree holds, by a walk of the standard library's that shares no code with the library it is there to
// check. Counts regular files only, without the files in which the library keeps attributes. Nothing for a tree that
// is not there.
TreeSize sizeOfTree(const std::string& directory);

// The same of the values of a store with keys, which is its files but for the manifest.
TreeSize sizeOfValues(const std::string& directory);

// Files, links and directories of a tree, itself included.
std::uint64_t entriesOfTree(const std::string& directory);

bool exists(const std::string& path);

// The part of `path` below `root`, for people to read.
std::string below(const std::string& root, const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::tools
