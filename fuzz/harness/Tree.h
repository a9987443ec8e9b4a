#pragma once

#include <map>
#include <string>
#include <utility>

namespace velmora::mobile::xplat::cellar::fuzz {

using FileNumber = unsigned long long;  // a file keeps it when it is renamed

// An entry of a tree, links not followed.
struct TreeEntry {
  FileNumber number = 0;
  bool isFile = false;  // a regular one
  std::string content;  // bytes, or where a link leads to
  std::string dates;    // of the last access, but for links, and of the last change

  bool operator==(const TreeEntry& other) const;
};

using Tree = std::map<std::string, TreeEntry>;  // by path below the directory

// Everything below a directory, which keeps its dates. Those are long past, so that an access would change them.
Tree treeOf(const std::string& directory);

// Whether what is below a part of the tree is as it was.
void checkUnchanged(const Tree& before, const Tree& now, const std::string& part, const char* law);

// Sets all dates below to one that is long past.
void makeOld(const std::string& directory);

// Gives its owner every right on everything below.
void makeReadable(const std::string& directory);

// From now on even the superuser cannot read what nobody may read.
void obeyPermissions();

}  // namespace velmora::mobile::xplat::cellar::fuzz
