#include "base/SchemaFunctions.h"

#include <sqlite3.h>

#include <algorithm>
#include <memory>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "SQLiteStore.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// A database in memory, where statements are compiled but not run.
class Scratch {
 public:
  Scratch() : database_(open()), usualArguments_(sqlite3_limit(database_.get(), SQLITE_LIMIT_FUNCTION_ARG, -1)) {}

  // SQLite alone can tell a call from a name in quotes: where it allows no arguments, it complains of each.
  bool findsFunctions(const std::string& statement) {
    return complaintAbout(statement, 0) != complaintAbout(statement, usualArguments_);
  }

 private:
  static std::shared_ptr<sqlite3> open() {
    sqlite3* handle = nullptr;
    const int resultCode = sqlite3_open(":memory:", &handle);
    std::shared_ptr<sqlite3> database(handle, sqlite3_close);
    throwSQLiteException(resultCode, "Cannot open a database in memory");
    return database;
  }

  std::string complaintAbout(const std::string& statement, int maxArguments) {
    sqlite3_limit(database_.get(), SQLITE_LIMIT_FUNCTION_ARG, maxArguments);
    try {
      const SQLiteStoreCursor compiled(database_, statement);
      return "";
    } catch (const SQLiteStoreException& error) {
      return error.description();
    }
  }

  const std::shared_ptr<sqlite3> database_;
  const int usualArguments_;
};

// The statements that made the table and its indices, but for those with too few brackets for a call: a table has one
// pair around its columns, one around an expression and one for the call; an index one for its columns and one for the
// call.
std::vector<std::string> statementsWithRoomForCalls(SQLiteStore& store, const std::string& table) {
  SQLiteStoreCursor made = store.SQLiteStore::cursor(  // not its override in a derived class
      "SELECT sql, type = 'table' FROM sqlite_master "
      "WHERE tbl_name = ?1 COLLATE NOCASE AND type <> 'trigger' AND type <> 'view'");
  made.bind<std::string>(1, table);
  std::vector<std::string> statements;
  while (made.next()) {
    std::string statement = made.get<std::string>(0);
    const auto brackets = std::count(statement.begin(), statement.end(), '(');
    if (brackets > (made.get<bool>(1) ? 2 : 1)) statements.push_back(std::move(statement));
  }
  return statements;
}

}  // namespace

void throwIfTableCallsFunctions(SQLiteStore& store, const std::string& table) {
  const auto statements = statementsWithRoomForCalls(store, table);
  if (statements.empty()) return;
  Scratch scratch;
  for (const std::string& statement : statements) {
    if (scratch.findsFunctions(statement)) throw SQLiteStoreCorruptedException("Invalid schema.", -1);
  }
}

}  // namespace velmora::mobile::xplat::cellar
