#include "check/Warnings.h"

#include <algorithm>
#include <cstdint>
#include <map>
#include <string>
#include <utility>

#include "Configuration.h"
#include "Format.h"
#include "check/Faults.h"
#include "check/KeyWarnings.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kLongestFileName = 255;  // bytes, of the file systems of phones

void warnOfDiskCache(const ResolvedStore& store, const DiskCacheDefinition& cache, Diagnostics& findings) {
  if (cache.lruSizeLimit == 0) {
    findings.push_back({"no_limit", memberPointer(store.pointer, "lru_size_limit"),
                        "is 0 B: each round of pruning empties the cache"});
  }
  if (cache.survivalSize > cache.lruSizeLimit) {
    findings.push_back({"survival_size", memberPointer(store.pointer, "survival_size"),
                        formatSize(cache.survivalSize) + " is more than the limit of " +
                            formatSize(cache.lruSizeLimit) + ": a device that is short of space would keep more"});
  }
  if (cache.pruneStrategy == PruneStrategyIdentifier::VideoDownload &&
      cache.metadataFactory != ExtendedMetadataFactoryIdentifier::VideoDownload) {
    findings.push_back({"no_metadata", memberPointer(store.pointer, "prune_strategy"),
                        "video_download without the metadata_factory of that name: after a restart no item has a "
                        "priority"});
  }
}

void warnOfLimits(const ResolvedStore& store, Diagnostics& findings) {
  const StoreDefinition& definition = *store.definition;
  if (definition.type == StoreDefinition::Type::DiskCache) {
    warnOfDiskCache(store, static_cast<const DiskCacheDefinition&>(definition), findings);
  }
  if (definition.type == StoreDefinition::Type::Unmanaged && definition.isCache && definition.maxSize == 0) {
    findings.push_back(
        {"no_limit", memberPointer(store.pointer, "max_size"), "is 0 B: the cache is emptied whenever it is opened"});
  }
}

// What lies in the documents area exists nowhere else.
void warnOfDurability(const ResolvedManager& manager, const ResolvedStore& store, Diagnostics& findings) {
  if (manager.definition->area != Area::Documents || store.definition->type != StoreDefinition::Type::PKVS) return;
  if (static_cast<const PKVSDefinition&>(*store.definition).durability != Durability::Relaxed) return;
  findings.push_back({"durability", memberPointer(store.pointer, "durability"),
                      "is relaxed: a kill may damage a value, and a damaged manifest or a full disk loses all of them; "
                      "use 'safe' for values that exist nowhere else"});
}

void warnOfFileName(const ResolvedStore& store, Diagnostics& findings) {
  const std::string& name = store.definition->name;
  const std::string place = name == store.identifier ? store.pointer : memberPointer(store.pointer, "name");
  if (name.find('/') != std::string::npos) {
    findings.push_back({"file_name", place, "'" + name + "' contains a '/' and leads outside the manager's directory"});
  } else if (name.find('\0') != std::string::npos) {
    findings.push_back({"file_name", place, "the name contains a zero byte, at which the system truncates it"});
  } else if (name.empty()) {
    findings.push_back({"file_name", place, "the name is empty"});
  } else if (store.directory.size() > kLongestFileName) {
    findings.push_back({"file_name", place,
                        "the directory's name has " + std::to_string(store.directory.size()) +
                            " bytes, more than the " + std::to_string(kLongestFileName) + " that file systems allow"});
  }
}

// Caches within their limits can together exceed their manager's, and then nothing can be pruned.
void warnOfManagerLimit(const ResolvedManager& manager, Diagnostics& findings) {
  std::uint64_t sum = 0;
  std::uint64_t unmanaged = 0;
  for (const ResolvedStore& store : manager.stores) {
    if (!store.definition->isCache) continue;
    sum += store.definition->maxSize;
    if (store.definition->type == StoreDefinition::Type::Unmanaged) unmanaged += store.definition->maxSize;
  }
  if (unmanaged > manager.definition->maxSize) {
    findings.push_back({"unmanaged_over_manager_limit", memberPointer(manager.pointer, "max_size"),
                        "its unmanaged caches alone may have " + formatSize(unmanaged) +
                            ", more than the manager's limit of " + formatSize(manager.definition->maxSize) +
                            ": they count for it, and a round of pruning takes nothing from them"});
  }
  if (sum <= manager.definition->maxSize || sum == unmanaged) return;
  findings.push_back({"over_manager_limit", memberPointer(manager.pointer, "max_size"),
                      "its caches may together have " + formatSize(sum) + ", more than the manager's limit of " +
                          formatSize(manager.definition->maxSize)});
}

void warnOfPruning(const ResolvedManager& manager, Diagnostics& findings) {
  if (manager.definition->pruneInterval != 0) return;
  for (const ResolvedStore& store : manager.stores) {
    if (store.definition->type != StoreDefinition::Type::DiskCache) continue;
    findings.push_back({"never_prunes", memberPointer(manager.pointer, "prune_interval"),
                        "is 0: the manager never prunes, and its disk caches grow without limit"});
    return;
  }
}

// Stores in one directory treat each other's files as their own; stores of one name cannot be told apart in events and
// log lines.
class Namesakes {
 public:
  void lookAt(const ResolvedManager& manager, Diagnostics& findings) {
    lookAtManagerDirectory(manager, findings);
    for (const ResolvedStore& store : manager.stores) lookAtStore(manager, store, findings);
  }

 private:
  using FirstOf = std::map<std::string, std::string>;  // to its pointer

  void lookAtManagerDirectory(const ResolvedManager& manager, Diagnostics& findings) {
    const auto [first, isFirst] = managers_.emplace(manager.directory, manager.pointer);
    if (isFirst) return;
    findings.push_back(
        {"shared_directory", manager.pointer,
         "shares its directory " + manager.directory + " with " + first->second + ": each removes the other's stores"});
  }

  void lookAtStore(const ResolvedManager& manager, const ResolvedStore& store, Diagnostics& findings) {
    const auto [place, isFirstThere] = stores_.emplace(manager.directory + "/" + store.directory, store.pointer);
    const auto [namesake, isFirstOfName] = names_.emplace(store.definition->name, store.pointer);
    if (!isFirstThere) {
      findings.push_back(
          {"shared_directory", store.pointer, "shares its directory " + store.directory + " with " + place->second});
    } else if (!isFirstOfName) {
      findings.push_back({"shared_name", store.pointer,
                          "has the name '" + store.definition->name + "' of " + namesake->second +
                              ": they cannot be told apart in events and log lines"});
    }
  }

  FirstOf managers_;
  FirstOf stores_;
  FirstOf names_;
};

void warnOfRepeatedKeys(const ConfigurationDocument& document, Diagnostics& findings) {
  for (const std::string& pointer : document.repeated) {
    findings.push_back({"repeated_key", pointer, "is defined more than once here; only the last counts"});
  }
}

}  // namespace

Diagnostics findWarnings(const ConfigurationDocument& document, const ResolvedConfiguration& resolved) {
  Diagnostics findings;
  Namesakes namesakes;
  // Both have the order of the document; looking a name up would take longer, the more there are.
  auto written = document.root.begin();
  for (const ResolvedManager& manager : resolved) {
    warnOfManagerKeys(manager.pointer, *written, findings);
    warnOfManagerLimit(manager, findings);
    warnOfPruning(manager, findings);
    auto writtenStore = manager.stores.empty() ? OrderedJson::const_iterator() : written->at("stores").begin();
    for (const ResolvedStore& store : manager.stores) {
      warnOfStoreKeys(store.pointer, *writtenStore++, findings);
      warnOfLimits(store, findings);
      warnOfDurability(manager, store, findings);
      warnOfFileName(store, findings);
    }
    namesakes.lookAt(manager, findings);
    ++written;
  }
  warnOfRepeatedKeys(document, findings);
  return findings;
}

namespace {

// Whether a fault lies at the pointer or below it.
bool isFaulty(const std::string& pointer, const Diagnostics& faults) {
  return std::any_of(faults.begin(), faults.end(), [&](const Diagnostic& fault) {
    return fault.pointer == pointer || fault.pointer.rfind(pointer + "/", 0) == 0;
  });
}

// Warns of the keys of what has a fault. What the key's own fault says is not said twice.
class KeysOfFaulty {
 public:
  KeysOfFaulty(const Diagnostics& faults, Diagnostics& findings) : faults_(faults), findings_(findings) {}

  void ofManager(const std::string& pointer, const OrderedJson& manager) {
    if (manager.is_object()) warnOfManagerKeys(pointer, withoutFaulty(pointer, manager), findings_);
  }

  void ofStore(const std::string& pointer, const OrderedJson& store) {
    if (!store.is_object() || !store.contains("type") || isFaulty(memberPointer(pointer, "type"), faults_)) return;
    warnOfStoreKeys(pointer, withoutFaulty(pointer, store), findings_);
  }

 private:
  OrderedJson withoutFaulty(const std::string& pointer, const OrderedJson& object) const {
    OrderedJson kept = OrderedJson::object();
    for (const auto& [key, value] : object.items()) {
      if (key == "stores" || !isFaulty(memberPointer(pointer, key), faults_)) kept[key] = value;
    }
    return kept;
  }

  const Diagnostics& faults_;
  Diagnostics& findings_;
};

bool hasOwnFault(const std::string& pointer, const OrderedJson& manager, const Diagnostics& faults) {
  if (!manager.is_object()) return true;
  const std::string stores = memberPointer(pointer, "stores") + "/";
  return std::any_of(faults.begin(), faults.end(), [&](const Diagnostic& fault) {
    const bool isBelow = fault.pointer == pointer || fault.pointer.rfind(pointer + "/", 0) == 0;
    return isBelow && fault.pointer.rfind(stores, 0) != 0;
  });
}

}  // namespace

Diagnostics findWarningsBeside(const Diagnostics& faults, const ConfigurationDocument& document, const NameTags& tags) {
  Diagnostics ofKeys;
  KeysOfFaulty keys(faults, ofKeys);
  ConfigurationDocument sound;
  sound.root = OrderedJson::object();
  sound.repeated = document.repeated;
  if (!document.root.is_object()) return {};
  for (const auto& [name, manager] : document.root.items()) {
    const std::string pointer = memberPointer("", name);
    const bool isRefused = hasOwnFault(pointer, manager, faults);
    if (isRefused) keys.ofManager(pointer, manager);
    if (!isRefused) sound.root[name] = manager;
    if (!manager.is_object() || !manager.contains("stores") || !manager["stores"].is_object()) continue;
    for (const auto& [identifier, store] : manager["stores"].items()) {
      const std::string pointerOfStore = memberPointer(memberPointer(pointer, "stores"), identifier);
      if (!isRefused && !isFaulty(pointerOfStore, faults)) continue;
      keys.ofStore(pointerOfStore, store);
      if (!isRefused) sound.root[name]["stores"].erase(identifier);
    }
  }
  sound.text = sound.root.dump();
  if (!findFaults(sound).empty()) return ofKeys;
  Diagnostics findings = findWarnings(sound, resolve(sound, tags));
  findings.insert(findings.end(), ofKeys.begin(), ofKeys.end());
  return findings;
}

}  // namespace velmora::mobile::xplat::cellar::tools
