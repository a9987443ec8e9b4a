// Manifests that somebody else has had a hand in: what they bring along is not run, and nothing of them makes a call
// that does not return.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <string>

#include "FileUtils.h"
#include "LarderException.h"
#include "ManifestSnapshot.h"
#include "SQLiteManifestPersistence.h"
#include "SQLiteStore.h"
#include "support/KeyValueStoreFixture.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::kSecond;

using testing::ElementsAre;
using testing::HasSubstr;
using testing::SizeIs;
using testing::StartsWith;

namespace fs = std::filesystem;

constexpr unsigned int kSeconds = 60;  // after which a call is taken for one that does not return

const std::string kColumns =
    "key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
    "last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key)";
const std::string kTable = "CREATE TABLE LarderManifest (" + kColumns + ");";
const std::string kRow = "INSERT INTO LarderManifest VALUES ('old', 'old', 1, 0, NULL, 1, 1, NULL);";
const std::string kEndless = "WITH RECURSIVE c(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM c) SELECT i FROM c";
// One search of a long text in a longer one, which takes years.
const std::string kSearch = "instr(zeroblob(900000000), zeroblob(450000000) || x'01')";

std::string endlessTriggers() {
  std::string script = "CREATE TABLE numbers (number);";
  for (const std::string event : {"INSERT", "UPDATE", "DELETE"}) {
    for (const std::string time : {"BEFORE", "AFTER"}) {
      script += "CREATE TRIGGER " + time + event + " " + time + " " + event + " ON LarderManifest BEGIN ";
      script += "INSERT INTO numbers " + kEndless + "; END;";
    }
  }
  return script;
}

// Another program's connection.
void run(const std::string& path, const std::string& script) {
  sqlite3* database = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &database), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(database, script.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(database);
  sqlite3_close(database);
}

struct Failure {
  std::string description;
  int code = 0;
  bool corrupted = false;
};

template <class Plain, class Corrupted> Failure failureOf(const std::function<void()>& action) {
  try {
    action();
  } catch (const Corrupted& error) {
    return {error.description(), error.code(), true};
  } catch (const Plain& error) {
    return {error.description(), error.code(), false};
  }
  return {};
}

// --- The connection ---

class SQLiteStoreOfAnother : public testing::Test {
 protected:
  Failure failureOf(const std::string& script) const {
    return cellar::failureOf<SQLiteStoreException, SQLiteStoreCorruptedException>(
        [&] { SQLiteStore(path).exec(script); });
  }
  std::string valueOf(const std::string& query) const {
    SQLiteStore store(path);
    SQLiteStoreCursor cursor = store.cursor(query);
    return cursor.next() ? cursor.get<std::string>(0) : "";
  }

  const test::TemporaryDirectory directory;
  const std::string path = directory.file("db");
};

TEST_F(SQLiteStoreOfAnother, RunsNoTriggers) {
  run(path, "CREATE TABLE t(n);CREATE TRIGGER g AFTER INSERT ON t BEGIN DELETE FROM t; END");
  EXPECT_EQ(failureOf("INSERT INTO t VALUES (1)").description, "");
  EXPECT_EQ(valueOf("SELECT n FROM t"), "1");
}

TEST_F(SQLiteStoreOfAnother, ReadsNoViews) {
  const test::Watchdog watchdog(kSeconds);
  run(path, "CREATE VIEW v AS " + kEndless);
  const Failure failure = failureOf("SELECT count(*) FROM v");
  EXPECT_EQ(failure.code, SQLITE_ERROR);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteStoreOfAnother, DoesNotTrustTheFunctionsOfASchema) { EXPECT_EQ(valueOf("PRAGMA trusted_schema"), "0"); }

TEST_F(SQLiteStoreOfAnother, LetsNobodyWriteTheSchema) {
  run(path, "CREATE TABLE t(n)");
  EXPECT_THAT(failureOf("PRAGMA writable_schema = ON; DELETE FROM sqlite_master").description,
              HasSubstr("may not be modified"));
}

TEST_F(SQLiteStoreOfAnother, IsWrittenAheadOfTimeAndMayBeAltered) {
  run(path, "CREATE TABLE t(a TEXT);" + std::string("CREATE VIEW v AS SELECT * FROM t;") +
                "CREATE TRIGGER g AFTER INSERT ON t BEGIN DELETE FROM t; END");
  EXPECT_EQ(valueOf("PRAGMA journal_mode = WAL"), "wal");
  EXPECT_EQ(failureOf("ALTER TABLE t ADD b BLOB").description, "");
  EXPECT_THAT(SQLiteStore(path).info("t"), SizeIs(2));
}

TEST_F(SQLiteStoreOfAnother, AttachesNoOtherDatabase) {
  EXPECT_THAT(failureOf("ATTACH ':memory:' AS other").description, HasSubstr("too many attached databases"));
}

TEST_F(SQLiteStoreOfAnother, TakesStatementsOfAMillionBytesAndNoMore) {
  const auto statementOf = [](std::size_t bytes) {
    const std::string head = "SELECT '";
    return head + std::string(bytes - head.size() - 1, 'x') + "'";
  };
  EXPECT_EQ(failureOf(statementOf(1'000'000)).code, 0);
  EXPECT_EQ(failureOf(statementOf(1'000'001)).code, SQLITE_TOOBIG);
}

TEST_F(SQLiteStoreOfAnother, TakesExpressionsOfAHundredLevelsAndNoMore) {
  const auto statementOf = [](int levels) {
    std::string statement = "SELECT 1";
    for (int level = 1; level < levels; ++level) statement += "+1";
    return statement;
  };
  EXPECT_EQ(failureOf(statementOf(100)).code, 0);
  EXPECT_THAT(failureOf(statementOf(101)).description, HasSubstr("Expression tree is too large"));
}

TEST_F(SQLiteStoreOfAnother, TakesPatternsOfAHundredBytesAndNoMore) {
  const auto statementOf = [](std::size_t bytes) { return "SELECT 'x' LIKE '" + std::string(bytes, 'x') + "'"; };
  EXPECT_EQ(failureOf(statementOf(100)).code, 0);
  EXPECT_THAT(failureOf(statementOf(101)).description, HasSubstr("LIKE or GLOB pattern too complex"));
}

TEST_F(SQLiteStoreOfAnother, CompilesNoProgramOfAHundredThousandSteps) {
  const auto statementOf = [](int columns) {
    std::string statement = "SELECT 1";
    for (int column = 1; column < columns; ++column) {
      statement += ",random()";
      for (int term = 1; term < 40; ++term) statement += "+random()";
    }
    return statement;
  };
  EXPECT_EQ(failureOf(statementOf(400)).code, 0);
  EXPECT_EQ(failureOf(statementOf(1900)).code, SQLITE_NOMEM);
}

// --- In place of its files ---

class SQLiteStoreInPlace : public SQLiteStoreOfAnother {
 protected:
  void SetUp() override { run(path, kTable + kRow); }

  void makeFifo(const std::string& suffix, mode_t mode = 0600) const {
    fs::remove(path + suffix);
    ASSERT_EQ(::mkfifo((path + suffix).c_str(), mode), 0);
  }
  static const char* whatIsThere() { return "SELECT count(*) FROM sqlite_master"; }

  const test::Watchdog watchdog{kSeconds};
};

TEST_F(SQLiteStoreInPlace, AFifoIsNoDatabase) {
  for (const mode_t mode : {0600U, 0400U}) {
    makeFifo("", mode);
    const Failure failure = failureOf(whatIsThere());
    EXPECT_EQ(failure.description, "SQLite Error #26: Cannot open database: '" + path + "'");
    EXPECT_EQ(failure.code, SQLITE_NOTADB);
    EXPECT_TRUE(failure.corrupted);
  }
}

TEST_F(SQLiteStoreInPlace, ALinkToAFifoOrADeviceIsNoDatabase) {
  makeFifo("-fifo");
  for (const std::string& target : {path + "-fifo", std::string("/dev/null")}) {
    fs::remove(path);
    fs::create_symlink(target, path);
    EXPECT_EQ(failureOf(whatIsThere()).code, SQLITE_NOTADB) << target;
  }
}

TEST_F(SQLiteStoreInPlace, ADirectoryCannotBeOpened) {
  fs::remove(path);
  fs::create_directory(path);
  const Failure failure = failureOf(whatIsThere());
  EXPECT_EQ(failure.description, "SQLite Error #14: Cannot open database: '" + path + "'");
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteStoreInPlace, ALinkToADatabaseIsOne) {
  fs::rename(path, path + "2");
  fs::create_symlink(path + "2", path);
  EXPECT_EQ(failureOf(whatIsThere()).description, "");
}

TEST_F(SQLiteStoreInPlace, OfACompanionAFifoKeepsTheDatabaseFromBeingOpened) {
  for (const std::string suffix : {"-wal", "-journal", "-shm"}) {
    for (const mode_t mode : {0600U, 0400U}) {
      makeFifo(suffix, mode);
      const Failure failure = failureOf(whatIsThere());
      EXPECT_EQ(failure.description, "SQLite Error #14: Cannot open database: '" + path + "': '" + path + suffix +
                                         "' is not a regular file");
      EXPECT_EQ(failure.code, SQLITE_CANTOPEN);
      EXPECT_FALSE(failure.corrupted);
    }
    fs::remove(path + suffix);
    EXPECT_EQ(valueOf("SELECT key FROM LarderManifest"), "old") << suffix;
  }
}

TEST_F(SQLiteStoreInPlace, OfACompanionOfALinkedDatabaseAFifoIsFoundWhereSQLiteLooksForIt) {
  fs::create_directory(directory.file("elsewhere"));
  fs::create_symlink(path, directory.file("elsewhere/link"));
  makeFifo("-journal");
  EXPECT_EQ((cellar::failureOf<SQLiteStoreException, SQLiteStoreCorruptedException>([&] {
               SQLiteStore(directory.file("elsewhere/link")).exec(whatIsThere());
             }).code),
            SQLITE_CANTOPEN);
}

TEST_F(SQLiteStoreInPlace, OfALogOrJournalAFifoBesideAnEmptyDatabaseIsRemovedAsItIsByTheDatabase) {
  for (const std::string suffix : {"-wal", "-journal"}) {
    directory.write("db", "");
    makeFifo(suffix);
    EXPECT_EQ(failureOf("PRAGMA journal_mode = WAL; CREATE TABLE t(n)").description, "") << suffix;
  }
}

// --- The manifest ---

class SQLiteManifestPersistenceOfAnother : public testing::Test {
 protected:
  Failure failureOfOpening() {
    return failureOf<ManifestPersistenceException, ManifestCorruptedException>(
        [this] { manifest = std::make_unique<SQLiteManifestPersistence>(path, nullptr, nullptr); });
  }
  void expectIsForeign(const std::string& script) {
    fs::remove(path);
    run(path, script);
    const Failure failure = failureOfOpening();
    EXPECT_EQ(failure.description, "Invalid schema.") << script;
    EXPECT_EQ(failure.code, -1);
    EXPECT_TRUE(failure.corrupted);
  }
  void expectIsOurs(const std::string& script) {
    fs::remove(path);
    run(path, script);
    EXPECT_EQ(failureOfOpening().description, "") << script;
    if (manifest == nullptr) return;
    manifest->setItem({"new", "new", 2, false, 2, 2, nullptr});
    EXPECT_NE(manifest->getItem("new"), nullptr) << script;
    manifest.reset();
  }

  const test::TemporaryDirectory directory;
  const std::string path = directory.file("manifest_v1.sqlite");
  std::unique_ptr<SQLiteManifestPersistence> manifest;
  const test::Watchdog watchdog{kSeconds};
};

TEST_F(SQLiteManifestPersistenceOfAnother, WithTriggersThatNeverEndWorksAsWithout) {
  run(path, kTable + kRow + endlessTriggers());
  ASSERT_EQ(failureOfOpening().description, "");
  manifest->setItem({"new", "new", 2, false, 2, 2, nullptr});
  manifest->setInlineData("new", {1, 2});
  manifest->updateLastAccessDate("new", 9);
  EXPECT_EQ(manifest->getItem("new")->lastAccessDate, 9);
  EXPECT_EQ(manifest->getInlineData("new"), (Bytes{1, 2}));
  EXPECT_THAT(manifest->getAllItems(), SizeIs(2));
  EXPECT_THAT(manifest->getItemsLastAccessedBefore(9), SizeIs(1));
  manifest->removeInlineData("new");
  manifest->removeItem("old");
  manifest->clearItems();
  EXPECT_THAT(manifest->getAllItems(), SizeIs(1));
}

TEST_F(SQLiteManifestPersistenceOfAnother, OfTheFirstVersionWithViewsAndTriggersIsMigrated) {
  run(path,
      "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, "
      "modification_date INTEGER, last_access_date INTEGER, PRIMARY KEY(key));"
      "INSERT INTO LarderManifest VALUES ('old', 'old', 1, 0, NULL, 1, 1);"
      "CREATE VIEW keys AS SELECT key, replace(filename, 'a', 'b') FROM LarderManifest;" +
          endlessTriggers());
  ASSERT_EQ(failureOfOpening().description, "");
  EXPECT_NE(manifest->getItem("old"), nullptr);
  manifest.reset();
  EXPECT_THAT(SQLiteStore(path).info("LarderManifest"), SizeIs(8));
}

TEST_F(SQLiteManifestPersistenceOfAnother, ThatIsAViewIsAPlainError) {
  run(path, "CREATE VIEW LarderManifest AS " + kEndless);
  const Failure failure = failureOfOpening();
  EXPECT_THAT(failure.description, StartsWith("SQLite Error #1: views may not be indexed"));
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteManifestPersistenceOfAnother, ThatCallsFunctionsIsForeign) {
  const std::string open = "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, ";
  const std::string rest = "modification_date INTEGER, last_access_date INTEGER, extended_manifest BLOB";
  expectIsForeign("CREATE TABLE LarderManifest (" + kColumns + ", CHECK (" + kSearch + " IS NULL))");
  expectIsForeign(open + "has_inline_data BOOLEAN, inline_data BLOB DEFAULT (" + kSearch + "), " + rest + ")");
  expectIsForeign(open + "has_inline_data BOOLEAN, inline_data BLOB AS (" + kSearch + ") STORED, " + rest + ")");
  expectIsForeign("CREATE TABLE LarderManifest (" + kColumns + ", CHECK (key GLOB filename))");
  expectIsForeign("CREATE TABLE larderMANIFEST (" + kColumns + ", CHECK (length(key) > 0))");
  expectIsForeign(kTable + "CREATE INDEX i ON LarderManifest(" + kSearch + ")");
  expectIsForeign(kTable + "CREATE INDEX i ON LarderManifest(size) WHERE ifnull(size, 1)");
}

// The index by access date is made when it is missing, which computes what it holds.
TEST_F(SQLiteManifestPersistenceOfAnother, ThatCallsFunctionsIsForeignBeforeAnyIsCalled) {
  expectIsForeign(
      "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, "
      "modification_date INTEGER, PRIMARY KEY(key)); INSERT INTO LarderManifest (key) VALUES ('a');"
      "ALTER TABLE LarderManifest ADD last_access_date INTEGER AS (" +
      kSearch + ") VIRTUAL; ALTER TABLE LarderManifest ADD extended_manifest BLOB");
}

TEST_F(SQLiteManifestPersistenceOfAnother, ThatCallsNoFunctionsStays) {
  expectIsOurs("CREATE TABLE LarderManifest (" + kColumns + ", CHECK (size >= 0), CHECK (has_inline_data IN (0, 1)))");
  expectIsOurs(
      "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, "
      "inline_data BLOB, modification_date INTEGER, last_access_date INTEGER, extended_manifest BLOB, "
      "price DECIMAL(10, 2) DEFAULT (1 + 2), note VARCHAR(30) DEFAULT 'f(x)', "
      "twice INTEGER AS (size + size), PRIMARY KEY(key))");
  expectIsOurs(kTable + "CREATE INDEX i ON LarderManifest(size, key); CREATE INDEX j ON LarderManifest(size + 1)");
  expectIsOurs(kTable + "CREATE TABLE other (x CHECK (length(x) > 0)); CREATE INDEX k ON other(lower(x))");
  expectIsOurs(kTable + "CREATE VIEW v AS SELECT length(key) FROM LarderManifest");
}

TEST_F(SQLiteManifestPersistenceOfAnother, ThatCallsFunctionsIsDamagedToTheSnapshot) {
  run(path, "CREATE TABLE LarderManifest (" + kColumns + ", CHECK (" + kSearch + " IS NULL));");
  run(path, "PRAGMA ignore_check_constraints = ON;" + kRow);
  const ManifestSnapshot snapshot(directory.path(), directory.makeDirectory("temporary"),
                                  std::make_shared<FileUtils>());
  EXPECT_THAT(snapshot.integrityErrors(), ElementsAre("Invalid schema."));
  EXPECT_THROW(snapshot.records(nullptr), ManifestCorruptedException);
}

// --- A store ---

class PersistentKeyValueStoreOfAnother : public test::KeyValueStoreFixture {
 protected:
  void SetUp() override {
    open();
    put("key", "value");
    close();
  }
  void makeFifo(const std::string& suffix) const {
    fs::remove(manifestPath() + suffix);
    ASSERT_EQ(::mkfifo((manifestPath() + suffix).c_str(), 0600), 0);
  }
  std::string manifestPath() const { return pathOf("manifest_v1.sqlite"); }

  // Every operation, to whatever end.
  void tryEverything() {
    settleAll();
    const auto written = test::watch(store->store("new", test::bytesOf("new value")));
    const auto fetched = test::watch(store->fetch("key"));
    const auto removed = test::watch(store->removeItem("key"));
    settleAll();
    store->clear(onSuccess(), onError());
    settleAll();
    EXPECT_FALSE(written->isPending());
    EXPECT_FALSE(fetched->isPending());
    EXPECT_FALSE(removed->isPending());
    EXPECT_FALSE(ending.empty());
  }

  // What cannot be opened says so out of the task that loads it.
  void settleAll() const {
    for (bool done = false; !done;) {
      try {
        settle();
        done = true;
      } catch (const ManifestPersistenceException&) {
      }
    }
  }

  const test::Watchdog watchdog{kSeconds};
};

TEST_F(PersistentKeyValueStoreOfAnother, WithTriggersThatNeverEndKeepsItsValues) {
  run(manifestPath(), endlessTriggers());
  open();
  EXPECT_EQ(get("key"), "value");
  put("key", "later value");
  put("other", "value");
  EXPECT_EQ(drop("other"), "<done>");
  reopen();
  EXPECT_EQ(get("key"), "later value");
  EXPECT_EQ(clear(), "<done>");
}

TEST_F(PersistentKeyValueStoreOfAnother, WithATableThatCallsFunctionsBeginsAgain) {
  run(manifestPath(), "CREATE INDEX slow ON LarderManifest(size) WHERE size = 1000 AND " + kSearch);
  openUnloaded();
  settleAll();
  put("new", "value");
  EXPECT_EQ(get("new"), "value");
}

TEST_F(PersistentKeyValueStoreOfAnother, WithAFifoInPlaceOfItsManifestBeginsAgain) {
  makeFifo("");
  openUnloaded();
  settleAll();
  put("new", "value");
  EXPECT_EQ(get("new"), "value");
  EXPECT_EQ(get("key"), "<miss>");
}

TEST_F(PersistentKeyValueStoreOfAnother, WithAFifoInPlaceOfACompanionCompletesEveryOperation) {
  for (const std::string suffix : {"-wal", "-journal", "-shm"}) {
    makeFifo(suffix);
    openUnloaded();
    tryEverything();
    store.reset();
    settleAll();
    fs::remove(manifestPath() + suffix);
    open();
    put("key", "value");
    EXPECT_EQ(get("key"), "value") << suffix;
    close();
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
