#include "ManifestSnapshot.h"

#include <glog/logging.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <exception>
#include <system_error>
#include <unordered_map>
#include <utility>

#include "ExtendedMetadata.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "SQLiteStore.h"
#include "base/ManifestErrors.h"
#include "base/Schema.h"
#include "base/SchemaFunctions.h"

namespace velmora::mobile::xplat::cellar {

namespace {

using Bytes = std::vector<unsigned char>;

constexpr std::size_t kLogHeaderSize = 32;  // changes whenever SQLite restarts the write-ahead log
constexpr int kAttempts = 10;
constexpr int kStatementDoesNotFit = 1;  // SQLite's code for a statement that names what is not there

const std::string kLogSuffix = "-wal";
const std::string kJournalSuffix = "-journal";

struct Files {
  Bytes manifest;
  std::optional<Bytes> log;
  std::optional<Bytes> journal;
};

std::optional<Bytes> readIfThere(FileUtils& fileUtils, const std::string& path) {
  if (!fileUtils.pathExists(path)) return std::nullopt;
  try {
    return fileUtils.readFile(path);
  } catch (const FileUtilsIoException& error) {
    if (error.code() != ENOENT) throw;  // a store that closes takes them away
    return std::nullopt;
  }
}

// An empty log has an empty header: one that has begun since is another.
Bytes headerOf(const Bytes& log) {
  return {log.begin(), log.begin() + static_cast<std::ptrdiff_t>(std::min(log.size(), kLogHeaderSize))};
}

// Whether the log was only written on between two readings. Then whatever a checkpoint has moved into the manifest
// meanwhile is still in the later reading, too, and manifest and log go together.
bool isSameLog(const std::optional<Bytes>& earlier, const std::optional<Bytes>& later) {
  if (!earlier || !later) return !earlier && !later;
  return earlier->size() <= later->size() && headerOf(*earlier) == headerOf(*later);
}

Files readConsistently(FileUtils& fileUtils, const std::string& path) {
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    const auto logBefore = readIfThere(fileUtils, path + kLogSuffix);
    Files files;
    files.journal = readIfThere(fileUtils, path + kJournalSuffix);
    files.manifest = fileUtils.readFile(path);
    files.log = readIfThere(fileUtils, path + kLogSuffix);
    if (isSameLog(logBefore, files.log)) return files;
  }
  throw ManifestPersistenceException("The manifest changes all the time (" + path + ")", 0);
}

std::string makeOwnDirectory(FileUtils& fileUtils, const std::string& parent) {
  std::string path = fileUtils.combinePath(parent, "manifest_snapshot_XXXXXX");
  if (mkdtemp(path.data()) == nullptr) {
    const int code = errno;
    throw FileUtilsIoException(code, "Cannot create '" + path + "': " + std::generic_category().message(code));
  }
  return path;
}

void removeOwnDirectory(FileUtils& fileUtils, const std::string& path) {
  try {
    fileUtils.recursiverDirectoryDelete(path);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not remove the copy of a manifest: " << error.what();
  }
}

void copyInto(FileUtils& fileUtils, const std::string& copy, const std::string& original) {
  const Files files = readConsistently(fileUtils, original);
  fileUtils.writeFile(copy, files.manifest);
  if (files.log) fileUtils.writeFile(copy + kLogSuffix, *files.log);
  if (files.journal) fileUtils.writeFile(copy + kJournalSuffix, *files.journal);
}

// By key, of the records that have one.
std::unordered_map<std::string, std::uint64_t> inlineSizesIn(const std::string& path) {
  std::unordered_map<std::string, std::uint64_t> sizes;
  SQLiteStore store(path);
  SQLiteStoreCursor cursor =
      store.cursor("SELECT key, length(inline_data) FROM LarderManifest WHERE inline_data IS NOT NULL;");
  while (cursor.next()) sizes[cursor.get<std::string>(0)] = cursor.get<unsigned long long>(1);
  return sizes;
}

// What somebody else has put into the database.
std::vector<std::string> foreignPartsOf(SQLiteStore& store) {
  std::vector<std::string> parts;
  SQLiteStoreCursor cursor = store.cursor(
      "SELECT type || ' ''' || name || '''' FROM sqlite_master WHERE type IN ('trigger', 'view') OR (type = 'table' "
      "AND "
      "name <> 'LarderManifest' COLLATE NOCASE AND substr(name, 1, 7) <> 'sqlite_') ORDER BY 1;");
  while (cursor.next()) parts.push_back(cursor.get<std::string>(0));
  return parts;
}

bool isTable(const std::string& foreignPart) { return foreignPart.rfind("table ", 0) == 0; }

// What SQLite says names the file, which is the copy: nobody else knows that.
std::string withoutPath(std::string text, const std::string& path) {
  const std::string place = " (" + path + ")";
  const auto found = text.find(place);
  return found == std::string::npos ? text : text.erase(found, place.size());
}

}  // namespace

const std::string ManifestSnapshot::manifestName = kManifestFileName;

ManifestSnapshot::ManifestSnapshot(const std::string& storeDirectory, const std::string& temporaryDirectory,
                                   std::shared_ptr<FileUtils> fileUtils)
    : fileUtils_(std::move(fileUtils)),
      directory_(makeOwnDirectory(*fileUtils_, temporaryDirectory)),
      path_(fileUtils_->combinePath(directory_, manifestName)) {
  try {
    copyInto(*fileUtils_, path_, fileUtils_->combinePath(storeDirectory, manifestName));
  } catch (...) {
    removeOwnDirectory(*fileUtils_, directory_);
    throw;
  }
}

ManifestSnapshot::~ManifestSnapshot() { removeOwnDirectory(*fileUtils_, directory_); }

std::vector<ManifestSnapshot::Record> ManifestSnapshot::records(
    std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory) const {
  // Opened as a safe store's, a manifest without checksums would get a column for them.
  const Durability durability = hasChecksums() ? Durability::Safe : Durability::Relaxed;
  const SQLiteManifestPersistence manifest(path_, std::move(extendedMetadataFactory), nullptr, durability);
  auto items = manifest.getAllItems();
  std::vector<Record> records;
  records.reserve(items.size());
  std::unordered_map<std::string, std::uint64_t> inlineSizes;
  translatingManifestErrors([&] { inlineSizes = inlineSizesIn(path_); });
  for (auto& item : items) {
    const auto inlineSize = inlineSizes.find(item->key);
    records.push_back({std::move(*item), std::nullopt});
    if (inlineSize != inlineSizes.end()) records.back().inlineSize = inlineSize->second;
  }
  return records;
}

bool ManifestSnapshot::hasChecksums() const {
  bool hasChecksums = false;
  translatingManifestErrors([&] {
    SQLiteStore store(path_);
    hasChecksums = hasChecksumColumn(store);
  });
  return hasChecksums;
}

void ManifestSnapshot::forEachInlineValue(const std::function<void(const std::string&, const Bytes&)>& onValue) const {
  const SQLiteManifestPersistence manifest(path_, nullptr, nullptr);  // refuses a foreign table
  translatingManifestErrors([&] {
    SQLiteStore store(path_);
    SQLiteStoreCursor cursor =
        store.cursor("SELECT key, inline_data FROM LarderManifest WHERE inline_data IS NOT NULL;");
    while (cursor.next()) onValue(cursor.get<std::string>(0), cursor.get<Bytes>(1));
  });
}

std::vector<std::string> ManifestSnapshot::integrityErrors() const {
  std::vector<std::string> lines;
  try {
    SQLiteStore store(path_);
    throwIfTableCallsFunctions(store, "LarderManifest");
    // The checks and generated columns of a foreign table may call any function.
    const auto parts = foreignPartsOf(store);
    const bool hasForeignTable = std::any_of(parts.begin(), parts.end(), isTable);
    SQLiteStoreCursor cursor =
        store.cursor(hasForeignTable ? "PRAGMA integrity_check(LarderManifest);" : "PRAGMA integrity_check;");
    while (cursor.next()) lines.push_back(cursor.get<std::string>(0));
    if (lines == std::vector<std::string>{"ok"}) lines.clear();
  } catch (const SQLiteStoreCorruptedException& error) {
    lines.push_back(withoutPath(error.description(), path_));
  }
  if (!lines.empty()) return lines;
  try {
    const SQLiteManifestPersistence manifest(path_, nullptr, nullptr);
  } catch (const ManifestPersistenceException& error) {
    const bool isForeign = dynamic_cast<const ManifestCorruptedException*>(&error) != nullptr;
    if (!isForeign && error.code() != kStatementDoesNotFit) throw;
    lines.push_back(withoutPath(error.description(), path_));
  }
  return lines;
}

std::vector<std::string> ManifestSnapshot::foreignParts() const {
  std::vector<std::string> parts;
  translatingManifestErrors([&] {
    SQLiteStore store(path_);
    parts = foreignPartsOf(store);
  });
  return parts;
}

}  // namespace velmora::mobile::xplat::cellar
