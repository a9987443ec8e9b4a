#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <random>
#include <set>
#include <stdexcept>
#include <string>

#include "FileUtils.h"
#include "host/testing/PowerCut.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;

class Database {
 public:
  explicit Database(const string& path) {
    const int code = sqlite3_open(path.c_str(), &handle_);
    if (code == SQLITE_OK) return;
    (void)sqlite3_close(handle_);
    throw std::runtime_error(sqlite3_errstr(code));
  }
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;
  ~Database() { EXPECT_EQ(sqlite3_close(handle_), SQLITE_OK); }

  // The first column of the last row, "" without one.
  string run(const string& sql) {
    string result;
    const auto take = [](void* to, int, char** values, char**) {
      *static_cast<string*>(to) = values[0] == nullptr ? "" : values[0];
      return 0;
    };
    const int code = sqlite3_exec(handle_, sql.c_str(), take, &result, nullptr);
    if (code != SQLITE_OK) throw std::runtime_error(sqlite3_errstr(code));
    return result;
  }

 private:
  sqlite3* handle_ = nullptr;
};

constexpr int kNone = -1;

// What a cut has left of a database.
struct Found {
  bool isSound = true;
  int transaction = kNone;  // the last that is there
};

// Each transaction writes three rows and the last transaction's number, and deletes old rows.
class Life {
 public:
  Life(const string& path, const string& pragmas) : path_(path), pragmas_(pragmas) {}

  void open() {
    database_ = std::make_unique<Database>(path_);
    database_->run(pragmas_);
    if (started_ != kNone) return;
    started_ = 0;
    database_->run(
        "BEGIN; CREATE TABLE rows(made INTEGER, text TEXT); CREATE INDEX byText ON rows(text);"
        "CREATE TABLE last(number INTEGER); INSERT INTO last VALUES(0); COMMIT;");
    done_ = 0;
  }

  void close() { database_.reset(); }

  void commit(std::size_t size) {
    const string number = std::to_string(++started_);
    string sql = "BEGIN; UPDATE last SET number = " + number + ";";
    for (int row = 0; row < 3; ++row) sql += "INSERT INTO rows VALUES(" + number + ", " + text(row, size) + ");";
    sql += "DELETE FROM rows WHERE made <= " + number + " - 15; COMMIT;";
    database_->run(sql);
    done_ = started_;
  }

  static Found inspect(const string& path) {
    Found found;
    if (!std::filesystem::exists(path)) return found;
    try {
      Database database(path);
      found.isSound = database.run("PRAGMA integrity_check;") == "ok";
      if (database.run("SELECT count(*) FROM sqlite_master;") == "0") return found;
      const string last = database.run("SELECT number FROM last;");
      found.transaction = std::stoi(last);
      const string rows = "SELECT count(*) FROM rows WHERE made ";
      found.isSound = found.isSound && database.run(rows + "> " + last + ";") == "0" &&
                      database.run(rows + "= " + last + ";") == (last == "0" ? "0" : "3");
    } catch (const std::exception&) {
      found.isSound = false;
    }
    return found;
  }

  int started() const { return started_; }
  int done() const { return done_; }

 private:
  string text(int row, std::size_t size) const {
    return "'" + std::to_string(started_ * 7919 % 101) + string(size + static_cast<std::size_t>(row) * 300, 'x') + "'";
  }

  const string path_;
  const string pragmas_;
  std::unique_ptr<Database> database_;
  int started_ = kNone;
  int done_ = kNone;  // committed, as its caller knows
};

struct Tally {
  int cuts = 0;
  int damaged = 0;
  int lost = 0;         // committed, not there
  int lostAtOnce = 0;   // the most transactions that one cut has lost
  int invented = 0;     // there, not yet begun
  int uncommitted = 0;  // there, but not yet acknowledged
};

class PowerCutDatabase : public testing::Test {
 protected:
  // Cuts a life of transactions after every few of its operations, most of which are in the middle of a transaction.
  Tally cut(const string& pragmas, int cuts) {
    Life life(directory_.file("db"), pragmas);
    Tally tally;
    powerCut_.onOperation([&] {
      if (tally.cuts < cuts && random_() % 7 == 0) count(life, tally);
    });
    life.open();
    for (int i = 1; tally.cuts < cuts; ++i) {
      life.commit(random_() % 4000);
      if (i % 20 != 0) continue;
      life.close();
      life.open();
    }
    life.close();
    powerCut_.onOperation(nullptr);
    return tally;
  }

  Found inspectRemains(std::uint32_t seed) {
    const TemporaryDirectory other;
    powerCut_.cutInto(other.path(), seed);
    return Life::inspect(other.file("db"));
  }

  TemporaryDirectory directory_;
  PowerCut powerCut_{directory_.path()};
  std::mt19937 random_{1};

 private:
  void count(const Life& life, Tally& tally) {
    ++tally.cuts;
    const Found found = inspectRemains(static_cast<std::uint32_t>(random_()));
    if (!found.isSound) ++tally.damaged;
    if (!found.isSound) return;
    if (found.transaction < life.done()) ++tally.lost;
    tally.lostAtOnce = std::max(tally.lostAtOnce, life.done() - found.transaction);
    if (found.transaction > life.started()) ++tally.invented;
    if (found.transaction > life.done()) ++tally.uncommitted;
  }
};

const string kLog = "PRAGMA journal_mode = WAL; PRAGMA wal_autocheckpoint = 12;";

TEST_F(PowerCutDatabase, WithAFullySyncedLogLosesNoTransactionAndIsSound) {
  const Tally tally = cut(kLog + "PRAGMA synchronous = FULL;", 500);
  EXPECT_EQ(tally.cuts, 500);
  EXPECT_EQ(tally.damaged, 0);
  EXPECT_EQ(tally.lost, 0);
  EXPECT_EQ(tally.invented, 0);
  EXPECT_GT(tally.uncommitted, 0);  // cut between the last write and the end of its call
}

TEST_F(PowerCutDatabase, WithALogThatIsSyncedNowAndThenLosesTransactionsButIsSound) {
  const Tally tally = cut(kLog + "PRAGMA synchronous = NORMAL;", 250);
  EXPECT_EQ(tally.damaged, 0);
  EXPECT_EQ(tally.invented, 0);
  EXPECT_GT(tally.lost, 0);
}

TEST_F(PowerCutDatabase, WithoutSyncsIsDamaged) {
  const Tally tally = cut(kLog + "PRAGMA synchronous = OFF;", 100);
  EXPECT_GT(tally.damaged, 0);
}

TEST_F(PowerCutDatabase, WithAJournalLosesNothingWhereItsDeletionIsSynced) {
  const Tally tally = cut("PRAGMA journal_mode = DELETE; PRAGMA synchronous = EXTRA;", 200);
  EXPECT_EQ(tally.damaged, 0);
  EXPECT_EQ(tally.lost, 0);
}

TEST_F(PowerCutDatabase, WithAJournalThatComesBackLosesTheLastTransactionButIsSound) {
  const Tally tally = cut("PRAGMA journal_mode = DELETE; PRAGMA synchronous = FULL;", 200);
  EXPECT_EQ(tally.damaged, 0);
  EXPECT_EQ(tally.lostAtOnce, 1);
}

TEST_F(PowerCutDatabase, WithAJournalAndWithoutSyncsIsDamaged) {
  const Tally tally = cut("PRAGMA journal_mode = DELETE; PRAGMA synchronous = OFF;", 100);
  EXPECT_GT(tally.damaged, 0);
}

TEST_F(PowerCutDatabase, ThatIsSyncedAloneMayVanish) {
  Life life(directory_.file("db"), "PRAGMA journal_mode = OFF; PRAGMA synchronous = FULL;");
  life.open();
  std::set<int> transactions;
  for (std::uint32_t seed = 0; seed < 50; ++seed) transactions.insert(inspectRemains(seed).transaction);
  EXPECT_EQ(transactions, (std::set<int>{kNone, 0}));
  powerCut_.files()->sync(directory_.path());
  for (std::uint32_t seed = 0; seed < 50; ++seed) EXPECT_EQ(inspectRemains(seed).transaction, 0);
}

TEST_F(PowerCutDatabase, LosesItsSharedMemoryAndKeepsItsLog) {
  Life life(directory_.file("db"), kLog + "PRAGMA synchronous = FULL;");
  life.open();
  powerCut_.files()->sync(directory_.path());
  ASSERT_TRUE(directory_.exists("db-shm"));
  const TemporaryDirectory other;
  powerCut_.cutInto(other.path(), 1);
  EXPECT_EQ(other.names(), (std::vector<string>{"db", "db-wal"}));
}

TEST_F(PowerCutDatabase, InADirectoryThatIsNotSyncedMayVanishWithIt) {
  powerCut_.files()->createDirectory(directory_.file("store"), false);
  Life life(directory_.file("store/db"), kLog + "PRAGMA synchronous = FULL;");
  life.open();
  std::set<bool> isThere;
  for (std::uint32_t seed = 0; seed < 50; ++seed) {
    const TemporaryDirectory other;
    powerCut_.cutInto(other.path(), seed);
    isThere.insert(Life::inspect(other.file("store/db")).transaction == 0);
  }
  EXPECT_EQ(isThere.size(), 2U);
}

TEST_F(PowerCutDatabase, OutsideIsUsedAsEver) {
  const TemporaryDirectory outside;
  Life life(outside.file("db"), kLog);
  life.open();
  life.commit(100);
  life.close();
  EXPECT_EQ(Life::inspect(outside.file("db")).transaction, 1);
}

TEST(PowerCutFileLayer, IsThereOnlyWhileOneLives) {
  sqlite3_vfs* const system = sqlite3_vfs_find(nullptr);
  const TemporaryDirectory directory;
  const TemporaryDirectory other;
  auto first = std::make_unique<PowerCut>(directory.path());
  sqlite3_vfs* const recording = sqlite3_vfs_find(nullptr);
  EXPECT_NE(recording, system);
  const auto second = std::make_unique<PowerCut>(other.path());
  EXPECT_EQ(sqlite3_vfs_find(nullptr), recording);
  first.reset();
  EXPECT_EQ(sqlite3_vfs_find(nullptr), recording);
}

TEST(PowerCutFileLayer, GivesTheSystemsLayerBack) {
  sqlite3_vfs* const system = sqlite3_vfs_find(nullptr);
  const TemporaryDirectory directory;
  { const PowerCut powerCut(directory.path()); }
  EXPECT_EQ(sqlite3_vfs_find(nullptr), system);
  { const PowerCut powerCut(directory.path()); }
  EXPECT_EQ(sqlite3_vfs_find(nullptr), system);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
