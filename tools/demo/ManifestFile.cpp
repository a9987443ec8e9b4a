#include "demo/ManifestFile.h"

#include <sqlite3.h>

#include <stdexcept>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Statement = std::unique_ptr<sqlite3_stmt, int (*)(sqlite3_stmt*)>;

[[noreturn]] void fail(sqlite3* database) {
  throw std::runtime_error(std::string("cannot use the manifest: ") + sqlite3_errmsg(database));
}

std::shared_ptr<sqlite3> open(const std::string& path) {
  sqlite3* database = nullptr;
  const int result = sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE, nullptr);
  std::shared_ptr<sqlite3> owner(database, sqlite3_close);
  if (result != SQLITE_OK) fail(database);
  return owner;
}

Statement prepare(sqlite3* database, const char* text) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(database, text, -1, &statement, nullptr) != SQLITE_OK) fail(database);
  return {statement, sqlite3_finalize};
}

// False when there are no more rows.
bool step(sqlite3* database, const Statement& statement) {
  const int result = sqlite3_step(statement.get());
  if (result != SQLITE_ROW && result != SQLITE_DONE) fail(database);
  return result == SQLITE_ROW;
}

std::string textOf(const Statement& row, int column) {
  const void* const text = sqlite3_column_blob(row.get(), column);
  return {static_cast<const char*>(text), static_cast<std::size_t>(sqlite3_column_bytes(row.get(), column))};
}

}  // namespace

ManifestFile::ManifestFile(const std::string& storeDirectory)
    : database_(open(storeDirectory + "/manifest_v1.sqlite")) {}

std::map<std::string, ManifestFile::Row> ManifestFile::rowsByKey() {
  std::map<std::string, Row> rows;
  const Statement row =
      prepare(database_.get(),
              "SELECT key, filename, size, has_inline_data, length(inline_data), modification_date, last_access_date "
              "FROM LarderManifest");
  while (step(database_.get(), row)) {
    rows[textOf(row, 0)] = {textOf(row, 1),
                            sqlite3_column_int64(row.get(), 2),
                            sqlite3_column_int(row.get(), 3) != 0,
                            sqlite3_column_int64(row.get(), 4),
                            sqlite3_column_int64(row.get(), 5),
                            sqlite3_column_int64(row.get(), 6)};
  }
  return rows;
}

void ManifestFile::setLastAccessDates(const std::map<std::string, std::int64_t>& dates) {
  execute("BEGIN");
  const Statement update = prepare(database_.get(), "UPDATE LarderManifest SET last_access_date = ?2 WHERE key = ?1");
  for (const auto& [key, date] : dates) {
    sqlite3_bind_text(update.get(), 1, key.data(), static_cast<int>(key.size()), SQLITE_STATIC);
    sqlite3_bind_int64(update.get(), 2, date);
    step(database_.get(), update);
    sqlite3_reset(update.get());
  }
  execute("COMMIT");
}

void ManifestFile::execute(const char* statement) { step(database_.get(), prepare(database_.get(), statement)); }

}  // namespace velmora::mobile::xplat::cellar::tools
