#include "keyvalue/Salvage.h"

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <system_error>
#include <unordered_set>
#include <utility>

#include "FileUtils.h"
#include "Incident.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "base/DamagedManifest.h"
#include "base/NewManifest.h"
#include "base/StoreTime.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/VersionedFiles.h"

namespace velmora::mobile::xplat::cellar {

namespace {

const std::string kQuarantine = "quarantine";

bool isFileWithBytes(const std::string& path) {
  if (typeOfFile(path) != std::filesystem::file_type::regular) return false;
  std::error_code error;
  return std::filesystem::file_size(path, error) > 0;
}

}  // namespace

// What has become of the values.
struct Salvage::Yield {
  std::size_t kept = 0;                   // with their rows
  std::size_t adopted = 0;                // without one
  std::size_t lost = 0;                   // that are known
  std::vector<std::string> unreadable{};  // files that are not what their names say
};

Salvage::Salvage(StoreContext& context, StoreManifest& manifest, VersionedFiles& files)
    : context_(context),
      manifest_(manifest),
      files_(files),
      newName_(std::string(kManifestFileName) + "-new"),
      salvagedName_(std::string(kManifestFileName) + "-salvaged") {}

void Salvage::prepareOpening() {
  if (isThere(salvagedName_)) putInPlace();
  if (isThere(newName_)) removeUnfinished();
  if (isMissing() && !files_.found().empty()) salvage("The manifest is missing.");
}

// A file without a byte is a database to SQLite, and an empty one.
bool Salvage::isMissing() const {
  const auto type = typeOfFile(context_.manifestPath);
  return type == std::filesystem::file_type::not_found ||
         (type == std::filesystem::file_type::regular && !isFileWithBytes(context_.manifestPath));
}

void Salvage::recoverOpening(const ManifestPersistenceException& error, int attempt) {
  constexpr int kMostAttempts = 2;
  if (!isNotAManifest(error) && !context_.files->isDirectory(context_.manifestPath)) throw;
  if (attempt >= kMostAttempts) throw;
  if (attempt > 0) salvage(error.what());
}

ManifestRecovery::Outcome Salvage::recoverFromDamage(const StoreLock& /*lock*/, const LarderException& error,
                                                     int attempt) {
  constexpr int kMostAttempts = 2;
  context_.throwIfClosed();
  const auto manifest = manifest_.opened();
  if (attempt >= kMostAttempts || manifest == nullptr) return Outcome::NotRecovered;
  if (attempt == 0 && !isUnderWay_) {
    manifest->release();
  } else {
    salvage(error.what());
  }
  return Outcome::Recovered;
}

ManifestRecovery::Outcome Salvage::recoverFromFailedWrite(const StoreLock& lock,
                                                          const ManifestPersistenceException& error, int attempt) {
  return isNotAManifest(error) ? recoverFromDamage(lock, error, attempt) : Outcome::NotRecovered;
}

void Salvage::prepareReading(const StoreLock& /*lock*/) {
  if (isUnderWay_) finish();
}

void Salvage::prepareChange(const StoreLock& lock) {
  prepareReading(lock);
  const auto manifest = manifest_.opened();
  if (manifest == nullptr || !manifest->hasMoved()) return;
  context_.throwIfClosed();
  if (isMissing()) return salvage("The manifest has vanished.");
  manifest->release();
  manifest->reload();
  errorLine(__LINE__).stream() << "Store \"" << context_.options.name
                               << "\" continues with the manifest that somebody has put in the place of its own.";
}

// Once the new manifest is complete there is no way back: what fails from then on is tried again by the next operation,
// and until then nothing is written to the old one.
void Salvage::salvage(const std::string& reason) {
  if (isUnderWay_) return finish();
  const auto manifest = manifest_.opened();
  if (manifest != nullptr) manifest->suspend();
  Yield yield;
  try {
    makeNew(manifest.get(), yield);
    isUnderWay_ = true;
    context_.files->rename(pathOf(newName_), pathOf(salvagedName_));
  } catch (...) {
    isUnderWay_ = false;
    if (manifest != nullptr) manifest->resume();
    throw;
  }
  report(yield, reason);
  finish();
}

void Salvage::finish() {
  if (isThere(salvagedName_)) putInPlace();
  if (const auto manifest = manifest_.opened()) manifest->reload();
  isUnderWay_ = false;
}

void Salvage::makeNew(DiskCacheManifestInterface* records, Yield& yield) {
  files_.takeStock();
  files_.createDirectory();
  if (isThere(newName_)) removeUnfinished();
  {
    NewManifest rows(pathOf(newName_));
    if (records != nullptr && records->isLoaded()) {
      keepRecords(*records, rows, yield);
    } else {
      keepWhatIsThere(rows, yield);
    }
    rows.complete();
  }
  for (const std::string& name : yield.unreadable) quarantine(name);
}

void Salvage::removeUnfinished() {
  if (typeOfFile(pathOf(newName_)) == std::filesystem::file_type::directory) return quarantine(newName_);
  context_.files->deleteFile(pathOf(newName_));
}

// Those in memory are all there are. The manifest is needed for inline values, and for metadata that nobody has read.
void Salvage::keepRecords(DiskCacheManifestInterface& records, NewManifest& rows, Yield& yield) {
  std::unordered_set<std::string> kept;
  const auto keep = [&](ManifestRow&& row) {
    const auto item = records.getItem(row.item.key);
    if (item == nullptr || item->checksum != row.item.checksum) return;
    if (item->hasInlineData ? !row.inlineData : !isThere(item->filename)) return;
    row.item = *item;
    rows.add(row);
    kept.insert(item->key);
  };
  if (isFileWithBytes(context_.manifestPath)) readDamagedManifest(context_.manifestPath, keep);
  for (const std::string& key : records.getAllKeys()) {
    if (kept.count(key) > 0) continue;
    const auto item = records.getItem(key);
    if (item->hasInlineData || !isThere(item->filename)) {
      ++yield.lost;
      continue;
    }
    const auto& metadata = item->extendedMetadata;
    rows.add({*item, std::nullopt, metadata == nullptr ? std::nullopt : std::make_optional(metadata->serialize())});
    kept.insert(key);
  }
  yield.kept = kept.size();
}

// Rows that can be read and have a value, and then files that tell whose they are.
void Salvage::keepWhatIsThere(NewManifest& rows, Yield& yield) {
  std::unordered_set<std::string> kept;
  std::unordered_set<std::string> named;
  StoreTime time;
  const auto keep = [&](ManifestRow&& row) {
    const auto version = VersionedName::parse(row.item.filename);
    const bool isOthers = row.item.checksum && version && version->key && *version->key != row.item.key;
    if (row.item.hasInlineData ? !row.inlineData : isOthers || !isThere(row.item.filename)) return;
    rows.add(row);
    time.noteDateOf(row.item);
    kept.insert(row.item.key);
    named.insert(row.item.filename);
  };
  if (isFileWithBytes(context_.manifestPath)) readDamagedManifest(context_.manifestPath, keep);
  yield.kept = kept.size();

  auto files = files_.found();
  const auto now = static_cast<std::int32_t>(time.now());
  for (auto file = files.rbegin(); file != files.rend(); ++file) {  // the latest of a key first
    const auto& key = file->version.key;
    if (named.count(file->name) > 0 || (key && kept.count(*key) > 0)) continue;
    const auto size = files_.sizeIfIntact(*file);
    if (!size) {
      yield.unreadable.push_back(file->name);
      continue;
    }
    DiskCacheItem item(*key, file->name, *size, false, now, now, nullptr);
    item.checksum = file->version.checksum;
    rows.add({item, std::nullopt, std::nullopt});
    kept.insert(*key);
    ++yield.adopted;
  }
}

// SQLite's own files first: beside another manifest they would damage it.
void Salvage::putInPlace() {
  for (const char* suffix : {"-wal", "-shm", "-journal", ""}) {
    const std::string name = std::string(kManifestFileName) + suffix;
    if (isThere(name)) quarantine(name);
  }
  context_.files->sync(context_.options.directory);
  context_.files->rename(pathOf(salvagedName_), context_.manifestPath);
  context_.files->sync(context_.options.directory);
}

// A relaxed store may have had a file of that name.
std::string Salvage::quarantineDirectory() {
  std::string directory = pathOf(kQuarantine);
  for (int i = 1; context_.files->pathExists(directory) && !context_.files->isDirectory(directory); ++i) {
    directory = pathOf(kQuarantine) + "." + std::to_string(i);
  }
  context_.files->createDirectory(directory, false);
  return directory;
}

void Salvage::quarantine(const std::string& name) {
  const std::string directory = quarantineDirectory();
  std::string place = context_.files->combinePath(directory, name);
  for (int i = 1; context_.files->pathExists(place); ++i) {
    place = context_.files->combinePath(directory, name + "." + std::to_string(i));
  }
  context_.files->rename(pathOf(name), place);
}

void Salvage::report(const Yield& yield, const std::string& reason) {
  const std::string text =
      "Store \"" + context_.options.name + "\" salvaged: " + std::to_string(yield.kept) + " records kept, " +
      std::to_string(yield.adopted) + " values adopted by the names of their files, " + std::to_string(yield.lost) +
      " values known to be lost, " + std::to_string(yield.unreadable.size()) + " files quarantined. " + reason;
  errorLine(__LINE__).stream() << text;
  context_.report({Incident::Kind::StoreSalvaged, context_.options.name, "", text});
  if (yield.unreadable.empty()) return;
  context_.report(
      {Incident::Kind::ValuesQuarantined, context_.options.name, "",
       std::to_string(yield.unreadable.size()) + " files that are not what their names say: " + pathOf(kQuarantine)});
}

bool Salvage::isThere(const std::string& name) const {
  return typeOfFile(pathOf(name)) != std::filesystem::file_type::not_found;
}

std::string Salvage::pathOf(const std::string& name) const {
  return context_.files->combinePath(context_.options.directory, name);
}

}  // namespace velmora::mobile::xplat::cellar
