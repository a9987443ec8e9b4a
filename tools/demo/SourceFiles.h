#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// The real files that the demonstration copies into its stores.
struct SourceFiles {
  // Files and bytes beyond which no more are taken.
  static constexpr std::size_t kMostFiles = 20000;
  static constexpr std::uint64_t kMostBytes = 200U << 20U;

  struct File {
    std::string path;
    std::string name;  // below the directory
    std::uint64_t size;
  };

  std::vector<File> files;
  std::uint64_t bytes = 0;
  std::uint64_t unreadable = 0;  // files and directories left out because they cannot be read
  bool isPart = false;           // there is more than was taken
};

// The readable regular files under `directory`, in the order of their names: the first ones where there are too many,
// and without the largest of these where they have too many bytes. So every run takes the same ones. Links inside it
// are not followed, and `without` (the demonstration's own directory, should it lie there) is left out. Throws
// `InputError` when the directory is missing, cannot be read or gives no files.
SourceFiles readSourceFiles(const std::string& directory, const std::string& without);

using Bytes = std::vector<unsigned char>;

// The first bytes of a file, no more than it had when it was listed: special file systems have files that never end.
// One that has become unreadable or shorter since counts as far as it can be read.
Bytes contentsOf(const SourceFiles::File& file, std::uint64_t most = std::numeric_limits<std::uint64_t>::max());

// A picture of `bytes` bytes, made by repeating the content of the file, blank when that is empty.
Bytes pictureOf(const SourceFiles::File& file, std::size_t bytes);

}  // namespace velmora::mobile::xplat::cellar::tools
