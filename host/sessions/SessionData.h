#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include <cellar/StoreDefinition.h>

namespace velmora::mobile::xplat::cellar {

class FileUtils;
class StoreDirectoryNameBuilder;
class StoreDirectoryNameBuilderFactory;
class TrashCollector;
struct PathLocations;

namespace host {

// Where the directories of sessions are: with all others in the areas of the root, or, if several sessions are kept,
// in areas of their own.
//
//   caches/_store_alice                             the session with the tag "alice", one at a time
//   _cellar_accounts/of_alice/caches/_store_alice   the same, several kept
//
// Whatever the host keeps now, data is found, moved and discarded in both places. Any thread may call; what is not
// about one session that others do not use at the same time is a snapshot.
class SessionData {
 public:
  SessionData(std::string root, bool severalKept, std::shared_ptr<FileUtils> fileUtils,
              std::shared_ptr<TrashCollector> trash, std::shared_ptr<StoreDirectoryNameBuilderFactory> nameBuilders);

  // The areas of the managers without session scope, and those of a session.
  const std::shared_ptr<PathLocations>& sessionless() const { return shared_; }
  std::shared_ptr<PathLocations> locationsOf(const std::string& tag) const;

  // The directories of a manager and of one of its stores; the tag counts if the manager is session scoped.
  std::string pathOf(const StoreManagerDefinition& manager, const std::string& tag) const;
  std::string pathOf(const StoreManagerDefinition& manager, const StoreDefinition& store, const std::string& tag) const;

  // Moves the directories of a session that lie in the other place to where they are looked for now. Those that are in
  // both places stay. Throws `FileUtilsIoException`, also for a link; what was moved by then is found.
  void adopt(const std::string& tag);

  // The tags of the sessions with directories, sorted. Throws when a place cannot be read.
  std::vector<std::string> tags() const;

  // The bytes of the session's files, links not followed. What vanishes meanwhile does not count.
  std::uint64_t bytesOf(const std::string& tag) const;

  // Moves the directories of a session to the trash; whether there were any. A failure in one place does not keep the
  // others from being discarded; then it throws `FileUtilsIoException` that names what remains.
  bool discard(const std::string& tag);

 private:
  struct Place {
    std::string directory;
    std::string name;
  };

  std::shared_ptr<StoreDirectoryNameBuilder> namesOf(const StoreManagerDefinition& manager,
                                                     const std::string& tag) const;
  std::string managerName(const std::string& tag) const;
  std::string accountPath(const std::string& tag) const;
  std::vector<Place> placesOf(const std::string& tag) const;
  void removeIfEmpty(const std::string& tag);
  bool discardAt(const Place& place);
  bool holds(const Place& place) const;
  std::vector<std::string> directoriesIn(const std::string& path) const;

  const std::string accounts_;  // the directory of the sessions' own areas
  const bool severalKept_;
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<TrashCollector> trash_;
  const std::shared_ptr<StoreDirectoryNameBuilderFactory> nameBuilders_;
  const std::shared_ptr<PathLocations> shared_;
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
