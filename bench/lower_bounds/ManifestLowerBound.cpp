#include "lower_bounds/ManifestLowerBound.h"

#include <stdexcept>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr const char* kScript =
    "PRAGMA journal_mode = WAL;"
    "PRAGMA synchronous = NORMAL;"
    "CREATE TABLE IF NOT EXISTS LarderManifest ("
    "key               TEXT,   "
    "filename          TEXT,   "
    "size              INTEGER,   "
    "has_inline_data   BOOLEAN,   "
    "inline_data       BLOB,   "
    "modification_date INTEGER,   "
    "last_access_date  INTEGER,   "
    "extended_manifest BLOB,   "
    "PRIMARY KEY(key));"
    "CREATE INDEX IF NOT EXISTS last_access_date_idx   ON LarderManifest(last_access_date);";

constexpr const char* kPut =
    "INSERT OR REPLACE INTO LarderManifest("
    "key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  extended_manifest )"
    "VALUES  (?1, ?2, ?3, ?4, ?5, ?6, ?7);";
constexpr const char* kPutValue =
    "UPDATE   LarderManifest SET   has_inline_data = 1,  inline_data = ?2 WHERE   key = ?1;";
constexpr const char* kBegin = "BEGIN IMMEDIATE;";
constexpr const char* kCommit = "COMMIT;";
constexpr const char* kRemove = "DELETE FROM LarderManifest WHERE key = ?1;";

void bindRecord(Statement& statement, const std::string& key, std::size_t size, std::int32_t date) {
  statement.text(1, key)
      .text(2, key)
      .number(3, static_cast<long long>(size))
      .number(4, 0)
      .number(5, date)
      .number(6, date);
}

}  // namespace

ManifestLowerBound::ManifestLowerBound(const std::string& directory) : database_(directory + "/manifest_v1.sqlite") {
  database_.exec(kScript);
}

void ManifestLowerBound::inTransaction(const std::function<void()>& writes) {
  keepsStatements_ = true;
  statement(kBegin).next();
  writes();
  statement(kCommit).next();
}

// Prepared, or reset.
Statement& ManifestLowerBound::statement(const char* sql) {
  auto& statement = statements_[sql];
  if (statement == nullptr || !keepsStatements_) {
    statement = nullptr;
    statement = std::make_unique<Statement>(database_, sql);
  } else {
    statement->reset();
  }
  return *statement;
}

void ManifestLowerBound::put(const std::string& key, std::size_t size, std::int32_t date) {
  Statement& put = statement(kPut);
  bindRecord(put, key, size, date);
  put.next();
}

void ManifestLowerBound::putValue(const std::string& key, const Bytes& value) {
  statement(kPutValue).text(1, key).blob(2, value).next();
}

Bytes ManifestLowerBound::value(const std::string& key) {
  Statement statement(database_, "SELECT  inline_data FROM  LarderManifest WHERE  has_inline_data IS 1 AND  key = ?1");
  if (!statement.text(1, key).next()) throw std::runtime_error("no record of " + key);
  return statement.blob(0);
}

void ManifestLowerBound::remove(const std::string& key) { statement(kRemove).text(1, key).next(); }

void ManifestLowerBound::fill(std::size_t count, std::size_t size) {
  database_.exec("PRAGMA cache_size = -500000");  // in KiB: all of it
  database_.exec("BEGIN");
  {
    Statement statement(database_, kPut);
    for (std::size_t number = 0; number < count; ++number) {
      const std::string key = keyOf(number);
      bindRecord(statement, key, size, dateOf(number));
      statement.next();
      statement.reset();
    }
  }
  database_.exec("COMMIT");
  database_.exec("PRAGMA wal_checkpoint(TRUNCATE)");
}

std::int32_t dateOf(std::size_t number) {
  constexpr std::int32_t start = 1'600'000'000;
  return start + static_cast<std::int32_t>(number);
}

}  // namespace velmora::mobile::xplat::cellar::bench
