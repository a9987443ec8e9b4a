#include "SQLiteStore.h"

#include <glog/logging.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>
#include <cstring>
#include <ctime>
#include <exception>
#include <limits>
#include <locale>
#include <sstream>
#include <utility>

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr int attemptsThatMayFail = 4;

void pauseBeforeNextAttempt() {
  timespec left = {0, 30000000};
  while (nanosleep(&left, &left) != 0 && errno == EINTR) continue;
}

bool isSuccess(int resultCode) {
  return resultCode == SQLITE_OK || resultCode == SQLITE_ROW || resultCode == SQLITE_DONE;
}

bool isCorruption(int resultCode) {
  return resultCode == SQLITE_INTERNAL || resultCode == SQLITE_CORRUPT || resultCode == SQLITE_FORMAT ||
         resultCode == SQLITE_NOTADB;
}

// Compiled statements of a connection that no cursor has at the moment, so that the next one with the same text need
// not compile it again. The one that was used last comes last. An idle statement holds no lock and no values.
class IdleStatements {
 public:
  IdleStatements() { statements_.reserve(kMost); }
  IdleStatements(const IdleStatements&) = delete;
  IdleStatements& operator=(const IdleStatements&) = delete;
  ~IdleStatements() { finalizeAll(); }

  // Null when there is none.
  sqlite3_stmt* take(const std::string& sql) {
    const auto hasText = [&](sqlite3_stmt* statement) { return std::strcmp(sqlite3_sql(statement), sql.c_str()) == 0; };
    const auto found = std::find_if(statements_.begin(), statements_.end(), hasText);
    if (found == statements_.end()) return nullptr;
    sqlite3_stmt* const statement = *found;
    statements_.erase(found);
    return statement;
  }

  // It must have been reset.
  void put(sqlite3_stmt* statement) {
    sqlite3_clear_bindings(statement);
    if (statements_.size() == kMost) {
      sqlite3_finalize(statements_.front());
      statements_.erase(statements_.begin());
    }
    statements_.push_back(statement);
  }

  void finalizeAll() {
    for (sqlite3_stmt* const statement : statements_) sqlite3_finalize(statement);
    statements_.clear();
  }

 private:
  static constexpr std::size_t kMost = 8;  // a few kilobytes each, and more than a manifest uses all the time

  std::vector<sqlite3_stmt*> statements_;
};

// Closes a connection of ours. Cursors find its idle statements here, as they know nothing but the connection.
struct ConnectionCloser {
  std::shared_ptr<IdleStatements> idle = std::make_shared<IdleStatements>();

  void operator()(sqlite3* database) const {
    idle->finalizeAll();
    sqlite3_close(database);
  }
};

// Null for a connection that a host has opened itself.
IdleStatements* idleStatementsOf(const std::shared_ptr<sqlite3>& database) {
  const auto* const closer = std::get_deleter<ConnectionCloser>(database);
  return closer != nullptr ? closer->idle.get() : nullptr;
}

// SQLite returns null for a connection without a file, and wants none asked of a null connection.
std::string fileOf(const std::shared_ptr<sqlite3>& database) {
  const char* const file = database != nullptr ? sqlite3_db_filename(database.get(), "main") : nullptr;
  return file != nullptr ? file : "";
}

std::string withFile(const std::string& message, const std::shared_ptr<sqlite3>& database) {
  return message + " (" + fileOf(database) + ")";
}

std::string textOf(int resultCode, const std::string& message) {
  return "SQLite Error #" + std::to_string(resultCode) + ": " + message;
}

// Throws nothing to log it, not even to catch it again: the cursor may be destroyed because of another exception, and
// 32-bit ARM programs do not survive that when the library was optimised at link time.
void logUnfinalized(const std::shared_ptr<sqlite3>& database, int resultCode) {
  const std::string text = textOf(resultCode, withFile(sqlite3_errmsg(database.get()), database));
  LOG(ERROR) << "Could not finalize sqlite3 statement: "
             << (isCorruption(resultCode) ? SQLiteStoreCorruptedException(text, resultCode).what()
                                          : SQLiteStoreException(text, resultCode).what());
}

bool isPresent(const std::string& path, struct stat& status) { return ::stat(path.c_str(), &status) == 0; }

// Opening or reading it may wait for somebody else, who need not ever come.
bool isFifoOrDevice(const struct stat& status) { return !S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode); }

std::string cannotOpen(const std::string& path) { return "Cannot open database: '" + path + "'"; }

void throwIfCompanionMayBlock(const std::string& companion, const std::string& path) {
  struct stat status = {};
  if (!isPresent(companion, status) || !isFifoOrDevice(status)) return;
  throwSQLiteException(SQLITE_CANTOPEN, cannotOpen(path) + ": '" + companion + "' is not a regular file");
}

// The file's name is SQLite's, which has followed links. Beside a database without a byte in it, SQLite removes a log
// or journal without opening it.
void throwIfCompanionsMayBlock(const std::shared_ptr<sqlite3>& database, const std::string& path, bool isEmpty) {
  const std::string file = fileOf(database);
  if (file.empty()) return;
  throwIfCompanionMayBlock(file + "-shm", path);
  if (isEmpty) return;
  throwIfCompanionMayBlock(file + "-wal", path);
  throwIfCompanionMayBlock(file + "-journal", path);
}

// What a file of somebody else may bring along is not run: triggers and views (which may never end), functions with
// effects, changes of the schema behind SQLite's back.
void distrustSchema(sqlite3* database) {
  int* const noAnswer = nullptr;
  for (const int option :
       {SQLITE_DBCONFIG_ENABLE_TRIGGER, SQLITE_DBCONFIG_ENABLE_VIEW, SQLITE_DBCONFIG_TRUSTED_SCHEMA}) {
    sqlite3_db_config(database, option, 0, noAnswer);
  }
  sqlite3_db_config(database, SQLITE_DBCONFIG_DEFENSIVE, 1, noAnswer);
}

// Far more than any statement or table of ours takes.
void limitStatements(sqlite3* database) {
  sqlite3_limit(database, SQLITE_LIMIT_SQL_LENGTH, 1'000'000);
  sqlite3_limit(database, SQLITE_LIMIT_EXPR_DEPTH, 100);
  sqlite3_limit(database, SQLITE_LIMIT_VDBE_OP, 100'000);
  sqlite3_limit(database, SQLITE_LIMIT_LIKE_PATTERN_LENGTH, 100);
  sqlite3_limit(database, SQLITE_LIMIT_ATTACHED, 0);
}

// SQLite counts bytes in an int and takes a negative number for "up to the first zero byte".
int byteLength(const std::shared_ptr<sqlite3>& database, std::size_t size) {
  if (size > static_cast<std::size_t>(std::numeric_limits<int>::max())) {
    throwSQLiteException(SQLITE_TOOBIG, withFile(sqlite3_errstr(SQLITE_TOOBIG), database));
  }
  return static_cast<int>(size);
}

template <class Bytes> Bytes bytesOf(const std::shared_ptr<sqlite3>& database, sqlite3_stmt* statement, int column) {
  const void* const data = sqlite3_column_blob(statement, column);
  if (data == nullptr) {
    throwIfSQLiteError(database, sqlite3_errcode(database.get()));
    return {};
  }
  const auto* const first = static_cast<const typename Bytes::value_type*>(data);
  return Bytes(first, first + sqlite3_column_bytes(statement, column));
}

// What is between the outermost brackets of a CREATE TABLE text.
std::string declarationsOf(std::string createTable) {
  const auto closing = createTable.rfind(')');
  if (closing != std::string::npos) createTable.erase(closing);
  const auto opening = createTable.find('(');
  if (opening != std::string::npos) createTable.erase(0, opening + 1);
  return createTable;
}

bool isColumnType(const std::string& word) {
  static constexpr std::array<const char*, 5> types = {"INTEGER", "REAL", "TEXT", "BOOLEAN", "BLOB"};
  return std::find(types.begin(), types.end(), word) != types.end();
}

std::istringstream classicStream(const std::string& text) {
  std::istringstream stream(text);
  stream.imbue(std::locale::classic());
  return stream;
}

std::vector<SQLiteStoreColumn> columnsDeclaredBy(const std::string& createTable) {
  std::vector<SQLiteStoreColumn> columns;
  std::istringstream declarations = classicStream(declarationsOf(createTable));
  for (std::string declaration; std::getline(declarations, declaration, ',');) {
    std::istringstream words = classicStream(declaration);
    std::string name;
    std::string type;
    words >> name >> type;
    if (isColumnType(type)) columns.emplace_back(name, type);
  }
  return columns;
}

}  // namespace

void throwSQLiteException(int resultCode, const std::string& message) {
  if (isSuccess(resultCode)) return;
  if (isCorruption(resultCode)) throw SQLiteStoreCorruptedException(textOf(resultCode, message), resultCode);
  throw SQLiteStoreException(textOf(resultCode, message), resultCode);
}

void throwIfSQLiteError(const std::shared_ptr<sqlite3>& database, int resultCode) {
  if (isSuccess(resultCode)) return;
  throwSQLiteException(resultCode, withFile(sqlite3_errmsg(database.get()), database));
}

SQLiteStoreCursor::SQLiteStoreCursor(std::shared_ptr<sqlite3> database, const std::string& sql)
    : database_(std::move(database)) {
  if (IdleStatements* const idle = idleStatementsOf(database_)) statement_ = idle->take(sql);
  if (statement_ != nullptr) return;
  throwIfSQLiteError(database_, sqlite3_prepare_v2(database_.get(), sql.c_str(), -1, &statement_, nullptr));
}

SQLiteStoreCursor::~SQLiteStoreCursor() { finalize(); }

SQLiteStoreCursor::SQLiteStoreCursor(SQLiteStoreCursor&& other) noexcept
    : database_(std::move(other.database_)), statement_(std::exchange(other.statement_, nullptr)) {}

SQLiteStoreCursor& SQLiteStoreCursor::operator=(SQLiteStoreCursor&& other) noexcept {
  if (this == &other) return *this;
  finalize();
  database_ = std::move(other.database_);
  statement_ = std::exchange(other.statement_, nullptr);
  return *this;
}

void SQLiteStoreCursor::finalize() noexcept {
  if (statement_ == nullptr) return;
  sqlite3_stmt* const statement = std::exchange(statement_, nullptr);
  IdleStatements* const idle = idleStatementsOf(database_);
  const int resultCode = idle != nullptr ? sqlite3_reset(statement) : sqlite3_finalize(statement);
  if (!isSuccess(resultCode)) logUnfinalized(database_, resultCode);
  if (idle == nullptr) return;
  if (isSuccess(resultCode)) {
    idle->put(statement);
  } else {
    sqlite3_finalize(statement);
  }
}

template <> void SQLiteStoreCursor::bind<std::string>(int index, const std::string& value) {
  const int length = byteLength(database_, value.size());
  throwIfSQLiteError(database_, sqlite3_bind_text(statement_, index, value.data(), length, SQLITE_TRANSIENT));
}

template <> void SQLiteStoreCursor::bind<bool>(int index, const bool& value) {
  throwIfSQLiteError(database_, sqlite3_bind_int(statement_, index, value ? 1 : 0));
}

template <> void SQLiteStoreCursor::bind<unsigned long long>(int index, const unsigned long long& value) {
  throwIfSQLiteError(database_, sqlite3_bind_int64(statement_, index, static_cast<sqlite3_int64>(value)));
}

template <>
void SQLiteStoreCursor::bind<std::vector<unsigned char>>(int index, const std::vector<unsigned char>& value) {
  // An empty vector may have no data, and SQLite takes a null pointer for NULL.
  const void* const data = value.empty() ? static_cast<const void*>("") : value.data();
  const int length = byteLength(database_, value.size());
  throwIfSQLiteError(database_, sqlite3_bind_blob(statement_, index, data, length, SQLITE_TRANSIENT));
}

bool SQLiteStoreCursor::next() {
  const int resultCode = sqlite3_step(statement_);
  throwIfSQLiteError(database_, resultCode);
  return resultCode == SQLITE_ROW;
}

template <> std::string SQLiteStoreCursor::get<std::string>(int column) {
  return bytesOf<std::string>(database_, statement_, column);
}

template <> bool SQLiteStoreCursor::get<bool>(int column) { return sqlite3_column_int(statement_, column) != 0; }

template <> unsigned long long SQLiteStoreCursor::get<unsigned long long>(int column) {
  return static_cast<unsigned long long>(sqlite3_column_int64(statement_, column));
}

template <> std::vector<unsigned char> SQLiteStoreCursor::get<std::vector<unsigned char>>(int column) {
  return bytesOf<std::vector<unsigned char>>(database_, statement_, column);
}

SQLiteStoreColumn::SQLiteStoreColumn(const std::string& name_, const std::string& type_) : name(name_), type(type_) {}

SQLiteStore::SQLiteStore(const std::string& path) : path_(path) {
  struct stat status = {};
  if (isPresent(path_, status) && isFifoOrDevice(status)) throwSQLiteException(SQLITE_NOTADB, cannotOpen(path_));
  const ConnectionCloser closer;
  sqlite3* handle = nullptr;
  const int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX;
  const int resultCode = sqlite3_open_v2(path_.c_str(), &handle, flags, nullptr);
  // A failed open hands out a handle too, which has to be closed like any other.
  database_ = std::shared_ptr<sqlite3>(handle, closer);
  throwSQLiteException(resultCode, cannotOpen(path_));
  throwIfCompanionsMayBlock(database_, path_, status.st_size == 0);
  distrustSchema(handle);
  limitStatements(handle);
}

SQLiteStore::~SQLiteStore() = default;

std::unique_ptr<SQLiteStore> SQLiteStore::createEnsuredSQLiteStore(const std::string& path,
                                                                   SQLiteStoreFactory factory) {
  if (!factory) factory = [](const std::string& file) { return std::make_unique<SQLiteStore>(file); };
  for (int attempt = 0; attempt < attemptsThatMayFail; ++attempt) {
    try {
      return factory(path);
    } catch (const SQLiteStoreException&) {
      pauseBeforeNextAttempt();
    }
  }
  return factory(path);
}

SQLiteStoreCursor SQLiteStore::cursor(const std::string& sql) { return {database_, sql}; }

void SQLiteStore::exec(const std::string& sql) {
  throwIfSQLiteError(database_, sqlite3_exec(database_.get(), sql.c_str(), nullptr, nullptr, nullptr));
}

std::vector<SQLiteStoreColumn> SQLiteStore::info(const std::string& table) {
  SQLiteStoreCursor tables = cursor("SELECT sql FROM sqlite_master WHERE type='table'   AND name=?1");
  tables.bind<std::string>(1, table);
  if (!tables.next()) return {};
  return columnsDeclaredBy(tables.get<std::string>(0));
}

bool SQLiteStore::hasMoved() {
  int hasMoved = 0;
  const int resultCode = sqlite3_file_control(database_.get(), "main", SQLITE_FCNTL_HAS_MOVED, &hasMoved);
  return resultCode == SQLITE_OK && hasMoved != 0;
}

}  // namespace velmora::mobile::xplat::cellar
