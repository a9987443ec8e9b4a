#include "support/Fill.h"

#include <sys/stat.h>

#include <filesystem>

#include "lower_bounds/FileLowerBound.h"
#include "lower_bounds/ManifestLowerBound.h"
#include "support/Values.h"

namespace velmora::mobile::xplat::cellar::bench {

void Manifests::copyTo(const std::string& directory, std::size_t count) {
  std::string& file = files_[count];
  if (file.empty()) {
    const std::string place = scratch_ / std::to_string(count);
    std::filesystem::create_directories(place);
    ManifestLowerBound(place).fill(count, kItemSize);
    file = place + "/manifest_v1.sqlite";
  }
  std::filesystem::create_directories(directory);
  std::filesystem::copy_file(file, directory + "/manifest_v1.sqlite");
}

void fillFiles(const std::string& directory, std::size_t count) {
  Bytes value = valueOf(Manifests::kItemSize);
  for (std::size_t number = 0; number < count; ++number) {
    stamp(value, number);
    writeFile(directory + "/" + keyOf(number), value);
  }
}

void fillTree(const std::string& directory, std::size_t count, std::size_t directories) {
  const Bytes value = valueOf(100);
  for (std::size_t number = 0; number < directories; ++number) {
    std::filesystem::create_directories(directory + "/" + std::to_string(number));
  }
  for (std::size_t number = 0; number < count; ++number) {
    writeFile(directory + "/" + std::to_string(number % directories) + "/" + keyOf(number), value);
  }
}

TreeFigures figuresOf(const std::string& directory) {
  constexpr std::uint64_t block = 512;
  TreeFigures figures{};
  for (const auto& entry : std::filesystem::recursive_directory_iterator(directory)) {
    struct stat status {};
    if (::lstat(entry.path().c_str(), &status) != 0) continue;
    figures.bytes += static_cast<std::uint64_t>(status.st_blocks) * block;
    if (!S_ISDIR(status.st_mode)) ++figures.files;
  }
  return figures;
}

}  // namespace velmora::mobile::xplat::cellar::bench
