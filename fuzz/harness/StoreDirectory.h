#pragma once

#include <string>
#include <vector>

#include "harness/ByteReader.h"
#include "harness/Scratch.h"

namespace velmora::mobile::xplat::cellar::fuzz {

// What an input put into a store's directory before the store was opened.
struct StoreDirectory {
  std::string path;
  std::vector<std::string> names;  // of files, directories and links, and the keys of planted records
  bool isSound = true;             // the manifest, if there is one, is sound
  bool namesAgree = true;          // and each of its records has a file named after its key
};

// Builds the directory from the input:
//
//   a count of entries (one byte, 16 at most), then for each a kind (one byte) and
//   0, 1  a file: name, content            2  a directory: name          3  a link to a place outside: name
//   4     the manifest's bytes             5  the attributes' bytes      6  a companion of the manifest: which, bytes
//   7     a record in the manifest: key, filename, size, inline or not, value, two dates, metadata, each of any type
StoreDirectory buildStoreDirectory(const Scratch& scratch, ByteReader& input);

}  // namespace velmora::mobile::xplat::cellar::fuzz
