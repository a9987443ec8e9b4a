#pragma once

#include <memory>
#include <string>
#include <vector>

#include "check/ConfigurationDocument.h"

namespace velmora::mobile::xplat::cellar {
class StoreDefinition;
struct StoreManagerDefinition;
}  // namespace velmora::mobile::xplat::cellar

namespace velmora::mobile::xplat::cellar::tools {

// The parts of directory names that are not in the configuration. The defaults are those of the host kit.
struct NameTags {
  std::string versionTag;
  std::string localeFirstTag;
  std::string localeSecondTag;
  std::string sessionKey;
};

// A configuration as the library reads it, with every default filled in, in the order of the document.
struct ResolvedStore {
  std::string identifier;
  std::string pointer;  // JSON pointer into the document
  std::shared_ptr<const StoreDefinition> definition;
  std::string directory;  // its name within the manager's directory
};

struct ResolvedManager {
  std::string pointer;
  std::shared_ptr<const StoreManagerDefinition> definition;
  std::string directory;  // with the area: "caches/_store_alice"
  std::vector<ResolvedStore> stores;
};

using ResolvedConfiguration = std::vector<ResolvedManager>;

// The library must accept the document.
ResolvedConfiguration resolve(const ConfigurationDocument& document, const NameTags& tags);

// "caches", "disk_cache", "lru": as they are written in a configuration.
std::string areaName(const StoreManagerDefinition& manager);
std::string typeName(const StoreDefinition& store);

}  // namespace velmora::mobile::xplat::cellar::tools
