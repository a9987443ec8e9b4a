#include "demo/FileContents.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <fstream>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

Bytes beginningOf(const SourceFiles::File& file, std::uint64_t bytes) {
  Bytes contents(static_cast<std::size_t>(std::min(file.size, bytes)));
  std::ifstream in(file.path, std::ios::binary);
  in.read(reinterpret_cast<char*>(contents.data()), static_cast<std::streamsize>(contents.size()));
  contents.resize(static_cast<std::size_t>(in.gcount()));
  return contents;
}

}  // namespace

Bytes contentsOf(const SourceFiles::File& file) { return beginningOf(file, file.size); }

Bytes pictureOf(const SourceFiles::File& file, std::size_t bytes) {
  Bytes picture = beginningOf(file, bytes);
  if (picture.empty()) picture.push_back(' ');
  for (std::size_t size = picture.size(); size < bytes; size = picture.size()) {
    picture.resize(std::min(bytes, 2 * size));
    std::copy_n(picture.begin(), picture.size() - size, picture.begin() + static_cast<std::ptrdiff_t>(size));
  }
  return picture;
}

}  // namespace velmora::mobile::xplat::cellar::tools
