#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// The directory in which `cellar verify --repair` keeps what it takes out of stores. It stands beside the managers'
// directories, where no clean-up of an application comes by.
extern const char* const kQuarantineName;

// A store's directory, as far as its names tell.
struct StorePlace {
  std::string path;
  std::string name;          // of the directory
  bool hasManifest = false;  // a store with keys; without: an unmanaged one, or one that is empty
};

// A manager's directory.
struct ManagerPlace {
  std::string path;
  std::string name;  // of the directory; empty when it is none that a manager would have
  std::string area;  // the name of the directory that it stands in
  std::vector<StorePlace> stores;

  std::string directory() const;  // the name of the directory, whatever it is
  bool isSessionless() const;
  std::string sessionTag() const;  // empty without a session
};

// What belongs to no store.
struct OtherPlace {
  enum class Kind { Temporary, Trash, Quarantine };

  std::string path;
  Kind kind;
};

// What a directory of storage consists of.
struct Layout {
  enum class Kind { Empty, Root, Area, Manager, Store };

  Kind kind = Kind::Empty;
  std::string root;  // absolute, without links
  std::vector<ManagerPlace> managers;
  std::vector<OtherPlace> others;
};

// Finds out which depth of a storage root the directory is, and what is in it. Touches nothing. Throws `InputError` for
// a path that cannot be read or is nothing of the kind.
Layout findLayout(const std::string& path);

// The part of `path` below `root`; "." for the root itself.
std::string relativeTo(const std::string& root, const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::tools
