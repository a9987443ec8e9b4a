#pragma once

#include <cstddef>
#include <string>

#include "support/Values.h"

struct sqlite3;
struct sqlite3_stmt;

namespace velmora::mobile::xplat::cellar::bench {

// A connection and its statements: SQLite itself, with a check of its results. Bound values must exist until the
// statement has run.
class Database {
 public:
  explicit Database(const std::string& path);
  ~Database();
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;

  void exec(const char* sql);
  sqlite3* get() const { return database_; }

 private:
  sqlite3* database_ = nullptr;
};

class Statement {
 public:
  Statement(const Database& database, const char* sql);
  ~Statement();
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  Statement& text(int index, const std::string& value);
  Statement& number(int index, long long value);
  Statement& blob(int index, const Bytes& value);

  bool next();  // whether there is a row
  Bytes blob(int column) const;
  std::string text(int column) const;
  long long number(int column) const;
  void reset();  // to be run again

 private:
  void check(int resultCode) const;

  sqlite3* database_;
  sqlite3_stmt* statement_ = nullptr;
};

}  // namespace velmora::mobile::xplat::cellar::bench
