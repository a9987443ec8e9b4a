#include "harness/StoreDirectory.h"

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <system_error>

#include "AttributeStore.h"
#include "harness/ManifestFile.h"

namespace velmora::mobile::xplat::cellar::fuzz {

namespace {

namespace fs = std::filesystem;

constexpr int kMostEntries = 16;
const std::string kManifest = "manifest_v1.sqlite";

// A name that stays in its directory; empty when there is none in the text.
std::string nameFrom(ByteReader& input) {
  std::string name = input.text();
  name.resize(std::min<std::size_t>(name.size(), 100));
  std::replace(name.begin(), name.end(), '/', '_');
  std::replace(name.begin(), name.end(), '\0', '_');
  return name == "." || name == ".." ? "" : name;
}

void writeFile(const Scratch& scratch, const std::string& name, const std::string& bytes) {
  std::error_code ignored;
  if (!fs::exists(fs::symlink_status(scratch.file(name), ignored))) (void)scratch.write(name, bytes);
}

// One target for each, so that no two names lead to one file.
void plantLink(const Scratch& scratch, const std::string& name, std::size_t number) {
  std::error_code ignored;
  fs::create_symlink("../outside/" + std::to_string(number), scratch.file("store/" + name), ignored);
}

ManifestFile::Value valueFrom(ByteReader& input) {
  const std::uint8_t type = input.byte();
  switch (type % 5) {
    case 0:
      return {'i', input.integer<std::int32_t>(), ""};
    case 1:
      return {'i', input.integer<std::int64_t>(), ""};
    case 2:
      return {'t', 0, input.text()};
    case 3:
      return {'b', 0, input.text()};
    default:
      return {type < 128 ? 'n' : 'r', type, ""};
  }
}

// Records that a store may have written are those whose text is both key and filename.
std::string plantRecord(const std::string& path, ByteReader& input) {
  std::vector<ManifestFile::Value> values(8);
  values[0] = {'t', 0, input.text()};
  for (std::size_t i = 1; i < values.size(); ++i) values[i] = valueFrom(input);
  if (values[1].type == 'n') values[1] = values[0];
  std::error_code failed;
  if (fs::exists(path, failed) && !fs::is_regular_file(path, failed)) return values[0].bytes;
  ManifestFile file(path);
  (void)file.exec("PRAGMA page_size = 512; PRAGMA synchronous = OFF");
  (void)file.exec(kCurrentTable);
  (void)file.exec("INSERT OR REPLACE INTO LarderManifest VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8)", values);
  return values[0].bytes;
}

void addEntry(const Scratch& scratch, StoreDirectory& store, ByteReader& input) {
  static const char* const companions[] = {"-wal", "-shm", "-journal"};
  const std::string directory = "store/";
  const int kind = input.byte() % 8;
  if (kind == 4) return writeFile(scratch, directory + kManifest, input.longText());
  if (kind == 5) return writeFile(scratch, directory + AttributeStore::fileName, input.longText());
  if (kind == 6) {
    const char* const companion = companions[input.byte() % 3];
    return writeFile(scratch, directory + kManifest + companion, input.longText());
  }
  if (kind == 7) return store.names.push_back(plantRecord(store.path + "/" + kManifest, input));
  const std::string name = nameFrom(input);
  if (name.empty()) return;
  store.names.push_back(name);
  std::error_code ignored;
  if (kind < 2) writeFile(scratch, directory + name, input.text());
  if (kind == 2) fs::create_directory(scratch.file(directory + name), ignored);
  if (kind == 3) plantLink(scratch, name, store.names.size());
}

// By a copy: looking at a database may change it.
void judge(const Scratch& scratch, StoreDirectory& store) {
  const fs::path copy = scratch.makeDirectory("copy");
  for (const char* suffix : {"", "-wal", "-journal"}) {
    const fs::path from = store.path + "/" + kManifest + suffix;
    std::error_code missing;
    if (!fs::is_regular_file(from, missing)) {
      if (fs::exists(from, missing)) store.isSound = false;
      continue;
    }
    copyFile(from.string(), (copy / from.filename()).string());
  }
  const std::string path = (copy / kManifest).string();
  if (!fs::exists(path) || !store.isSound) return;
  ManifestFile file(path);
  store.isSound = file.isSound();
  store.namesAgree = file.hasFilesNamedAfterKeys();
}

}  // namespace

StoreDirectory buildStoreDirectory(const Scratch& scratch, ByteReader& input) {
  StoreDirectory store;
  store.path = scratch.makeDirectory("store");
  scratch.makeDirectory("outside");
  const int count = std::min<int>(input.byte(), kMostEntries);
  for (int i = 0; i < count && !input.atEnd(); ++i) addEntry(scratch, store, input);
  judge(scratch, store);
  return store;
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
