#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "FileUtils.h"
#include "host/testing/PowerCut.h"
#include "support/Bytes.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {

constexpr std::uint32_t kCuts = 40;

// The files of a tree with their contents, links with "-> " and their targets, and directories with nothing.
using Tree = std::map<std::string, std::string>;

inline Tree treeOf(const TemporaryDirectory& directory) {
  Tree tree;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(directory.path())) {
    const std::string name = entry.path().lexically_relative(directory.path()).string();
    if (entry.is_symlink()) {
      tree[name] = "-> " + std::filesystem::read_symlink(entry.path()).string();
    } else {
      tree[name] = entry.is_regular_file() ? directory.read(name) : "";
    }
  }
  return tree;
}

// A long text as the lengths of its runs, "a3 b1" for "aaab"; with "." for a zero byte.
inline std::string shapeOf(std::string text) {
  std::replace(text.begin(), text.end(), '\0', '.');
  if (text.size() <= 20) return text;
  std::string shape;
  for (std::size_t begin = 0, end = 0; begin < text.size(); begin = end) {
    end = std::min(text.find_first_not_of(text[begin], begin), text.size());
    shape += (begin == 0 ? "" : " ") + std::string(1, text[begin]) + std::to_string(end - begin);
  }
  return shape;
}

// A directory whose power is cut, and looks at what is left.
class PowerCutFixture : public testing::Test {
 protected:
  std::string path(const std::string& name) const { return life_.file(name); }
  void write(const std::string& name, const std::string& text) { files_->writeFile(path(name), bytesOf(text)); }
  void sync(const std::string& name) { files_->sync(path(name)); }
  void syncDirectory() { files_->sync(life_.path()); }

  void writeSynced(const std::string& name, const std::string& text) {
    write(name, text);
    sync(name);
    syncDirectory();
  }

  Tree remains(std::uint32_t seed) const {
    const TemporaryDirectory other;
    powerCut_.cutInto(other.path(), seed);
    return treeOf(other);
  }

  std::set<Tree> allRemains(std::uint32_t cuts = kCuts) const {
    std::set<Tree> all;
    for (std::uint32_t seed = 0; seed < cuts; ++seed) all.insert(remains(seed));
    return all;
  }

  // What becomes of a file, in all cuts; "-" where it is not there.
  std::set<std::string> contentsAfter(const std::string& name, std::uint32_t cuts = kCuts) const {
    std::set<std::string> contents;
    for (const Tree& tree : allRemains(cuts)) contents.insert(tree.count(name) == 0 ? "-" : shapeOf(tree.at(name)));
    return contents;
  }

  TemporaryDirectory life_;
  PowerCut powerCut_{life_.path()};
  const std::shared_ptr<FileUtils> files_ = powerCut_.files();
};

}  // namespace velmora::mobile::xplat::cellar::test
