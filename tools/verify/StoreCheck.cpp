#include "verify/StoreCheck.h"

#include <sys/stat.h>
#include <sys/types.h>

#include <algorithm>
#include <cstddef>
#include <exception>
#include <filesystem>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "JsonValue.h"
#include "LarderException.h"
#include "ManifestSnapshot.h"
#include "storage/Layout.h"
#include "storage/SafeFiles.h"
#include "storage/StoreFiles.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

// Links are followed, as a store does when it reads a value. The store's own files are not values. Throws
// `UnreadableException` when the system does not say whether there is a file.
std::optional<std::uint64_t> sizeOfValue(const std::string& directory, const std::string& below) {
  if (isManifestFile(below)) return std::nullopt;
  const fs::path path = fs::path(directory) / below;
  std::error_code error;
  const fs::file_status status = fs::status(path, error);
  if (status.type() == fs::file_type::none) throw UnreadableException(error.value(), {path.string(), error.message()});
  if (!fs::is_regular_file(status)) return std::nullopt;
  const std::uintmax_t size = fs::file_size(path, error);
  return error ? std::nullopt : std::make_optional<std::uint64_t>(size);
}

using FileId = std::pair<dev_t, ino_t>;

using Look = int (*)(const char* path, struct stat* status);  // `stat`, which follows links, or `lstat`

std::optional<FileId> idOf(const std::string& path, Look look) {
  struct stat status = {};
  return look(path.c_str(), &status) == 0 ? std::make_optional<FileId>(status.st_dev, status.st_ino) : std::nullopt;
}

// A damaged manifest cannot always tell that it is a safe store's, but what lies beside it can. So may what cannot be
// listed.
bool looksSafe(const std::string& directory) try {
  const auto entries = listUntouched(directory);
  return std::any_of(entries.begin(), entries.end(), [](const Entry& entry) {
    return entry.type == Entry::Type::Directory ? entry.name == kStoreQuarantine
                                                : parseSafeFileName(entry.name).has_value();
  });
} catch (const UnreadableException&) {
  return true;
}

// Reads nothing of a damaged manifest.
bool hasChecksums(const ManifestSnapshot& snapshot) {
  try {
    return snapshot.hasChecksums();
  } catch (const ManifestPersistenceException&) {
    return false;
  }
}

class StoreCheck {
 public:
  StoreCheck(const std::string& directory, bool isConfiguredSafe, OnFile onFile)
      : directory_(directory), isConfiguredSafe_(isConfiguredSafe), onFile_(std::move(onFile)) {}

  Findings check(const ManifestSnapshot& snapshot) {
    isSafe_ = hasChecksums(snapshot);
    const auto damages = snapshot.integrityErrors();
    if (!damages.empty()) {
      isSafe_ = isSafe_ || isConfiguredSafe_ || looksSafe(directory_);
      Finding finding = make(Finding::Kind::DamagedManifest, ManifestSnapshot::manifestName);
      finding.detail = damages.front();
      return {finding};
    }
    if (isSafe_) {
      snapshot.forEachInlineValue([this](const std::string& key, const std::vector<unsigned char>& value) {
        inlineChecksums_[key] = checksumOf(key, value);
      });
    }
    for (const auto& record : snapshot.records(nullptr)) {
      const auto before = findings_.size();
      record.item.hasInlineData ? checkInline(record) : checkFile(record.item);
      if (isSafe_ && findings_.size() == before) soundKeys_.insert(record.item.key);
    }
    for (const std::string& part : snapshot.foreignParts()) {
      findings_.push_back(make(Kind::ForeignPart, ManifestSnapshot::manifestName));
      findings_.back().detail = part;
    }
    findStrays();
    return std::move(findings_);
  }

 private:
  using Kind = Finding::Kind;

  Finding make(Kind kind, const std::string& name) const {
    Finding finding{kind, directory_, name};
    finding.isSafe = isSafe_;
    return finding;
  }

  void add(Kind kind, const std::string& name, std::uint64_t actual) {
    Finding finding = make(kind, name);
    finding.actual = actual;
    findings_.push_back(finding);
  }

  Finding& add(Kind kind, const DiskCacheItem& item, std::optional<std::uint64_t> actual) {
    Finding finding = make(kind, item.key);
    finding.recorded = item.size;
    finding.actual = actual.value_or(0);
    finding.hasFile = actual.has_value();
    return findings_.emplace_back(std::move(finding));
  }

  // An empty value is one that is there: what has no bytes but should have some has lost them.
  void checkInline(const ManifestSnapshot::Record& record) {
    const DiskCacheItem& item = record.item;
    const std::uint64_t actual = record.inlineSize.value_or(0);
    if (actual == 0 && item.size > 0) {
      add(Kind::InlineValueMissing, item, std::nullopt);
    } else if (item.checksum && *item.checksum != inlineChecksum(item.key)) {
      add(Kind::DamagedValue, item, std::nullopt).actual = actual;
    } else if (actual != item.size) {
      add(Kind::SizeDiffers, item, actual);
    }
  }

  std::uint32_t inlineChecksum(const std::string& key) const {
    const auto found = inlineChecksums_.find(key);
    return found == inlineChecksums_.end() ? checksumOf(key, {}) : found->second;
  }

  void checkFile(const DiskCacheItem& item) {
    const std::string below = (fs::path(".") / fs::path(item.filename).relative_path()).lexically_normal().string();
    std::optional<std::uint64_t> actual;
    try {
      actual = sizeOfValue(directory_, below);
    } catch (const UnreadableException& error) {
      add(Kind::UnreadableValue, item, actual).detail = error.description();
      return;
    }
    if (actual) valueFiles_.insert(below);
    const bool isProvisional = item.size == 0 && !item.checksum;
    if (!actual) {
      if (!isProvisional && isSafe_) withoutFile_[item.key] = findings_.size();
      add(isProvisional ? Kind::InterruptedWrite : Kind::RecordWithoutFile, item, actual);
      return;
    }
    if (item.checksum && !checkContent(item, below, *actual)) return;
    // Sizes are recorded in 32 bits, and wrap.
    if (static_cast<std::uint32_t>(*actual) == item.size) return;
    add(isProvisional ? Kind::InterruptedWrite : Kind::SizeDiffers, item, actual);
  }

  // Whether it has the checksum of its record.
  bool checkContent(const DiskCacheItem& item, const std::string& below, std::uint64_t actual) {
    try {
      if (checksumOfFile(item.key, directory_ + "/" + below) == *item.checksum) return true;
      add(Kind::DamagedValue, item, actual).file = below;
    } catch (const FileUtilsIoException& error) {
      add(Kind::UnreadableValue, item, actual).detail = error.description();
    }
    return false;
  }

  void findStrays() {
    Finding quarantine = make(Kind::Quarantine, kStoreQuarantine);
    const auto onEntry = [&](const std::string& below, const Entry& entry) {
      if (entry.type == Entry::Type::Directory) return;
      onFile_(entry.size);
      if (isManifestFile(below) || isAttributesFile(entry) || isStrangeAttributesFile(entry)) return;
      if (valueFiles_.count(below) > 0 || isValueByAnotherName(below)) return;
      if (isInStoreQuarantine(below)) {
        ++quarantine.files;
        quarantine.actual += entry.size;
      } else if (!isSafe_ || !takeForSafe(below, entry)) {
        add(Kind::FileWithoutRecord, below, entry.size);
      }
    };
    walkTree(directory_, onEntry, [](const Unreadable& /*found with the attributes*/) {});
    if (quarantine.files > 0) findings_.push_back(std::move(quarantine));
  }

  // Whether it is the file that a record names in another way, through a link for example. A second name of a value's
  // file, which has no bytes of its own, is taken for one as well.
  bool isValueByAnotherName(const std::string& below) {
    if (valueIds_.empty()) noteValueIds();
    const auto id = idOf(directory_ + "/" + below, ::lstat);
    return id && valueIds_.count(*id) > 0;
  }

  void noteValueIds() {
    for (const std::string& file : valueFiles_) {
      if (const auto id = idOf(directory_ + "/" + file, ::stat)) valueIds_.insert(*id);
    }
  }

  // Whether a safe store has left it: unfinished, or as the file of a key whose value is another one or will be this.
  bool takeForSafe(const std::string& below, const Entry& entry) {
    if (below == newManifestName()) {
      add(Kind::UnfinishedManifest, below, entry.size);
      return true;
    }
    const auto name = entry.type == Entry::Type::File ? parseSafeFileName(below) : std::nullopt;
    if (!name) return false;
    if (name->isUnfinished) {
      add(Kind::UnfinishedFile, below, entry.size);
      return true;
    }
    if (!name->key) return false;
    if (soundKeys_.count(*name->key) > 0) {
      add(Kind::SupersededFile, below, entry.size);
      return true;
    }
    const auto record = withoutFile_.find(*name->key);
    return record != withoutFile_.end() && offerFor(findings_[record->second], *name, entry);
  }

  // Of several files the one that was written last; the others are files without a record.
  bool offerFor(Finding& finding, const SafeFileName& name, const Entry& entry) {
    if (!isIntact(name, entry)) return false;
    if (!finding.file.empty()) {
      if (parseSafeFileName(finding.file)->number > name.number) return false;
      const std::string earlier = finding.file;
      const std::uint64_t size = finding.actual;
      finding.file = entry.name;
      finding.actual = entry.size;
      add(Kind::FileWithoutRecord, earlier, size);
      return true;
    }
    finding.file = entry.name;
    finding.actual = entry.size;
    return true;
  }

  bool isIntact(const SafeFileName& name, const Entry& entry) const {
    try {
      return checksumOfFile(*name.key, directory_ + "/" + entry.name) == name.checksum;
    } catch (const FileUtilsIoException&) {
      return false;
    }
  }

  const std::string directory_;
  const bool isConfiguredSafe_;
  const OnFile onFile_;
  Findings findings_;
  bool isSafe_ = false;                                             // or was: the manifest has checksums
  std::unordered_set<std::string> valueFiles_;                      // below the directory
  std::set<FileId> valueIds_;                                       // of the same; empty until they are needed
  std::unordered_map<std::string, std::uint32_t> inlineChecksums_;  // of a safe store, by key
  std::unordered_set<std::string> soundKeys_;                       // of a safe store
  std::unordered_map<std::string, std::size_t> withoutFile_;        // findings of a safe store, by key
};

bool isJson(const std::string& path) {
  const auto bytes = UntouchedFiles(kLargestAttributes).readFile(path);
  return JsonValue::accept(bytes.begin(), bytes.end());
}

// A store without a manifest has nothing to be held against, unless it must have had one: one of SQLite's files is
// still there, or it is configured with keys and has files.
Findings checkMissingManifest(const StorePlace& place, bool hasKeys) {
  const std::string manifest = place.path + "/" + ManifestSnapshot::manifestName;
  const std::string strangeness = strangenessOf(manifest);
  if (!strangeness.empty()) return {findingOf({manifest, strangeness})};
  std::vector<Entry> entries;
  const auto onEntry = [&](const std::string& below, const Entry& entry) {
    if (below == entry.name) entries.push_back(entry);
  };
  walkTree(place.path, onEntry, [](const Unreadable& /*found with the attributes*/) {});
  for (const Entry& entry : entries) {
    const bool isValue = hasKeys && !isAttributesFile(entry) && !isStrangeAttributesFile(entry);
    if (!isValue && !isManifestFile(entry.name) && entry.name != newManifestName()) continue;
    Finding finding{Finding::Kind::MissingManifest, place.path, ManifestSnapshot::manifestName};
    finding.detail = "'" + entry.name + "' is there";
    return {finding};
  }
  return {};
}

Findings checkReadableStore(const StorePlace& place, const Configured& configured,
                            const std::string& temporaryDirectory, const OnFile& onFile) {
  // Until it is in its place, the present one says little of the files.
  std::error_code error;
  if (fs::is_regular_file(fs::symlink_status(fs::path(place.path) / salvagedManifestName(), error))) {
    return {{Finding::Kind::InterruptedSalvage, place.path, salvagedManifestName()}};
  }
  if (!place.hasManifest) return checkMissingManifest(place, configured.hasKeys);
  const ManifestSnapshot snapshot(place.path, temporaryDirectory, std::make_shared<UntouchedFiles>());
  return StoreCheck(place.path, configured.isSafe, onFile).check(snapshot);
}

Findings checkAttributesFile(const std::string& directory, const std::string& below) {
  const std::string path = directory + "/" + below;
  try {
    if (isJson(path)) return {};
  } catch (const std::exception& error) {
    return {findingOf(unreadableBy(error, path))};
  }
  return {{Finding::Kind::DamagedAttributes, directory, below}};
}

}  // namespace

Finding findingOf(const Unreadable& unreadable) {
  Finding finding{Finding::Kind::Unreadable, unreadable.path, ""};
  finding.detail = unreadable.reason;
  return finding;
}

Findings checkStore(const StorePlace& place, const Configured& configured, const std::string& temporaryDirectory,
                    const OnFile& onFile) {
  try {
    return checkReadableStore(place, configured, temporaryDirectory, onFile);
  } catch (const std::exception& error) {
    return {findingOf(unreadableBy(error, place.path))};
  }
}

Findings checkAttributes(const std::string& directory) {
  Findings findings;
  const auto onEntry = [&](const std::string& below, const Entry& entry) {
    if (!isAttributesFile(entry) && !isStrangeAttributesFile(entry)) return;
    const Findings found = checkAttributesFile(directory, below);
    findings.insert(findings.end(), found.begin(), found.end());
  };
  walkTree(directory, onEntry, [&](const Unreadable& part) { findings.push_back(findingOf(part)); });
  return findings;
}

}  // namespace velmora::mobile::xplat::cellar::tools
