#pragma once

#include <string>

#include <cellar/Export.h>
#include <cellar/PathLocations.h>

namespace velmora::mobile::xplat::cellar::host {

// Every area is a directory of one root: "caches", "documents" and "shared". Creates nothing. Immutable; any thread.
//
// The session key is ignored: the directories of all sessions are in the same area, under different names, so that the
// manager of a new session finds those of the old ones and removes them.
class CELLAR_EXPORT DirectoryPathLocations : public PathLocations {
 public:
  // An empty root is the working directory.
  explicit DirectoryPathLocations(std::string root);
  ~DirectoryPathLocations() override;

  // Throws `std::invalid_argument` for a value that is not an area.
  std::string pathForArea(Area area, const std::string& sessionKey) override;

 private:
  const std::string root_;
};

}  // namespace velmora::mobile::xplat::cellar::host
