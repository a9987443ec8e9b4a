#include "harness/RootDirectory.h"

#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <system_error>

#include "EncodedFileName.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "harness/ManifestFile.h"
#include "storage/SafeFiles.h"
#include "storage/StoreFiles.h"

namespace velmora::mobile::xplat::cellar::fuzz {

const std::string kKeyOutside = "the key of a record outside";

namespace {

namespace fs = std::filesystem;

constexpr int kMostEntries = 32;
constexpr int kKinds = 9;
constexpr std::size_t kLongestKey = 60;  // that is encoded in a name
const std::string kManifest = "manifest_v1.sqlite";

const std::vector<std::string> kDirectories = {"caches/_sessionlessStore/s_v1",
                                               "caches/_sessionlessStore/t_en_US_v2",
                                               "caches/_sessionlessStore",
                                               "caches/_store_al%1bce/s_v1",
                                               "",
                                               "caches",
                                               "documents/_store_bob/u_v1",
                                               "_cellar_accounts/of_bob/caches/_sessionlessStore/s_v1",
                                               "trash",
                                               "_cellar_quarantine",
                                               "caches/_cellar_quarantine/_sessionlessStore/s_v1",
                                               "caches/_sessionlessStore/s_v1/quarantine",
                                               "caches/_sessionlessStore/tmp",
                                               "\x1b[2J/_store_\xff/\xe2\x80\xae_v1"};

const std::vector<std::string> kNames = {"a",
                                         "letter%20one",
                                         kManifest,
                                         kManifest + "-wal",
                                         kManifest + "-shm",
                                         kManifest + "-journal",
                                         kManifest + "-new",
                                         kManifest + "-salvaged",
                                         "_cellar_extended_attributes",
                                         "_cellar_lock",
                                         "_cellar_quarantine",
                                         "quarantine",
                                         "_sessionlessStore",
                                         "_store_x",
                                         "s_v1",
                                         "s_v2",
                                         "caches",
                                         "trash",
                                         "tmp",
                                         "a.2.00000000",
                                         "a.3.00000000.part",
                                         "\x1b]0;x\x07"};

const std::array<const char*, 12> kStatements = {
    "CREATE TRIGGER \"\x1b[m\" AFTER DELETE ON LarderManifest BEGIN DELETE FROM LarderManifest; END",
    "CREATE VIEW v AS SELECT * FROM LarderManifest",
    "UPDATE LarderManifest SET filename = '../../../../../outside/file'",
    "UPDATE LarderManifest SET filename = '../s_v1/a'",
    "UPDATE LarderManifest SET filename = x'00ff61', size = 'x'",
    "UPDATE LarderManifest SET key = x'1b5b6d00'",
    "UPDATE LarderManifest SET size = -1, last_access_date = 9223372036854775807",
    "UPDATE LarderManifest SET has_inline_data = 2, inline_data = 7",
    "PRAGMA journal_mode = WAL",
    "PRAGMA writable_schema = ON; UPDATE sqlite_master SET rootpage = 1",
    "DROP TABLE LarderManifest",
    "INSERT INTO LarderManifest (key, filename) SELECT key || '2', filename FROM LarderManifest"};

// One that stays in its directory; empty when there is none in the text.
std::string nameFrom(ByteReader& input) {
  const std::size_t number = input.byte();
  if (number < kNames.size()) return kNames[number];
  std::string name = input.text();
  std::replace(name.begin(), name.end(), '/', '_');
  std::replace(name.begin(), name.end(), '\0', '_');
  return name == "." || name == ".." ? "" : name;
}

bool isFile(const std::string& path) {
  std::error_code ignored;
  return fs::is_regular_file(fs::symlink_status(path, ignored));
}

bool isFree(const std::string& path) {
  std::error_code ignored;
  return fs::symlink_status(path, ignored).type() == fs::file_type::not_found;
}

void write(const std::string& path, const std::string& bytes) {
  if (isFree(path)) std::ofstream(path, std::ios::binary) << bytes;
}

class Builder {
 public:
  Builder(const Scratch& scratch, ByteReader& input) : input_(input) {
    root_.path = scratch.makeDirectory("place/root");
    root_.outside = scratch.makeDirectory("outside");
    scratch.makeDirectory("outside/store_v1");
    (void)scratch.write("outside/file", "not yours");
    (void)scratch.write("outside/store_v1/file", "nor this");
    putRecord(root_.outside + "/store_v1", {kKeyOutside, "file", 8, false, 1, 1, nullptr}, Durability::Relaxed, "");
  }

  RootDirectory build() {
    const int count = std::min<int>(input_.byte(), kMostEntries);
    for (int i = 0; i < count && !input_.atEnd(); ++i) add();
    return root_;
  }

 private:
  void add() {
    const int kind = input_.byte() % kKinds;
    const std::string directory = directoryFrom();
    if (kind == 5) return addRecords(directory);
    if (kind == 6) return runStatement(directory + "/" + kManifest);
    const std::string name = nameFrom(input_);
    if (!name.empty()) addNamed(kind, directory + "/" + name);
  }

  std::string directoryFrom() {
    const std::uint8_t byte = input_.byte();
    std::string path = root_.path + "/" + kDirectories[(byte & 127U) % kDirectories.size()];
    if (byte >= 128) path += "/" + nameFrom(input_);
    std::error_code ignored;
    fs::create_directories(path, ignored);
    return path;
  }

  void addNamed(int kind, const std::string& path) {
    std::error_code ignored;
    if (kind == 0) write(path, input_.longText());
    if (kind == 1) fs::create_directory(path, ignored);
    if (kind == 2) fs::create_symlink(targetFrom(path), path, ignored);
    if (kind == 3) (void)mkfifo(path.c_str(), S_IRUSR | S_IWUSR);
    if (kind == 4) addHardLink(path);
    if (kind == 7) damage(path);
    if (kind == 8 && !isFree(path) && !fs::is_symlink(path, ignored)) root_.unreadable.push_back(path);
  }

  // Nothing is beyond the scratch directory.
  std::string targetFrom(const std::string& path) {
    const std::array<std::string, 8> targets = {"a",
                                                ".",
                                                fs::path(path).filename().string(),
                                                root_.path,
                                                root_.outside,
                                                root_.outside + "/file",
                                                root_.outside + "/store_v1",
                                                root_.outside + "/store_v1/" + kManifest};
    return targets[input_.byte() % targets.size()];
  }

  void addHardLink(const std::string& path) {
    const std::string target = input_.byte() % 2 == 0 ? "/file" : "/store_v1/" + kManifest;
    std::error_code failed;
    fs::create_hard_link(root_.outside + target, path, failed);
    root_.hasHardLinks = root_.hasHardLinks || !failed;
  }

  void runStatement(const std::string& path) {
    const char* const statement = kStatements[input_.byte() % kStatements.size()];
    if (isFile(path) && fs::hard_link_count(path) == 1) (void)ManifestFile(path).exec(statement);
  }

  void damage(const std::string& path) {
    const std::uint8_t kind = input_.byte();
    const auto place = input_.integer<std::uint16_t>();
    if (!isFile(path) || fs::hard_link_count(path) > 1) return;
    if (kind % 2 == 0) return fs::resize_file(path, place);
    std::fstream stream(path, std::ios::binary | std::ios::in | std::ios::out);
    (void)stream.seekp(place).put(static_cast<char>(kind));
  }

  // Whether they are a safe store's and their count (one byte), then for each flags (one byte), key and value, and the
  // name of the file where that is another one.
  void addRecords(const std::string& directory) {
    const std::uint8_t options = input_.byte();
    const Durability durability = options >= 128 ? Durability::Safe : Durability::Relaxed;
    for (int i = 0; i < options % 8 && !input_.atEnd(); ++i) addRecord(directory, durability, i);
  }

  void addRecord(const std::string& directory, Durability durability, int number) {
    const std::uint8_t flags = input_.byte();
    const auto isSet = [flags](unsigned bit) { return ((static_cast<unsigned>(flags) >> bit) & 1U) != 0; };
    const std::string key = input_.text().substr(0, kLongestKey);
    const std::string value = input_.text();
    DiskCacheItem item(key, key, static_cast<std::uint32_t>(value.size()), isSet(0), number, number, nullptr);
    const std::uint32_t checksum = tools::checksumOf(key, bytesOf(value)) + (isSet(1) ? 1 : 0);
    if (durability == Durability::Safe) {
      std::array<char, 32> suffix{};
      (void)std::snprintf(suffix.data(), suffix.size(), ".%d.%08x", number, checksum);
      item.filename = encodeFileName(key) + suffix.data();
      if (!isSet(2)) item.checksum = checksum;
    }
    if (isSet(3)) item.filename = nameFrom(input_);
    if (isSet(4)) item.size += 1;
    if (isSet(5)) item.size = 0;
    putRecord(directory, item, durability, value);
    const bool hasFile = !item.hasInlineData && !isSet(6) && item.filename.find('/') == std::string::npos;
    if (hasFile) write(directory + "/" + item.filename, value);
  }

  static void putRecord(const std::string& directory, const DiskCacheItem& item, Durability durability,
                        const std::string& value) {
    const std::string path = directory + "/" + kManifest;
    if (!isFree(path) && (!isFile(path) || fs::hard_link_count(path) > 1)) return;
    try {
      SQLiteManifestPersistence manifest(path, nullptr, nullptr, durability);
      const std::vector<unsigned char> bytes = bytesOf(value);
      manifest.storeItem(item, item.hasInlineData ? &bytes : nullptr);
    } catch (const LarderException&) {
      // Something else is in its place, or it is damaged already.
    }
  }

  ByteReader& input_;
  RootDirectory root_;
};

}  // namespace

std::set<FileNumber> filesOfSoundRecords(const Scratch& scratch, const Tree& tree) {
  std::set<FileNumber> files;
  for (const auto& [path, manifest] : tree) {
    if (!manifest.isFile || fs::path(path).filename() != kManifest) continue;
    const std::string copy = scratch.makeDirectory("copy") + "/" + kManifest;
    for (const char* suffix : {"", "-wal", "-journal"}) {
      const auto part = tree.find(path + suffix);
      if (part != tree.end() && part->second.isFile) write(copy + suffix, part->second.content);
    }
    for (const std::string& name : ManifestFile(copy).filesOfRecords()) {
      const auto file = tree.find(fs::path(path).parent_path().string() + "/" + name);
      const bool isValue = file != tree.end() && file->second.isFile && !tools::isManifestFile(name);
      if (isValue) files.insert(file->second.number);
    }
    fs::remove_all(scratch.file("copy"));
  }
  return files;
}

RootDirectory buildRoot(const Scratch& scratch, ByteReader& input) { return Builder(scratch, input).build(); }

}  // namespace velmora::mobile::xplat::cellar::fuzz
