#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>
#include <system_error>
#include <vector>

namespace velmora::mobile::xplat::cellar::test {

// An empty directory of the test's own, gone with everything in it at the end. It knows nothing of the classes under
// test.
class TemporaryDirectory {
 public:
  TemporaryDirectory() : TemporaryDirectory(testing::TempDir()) {}
  explicit TemporaryDirectory(const std::string& parent) : path_(create(parent)) {}
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
  ~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }

  // Absolute, without a slash at the end.
  const std::string& path() const { return path_; }

  // The path of an entry, which need not exist; `name` may have several components.
  std::string file(const std::string& name) const { return path_ + "/" + name; }

  // Creates or replaces a file, and the directories above it; its path.
  std::string write(const std::string& name, const std::string& bytes) const {
    const std::string path = file(name);
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream stream(path, std::ios::binary | std::ios::trunc);
    stream.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    stream.close();
    if (!stream) throw std::runtime_error("Cannot write " + path);
    return path;
  }

  std::string read(const std::string& name) const {
    std::ifstream stream(file(name), std::ios::binary);
    if (!stream) throw std::runtime_error("Cannot read " + file(name));
    return {std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>()};
  }

  // Links count as they are: one that points nowhere exists.
  bool exists(const std::string& name) const {
    return std::filesystem::symlink_status(file(name)).type() != std::filesystem::file_type::not_found;
  }

  // The names of the entries, sorted.
  std::vector<std::string> names() const { return names("."); }

  // The names of the entries of a directory inside this one, sorted.
  std::vector<std::string> names(const std::string& directory) const {
    std::vector<std::string> found;
    for (const auto& entry : std::filesystem::directory_iterator(file(directory))) {
      found.push_back(entry.path().filename().string());
    }
    std::sort(found.begin(), found.end());
    return found;
  }

  // Creates a directory and the ones above it; its path.
  std::string makeDirectory(const std::string& name) const {
    std::filesystem::create_directories(file(name));
    return file(name);
  }

 private:
  static std::string create(const std::string& parent) {
    std::string pattern = (std::filesystem::path(parent) / "cellar-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) throw std::system_error(errno, std::generic_category(), pattern);
    return pattern;
  }

  std::string path_;
};

}  // namespace velmora::mobile::xplat::cellar::test
