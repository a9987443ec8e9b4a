#include "storage/StoreFiles.h"

#include <algorithm>
#include <array>

#include "AttributeStore.h"
#include "ManifestSnapshot.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::array<const char*, 4> kSuffixes = {"", "-wal", "-shm", "-journal"};

std::vector<Entry> entriesOf(const std::string& directory, const OnUnreadable& onUnreadable) {
  try {
    return listUntouched(directory);
  } catch (const UnreadableException& error) {
    if (!onUnreadable) throw;
    onUnreadable(error.unreadable());
    return {};
  }
}

void walk(const std::string& directory, const std::string& prefix, const OnEntry& onEntry,
          const OnUnreadable& onUnreadable) {
  for (const Entry& entry : entriesOf(directory, onUnreadable)) {
    onEntry(prefix + entry.name, entry);
    if (entry.type != Entry::Type::Directory) continue;
    walk(directory + "/" + entry.name, prefix + entry.name + "/", onEntry, onUnreadable);
  }
}

}  // namespace

const char* const kStoreQuarantine = "quarantine";

std::string newManifestName() { return ManifestSnapshot::manifestName + "-new"; }

std::string salvagedManifestName() { return ManifestSnapshot::manifestName + "-salvaged"; }

bool isInStoreQuarantine(const std::string& below) { return below.rfind(std::string(kStoreQuarantine) + "/", 0) == 0; }

std::vector<std::string> manifestFiles() {
  std::vector<std::string> names;
  names.reserve(kSuffixes.size());
  for (const char* const suffix : kSuffixes) names.push_back(ManifestSnapshot::manifestName + suffix);
  return names;
}

bool isManifestFile(const std::string& name) {
  return std::any_of(kSuffixes.begin(), kSuffixes.end(),
                     [&](const char* suffix) { return name == ManifestSnapshot::manifestName + suffix; });
}

bool isAttributesFile(const Entry& entry) {
  return entry.type == Entry::Type::File && entry.name == AttributeStore::fileName;
}

bool isStrangeAttributesFile(const Entry& entry) {
  const bool isStrange = entry.type == Entry::Type::Link || entry.type == Entry::Type::Other;
  return isStrange && entry.name == AttributeStore::fileName;
}

void walkTree(const std::string& directory, const OnEntry& onEntry, const OnUnreadable& onUnreadable) {
  walk(directory, "", onEntry, onUnreadable);
}

void walkTree(const std::string& directory, const OnEntry& onEntry) { walk(directory, "", onEntry, nullptr); }

}  // namespace velmora::mobile::xplat::cellar::tools
