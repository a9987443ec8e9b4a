#include "lower_bounds/SQLite.h"

#include <sqlite3.h>

#include <stdexcept>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

void throwUnlessSuccess(sqlite3* database, int resultCode) {
  if (resultCode == SQLITE_OK || resultCode == SQLITE_ROW || resultCode == SQLITE_DONE) return;
  throw std::runtime_error(sqlite3_errmsg(database));
}

}  // namespace

Database::Database(const std::string& path) {
  const int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX;
  throwUnlessSuccess(database_, sqlite3_open_v2(path.c_str(), &database_, flags, nullptr));
}

Database::~Database() { sqlite3_close(database_); }

void Database::exec(const char* sql) {
  throwUnlessSuccess(database_, sqlite3_exec(database_, sql, nullptr, nullptr, nullptr));
}

Statement::Statement(const Database& database, const char* sql) : database_(database.get()) {
  check(sqlite3_prepare_v2(database_, sql, -1, &statement_, nullptr));
}

Statement::~Statement() { sqlite3_finalize(statement_); }

Statement& Statement::text(int index, const std::string& value) {
  check(sqlite3_bind_text(statement_, index, value.data(), static_cast<int>(value.size()), SQLITE_STATIC));
  return *this;
}

Statement& Statement::number(int index, long long value) {
  check(sqlite3_bind_int64(statement_, index, value));
  return *this;
}

Statement& Statement::blob(int index, const Bytes& value) {
  check(sqlite3_bind_blob(statement_, index, value.data(), static_cast<int>(value.size()), SQLITE_STATIC));
  return *this;
}

bool Statement::next() {
  const int resultCode = sqlite3_step(statement_);
  check(resultCode);
  return resultCode == SQLITE_ROW;
}

Bytes Statement::blob(int column) const {
  const auto* const first = static_cast<const unsigned char*>(sqlite3_column_blob(statement_, column));
  return {first, first + sqlite3_column_bytes(statement_, column)};
}

std::string Statement::text(int column) const {
  const auto* const first = static_cast<const char*>(sqlite3_column_blob(statement_, column));
  return {first, static_cast<std::size_t>(sqlite3_column_bytes(statement_, column))};
}

long long Statement::number(int column) const { return sqlite3_column_int64(statement_, column); }

void Statement::reset() { check(sqlite3_reset(statement_)); }

void Statement::check(int resultCode) const { throwUnlessSuccess(database_, resultCode); }

}  // namespace velmora::mobile::xplat::cellar::bench
