#include <stdexcept>

#include "competitors/Competitor.h"
#include "lower_bounds/SQLite.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

// Values as blobs in a table, by statements that are prepared once.
class SQLiteBlobs : public GroupingCompetitor {
 public:
  SQLiteBlobs(const std::string& directory, bool isSynced) : database_(directory + "/blobs.sqlite") {
    database_.exec("PRAGMA journal_mode = WAL;");
    database_.exec(isSynced ? "PRAGMA synchronous = FULL;" : "PRAGMA synchronous = NORMAL;");
    database_.exec("CREATE TABLE IF NOT EXISTS Blobs (key TEXT PRIMARY KEY, value BLOB);");
    put_ = std::make_unique<Statement>(database_, "INSERT OR REPLACE INTO Blobs (key, value) VALUES (?1, ?2);");
    begin_ = std::make_unique<Statement>(database_, "BEGIN IMMEDIATE;");
    commit_ = std::make_unique<Statement>(database_, "COMMIT;");
    get_ = std::make_unique<Statement>(database_, "SELECT value FROM Blobs WHERE key = ?1;");
  }

  void put(const std::string& key, const Bytes& value) override {
    put_->text(1, key).blob(2, value).next();
    put_->reset();
  }

  void putTogether(const Entries& entries) override {
    run(*begin_);
    for (const auto& [key, value] : entries) put(key, value);
    run(*commit_);
  }

  Bytes get(const std::string& key) override {
    if (!get_->text(1, key).next()) throw std::runtime_error("no value for " + key);
    Bytes value = get_->blob(0);
    get_->reset();
    return value;
  }

 private:
  static void run(Statement& statement) {
    statement.next();
    statement.reset();
  }

  Database database_;
  std::unique_ptr<Statement> put_;
  std::unique_ptr<Statement> begin_;
  std::unique_ptr<Statement> commit_;
  std::unique_ptr<Statement> get_;
};

}  // namespace

std::unique_ptr<Competitor> openSQLite(const std::string& directory) {
  return std::make_unique<SQLiteBlobs>(directory, false);
}

std::unique_ptr<GroupingCompetitor> openSyncedSQLite(const std::string& directory) {
  return std::make_unique<SQLiteBlobs>(directory, true);
}

}  // namespace velmora::mobile::xplat::cellar::bench
