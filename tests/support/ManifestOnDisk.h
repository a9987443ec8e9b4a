#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <string>

#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar::test {

inline const std::string kManifestName = "manifest_v1.sqlite";

// A manifest as it lies on disk, by a connection that shares no code with the library.
class ManifestOnDisk {
 public:
  struct Row {
    std::string filename;
    std::uint32_t size = 0;
    bool isInline = false;
    Bytes inlineData;
    std::int64_t modificationDate = 0;
    std::int64_t lastAccessDate = 0;
  };

  // Not there before the store has needed it: no rows.
  explicit ManifestOnDisk(const std::string& storePath) {
    if (!std::filesystem::exists(storePath + "/" + kManifestName)) return;
    EXPECT_EQ(sqlite3_open((storePath + "/" + kManifestName).c_str(), &database_), SQLITE_OK);
  }
  ManifestOnDisk(const ManifestOnDisk&) = delete;
  ManifestOnDisk& operator=(const ManifestOnDisk&) = delete;
  ~ManifestOnDisk() { sqlite3_close(database_); }

  std::map<std::string, Row> rows() const {
    std::map<std::string, Row> rows;
    if (database_ == nullptr) return rows;
    sqlite3_stmt* statement = nullptr;
    const char* sql =
        "SELECT key, filename, size, has_inline_data, inline_data, modification_date, last_access_date "
        "FROM LarderManifest";
    EXPECT_EQ(sqlite3_prepare_v2(database_, sql, -1, &statement, nullptr), SQLITE_OK) << sqlite3_errmsg(database_);
    while (statement != nullptr && sqlite3_step(statement) == SQLITE_ROW) {
      const auto bytes = [&](int column) {
        const auto* begin = static_cast<const unsigned char*>(sqlite3_column_blob(statement, column));
        return begin == nullptr ? Bytes() : Bytes(begin, begin + sqlite3_column_bytes(statement, column));
      };
      const Bytes key = bytes(0);
      const Bytes filename = bytes(1);
      rows[std::string(key.begin(), key.end())] = {std::string(filename.begin(), filename.end()),
                                                   static_cast<std::uint32_t>(sqlite3_column_int64(statement, 2)),
                                                   sqlite3_column_int(statement, 3) != 0,
                                                   bytes(4),
                                                   sqlite3_column_int64(statement, 5),
                                                   sqlite3_column_int64(statement, 6)};
    }
    sqlite3_finalize(statement);
    return rows;
  }

  void setLastAccessDate(const std::string& key, std::int64_t date) const {
    const std::string sql =
        "UPDATE LarderManifest SET last_access_date = " + std::to_string(date) + " WHERE key = '" + key + "'";
    EXPECT_EQ(sqlite3_exec(database_, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(database_);
  }

 private:
  sqlite3* database_ = nullptr;
};

// Value files by name; the manifest's own files are left out.
inline std::map<std::string, std::vector<unsigned char>> valueFiles(const std::string& storePath) {
  std::map<std::string, std::vector<unsigned char>> files;
  for (const auto& entry : std::filesystem::directory_iterator(storePath)) {
    const std::string name = entry.path().filename().string();
    if (name.rfind(kManifestName, 0) == 0) continue;
    std::ifstream stream(entry.path(), std::ios::binary);
    files[name] = {std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>()};
  }
  return files;
}

}  // namespace velmora::mobile::xplat::cellar::test
