#pragma once

#include <string>
#include <vector>

#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

// The directory into which `cellar verify --repair` moves what it removes from stores. It is beside the managers'
// directories, where no application cleans up.
extern const char* const kQuarantineName;

// A store's directory, judged by its names.
struct StorePlace {
  std::string path;
  std::string name;          // of the directory
  bool hasManifest = false;  // a store with keys; else: an unmanaged or an empty one
};

// A manager's directory.
struct ManagerPlace {
  std::string path;
  std::string name;  // of the directory; empty if it is not a manager's
  std::string area;  // the name of the directory that contains it
  std::vector<StorePlace> stores;

  std::string directory() const;  // the name of the directory, in any case
  bool isSessionless() const;
  std::string sessionTag() const;  // empty without a session
};

// Directories that do not belong to a store.
struct OtherPlace {
  enum class Kind { Temporary, Trash, Quarantine };

  std::string path;
  Kind kind;
};

// The parts of a directory of storage.
struct Layout {
  enum class Kind { Empty, Root, Area, Manager, Store };

  Kind kind = Kind::Empty;
  std::string root;  // absolute, without links
  std::vector<ManagerPlace> managers;
  std::vector<OtherPlace> others;
  std::vector<Unreadable> unreadable;  // directories in which there may be more
};

// Finds out whether the directory is a storage root, an area, a manager or a store, and what is in it. Changes nothing.
// Throws `InputError` for a path that cannot be read or is none of these. Passes by directories below that cannot be
// read.
Layout findLayout(const std::string& path);

// The part of `path` below `root`; "." for the root itself.
std::string relativeTo(const std::string& root, const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::tools
