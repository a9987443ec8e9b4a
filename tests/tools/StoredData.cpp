#include "tools/StoredData.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>

namespace velmora::mobile::xplat::cellar::test {

namespace fs = std::filesystem;

namespace {

const char* const kManifest = "/manifest_v1.sqlite";

std::string text(const timespec& date) { return std::to_string(date.tv_sec) + "." + std::to_string(date.tv_nsec); }

// The directory itself and all below it, listed without moving an access date: the test owns what it made.
std::vector<std::string> entriesBelow(const std::string& directory) {
  std::vector<std::string> entries = {directory};
  const int file = open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOATIME | O_CLOEXEC);
  EXPECT_GE(file, 0) << directory;
  DIR* const stream = fdopendir(file);
  while (const dirent* const found = readdir(stream)) {
    const std::string name = found->d_name;
    if (name == "." || name == "..") continue;
    const std::string path = directory + "/" + name;
    const bool isDirectory = fs::is_directory(fs::symlink_status(path));
    const auto inner = isDirectory ? entriesBelow(path) : std::vector<std::string>{path};
    entries.insert(entries.end(), inner.begin(), inner.end());
  }
  closedir(stream);
  return entries;
}

}  // namespace

void StoredData::makeStore(const std::string& store) {
  fs::create_directories(path(store));
  const SQLiteManifestPersistence manifest(path(store) + kManifest, nullptr, nullptr);
}

void StoredData::putRecord(const std::string& store, const DiskCacheItem& item) {
  fs::create_directories(path(store));
  SQLiteManifestPersistence(path(store) + kManifest, nullptr, nullptr).setItem(item);
}

void StoredData::putFile(const std::string& below, const std::string& bytes) {
  directory_.write("root/" + below, bytes);
}

void StoredData::putItem(const std::string& store, const std::string& key, const std::string& value, std::int32_t age) {
  putRecord(store, {key, key, static_cast<std::uint32_t>(value.size()), false, kNow - age, kNow - age, nullptr});
  putFile(store + "/" + key, value);
}

void StoredData::putInline(const std::string& store, const std::string& key, const std::string& value,
                           std::int32_t age) {
  putRecord(store, {key, key, static_cast<std::uint32_t>(value.size()), false, kNow - age, kNow - age, nullptr});
  SQLiteManifestPersistence manifest(path(store) + kManifest, nullptr, nullptr);
  manifest.setInlineData(key, {value.begin(), value.end()});
}

void StoredData::run(const std::string& store, const std::string& script) const {
  sqlite3* database = nullptr;
  ASSERT_EQ(sqlite3_open((path(store) + kManifest).c_str(), &database), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(database, script.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(database);
  sqlite3_close(database);
}

void StoredData::killWhileWriting(const std::string& store, const std::string& key) {
  const std::string manifest = path(store) + kManifest;
  const std::string copy = directory_.makeDirectory("killed") + kManifest;
  {
    SQLiteManifestPersistence open(manifest, nullptr, nullptr);
    open.setItem({key, key, 0, false, kNow, kNow, nullptr});
    fs::copy(manifest, copy);
    fs::copy(manifest + "-wal", copy + "-wal");
  }
  fs::rename(copy, manifest);
  fs::rename(copy + "-wal", manifest + "-wal");
}

std::vector<std::string> StoredData::rows(const std::string& store) const {
  std::vector<std::string> rows;
  sqlite3* database = nullptr;
  EXPECT_EQ(sqlite3_open((path(store) + kManifest).c_str(), &database), SQLITE_OK);
  const auto collect = [](void* target, int, char** values, char**) {
    static_cast<std::vector<std::string>*>(target)->emplace_back(values[0]);
    return 0;
  };
  EXPECT_EQ(sqlite3_exec(database,
                         "SELECT key || ' ' || size || ' ' || has_inline_data || ' ' || "
                         "ifnull(length(inline_data), '-') FROM LarderManifest ORDER BY key",
                         collect, &rows, nullptr),
            SQLITE_OK);
  sqlite3_close(database);
  return rows;
}

void StoredData::makeReadingVisible() const {
  for (const std::string& entry : entriesBelow(root())) {
    const timespec dates[2] = {{kNow, 0}, {kNow + 1, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, entry.c_str(), static_cast<const timespec*>(dates), AT_SYMLINK_NOFOLLOW), 0);
  }
}

std::vector<std::string> StoredData::trace() const {
  std::vector<std::string> lines;
  for (const std::string& entry : entriesBelow(root())) {
    struct stat status = {};
    EXPECT_EQ(lstat(entry.c_str(), &status), 0);
    lines.push_back(entry + " " + std::to_string(status.st_mode) + " " + std::to_string(status.st_ino) + " " +
                    std::to_string(status.st_size) + " " + text(status.st_atim) + " " + text(status.st_mtim) + " " +
                    text(status.st_ctim));
  }
  std::sort(lines.begin(), lines.end());
  return lines;
}

}  // namespace velmora::mobile::xplat::cellar::test
