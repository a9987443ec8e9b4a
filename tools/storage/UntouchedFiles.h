#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "FileUtils.h"

namespace velmora::mobile::xplat::cellar::tools {

// One entry of a directory, links not followed.
struct Entry {
  enum class Type { File, Directory, Link, Other };

  std::string name;
  Type type = Type::Other;
  std::uint64_t size = 0;       // bytes of a file, else 0
  std::uint64_t allocated = 0;  // bytes allocated on the disk
  std::int64_t modified = 0;    // seconds since the Unix epoch
};

// The entries of a directory by name. Reading does not change its dates, including the access date where the system
// allows that. Throws `FileUtilsIoException`. Not an error: an entry that is removed meanwhile.
std::vector<Entry> listUntouched(const std::string& directory);

// The files of a tree, listed likewise.
std::uint64_t countFiles(const std::string& directory);

// Bytes that the directory itself has allocated on the disk.
std::uint64_t allocatedBy(const std::string& path);

// The real files, read without changing their access dates where the system allows that.
class UntouchedFiles final : public FileUtils {
 public:
  std::vector<unsigned char> readFile(const std::string& path) override;
  void readPieces(const std::string& path,
                  const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) override;
};

}  // namespace velmora::mobile::xplat::cellar::tools
