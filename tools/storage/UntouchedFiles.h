#pragma once

#include <cstddef>
#include <cstdint>
#include <exception>
#include <functional>
#include <string>
#include <vector>

#include "FileUtils.h"
#include "LarderException.h"

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

// What is there, but could not be looked at.
struct Unreadable {
  std::string path;
  std::string reason;  // "Permission denied"
};

// Thrown for it; the description contains both.
class UnreadableException : public FileUtilsIoException {
 public:
  UnreadableException(int code, Unreadable what);
  const Unreadable& unreadable() const { return what_; }

 private:
  Unreadable what_;
};

// What an exception says of `path`, or of the path that the exception itself names.
Unreadable unreadableBy(const std::exception& error, const std::string& path);

// Empty if there is nothing of that path, or a regular file; else what there is: "a link", "not a regular file".
std::string strangenessOf(const std::string& path);

// The entries of a directory by name; a link to one is refused. Reading does not change its dates, including the access
// date where the system allows that. Throws `UnreadableException`. Not an error: an entry that is removed meanwhile.
std::vector<Entry> listUntouched(const std::string& directory);

// The files of a tree, listed likewise, but for those in directories that cannot be read.
std::uint64_t countFiles(const std::string& directory);

// Bytes that the directory itself has allocated on the disk.
std::uint64_t allocatedBy(const std::string& path);

// Of what is read into memory at once: far more than a manifest or attributes have.
constexpr std::uint64_t kLargestManifest = std::uint64_t{1} << 30U;
constexpr std::uint64_t kLargestAttributes = std::uint64_t{4} << 20U;

// The real files, read without changing their access dates where the system allows that. Only regular files are read,
// and opening never waits. Throws `UnreadableException`.
class UntouchedFiles final : public FileUtils {
 public:
  // `largest`: the most bytes that `readFile` returns; it refuses a larger file.
  explicit UntouchedFiles(std::uint64_t largest = kLargestManifest) : largest_(largest) {}

  // Refuses a link, too.
  std::vector<unsigned char> readFile(const std::string& path) override;

  // Follows links, as a store does when it reads a value.
  void readPieces(const std::string& path,
                  const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) override;

 private:
  const std::uint64_t largest_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
