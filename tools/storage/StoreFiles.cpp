#include "storage/StoreFiles.h"

#include <algorithm>
#include <array>

#include "AttributeStore.h"
#include "ManifestSnapshot.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::array<const char*, 4> kSuffixes = {"", "-wal", "-shm", "-journal"};

using OnEntry = std::function<void(const std::string& below, const Entry&)>;

void walk(const std::string& directory, const std::string& prefix, const OnEntry& onEntry) {
  for (const Entry& entry : listUntouched(directory)) {
    onEntry(prefix + entry.name, entry);
    if (entry.type == Entry::Type::Directory) walk(directory + "/" + entry.name, prefix + entry.name + "/", onEntry);
  }
}

}  // namespace

const char* const kStoreQuarantine = "quarantine";

std::string newManifestName() { return ManifestSnapshot::manifestName + "-new"; }

std::string salvagedManifestName() { return ManifestSnapshot::manifestName + "-salvaged"; }

bool isInStoreQuarantine(const std::string& below) { return below.rfind(std::string(kStoreQuarantine) + "/", 0) == 0; }

bool isManifestFile(const std::string& name) {
  return std::any_of(kSuffixes.begin(), kSuffixes.end(),
                     [&](const char* suffix) { return name == ManifestSnapshot::manifestName + suffix; });
}

bool isAttributesFile(const Entry& entry) {
  return entry.type == Entry::Type::File && entry.name == AttributeStore::fileName;
}

void walkTree(const std::string& directory, const OnEntry& onEntry) { walk(directory, "", onEntry); }

}  // namespace velmora::mobile::xplat::cellar::tools
