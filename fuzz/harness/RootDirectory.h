#pragma once

#include <set>
#include <string>
#include <vector>

#include "harness/ByteReader.h"
#include "harness/Scratch.h"
#include "harness/Tree.h"

namespace velmora::mobile::xplat::cellar::fuzz {

// What an input has put into a storage root.
struct RootDirectory {
  std::string path;
  std::string outside;                  // where links lead to
  std::vector<std::string> unreadable;  // paths of what nobody is to be able to read; as yet everybody can
  bool hasHardLinks = false;            // to files outside
};

// The key of the one record in the manifest outside.
extern const std::string kKeyOutside;

// Builds the root from the input:
//
//   a count of entries (one byte, 32 at most), then for each a kind and a directory (one byte each), and
//   0  a file: name, bytes                  1  a directory: name           2  a link: name, target (one byte)
//   3  a fifo: name                         4  a hard link to a file outside: name, target (one byte)
//   5  records, most of them with files: see `addRecords`                  6  one of some statements, run on the
//   manifest 7  damage to a file: name, kind (one byte), place (two bytes)          8  a file or directory that cannot
//   be read: name
//
// A directory is one of those that a host makes; with the high bit, one in it: name. A name is one of those that
// mean something, or a text.
RootDirectory buildRoot(const Scratch& scratch, ByteReader& input);

// The files that are named by the records of manifests in which SQLite finds nothing wrong. Looks at copies of these.
std::set<FileNumber> filesOfSoundRecords(const Scratch& scratch, const Tree& tree);

}  // namespace velmora::mobile::xplat::cellar::fuzz
