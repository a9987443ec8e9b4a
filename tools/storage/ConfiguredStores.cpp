#include "storage/ConfiguredStores.h"

#include <algorithm>
#include <array>
#include <exception>

#include "InputError.h"
#include "JsonValue.h"
#include "TextFile.h"
#include "storage/Layout.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::array<const char*, 3> kAreaNames = {"caches", "documents", "shared"};

bool isDigit(char character) { return character >= '0' && character <= '9'; }

// An area of another name belongs to a host with its own locations, and may be any of them.
bool isForeignArea(const std::string& directoryName) {
  return std::find(kAreaNames.begin(), kAreaNames.end(), directoryName) == kAreaNames.end();
}

bool isArea(const std::string& directoryName, Area area) {
  return isForeignArea(directoryName) || kAreaNames.at(static_cast<std::size_t>(area)) == directoryName;
}

// Whether the part of a name between the store's name and its version is the expected locale and version tag: "_en_US",
// "_250", "_en_US_250".
bool fits(const std::string& middle, const StoreDefinition& store) {
  const auto parts = std::count(middle.begin(), middle.end(), '_');
  const int needed = (store.localeSensitive ? 2 : 0) + (store.hasVersion ? 0 : 1);
  if (needed == 0) return middle.empty();
  return parts >= needed && middle.front() == '_';
}

bool fits(const VersionedName& name, const StoreDefinition& store) {
  if (name.version.empty() || name.stem.compare(0, store.name.size(), store.name) != 0) return false;
  return fits(name.stem.substr(store.name.size()), store);
}

using Managers = std::vector<std::shared_ptr<const StoreManagerDefinition>>;

// Of its stores, those that are in the directory.
std::size_t storesAt(const ManagerPlace& place, const StoreManagerDefinition& manager) {
  const auto isThere = [&](const auto& configured) {
    return std::any_of(place.stores.begin(), place.stores.end(), [&](const StorePlace& store) {
      const VersionedName name(store.name);
      return fits(name, *configured.second) && name.version == std::to_string(configured.second->version);
    });
  };
  return static_cast<std::size_t>(std::count_if(manager.stores.begin(), manager.stores.end(), isThere));
}

Managers thoseWithMostStores(const Managers& managers, const ManagerPlace& place) {
  std::size_t most = 0;
  for (const auto& manager : managers) most = std::max(most, storesAt(place, *manager));
  Managers best;
  for (const auto& manager : managers) {
    if (storesAt(place, *manager) == most) best.push_back(manager);
  }
  return best;
}

Managers managersIn(const std::string& text) {
  const Configuration configuration(text);
  Managers managers;
  const JsonValue document = JsonValue::parse(text);
  for (const auto& member : document.items()) managers.push_back(configuration.getManager(member.key()));
  return managers;
}

}  // namespace

ConfiguredStores::ConfiguredStores(const std::string& file) {
  const std::string text = readTextFile(file);
  try {
    managers_ = managersIn(text);
  } catch (const std::exception& error) {
    throw InputError("cannot use the configuration '" + file + "': " + error.what());
  }
}

bool ConfiguredStores::isEmpty() const { return managers_.empty(); }

std::vector<std::shared_ptr<const StoreManagerDefinition>> ConfiguredStores::managersOf(
    const ManagerPlace& place) const {
  std::vector<std::shared_ptr<const StoreManagerDefinition>> found;
  for (const auto& manager : managers_) {
    const bool isScope = place.name.empty() || manager->sessionScoped != place.isSessionless();
    if (isScope && isArea(place.area, manager->area)) found.push_back(manager);
  }
  return isForeignArea(place.area) ? thoseWithMostStores(found, place) : found;
}

ConfiguredStore ConfiguredStores::find(const ManagerPlace& place, const std::string& directoryName) const {
  const VersionedName name(directoryName);
  ConfiguredStore found;
  for (const auto& manager : managersOf(place)) {
    for (const auto& [identifier, store] : manager->stores) {
      if (!fits(name, *store)) continue;
      if (found.definition != nullptr && found.definition->name.size() >= store->name.size()) continue;
      found = {manager, identifier, store, name.version == std::to_string(store->version)};
    }
  }
  return found;
}

Durability durabilityOf(const StoreDefinition& definition) {
  if (const auto* cache = dynamic_cast<const DiskCacheDefinition*>(&definition)) return cache->durability;
  if (const auto* keyValue = dynamic_cast<const PKVSDefinition*>(&definition)) return keyValue->durability;
  return Durability::Relaxed;
}

std::string durabilityName(Durability durability) {
  switch (durability) {
    case Durability::Safe:
      return "safe";
    case Durability::Synced:
      return "synced";
    case Durability::Relaxed:
      break;
  }
  return "relaxed";
}

VersionedName::VersionedName(const std::string& directoryName) : stem(directoryName) {
  const auto mark = directoryName.rfind("_v");
  if (mark == std::string::npos || mark + 2 == directoryName.size()) return;
  const std::string digits = directoryName.substr(mark + 2);
  if (!std::all_of(digits.begin(), digits.end(), isDigit)) return;
  stem = directoryName.substr(0, mark);
  version = digits;
}

}  // namespace velmora::mobile::xplat::cellar::tools
