#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "Export.h"

struct sqlite3;
struct sqlite3_stmt;

namespace velmora::mobile::xplat::cellar {

class SQLiteStore;

// Opens the database at a path; never returns null. Throws SQLiteStoreException when it cannot.
using SQLiteStoreFactory = std::function<std::unique_ptr<SQLiteStore>(const std::string& path)>;

// Throws for every result code but OK, ROW and DONE: SQLiteStoreCorruptedException for the four codes of a damaged or
// foreign file (INTERNAL, CORRUPT, FORMAT, NOTADB), SQLiteStoreException for the others. The description is "SQLite
// Error #CODE: MESSAGE", the exception's code is the result code.
CELLAR_EXPORT void throwSQLiteException(int resultCode, const std::string& message);

// The same, with the connection's own message of its last error and its file: "TEXT (FILE)".
CELLAR_EXPORT void throwIfSQLiteError(const std::shared_ptr<sqlite3>& database, int resultCode);

// One prepared statement: bind its parameters, call `next` until it says false, and read the columns of each row
// between. Compiled once: the connection keeps a few statements for the next cursors with the same text. It keeps the
// connection open even when the store is destroyed. Moved, never copied. One thread at a time, together with its store.
// Every operation throws SQLiteStoreException (or its corrupted subclass) when SQLite reports an error; one on a cursor
// that was moved from does so too.
class CELLAR_EXPORT SQLiteStoreCursor {
 public:
  // Prepares the first statement of `sql`; bytes after a zero byte are not read. When the connection has kept that
  // statement, a change of the schema that no longer fits it is found by `next`.
  SQLiteStoreCursor(std::shared_ptr<sqlite3> database, const std::string& sql);
  // Never throws. SQLite repeats the error of a failed `next` here, which gives a line in the log.
  ~SQLiteStoreCursor();

  SQLiteStoreCursor(SQLiteStoreCursor&& other) noexcept;
  SQLiteStoreCursor& operator=(SQLiteStoreCursor&& other) noexcept;
  SQLiteStoreCursor(const SQLiteStoreCursor&) = delete;
  SQLiteStoreCursor& operator=(const SQLiteStoreCursor&) = delete;

  // Gives the parameter "?index" (the first is 1) a copy of the value. T is string (zero bytes inside are kept), bool,
  // unsigned long long (the 64 bits as they are, so a negative number comes back negative) or a byte vector. An empty
  // string or vector is an empty value, not NULL; a parameter that is never bound is NULL.
  template <class T> void bind(int index, const T& value) = delete;

  // True when a row is there to be read, false when there are no more.
  bool next();

  // The value in a column (the first is 0) of the current row, as one of the four types above. NULL reads as false, 0
  // or empty.
  template <class T> T get(int column) = delete;

 private:
  void finalize() noexcept;

  std::shared_ptr<sqlite3> database_;
  sqlite3_stmt* statement_ = nullptr;
};

template <> CELLAR_EXPORT void SQLiteStoreCursor::bind<std::string>(int index, const std::string& value);
template <> CELLAR_EXPORT void SQLiteStoreCursor::bind<bool>(int index, const bool& value);
template <> CELLAR_EXPORT void SQLiteStoreCursor::bind<unsigned long long>(int index, const unsigned long long& value);
template <>
CELLAR_EXPORT void SQLiteStoreCursor::bind<std::vector<unsigned char>>(int index,
                                                                       const std::vector<unsigned char>& value);

template <> CELLAR_EXPORT std::string SQLiteStoreCursor::get<std::string>(int column);
template <> CELLAR_EXPORT bool SQLiteStoreCursor::get<bool>(int column);
template <> CELLAR_EXPORT unsigned long long SQLiteStoreCursor::get<unsigned long long>(int column);
template <> CELLAR_EXPORT std::vector<unsigned char> SQLiteStoreCursor::get<std::vector<unsigned char>>(int column);

// A column as the table's declaration has it.
struct CELLAR_EXPORT SQLiteStoreColumn {
  SQLiteStoreColumn(const std::string& name, const std::string& type);

  std::string name;
  std::string type;
};

// One connection to an SQLite database, open from construction on and closed when the store and all its cursors are
// gone. The connection has no lock of its own: the store and its cursors are used by one thread at a time. Operations
// are virtual so that a test or another back end can be used instead, through a SQLiteStoreFactory. Every operation
// throws SQLiteStoreException, or SQLiteStoreCorruptedException for a damaged or foreign file.
//
// The file may be another program's, so what it brings along is not run: triggers do not fire, views cannot be read,
// and the schema cannot be written but by CREATE, ALTER and the like. A statement has at most a million bytes, a
// hundred levels of expressions and a hundred bytes of a pattern for LIKE; no other database can be attached.
class CELLAR_EXPORT SQLiteStore {
 public:
  // Opens the database, creating the file (not its directory) when it is missing. Not an error yet: a file that is not
  // a database; the first statement meets that. A fifo or device in its place is refused as such a file at once, and
  // one in the place of its "-wal", "-shm" or "-journal" as one that cannot be opened: neither is ever waited for.
  explicit SQLiteStore(const std::string& path);
  virtual ~SQLiteStore();

  SQLiteStore(const SQLiteStore&) = delete;
  SQLiteStore& operator=(const SQLiteStore&) = delete;

  // Opens through the factory (an empty one makes a plain SQLiteStore), up to five times, 30 ms apart, as long as that
  // throws SQLiteStoreException; blocks the caller meanwhile, about 120 ms at most. The last exception, and any other,
  // reaches the caller. Never deletes a file.
  static std::unique_ptr<SQLiteStore> createEnsuredSQLiteStore(const std::string& path, SQLiteStoreFactory factory);

  // Prepares one statement.
  virtual SQLiteStoreCursor cursor(const std::string& sql);

  // Runs a script of one or more statements, separated by ";". Statements before one that fails stay done.
  virtual void exec(const std::string& sql);

  // The columns of a table in the order of their declaration; empty when there is no such table (names are
  // case-sensitive here). Only columns declared as INTEGER, REAL, TEXT, BOOLEAN or BLOB, in capitals, are found.
  virtual std::vector<SQLiteStoreColumn> info(const std::string& table);

  // Whether the path leads to another file by now, or to none.
  virtual bool hasMoved();

 private:
  std::string path_;
  std::shared_ptr<sqlite3> database_;
};

}  // namespace velmora::mobile::xplat::cellar
