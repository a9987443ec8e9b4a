#include "host/sessions/SessionData.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <set>
#include <utility>

#include "FileUtils.h"
#include "LarderException.h"
#include "StoreDirectoryNameBuilder.h"
#include "TrashCollector.h"
#include "host/DirectoryPathLocations.h"
#include "host/sessions/BytesBelow.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr std::array<Area, 3> kAreas = {Area::Caches, Area::Documents, Area::Shared};

const std::string kAccountPrefix = "of_";  // before a tag, which may be empty

}  // namespace

SessionData::SessionData(std::string root, bool severalKept, std::shared_ptr<FileUtils> fileUtils,
                         std::shared_ptr<TrashCollector> trash,
                         std::shared_ptr<StoreDirectoryNameBuilderFactory> nameBuilders)
    : accounts_(fileUtils->combinePath(root, "_cellar_accounts")),
      severalKept_(severalKept),
      fileUtils_(std::move(fileUtils)),
      trash_(std::move(trash)),
      nameBuilders_(std::move(nameBuilders)),
      shared_(std::make_shared<DirectoryPathLocations>(std::move(root))) {}

std::string SessionData::managerName(const std::string& tag) const {
  return nameBuilders_->createStoreDirectoryNameBuilder(tag)->buildStoreManagerName();
}

std::string SessionData::accountPath(const std::string& tag) const {
  return fileUtils_->combinePath(accounts_, kAccountPrefix + tag);
}

std::shared_ptr<PathLocations> SessionData::locationsOf(const std::string& tag) const {
  return severalKept_ ? std::make_shared<DirectoryPathLocations>(accountPath(tag)) : shared_;
}

std::shared_ptr<StoreDirectoryNameBuilder> SessionData::namesOf(const StoreManagerDefinition& manager,
                                                                const std::string& tag) const {
  return manager.sessionScoped ? nameBuilders_->createStoreDirectoryNameBuilder(tag)
                               : nameBuilders_->createStoreDirectoryNameBuilder();
}

std::string SessionData::pathOf(const StoreManagerDefinition& manager, const std::string& tag) const {
  const auto locations = manager.sessionScoped ? locationsOf(tag) : shared_;
  const std::string area = locations->pathForArea(manager.area, "");
  return fileUtils_->combinePath(area, namesOf(manager, tag)->buildStoreManagerName());
}

std::string SessionData::pathOf(const StoreManagerDefinition& manager, const StoreDefinition& store,
                                const std::string& tag) const {
  return fileUtils_->combinePath(pathOf(manager, tag), namesOf(manager, tag)->buildStoreName(store));
}

void SessionData::adopt(const std::string& tag) {
  if (!severalKept_ && !fileUtils_->pathExists(accounts_)) return;
  const std::string name = managerName(tag);
  DirectoryPathLocations account(accountPath(tag));
  PathLocations& from = severalKept_ ? *shared_ : account;
  PathLocations& to = severalKept_ ? account : *shared_;
  for (const Area area : kAreas) {
    const std::string source = fileUtils_->combinePath(from.pathForArea(area, ""), name);
    const std::string target = to.pathForArea(area, "");
    if (!fileUtils_->isDirectory(source) || holds({target, name})) continue;
    // Elsewhere a relative link would lead to another place, or nowhere.
    if (fileUtils_->isSymLink(source)) throw FileUtilsIoException(0, "could not move the link \"" + source + "\"");
    fileUtils_->createDirectory(target, true);
    fileUtils_->rename(source, fileUtils_->combinePath(target, name));
  }
  if (!severalKept_) removeIfEmpty(tag);
}

// What remains of an account whose data has been moved out of it.
void SessionData::removeIfEmpty(const std::string& tag) {
  DirectoryPathLocations account(accountPath(tag));
  std::vector<std::string> emptied;
  emptied.reserve(kAreas.size() + 1);
  for (const Area area : kAreas) emptied.push_back(account.pathForArea(area, ""));
  emptied.push_back(accountPath(tag));
  for (const std::string& path : emptied) {
    try {
      if (fileUtils_->isDirectory(path)) fileUtils_->deleteFile(path);
    } catch (const FileUtilsIoException&) {
      // It is not empty.
    }
  }
}

std::vector<std::string> SessionData::tags() const {
  const auto names = nameBuilders_->createStoreDirectoryNameBuilder("");
  const std::size_t prefix = names->buildStoreManagerName().size();
  std::set<std::string> tags;
  for (const Area area : kAreas) {
    const auto directories = directoriesIn(shared_->pathForArea(area, ""));
    for (const std::string& name : names->filterStoreManagerNames({}, directories)) tags.insert(name.substr(prefix));
  }
  for (const std::string& name : directoriesIn(accounts_)) {
    if (name.rfind(kAccountPrefix, 0) == 0) tags.insert(name.substr(kAccountPrefix.size()));
  }
  return {tags.begin(), tags.end()};
}

std::vector<SessionData::Place> SessionData::placesOf(const std::string& tag) const {
  std::vector<Place> places;
  places.reserve(kAreas.size() + 1);
  for (const Area area : kAreas) places.push_back({shared_->pathForArea(area, ""), managerName(tag)});
  places.push_back({accounts_, kAccountPrefix + tag});
  return places;
}

std::uint64_t SessionData::bytesOf(const std::string& tag) const {
  std::uint64_t bytes = 0;
  for (const Place& place : placesOf(tag)) {
    bytes += bytesBelow(*fileUtils_, fileUtils_->combinePath(place.directory, place.name));
  }
  return bytes;
}

bool SessionData::discard(const std::string& tag) {
  bool isFound = false;
  std::string remaining;
  for (const Place& place : placesOf(tag)) {
    try {
      if (discardAt(place)) isFound = true;
    } catch (const FileUtilsIoException& error) {
      remaining += (remaining.empty() ? "" : "; ") + std::string(error.description());
    }
  }
  if (!remaining.empty()) throw FileUtilsIoException(0, "Data of the session remains: " + remaining);
  return isFound;
}

// Whether there was anything. Checks again afterwards: a store that is being created in the background may have created
// its directory again.
bool SessionData::discardAt(const Place& place) {
  const std::string path = fileUtils_->combinePath(place.directory, place.name);
  int attempts = 0;
  for (; holds(place); ++attempts) {
    if (attempts == 2) throw FileUtilsIoException(0, "could not move \"" + path + "\" to the trash");
    trash_->collectPath(path);
  }
  return attempts > 0;
}

// Listing reports a place that cannot be read, but not on every file system which entries are directories.
bool SessionData::holds(const Place& place) const {
  const auto names = directoriesIn(place.directory);
  return std::find(names.begin(), names.end(), place.name) != names.end() ||
         fileUtils_->pathExists(fileUtils_->combinePath(place.directory, place.name));
}

// The names of its directories and links (which may point to directories). None if it does not exist yet.
std::vector<std::string> SessionData::directoriesIn(const std::string& path) const {
  std::vector<std::string> names;
  try {
    for (const FileUtils::Info& entry : fileUtils_->listDirectory(path)) {
      if (entry.type != FileUtils::Type::File) names.push_back(fileUtils_->basename(entry.path));
    }
  } catch (const FileUtilsIoException& error) {
    if (error.code() != ENOENT && error.code() != ENOTDIR) {
      throw FileUtilsIoException(error.code(), "could not read \"" + path + "\": " + error.description());
    }
  }
  return names;
}

}  // namespace velmora::mobile::xplat::cellar::host
