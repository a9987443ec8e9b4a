#include "inspect/Survey.h"

#include <algorithm>
#include <filesystem>
#include <map>
#include <set>

#include "inspect/StoreFigures.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "storage/TemporaryFolder.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

const char* textOf(Layout::Kind kind) {
  switch (kind) {
    case Layout::Kind::Root:
      return "root";
    case Layout::Kind::Area:
      return "area";
    case Layout::Kind::Manager:
      return "manager";
    case Layout::Kind::Store:
      return "store";
    case Layout::Kind::Empty:
      break;
  }
  return "empty";
}

LeftoverKind kindOf(OtherPlace::Kind kind) {
  switch (kind) {
    case OtherPlace::Kind::Temporary:
      return LeftoverKind::Temporary;
    case OtherPlace::Kind::Trash:
      return LeftoverKind::Trash;
    case OtherPlace::Kind::Quarantine:
      break;
  }
  return LeftoverKind::Quarantine;
}

std::int64_t lastUse(const StoreSurvey& store) { return store.newestAccess.value_or(0); }

std::int64_t lastUse(const ManagerSurvey& manager) {
  std::int64_t date = 0;
  for (const StoreSurvey& store : manager.stores) date = std::max(date, lastUse(store));
  return date;
}

// Without a configuration: of names that differ in the version alone, the highest is the present one. With it: of those
// that differ in version tag or locale, the one used last.
using Family = std::vector<StoreSurvey*>;

void markAllButNewest(const Family& family) {
  const auto newest = std::max_element(family.begin(), family.end(),
                                       [](const auto* a, const auto* b) { return lastUse(*a) < lastUse(*b); });
  for (StoreSurvey* const store : family) {
    if (store != *newest) store->leftover = LeftoverKind::OtherVersion;
  }
}

void markAllButHighest(const Family& family) {
  const auto isLower = [](const StoreSurvey* a, const StoreSurvey* b) {
    const std::string first = VersionedName(a->name).version;
    const std::string second = VersionedName(b->name).version;
    return first.size() != second.size() ? first.size() < second.size() : first < second;
  };
  const auto highest = std::max_element(family.begin(), family.end(), isLower);
  for (StoreSurvey* const store : family) {
    if (store != *highest) store->leftover = LeftoverKind::OtherVersion;
  }
}

class Surveyor {
 public:
  Surveyor(const Layout& layout, const ConfiguredStores& configured, StoreContext context)
      : layout_(layout), configured_(configured), context_(std::move(context)) {
    context_.onUnreadable = [this](const Unreadable& found) { add(found); };
  }

  Survey make() {
    survey_.root = layout_.root;
    survey_.depth = textOf(layout_.kind);
    survey_.inspectedAt = context_.now;
    for (const Unreadable& found : layout_.unreadable) add(found);
    for (const ManagerPlace& place : layout_.managers) survey_.managers.push_back(surveyManager(place));
    markOtherSessions();
    for (ManagerSurvey& manager : survey_.managers) countForLimit(manager);
    for (const ManagerSurvey& manager : survey_.managers) addStoreLeftovers(manager);
    for (const OtherPlace& place : layout_.others) addLeftover(place);
    return std::move(survey_);
  }

 private:
  void add(const Unreadable& found) {
    survey_.unreadable.push_back({relativeTo(layout_.root, found.path), found.reason});
  }

  ManagerSurvey surveyManager(const ManagerPlace& place) {
    ManagerSurvey manager;
    manager.path = relativeTo(layout_.root, place.path);
    manager.directory = place.directory();
    manager.area = place.area;
    manager.session = place.sessionTag();
    manager.isSessionless = place.isSessionless();
    const auto definitions = configured_.managersOf(place);
    for (const auto& definition : definitions) {
      manager.name += (manager.name.empty() ? "" : " or ") + definition->name;
      manager.limitBytes = definition->maxSize;
    }
    if (definitions.size() > 1) manager.limitBytes.reset();  // whose limit it is, is not known
    std::vector<ConfiguredStore> matches;
    for (const StorePlace& store : place.stores) {
      matches.push_back(configured_.find(place, store.name));
      manager.stores.push_back(surveyStore(store, matches.back(), context_));
    }
    markOtherVersions(matches, manager.stores);
    return manager;
  }

  void markOtherVersions(const std::vector<ConfiguredStore>& matches, std::vector<StoreSurvey>& stores) const {
    std::map<std::string, Family> families;
    for (std::size_t i = 0; i < stores.size(); ++i) {
      if (configured_.isEmpty()) {
        families[VersionedName(stores[i].name).stem].push_back(&stores[i]);
      } else if (matches[i].definition == nullptr) {
        stores[i].leftover = LeftoverKind::NotConfigured;
      } else if (!matches[i].hasItsVersion) {
        stores[i].leftover = LeftoverKind::OtherVersion;
      } else {
        families[matches[i].identifier].push_back(&stores[i]);
      }
    }
    for (const auto& family : families) {
      configured_.isEmpty() ? markAllButHighest(family.second) : markAllButNewest(family.second);
    }
  }

  // There is one session at a time; of several in an area it is taken to be the one used last. Accounts that are kept
  // have areas of their own.
  void markOtherSessions() {
    std::map<std::string, ManagerSurvey*> newest;
    for (ManagerSurvey& manager : survey_.managers) {
      if (manager.isSessionless) continue;
      ManagerSurvey*& present = newest[std::filesystem::path(manager.path).parent_path().string()];
      if (present == nullptr) {
        present = &manager;
        continue;
      }
      ManagerSurvey* const older = lastUse(manager) > lastUse(*present) ? present : &manager;
      if (older == present) present = &manager;
      for (StoreSurvey& store : older->stores) store.leftover = LeftoverKind::OtherSession;
    }
  }

  // An application counts what it has measured of an unmanaged store, which may be old, or nothing yet: here it is what
  // measuring finds now.
  static void countForLimit(ManagerSurvey& manager) {
    for (const StoreSurvey& store : manager.stores) {
      if (store.leftover) continue;
      const bool isUnmanaged = store.kind == StoreKind::Unmanaged;
      if (isUnmanaged) manager.unmanagedBytes += store.heldBytes();
      manager.countedBytes += isUnmanaged ? store.heldBytes() : store.recordedBytes.value_or(0);
    }
  }

  void addStoreLeftovers(const ManagerSurvey& manager) {
    for (const StoreSurvey& store : manager.stores) {
      if (!store.leftover) continue;
      survey_.leftovers.push_back({store.path, *store.leftover, store.files, store.heldBytes(), store.allocatedBytes});
    }
  }

  void addLeftover(const OtherPlace& place) {
    Leftover leftover;
    leftover.path = relativeTo(layout_.root, place.path);
    leftover.kind = kindOf(place.kind);
    measureTree(place.path, leftover, context_);
    if (leftover.files > 0) survey_.leftovers.push_back(leftover);
  }

  const Layout& layout_;
  const ConfiguredStores& configured_;
  StoreContext context_;
  Survey survey_;
};

}  // namespace

Survey makeSurvey(const Layout& layout, const ConfiguredStores& configured, std::size_t top, std::int64_t now,
                  const OnFile& onFile, bool hashesKeys) {
  const TemporaryFolder temporary;
  return Surveyor(layout, configured, {layout.root, temporary.path(), top, now, onFile, nullptr, hashesKeys}).make();
}

const char* textOf(StoreKind kind) {
  switch (kind) {
    case StoreKind::Keyed:
      return "keyed";
    case StoreKind::KeyValue:
      return "pkvs";
    case StoreKind::DiskCache:
      return "disk_cache";
    case StoreKind::Unmanaged:
      break;
  }
  return "unmanaged";
}

const char* textOf(LeftoverKind kind) {
  switch (kind) {
    case LeftoverKind::OtherVersion:
      return "other_version";
    case LeftoverKind::OtherSession:
      return "other_session";
    case LeftoverKind::NotConfigured:
      return "not_configured";
    case LeftoverKind::Temporary:
      return "temporary";
    case LeftoverKind::Trash:
      return "trash";
    case LeftoverKind::Quarantine:
      break;
  }
  return "quarantine";
}

}  // namespace velmora::mobile::xplat::cellar::tools
