#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Configuration.h"
#include "Durability.h"

namespace velmora::mobile::xplat::cellar::tools {

struct ManagerPlace;

// Which definition a directory belongs to. Version tag and locale come from the application and are not in the
// document, so a name matches with any of them.
struct ConfiguredStore {
  std::shared_ptr<const StoreManagerDefinition> manager;
  std::string identifier;  // empty: no store of that name is configured
  std::shared_ptr<const StoreDefinition> definition;
  bool hasItsVersion = false;  // the version in the name is the configured one
};

class ConfiguredStores {
 public:
  // Nothing is configured.
  ConfiguredStores() = default;

  // Reads the document. Throws `InputError`, naming the file, if it cannot be read or is not valid.
  explicit ConfiguredStores(const std::string& file);

  bool isEmpty() const;

  // The managers that may keep their stores in that directory. In an area that is none of the host kit's, which may be
  // any of the three: the one with the most of the directory's stores, several only if they have equally many.
  std::vector<std::shared_ptr<const StoreManagerDefinition>> managersOf(const ManagerPlace& place) const;

  // Of several matching stores, the one with the longest name.
  ConfiguredStore find(const ManagerPlace& place, const std::string& directoryName) const;

 private:
  std::vector<std::shared_ptr<const StoreManagerDefinition>> managers_;
};

// Relaxed for one without keys, which promises nothing.
Durability durabilityOf(const StoreDefinition& definition);

// "relaxed", "safe" or "synced", as it is written in a configuration.
std::string durabilityName(Durability durability);

// "thumbs_250" and 2 for "thumbs_250_v2"; the whole name and no number for one without a version.
struct VersionedName {
  std::string stem;
  std::string version;

  explicit VersionedName(const std::string& directoryName);
};

}  // namespace velmora::mobile::xplat::cellar::tools
