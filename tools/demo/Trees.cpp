#include "demo/Trees.h"

#include <filesystem>
#include <iterator>

#include "AttributeStore.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

TreeSize& TreeSize::operator+=(const TreeSize& other) {
  files += other.files;
  bytes += other.bytes;
  return *this;
}

namespace {

template <class Predicate> TreeSize sizeOfFiles(const std::string& directory, const Predicate& counts) {
  TreeSize size;
  if (!fs::exists(directory)) return size;
  for (const fs::directory_entry& entry : fs::recursive_directory_iterator(directory)) {
    if (entry.is_symlink() || !entry.is_regular_file()) continue;
    const std::string name = entry.path().filename().string();
    if (name == AttributeStore::fileName || !counts(name)) continue;
    size += {1, entry.file_size()};
  }
  return size;
}

}  // namespace

TreeSize sizeOfTree(const std::string& directory) {
  return sizeOfFiles(directory, [](const std::string& /*name*/) { return true; });
}

TreeSize sizeOfValues(const std::string& directory) {
  return sizeOfFiles(directory, [](const std::string& name) { return name.rfind("manifest_v1.sqlite", 0) != 0; });
}

std::uint64_t entriesOfTree(const std::string& directory) {
  const fs::recursive_directory_iterator entries(directory);
  return 1 + static_cast<std::uint64_t>(std::distance(begin(entries), end(entries)));
}

bool exists(const std::string& path) { return fs::exists(fs::symlink_status(path)); }

std::string below(const std::string& root, const std::string& path) {
  return fs::path(path).lexically_relative(root).string();
}

}  // namespace velmora::mobile::xplat::cellar::tools
