#include "storage/Layout.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <map>
#include <system_error>

#include "InputError.h"
#include "LarderException.h"
#include "ManifestSnapshot.h"
#include "StoreManagerImplCommon.h"
#include "host/RootLock.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

const char* const kQuarantineName = "_cellar_quarantine";

namespace {

const std::string kSessionPrefix = "_store_";
const std::string kSessionless = "_sessionlessStore";
const std::string kTrash = "trash";
const std::string kAccounts = "_cellar_accounts";  // of a host that keeps several: areas of their own
constexpr std::array<const char*, 3> kAreas = {"caches", "documents", "shared"};

bool isManagerName(const std::string& name) {
  return name == kSessionless || name.compare(0, kSessionPrefix.size(), kSessionPrefix) == 0;
}

bool isAreaName(const std::string& name) { return std::find(kAreas.begin(), kAreas.end(), name) != kAreas.end(); }

std::string nameOf(const std::string& path) { return fs::path(path).filename().string(); }
std::string parentOf(const std::string& path) { return fs::path(path).parent_path().string(); }
std::string in(const std::string& directory, const std::string& name) { return (fs::path(directory) / name).string(); }

bool hasManifest(const std::string& directory) {
  std::error_code ignored;
  return fs::is_regular_file(fs::symlink_status(in(directory, ManifestSnapshot::manifestName), ignored));
}

std::string resolved(const std::string& path) {
  std::error_code error;
  const fs::path root = fs::canonical(path, error);
  if (error == std::errc::no_such_file_or_directory) throw InputError("ROOT '" + path + "' does not exist");
  if (error) throw InputError("cannot read ROOT '" + path + "': " + error.message());
  if (!fs::is_directory(root)) throw InputError("ROOT '" + path + "' is not a directory");
  return root.string();
}

class Finder {
 public:
  explicit Finder(const std::string& root) { layout_.root = root; }

  Layout find() {
    const std::string& root = layout_.root;
    if (hasManifest(root) || isManagerName(nameOf(parentOf(root)))) {
      layout_.kind = Layout::Kind::Store;
      addStoreByItself(root);
    } else if (isManagerName(nameOf(root)) || holdsManifests(root)) {
      layout_.kind = Layout::Kind::Manager;
      addManager(root);
    } else if (holdsManagers(root)) {
      layout_.kind = Layout::Kind::Area;
      addArea(root);
    } else {
      findAreas(root);
    }
    for (const auto& [path, reason] : unreadable_) layout_.unreadable.push_back({path, reason});
    return layout_;
  }

 private:
  // The root itself must be readable.
  std::vector<std::string> directoriesIn(const std::string& path) {
    std::vector<std::string> names;
    try {
      for (const Entry& entry : listUntouched(path)) {
        if (entry.type == Entry::Type::Directory) names.push_back(entry.name);
      }
    } catch (const UnreadableException& error) {
      if (path == layout_.root) throw;
      unreadable_[path] = error.unreadable().reason;
    }
    return names;
  }

  bool holdsManifests(const std::string& path) {
    const auto names = directoriesIn(path);
    return std::any_of(names.begin(), names.end(), [&](const auto& name) { return hasManifest(in(path, name)); });
  }

  bool holdsManagers(const std::string& path) {
    const auto names = directoriesIn(path);
    return std::any_of(names.begin(), names.end(), isManagerName);
  }

  void addStoreByItself(const std::string& path) {
    ManagerPlace manager;
    manager.path = parentOf(path);
    if (isManagerName(nameOf(manager.path))) manager.name = nameOf(manager.path);
    manager.area = nameOf(parentOf(manager.path));
    manager.stores.push_back({path, nameOf(path), hasManifest(path)});
    layout_.managers.push_back(manager);
  }

  void addManager(const std::string& path) {
    ManagerPlace manager;
    manager.path = path;
    if (isManagerName(nameOf(path))) manager.name = nameOf(path);
    manager.area = nameOf(parentOf(path));
    for (const std::string& name : directoriesIn(path)) {
      if (name == StoreManagerImplCommon::TemporaryDirectoryName) {
        layout_.others.push_back({in(path, name), OtherPlace::Kind::Temporary});
      } else if (name != kQuarantineName) {
        manager.stores.push_back({in(path, name), name, hasManifest(in(path, name))});
      }
    }
    layout_.managers.push_back(manager);
  }

  void addArea(const std::string& path) {
    for (const std::string& name : directoriesIn(path)) {
      if (isManagerName(name)) addManager(in(path, name));
      if (name == kQuarantineName) layout_.others.push_back({in(path, name), OtherPlace::Kind::Quarantine});
    }
  }

  // A host that was opened but not used has left only its lock file.
  static bool holdsLock(const std::string& root) {
    std::error_code ignored;
    return fs::is_regular_file(fs::symlink_status(in(root, host::RootLock::fileName), ignored));
  }

  void addAccounts(const std::string& path) {
    for (const std::string& account : directoriesIn(path)) {
      for (const std::string& area : directoriesIn(in(path, account))) addArea(in(in(path, account), area));
    }
  }

  void findAreas(const std::string& root) {
    bool isRoot = holdsLock(root);
    for (const std::string& name : directoriesIn(root)) {
      const std::string path = in(root, name);
      if (name == kTrash) {
        layout_.others.push_back({path, OtherPlace::Kind::Trash});
      } else if (name == kQuarantineName) {
        layout_.others.push_back({path, OtherPlace::Kind::Quarantine});
      } else if (name == kAccounts) {
        addAccounts(path);
      } else if (holdsManagers(path) || isAreaName(name)) {
        isRoot = true;
        addArea(path);
      }
    }
    layout_.kind = isRoot ? Layout::Kind::Root : Layout::Kind::Empty;
    if (isRoot || listUntouched(root).empty()) return;
    if (!unreadable_.empty()) {
      throw InputError("cannot read '" + unreadable_.begin()->first + "': " + unreadable_.begin()->second);
    }
    throw InputError("ROOT '" + root + "' is not a storage root or a part of one: there is no manager's directory (" +
                     kSessionless + ", " + kSessionPrefix + "...) in it or one level below, and no " +
                     ManifestSnapshot::manifestName);
  }

  Layout layout_;
  std::map<std::string, std::string> unreadable_;  // the reason by path: a directory may be listed more than once
};

}  // namespace

std::string ManagerPlace::directory() const { return nameOf(path); }

bool ManagerPlace::isSessionless() const { return name == kSessionless; }

std::string ManagerPlace::sessionTag() const {
  return name.empty() || isSessionless() ? "" : name.substr(kSessionPrefix.size());
}

Layout findLayout(const std::string& path) {
  const std::string root = resolved(path);
  try {
    return Finder(root).find();
  } catch (const FileUtilsIoException& error) {
    throw InputError(error.description());
  }
}

std::string relativeTo(const std::string& root, const std::string& path) {
  return fs::path(path).lexically_relative(root).string();
}

}  // namespace velmora::mobile::xplat::cellar::tools
