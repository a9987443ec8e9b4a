#include "demo/FileWriter.h"

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <system_error>
#include <vector>

#include "Progress.h"
#include "demo/FileContents.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

std::ofstream create(const std::string& path) {
  fs::create_directories(fs::path(path).parent_path());
  return std::ofstream(path, std::ios::binary | std::ios::trunc);
}

// No more than `bytes`: special file systems have files that never end.
std::uint64_t copyUpTo(std::uint64_t bytes, std::istream& in, std::ostream& out) {
  std::vector<char> buffer(std::size_t{1} << 16U);
  std::uint64_t copied = 0;
  while (copied < bytes && in) {
    in.read(buffer.data(), static_cast<std::streamsize>(std::min<std::uint64_t>(buffer.size(), bytes - copied)));
    out.write(buffer.data(), in.gcount());
    copied += static_cast<std::uint64_t>(in.gcount());
  }
  return copied;
}

void close(std::ofstream& file, const std::string& path) {
  file.close();
  if (!file) throw std::runtime_error("cannot write '" + path + "': " + std::generic_category().message(errno));
}

}  // namespace

FileWriter::FileWriter(Progress& progress) : progress_(progress) {}

TreeSize FileWriter::copy(const SourceFiles::File& file, const std::string& directory) {
  const std::string path = (fs::path(directory) / file.name).string();
  std::ifstream in(file.path, std::ios::binary);
  std::ofstream out = create(path);
  const std::uint64_t bytes = copyUpTo(file.size, in, out);
  close(out, path);
  return noted(bytes);
}

TreeSize FileWriter::render(const SourceFiles::File& file, std::size_t bytes, const std::string& path) {
  const Bytes picture = pictureOf(file, bytes);
  std::ofstream out = create(path);
  out.write(reinterpret_cast<const char*>(picture.data()), static_cast<std::streamsize>(picture.size()));
  close(out, path);
  return noted(picture.size());
}

TreeSize FileWriter::noted(std::uint64_t bytes) {
  progress_.advance(bytes);
  return {1, bytes};
}

}  // namespace velmora::mobile::xplat::cellar::tools
