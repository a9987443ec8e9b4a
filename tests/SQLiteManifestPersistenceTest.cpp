#include "SQLiteManifestPersistence.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <functional>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "DiskCacheItem.h"
#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;

using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;
using testing::UnorderedElementsAre;

using Items = std::vector<std::unique_ptr<DiskCacheItem>>;
using ItemType = VideoDownloadExtendedMetadata::ItemType;

// The table as the first version of the format had it, and as it is now; frozen, because both are on disk.
const std::string firstVersionTable =
    "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, "
    "modification_date INTEGER, last_access_date INTEGER, PRIMARY KEY(key));";
const std::string currentTable =
    "CREATE TABLE LarderManifest (key               TEXT,   filename          TEXT,   size              INTEGER,   "
    "has_inline_data   BOOLEAN,   inline_data       BLOB,   modification_date INTEGER,   last_access_date  INTEGER,   "
    "extended_manifest BLOB,   PRIMARY KEY(key))";

// The database seen from outside: a connection of the test's own, which shares no code with the class under test.
class Outsider {
 public:
  explicit Outsider(const std::string& path) { EXPECT_EQ(sqlite3_open(path.c_str(), &database_), SQLITE_OK) << path; }
  Outsider(const Outsider&) = delete;
  Outsider& operator=(const Outsider&) = delete;
  ~Outsider() { sqlite3_close(database_); }

  // Each row as its columns with "|" between them.
  std::vector<std::string> run(const std::string& script) const {
    std::vector<std::string> rows;
    char* error = nullptr;
    EXPECT_EQ(sqlite3_exec(database_, script.c_str(), &Outsider::collect, &rows, &error), SQLITE_OK) << script << error;
    sqlite3_free(error);
    return rows;
  }

 private:
  static int collect(void* rows, int count, char** values, char** /*names*/) {
    std::string row;
    for (int i = 0; i < count; ++i) {
      if (i > 0) row += "|";
      row += values[i] != nullptr ? values[i] : "NULL";
    }
    static_cast<std::vector<std::string>*>(rows)->push_back(row);
    return 0;
  }

  sqlite3* database_ = nullptr;
};

// Fails on demand, and remembers the scripts it was given.
class WatchedStore final : public SQLiteStore {
 public:
  struct Watch {
    std::vector<std::string> events;
    std::function<void()> onExec;
    std::function<void()> onCursor;
  };

  WatchedStore(const std::string& path, std::shared_ptr<Watch> watch) : SQLiteStore(path), watch_(std::move(watch)) {}
  WatchedStore(const WatchedStore&) = delete;
  WatchedStore& operator=(const WatchedStore&) = delete;
  ~WatchedStore() override { watch_->events.emplace_back("close"); }

  SQLiteStoreCursor cursor(const std::string& sql) override {
    watch_->events.push_back(sql);
    if (watch_->onCursor) watch_->onCursor();
    return SQLiteStore::cursor(sql);
  }

  void exec(const std::string& sql) override {
    watch_->events.push_back(sql);
    if (watch_->onExec) watch_->onExec();
    SQLiteStore::exec(sql);
  }

 private:
  std::shared_ptr<Watch> watch_;
};

class BytesMetadata final : public DiskCacheItem::ExtendedMetadata {
 public:
  explicit BytesMetadata(Bytes bytes = {99}) : bytes_(std::move(bytes)) {}
  std::vector<unsigned char> serialize() const override { return bytes_; }
  void deserialize(const std::vector<unsigned char>& bytes) override { bytes_ = bytes; }

 private:
  Bytes bytes_;
};

class BytesMetadataFactory final : public ExtendedMetadataFactory {
 public:
  using ExtendedMetadataFactory::getExtendedMetadata;
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> getExtendedMetadata() const override {
    return std::make_shared<BytesMetadata>();
  }
};

class StubbornMetadata final : public DiskCacheItem::ExtendedMetadata {
 public:
  std::vector<unsigned char> serialize() const override { throw std::domain_error("cannot be serialised"); }
  void deserialize(const std::vector<unsigned char>& /*bytes*/) override {}
};

struct Failure {
  std::string description;
  int code = 0;
  bool corrupted = false;
  std::string domain;
};

// Exceptions of SQLite's own are not caught here: letting one out fails the test.
Failure failureOf(const std::function<void()>& action) {
  try {
    action();
  } catch (const ManifestCorruptedException& exception) {
    return {exception.description(), exception.code(), true, exception.domain()};
  } catch (const ManifestPersistenceException& exception) {
    return {exception.description(), exception.code(), false, exception.domain()};
  }
  return {};
}

DiskCacheItem itemCalled(const std::string& key) { return {key, key + ".file", 10, false, 100, 200, nullptr}; }

DiskCacheItem itemUsedAt(const std::string& key, std::int32_t date) { return {key, "f", 1, false, 0, date, nullptr}; }

std::vector<std::string> keysOf(const Items& items) {
  std::vector<std::string> keys;
  for (const auto& item : items) keys.push_back(item->key);
  return keys;
}

class SQLiteManifestPersistenceTest : public testing::Test {
 protected:
  void open(std::shared_ptr<ExtendedMetadataFactory> metadata = nullptr, const SQLiteStoreFactory& factory = nullptr) {
    manifest = std::make_unique<SQLiteManifestPersistence>(path, std::move(metadata), factory);
  }

  void reopen() {
    manifest.reset();
    open();
  }

  void openWatched() { open(nullptr, watchingFactory()); }

  SQLiteStoreFactory watchingFactory() {
    return [this](const std::string& file) {
      watch->events.push_back("open " + file);
      if (onOpen) onOpen();
      return std::make_unique<WatchedStore>(file, watch);
    };
  }

  void removeEveryFile() const {
    for (const std::string& name : directory.names()) std::remove(directory.file(name).c_str());
  }

  std::vector<std::string> seenFromOutside(const std::string& sql) const { return Outsider(path).run(sql); }

  std::vector<std::string> columns() const {
    return seenFromOutside("SELECT name || ' ' || type FROM pragma_table_info('LarderManifest')");
  }

  Failure failureOfOpening() {
    return failureOf([this] { open(); });
  }

  // Every operation that uses the database, with its name.
  std::vector<std::pair<std::string, std::function<void()>>> everyOperation() {
    return {{"clearItems", [this] { manifest->clearItems(); }},
            {"setItem", [this] { manifest->setItem(itemCalled("other")); }},
            {"getItem", [this] { manifest->getItem("key"); }},
            {"removeItem", [this] { manifest->removeItem("key"); }},
            {"updateLastAccessDate", [this] { manifest->updateLastAccessDate("key", 5); }},
            {"getItemsLastAccessedBefore", [this] { manifest->getItemsLastAccessedBefore(5); }},
            {"getAllItems", [this] { manifest->getAllItems(); }},
            {"getInlineData", [this] { manifest->getInlineData("key"); }},
            {"setInlineData", [this] { manifest->setInlineData("key", {1}); }},
            {"removeInlineData", [this] { manifest->removeInlineData("key"); }}};
  }

  const test::TemporaryDirectory directory;
  const std::string path = directory.file("manifest_v1.sqlite");
  const std::shared_ptr<WatchedStore::Watch> watch = std::make_shared<WatchedStore::Watch>();
  std::function<void()> onOpen;
  std::unique_ptr<SQLiteManifestPersistence> manifest;
};

// --- The database ---

TEST_F(SQLiteManifestPersistenceTest, OpeningCreatesTheTableAndItsIndex) {
  open();
  EXPECT_THAT(seenFromOutside("SELECT sql FROM sqlite_master WHERE name = 'LarderManifest'"),
              ElementsAre(currentTable));
  EXPECT_THAT(seenFromOutside("SELECT tbl_name FROM sqlite_master WHERE name = 'last_access_date_idx'"),
              ElementsAre("LarderManifest"));
  EXPECT_THAT(seenFromOutside("SELECT name FROM pragma_index_info('last_access_date_idx')"),
              ElementsAre("last_access_date"));
  EXPECT_THAT(seenFromOutside("SELECT name FROM pragma_table_info('LarderManifest') WHERE pk = 1"), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, OpeningRunsOneScriptAndReadsTheColumns) {
  openWatched();
  EXPECT_THAT(watch->events,
              ElementsAre("open " + path,
                          "PRAGMA journal_mode = WAL;PRAGMA synchronous = NORMAL;"
                          "CREATE TABLE IF NOT EXISTS LarderManifest (key               TEXT,   "
                          "filename          TEXT,   size              INTEGER,   has_inline_data   BOOLEAN,   "
                          "inline_data       BLOB,   modification_date INTEGER,   last_access_date  INTEGER,   "
                          "extended_manifest BLOB,   PRIMARY KEY(key));"
                          "CREATE INDEX IF NOT EXISTS last_access_date_idx   ON LarderManifest(last_access_date);",
                          "SELECT sql FROM sqlite_master WHERE type='table'   AND name=?1"));
}

TEST_F(SQLiteManifestPersistenceTest, TheDatabaseIsWrittenAheadOfTime) {
  open();
  EXPECT_THAT(seenFromOutside("PRAGMA journal_mode"), ElementsAre("wal"));
  EXPECT_TRUE(directory.exists("manifest_v1.sqlite-wal"));
}

TEST_F(SQLiteManifestPersistenceTest, DestroyingItClosesTheDatabase) {
  open();
  manifest.reset();
  EXPECT_THAT(directory.names(), ElementsAre("manifest_v1.sqlite"));
}

TEST_F(SQLiteManifestPersistenceTest, ItemsSurviveReopening) {
  open();
  manifest->setItem(itemCalled("key"));
  reopen();
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, AWriteIsSeenFromOutsideAtOnce) {
  open();
  manifest->setItem(itemCalled("key"));
  EXPECT_THAT(seenFromOutside("SELECT key FROM LarderManifest"), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, OpeningAFirstVersionDatabaseAddsTheColumnAndKeepsEveryRow) {
  Outsider(path).run(firstVersionTable +
                     "INSERT INTO LarderManifest VALUES('a', 'a.file', 1, 0, NULL, 10, 20);"
                     "INSERT INTO LarderManifest VALUES('b', '', 2, 1, x'0102', 30, 40);");
  open();
  EXPECT_THAT(columns(),
              ElementsAre("key TEXT", "filename TEXT", "size INTEGER", "has_inline_data BOOLEAN", "inline_data BLOB",
                          "modification_date INTEGER", "last_access_date INTEGER", "extended_manifest BLOB"));
  EXPECT_THAT(keysOf(manifest->getAllItems()), UnorderedElementsAre("a", "b"));
  EXPECT_EQ(manifest->getItem("a")->lastAccessDate, 20);
  EXPECT_EQ(manifest->getInlineData("b"), (Bytes{1, 2}));
}

TEST_F(SQLiteManifestPersistenceTest, AMigratedDatabaseIsNotMigratedAgain) {
  Outsider(path).run(firstVersionTable);
  open();
  manifest->setItem(itemCalled("key"));
  const auto migrated = columns();
  manifest.reset();
  openWatched();
  EXPECT_EQ(columns(), migrated);
  EXPECT_EQ(
      std::count(watch->events.begin(), watch->events.end(), "ALTER TABLE LarderManifest ADD extended_manifest BLOB"),
      0);
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, MigratingAddsTheColumnOnce) {
  Outsider(path).run(firstVersionTable);
  openWatched();
  EXPECT_EQ(watch->events.back(), "ALTER TABLE LarderManifest ADD extended_manifest BLOB");
  EXPECT_EQ(watch->events.size(), 4U);
}

TEST_F(SQLiteManifestPersistenceTest, MetadataIsWrittenIntoAMigratedDatabase) {
  Outsider(path).run(firstVersionTable);
  open(std::make_shared<BytesMetadataFactory>());
  manifest->setItem({"key", "f", 1, false, 2, 3, std::make_shared<BytesMetadata>(Bytes{4, 5})});
  EXPECT_EQ(manifest->getItem("key")->extendedMetadata->serialize(), (Bytes{4, 5}));
}

TEST_F(SQLiteManifestPersistenceTest, AForeignTableIsCorruption) {
  const std::vector<std::string> foreign = {
      // another type of a column
      "key TEXT, filename TEXT, size BIGINT, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key)",
      "key TEXT, filename TEXT, size REAL, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key)",
      "key text, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key)",
      "key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, extended_manifest TEXT, PRIMARY KEY(key)",
      // another name
      "Key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key)",
      "key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, metadata BLOB, PRIMARY KEY(key)",
      // another order
      "filename TEXT, key TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, "
      "last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key)",
      // too few columns
      "key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, last_access_date INTEGER",
      "last_access_date INTEGER"};
  for (const std::string& declarations : foreign) {
    const test::TemporaryDirectory own;
    const std::string file = own.file("manifest_v1.sqlite");
    Outsider(file).run("CREATE TABLE LarderManifest(" + declarations + ")");
    const Failure failure = failureOf([&] { SQLiteManifestPersistence(file, nullptr, nullptr); });
    EXPECT_EQ(failure.description, "Invalid schema.") << declarations;
    EXPECT_EQ(failure.code, -1);
    EXPECT_TRUE(failure.corrupted);
    EXPECT_EQ(failure.domain, "QZManifestPersistenceErrorDomain");
  }
}

TEST_F(SQLiteManifestPersistenceTest, AForeignTableIsLeftAsItIs) {
  Outsider(path).run("CREATE TABLE LarderManifest(last_access_date INTEGER);INSERT INTO LarderManifest VALUES(7)");
  EXPECT_TRUE(failureOfOpening().corrupted);
  EXPECT_THAT(columns(), ElementsAre("last_access_date INTEGER"));
  EXPECT_THAT(seenFromOutside("SELECT * FROM LarderManifest"), ElementsAre("7"));
}

TEST_F(SQLiteManifestPersistenceTest, ATableThatCannotBeIndexedIsAPlainError) {
  Outsider(path).run("CREATE TABLE LarderManifest(key TEXT)");
  const Failure failure = failureOfOpening();
  EXPECT_THAT(failure.description, StartsWith("SQLite Error #1: "));
  EXPECT_EQ(failure.code, SQLITE_ERROR);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteManifestPersistenceTest, ColumnsBeyondTheKnownOnesAreLeftAlone) {
  open();
  manifest.reset();
  Outsider(path).run("ALTER TABLE LarderManifest ADD later TEXT");
  open();
  manifest->setItem(itemCalled("key"));
  EXPECT_EQ(manifest->getItem("key")->filename, "key.file");
  EXPECT_EQ(columns().size(), 9U);
}

TEST_F(SQLiteManifestPersistenceTest, AFailedOpenLeavesNoConnectionBehind) {
  Outsider(path).run("PRAGMA journal_mode = WAL;CREATE TABLE LarderManifest(last_access_date INTEGER)");
  EXPECT_TRUE(failureOfOpening().corrupted);
  EXPECT_THAT(directory.names(), ElementsAre("manifest_v1.sqlite"));
}

TEST_F(SQLiteManifestPersistenceTest, AFileThatIsNoDatabaseIsCorruptionAndIsNotDeleted) {
  directory.write("manifest_v1.sqlite", std::string(4096, 'x'));
  const Failure failure = failureOfOpening();
  EXPECT_EQ(failure.description, "SQLite Error #26: file is not a database (" + path + ")");
  EXPECT_EQ(failure.code, SQLITE_NOTADB);
  EXPECT_TRUE(failure.corrupted);
  EXPECT_EQ(failure.domain, "QZManifestPersistenceErrorDomain");
  EXPECT_EQ(directory.read("manifest_v1.sqlite"), std::string(4096, 'x'));
}

TEST_F(SQLiteManifestPersistenceTest, AMissingDirectoryIsAPlainError) {
  const std::string missing = directory.file("missing/manifest_v1.sqlite");
  const Failure failure = failureOf([&] { SQLiteManifestPersistence(missing, nullptr, nullptr); });
  EXPECT_EQ(failure.description, "SQLite Error #14: Cannot open database: '" + missing + "'");
  EXPECT_EQ(failure.code, SQLITE_CANTOPEN);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteManifestPersistenceTest, AnEmptyFileBecomesADatabase) {
  directory.write("manifest_v1.sqlite", "");
  open();
  EXPECT_EQ(columns().size(), 8U);
}

TEST_F(SQLiteManifestPersistenceTest, AGivenStoreFactoryIsAskedOnce) {
  onOpen = [] { throw SQLiteStoreException("busy", SQLITE_BUSY); };
  const Failure failure = failureOf([this] { openWatched(); });
  EXPECT_EQ(failure.description, "busy");
  EXPECT_EQ(failure.code, SQLITE_BUSY);
  EXPECT_THAT(watch->events, ElementsAre("open " + path));
}

// --- Items ---

TEST_F(SQLiteManifestPersistenceTest, AnItemIsWrittenAsOneRow) {
  open();
  manifest->setItem({"key", "the.file", 12, false, 100, 200, nullptr});
  EXPECT_THAT(seenFromOutside("SELECT * FROM LarderManifest"), ElementsAre("key|the.file|12|0|NULL|100|200|NULL"));
  EXPECT_THAT(seenFromOutside("SELECT typeof(key), typeof(filename), typeof(size), typeof(has_inline_data), "
                              "typeof(modification_date), typeof(last_access_date) FROM LarderManifest"),
              ElementsAre("text|text|integer|integer|integer|integer"));
}

TEST_F(SQLiteManifestPersistenceTest, AnItemIsReadBackAsItWasWritten) {
  open();
  manifest->setItem({"key", "the.file", 12, true, 100, 200, nullptr});
  const auto item = manifest->getItem("key");
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->key, "key");
  EXPECT_EQ(item->filename, "the.file");
  EXPECT_EQ(item->size, 12U);
  EXPECT_TRUE(item->hasInlineData);
  EXPECT_EQ(item->modificationDate, 100);
  EXPECT_EQ(item->lastAccessDate, 200);
  EXPECT_EQ(item->extendedMetadata, nullptr);
}

TEST_F(SQLiteManifestPersistenceTest, TheExtremesOfEveryNumberAreKept) {
  constexpr auto first = std::numeric_limits<std::int32_t>::min();
  constexpr auto last = std::numeric_limits<std::int32_t>::max();
  constexpr auto largest = std::numeric_limits<std::uint32_t>::max();
  open();
  manifest->setItem({"a", "f", largest, false, first, last, nullptr});
  manifest->setItem({"b", "f", 0, false, -1, first, nullptr});
  EXPECT_THAT(seenFromOutside("SELECT size, modification_date, last_access_date FROM LarderManifest ORDER BY key"),
              ElementsAre("4294967295|-2147483648|2147483647", "0|-1|-2147483648"));
  EXPECT_EQ(manifest->getItem("a")->size, largest);
  EXPECT_EQ(manifest->getItem("a")->modificationDate, first);
  EXPECT_EQ(manifest->getItem("a")->lastAccessDate, last);
  EXPECT_EQ(manifest->getItem("b")->modificationDate, -1);
}

TEST_F(SQLiteManifestPersistenceTest, NumbersBeyondThirtyTwoBitsAreCutWhenRead) {
  open();
  Outsider(path).run(
      "INSERT INTO LarderManifest VALUES('key', 'f', 4294967301, 0, NULL, 4294967302, -4294967297, NULL)");
  const auto item = manifest->getItem("key");
  EXPECT_EQ(item->size, 5U);
  EXPECT_EQ(item->modificationDate, 6);
  EXPECT_EQ(item->lastAccessDate, -1);
}

TEST_F(SQLiteManifestPersistenceTest, ARowOfNullsReadsAsAnEmptyItem) {
  open();
  Outsider(path).run("INSERT INTO LarderManifest(key) VALUES('key')");
  const auto item = manifest->getItem("key");
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->filename, "");
  EXPECT_EQ(item->size, 0U);
  EXPECT_FALSE(item->hasInlineData);
  EXPECT_EQ(item->lastAccessDate, 0);
}

TEST_F(SQLiteManifestPersistenceTest, AKeyWithoutARowGivesNoItem) {
  open();
  manifest->setItem(itemCalled("key"));
  EXPECT_EQ(manifest->getItem("Key"), nullptr);
  EXPECT_EQ(manifest->getItem(""), nullptr);
  EXPECT_EQ(manifest->getItem("ke%"), nullptr);
}

TEST_F(SQLiteManifestPersistenceTest, EveryTextIsAKey) {
  open();
  const std::vector<std::string> keys = {"",   std::string("a\0b", 3), std::string("a\0c", 3),
                                         "a",  "'; DROP TABLE x",      "\xff\xfe",
                                         "?1", std::string(5000, 'k')};
  for (const std::string& key : keys) manifest->setItem(itemCalled(key));
  EXPECT_THAT(keysOf(manifest->getAllItems()), testing::UnorderedElementsAreArray(keys));
  for (const std::string& key : keys) {
    const auto item = manifest->getItem(key);
    ASSERT_NE(item, nullptr) << key;
    EXPECT_EQ(item->filename, key + ".file");
  }
  manifest->removeItem(std::string("a\0b", 3));
  EXPECT_EQ(manifest->getAllItems().size(), keys.size() - 1);
  EXPECT_NE(manifest->getItem("a"), nullptr);
}

TEST_F(SQLiteManifestPersistenceTest, AnItemHandedOutIsTheCallersOwn) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->getItem("key")->size = 999;
  EXPECT_EQ(manifest->getItem("key")->size, 10U);
}

TEST_F(SQLiteManifestPersistenceTest, SettingAnItemAgainReplacesItsWholeRow) {
  open();
  manifest->setItem({"key", "old", 1, false, 2, 3, std::make_shared<BytesMetadata>()});
  manifest->setItem({"key", "new", 4, false, 5, 6, nullptr});
  EXPECT_THAT(seenFromOutside("SELECT * FROM LarderManifest"), ElementsAre("key|new|4|0|NULL|5|6|NULL"));
}

TEST_F(SQLiteManifestPersistenceTest, SettingAnItemAgainClearsItsInlineData) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->setInlineData("key", {1, 2, 3});
  manifest->setItem(itemCalled("key"));
  EXPECT_EQ(manifest->getInlineData("key"), Bytes());
  EXPECT_THAT(seenFromOutside("SELECT has_inline_data, inline_data FROM LarderManifest"), ElementsAre("0|NULL"));
}

TEST_F(SQLiteManifestPersistenceTest, TheInlineMarkOfAReplacedRowIsTheItemsOwn) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->setInlineData("key", {1, 2, 3});
  manifest->setItem({"key", "", 3, true, 1, 1, nullptr});
  EXPECT_EQ(manifest->getInlineData("key"), Bytes());
  EXPECT_THAT(seenFromOutside("SELECT has_inline_data, inline_data FROM LarderManifest"), ElementsAre("1|NULL"));
}

TEST_F(SQLiteManifestPersistenceTest, RemovingTakesOneItemWithItsInlineData) {
  open();
  manifest->setItem(itemCalled("a"));
  manifest->setItem(itemCalled("b"));
  manifest->setInlineData("a", {1});
  manifest->removeItem("a");
  EXPECT_THAT(seenFromOutside("SELECT key FROM LarderManifest"), ElementsAre("b"));
  EXPECT_EQ(manifest->getInlineData("a"), Bytes());
}

TEST_F(SQLiteManifestPersistenceTest, RemovingAnItemThatIsNotThereIsNoError) {
  open();
  manifest->setItem(itemCalled("a"));
  EXPECT_NO_THROW(manifest->removeItem("b"));
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("a"));
}

TEST_F(SQLiteManifestPersistenceTest, EveryOperationRunsOneStatementOfItsOwn) {
  openWatched();
  watch->events.clear();
  auto operations = everyOperation();
  operations.erase(operations.begin());  // clearItems opens the database anew
  for (const auto& [name, operation] : operations) operation();
  const std::string wholeRows =
      "SELECT  key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  extended_manifest "
      "FROM LarderManifest";
  EXPECT_THAT(
      watch->events,
      ElementsAre("INSERT OR REPLACE INTO LarderManifest(key,  filename,  size,  has_inline_data,  modification_date,  "
                  "last_access_date,  extended_manifest )VALUES  (?1, ?2, ?3, ?4, ?5, ?6, ?7);",
                  wholeRows + " WHERE key = ?1;", "DELETE FROM LarderManifest WHERE key = ?1;",
                  "UPDATE LarderManifest SET last_access_date = ?2 WHERE key = ?1;",
                  wholeRows + " WHERE last_access_date < ?1;", wholeRows + ";",
                  "SELECT  inline_data FROM  LarderManifest WHERE  has_inline_data IS 1 AND  key = ?1",
                  "UPDATE   LarderManifest SET   has_inline_data = 1,  inline_data = ?2 WHERE   key = ?1;",
                  "UPDATE   LarderManifest SET   has_inline_data = 0,   inline_data = NULL WHERE   key = ?1;"));
}

TEST_F(SQLiteManifestPersistenceTest, AllItemsOfAnEmptyTableAreNone) {
  open();
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
}

// --- Access dates ---

TEST_F(SQLiteManifestPersistenceTest, UpdatingTheAccessDateChangesNothingElse) {
  open();
  manifest->setItem({"key", "f", 1, true, 2, 3, std::make_shared<BytesMetadata>(Bytes{'m'})});
  manifest->setItem(itemUsedAt("other", 4));
  manifest->setInlineData("key", {'i'});
  manifest->updateLastAccessDate("key", 77);
  EXPECT_THAT(seenFromOutside("SELECT * FROM LarderManifest ORDER BY key"),
              ElementsAre("key|f|1|1|i|2|77|m", "other|f|1|0|NULL|0|4|NULL"));
}

TEST_F(SQLiteManifestPersistenceTest, UpdatingTheAccessDateKeepsItsSign) {
  open();
  manifest->setItem(itemUsedAt("key", 4));
  manifest->updateLastAccessDate("key", -77);
  EXPECT_THAT(seenFromOutside("SELECT last_access_date FROM LarderManifest"), ElementsAre("-77"));
  EXPECT_EQ(manifest->getItem("key")->lastAccessDate, -77);
}

TEST_F(SQLiteManifestPersistenceTest, UpdatingTheAccessDateOfAMissingItemMakesNone) {
  open();
  EXPECT_NO_THROW(manifest->updateLastAccessDate("key", 77));
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
}

TEST_F(SQLiteManifestPersistenceTest, ItemsUsedBeforeADateAreThoseStrictlyBefore) {
  open();
  manifest->setItem(itemUsedAt("before", 99));
  manifest->setItem(itemUsedAt("at", 100));
  manifest->setItem(itemUsedAt("after", 101));
  manifest->setItem(itemUsedAt("long before", -5));
  EXPECT_THAT(keysOf(manifest->getItemsLastAccessedBefore(100)), UnorderedElementsAre("before", "long before"));
  EXPECT_THAT(keysOf(manifest->getItemsLastAccessedBefore(0)), ElementsAre("long before"));
  EXPECT_THAT(manifest->getItemsLastAccessedBefore(-5), IsEmpty());
  EXPECT_EQ(manifest->getItemsLastAccessedBefore(std::numeric_limits<long>::max()).size(), 4U);
  EXPECT_THAT(manifest->getItemsLastAccessedBefore(std::numeric_limits<long>::min()), IsEmpty());
}

TEST_F(SQLiteManifestPersistenceTest, ItemsUsedBeforeADateAreWholeItems) {
  open();
  manifest->setItem({"key", "the.file", 12, true, 100, 200, nullptr});
  const Items items = manifest->getItemsLastAccessedBefore(201);
  ASSERT_EQ(items.size(), 1U);
  EXPECT_EQ(items[0]->filename, "the.file");
  EXPECT_EQ(items[0]->size, 12U);
  EXPECT_TRUE(items[0]->hasInlineData);
  EXPECT_EQ(items[0]->modificationDate, 100);
}

// --- Inline data ---

TEST_F(SQLiteManifestPersistenceTest, InlineDataComesBackAsItWasAndMarksItsItem) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->setItem(itemCalled("other"));
  manifest->setInlineData("key", {0, 255, 0});
  EXPECT_EQ(manifest->getInlineData("key"), (Bytes{0, 255, 0}));
  EXPECT_EQ(manifest->getInlineData("other"), Bytes());
  EXPECT_TRUE(manifest->getItem("key")->hasInlineData);
  EXPECT_FALSE(manifest->getItem("other")->hasInlineData);
  EXPECT_EQ(manifest->getItem("key")->size, 10U);
  reopen();
  EXPECT_EQ(manifest->getInlineData("key"), (Bytes{0, 255, 0}));
}

TEST_F(SQLiteManifestPersistenceTest, LaterInlineDataReplacesTheEarlier) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->setInlineData("key", Bytes(100000, 1));
  manifest->setInlineData("key", {2});
  EXPECT_EQ(manifest->getInlineData("key"), Bytes{2});
}

TEST_F(SQLiteManifestPersistenceTest, EmptyInlineDataIsThereAndEmpty) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->setInlineData("key", {1});
  manifest->setInlineData("key", {});
  EXPECT_EQ(manifest->getInlineData("key"), Bytes());
  EXPECT_TRUE(manifest->getItem("key")->hasInlineData);
  EXPECT_THAT(seenFromOutside("SELECT has_inline_data, typeof(inline_data), length(inline_data) FROM LarderManifest"),
              ElementsAre("1|blob|0"));
}

TEST_F(SQLiteManifestPersistenceTest, InlineDataOfAMissingItemIsDropped) {
  open();
  EXPECT_NO_THROW(manifest->setInlineData("key", {1}));
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
  EXPECT_EQ(manifest->getInlineData("key"), Bytes());
}

TEST_F(SQLiteManifestPersistenceTest, InlineDataWithoutTheMarkIsNotRead) {
  open();
  Outsider(path).run(
      "INSERT INTO LarderManifest VALUES('no', 'f', 1, 0, x'0102', 1, 1, NULL);"
      "INSERT INTO LarderManifest VALUES('null', 'f', 1, NULL, x'0102', 1, 1, NULL);"
      "INSERT INTO LarderManifest VALUES('two', 'f', 1, 2, x'0102', 1, 1, NULL)");
  for (const auto* key : {"no", "null", "two"}) EXPECT_EQ(manifest->getInlineData(key), Bytes()) << key;
}

TEST_F(SQLiteManifestPersistenceTest, RemovingInlineDataKeepsTheItem) {
  open();
  manifest->setItem({"key", "f", 1, false, 2, 3, std::make_shared<BytesMetadata>(Bytes{'m'})});
  manifest->setInlineData("key", {1});
  manifest->removeInlineData("key");
  EXPECT_EQ(manifest->getInlineData("key"), Bytes());
  EXPECT_THAT(seenFromOutside("SELECT * FROM LarderManifest"), ElementsAre("key|f|1|0|NULL|2|3|m"));
  EXPECT_NO_THROW(manifest->removeInlineData("missing"));
}

// --- Extended metadata ---

TEST_F(SQLiteManifestPersistenceTest, MetadataIsWrittenAsItsBytesAndReadBack) {
  open(std::make_shared<VideoDownloadExtendedMetadataFactory>());
  const auto metadata = std::make_shared<VideoDownloadExtendedMetadata>(12, static_cast<ItemType>(2));
  manifest->setItem({"key", "f", 1, false, 2, 3, metadata});
  EXPECT_THAT(seenFromOutside("SELECT typeof(extended_manifest), CAST(extended_manifest AS TEXT) FROM LarderManifest"),
              ElementsAre("blob|{chunkSecond:12}{itemType:2}"));
  const auto item = manifest->getItem("key");
  const auto read = std::dynamic_pointer_cast<VideoDownloadExtendedMetadata>(item->extendedMetadata);
  ASSERT_NE(read, nullptr);
  EXPECT_NE(read, metadata);
  EXPECT_EQ(read->getExtendedMetadata(), 12);
  EXPECT_EQ(read->getItemType(), static_cast<ItemType>(2));
}

TEST_F(SQLiteManifestPersistenceTest, EveryWayOfReadingItemsBringsTheirMetadata) {
  open(std::make_shared<BytesMetadataFactory>());
  manifest->setItem({"key", "f", 1, false, 2, 3, std::make_shared<BytesMetadata>(Bytes{0, 1})});
  EXPECT_EQ(manifest->getItem("key")->extendedMetadata->serialize(), (Bytes{0, 1}));
  EXPECT_EQ(manifest->getAllItems().at(0)->extendedMetadata->serialize(), (Bytes{0, 1}));
  EXPECT_EQ(manifest->getItemsLastAccessedBefore(9).at(0)->extendedMetadata->serialize(), (Bytes{0, 1}));
}

TEST_F(SQLiteManifestPersistenceTest, AnItemWithoutMetadataGetsAnObjectMadeFromNothing) {
  open(std::make_shared<BytesMetadataFactory>());
  manifest->setItem(itemCalled("key"));
  EXPECT_THAT(seenFromOutside("SELECT extended_manifest FROM LarderManifest"), ElementsAre("NULL"));
  const auto item = manifest->getItem("key");
  ASSERT_NE(item->extendedMetadata, nullptr);
  EXPECT_EQ(item->extendedMetadata->serialize(), Bytes());
}

TEST_F(SQLiteManifestPersistenceTest, MetadataOfNoBytesIsAnEmptyBlob) {
  open(std::make_shared<BytesMetadataFactory>());
  manifest->setItem({"key", "f", 1, false, 2, 3, std::make_shared<BytesMetadata>(Bytes())});
  EXPECT_THAT(seenFromOutside("SELECT typeof(extended_manifest) FROM LarderManifest"), ElementsAre("blob"));
  EXPECT_EQ(manifest->getItem("key")->extendedMetadata->serialize(), Bytes());
}

TEST_F(SQLiteManifestPersistenceTest, WithoutAFactoryMetadataIsWrittenButNotRead) {
  open();
  manifest->setItem({"key", "f", 1, false, 2, 3, std::make_shared<BytesMetadata>(Bytes{'m'})});
  EXPECT_EQ(manifest->getItem("key")->extendedMetadata, nullptr);
  EXPECT_THAT(seenFromOutside("SELECT extended_manifest FROM LarderManifest"), ElementsAre("m"));
}

TEST_F(SQLiteManifestPersistenceTest, AnExceptionOfTheMetadataPassesUnchangedAndWritesNothing) {
  open();
  EXPECT_THROW(manifest->setItem({"key", "f", 1, false, 2, 3, std::make_shared<StubbornMetadata>()}),
               std::domain_error);
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
}

// --- Starting again ---

TEST_F(SQLiteManifestPersistenceTest, ClearingAfterTheFileWasRemovedStartsEmpty) {
  open();
  manifest->setItem(itemCalled("old"));
  removeEveryFile();
  manifest->clearItems();
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
  manifest->setItem(itemCalled("new"));
  EXPECT_THAT(seenFromOutside("SELECT key FROM LarderManifest"), ElementsAre("new"));
  reopen();
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("new"));
}

TEST_F(SQLiteManifestPersistenceTest, ClearingAfterTheDatabaseAloneWasRemovedStartsEmptyToo) {
  open();
  manifest->setItem(itemCalled("old"));
  std::remove(path.c_str());
  manifest->clearItems();
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
  manifest->setItem(itemCalled("new"));
  EXPECT_THAT(seenFromOutside("SELECT key FROM LarderManifest"), ElementsAre("new"));
  reopen();
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("new"));
}

TEST_F(SQLiteManifestPersistenceTest, ClearingWhileTheFileIsThereKeepsTheItems) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->clearItems();
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, ClearingOpensTheNewStoreBeforeItLetsGoOfTheOldAndThenInitializes) {
  openWatched();
  const std::vector<std::string> opening = watch->events;
  watch->events.clear();
  manifest->clearItems();
  ASSERT_EQ(watch->events.size(), 4U);
  EXPECT_EQ(watch->events[0], opening[0]);
  EXPECT_EQ(watch->events[1], "close");
  EXPECT_EQ(watch->events[2], opening[1]);
  EXPECT_EQ(watch->events[3], opening[2]);
}

TEST_F(SQLiteManifestPersistenceTest, WhenTheNewStoreCannotBeOpenedTheOldOneStaysInUse) {
  openWatched();
  manifest->setItem(itemCalled("key"));
  onOpen = [] { throw SQLiteStoreException("no", SQLITE_CANTOPEN); };
  const Failure failure = failureOf([this] { manifest->clearItems(); });
  EXPECT_EQ(failure.description, "no");
  EXPECT_EQ(failure.code, SQLITE_CANTOPEN);
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, ClearingOntoAFileThatIsNoDatabaseIsCorruption) {
  open();
  removeEveryFile();
  directory.write("manifest_v1.sqlite", std::string(4096, 'x'));
  const Failure failure = failureOf([this] { manifest->clearItems(); });
  EXPECT_EQ(failure.code, SQLITE_NOTADB);
  EXPECT_TRUE(failure.corrupted);
}

TEST_F(SQLiteManifestPersistenceTest, ClearingMigratesToo) {
  open();
  removeEveryFile();
  Outsider(path).run(firstVersionTable);
  manifest->clearItems();
  EXPECT_EQ(columns().size(), 8U);
}

// --- Invalidation ---

TEST_F(SQLiteManifestPersistenceTest, InvalidatingClosesTheDatabase) {
  open();
  manifest->setItem(itemCalled("key"));
  manifest->invalidate();
  EXPECT_THAT(directory.names(), ElementsAre("manifest_v1.sqlite"));
}

TEST_F(SQLiteManifestPersistenceTest, AfterInvalidationEveryOperationIsASilentNoOp) {
  openWatched();
  manifest->setItem(itemCalled("key"));
  manifest->setInlineData("key", {1});
  const auto rows = seenFromOutside("SELECT * FROM LarderManifest");
  manifest->invalidate();
  watch->events.clear();
  for (const auto& [name, operation] : everyOperation()) EXPECT_NO_THROW(operation()) << name;
  EXPECT_EQ(manifest->getItem("key"), nullptr);
  EXPECT_THAT(manifest->getAllItems(), IsEmpty());
  EXPECT_THAT(manifest->getItemsLastAccessedBefore(1000), IsEmpty());
  EXPECT_EQ(manifest->getInlineData("key"), Bytes());
  EXPECT_THAT(watch->events, IsEmpty());
  EXPECT_EQ(seenFromOutside("SELECT * FROM LarderManifest"), rows);
}

TEST_F(SQLiteManifestPersistenceTest, AfterInvalidationTheDatabaseIsNotMadeAgain) {
  open();
  manifest->invalidate();
  std::remove(path.c_str());
  for (const auto& [name, operation] : everyOperation()) operation();
  EXPECT_THAT(directory.names(), IsEmpty());
}

TEST_F(SQLiteManifestPersistenceTest, InvalidatingTwiceIsNoError) {
  open();
  manifest->invalidate();
  EXPECT_NO_THROW(manifest->invalidate());
  EXPECT_EQ(manifest->getItem("key"), nullptr);
}

// --- Failures ---

TEST_F(SQLiteManifestPersistenceTest, EveryOperationTranslatesAPlainError) {
  openWatched();
  const auto fail = [] { throw SQLiteStoreException("SQLite Error #13: full (file)", SQLITE_FULL); };
  watch->onCursor = fail;
  watch->onExec = fail;
  for (const auto& [name, operation] : everyOperation()) {
    const Failure failure = failureOf(operation);
    EXPECT_EQ(failure.description, "SQLite Error #13: full (file)") << name;
    EXPECT_EQ(failure.code, SQLITE_FULL) << name;
    EXPECT_FALSE(failure.corrupted) << name;
    EXPECT_EQ(failure.domain, "QZManifestPersistenceErrorDomain") << name;
  }
}

TEST_F(SQLiteManifestPersistenceTest, EveryOperationTranslatesCorruption) {
  openWatched();
  const auto fail = [] { throw SQLiteStoreCorruptedException("SQLite Error #11: bad (file)", SQLITE_CORRUPT); };
  watch->onCursor = fail;
  watch->onExec = fail;
  for (const auto& [name, operation] : everyOperation()) {
    const Failure failure = failureOf(operation);
    EXPECT_EQ(failure.description, "SQLite Error #11: bad (file)") << name;
    EXPECT_EQ(failure.code, SQLITE_CORRUPT) << name;
    EXPECT_TRUE(failure.corrupted) << name;
    EXPECT_EQ(failure.domain, "QZManifestPersistenceErrorDomain") << name;
  }
}

TEST_F(SQLiteManifestPersistenceTest, EveryOperationLetsOtherExceptionsPassUnchanged) {
  openWatched();
  const auto fail = [] { throw std::domain_error("mine"); };
  watch->onCursor = fail;
  watch->onExec = fail;
  for (const auto& [name, operation] : everyOperation()) EXPECT_THROW(operation(), std::domain_error) << name;
}

TEST_F(SQLiteManifestPersistenceTest, AFailureIsNotTriedAgainAndLeavesTheNextCallItsChance) {
  openWatched();
  int attempts = 0;
  watch->onCursor = [&] {
    ++attempts;
    throw SQLiteStoreException("once", SQLITE_BUSY);
  };
  EXPECT_EQ(failureOf([this] { manifest->setItem(itemCalled("key")); }).description, "once");
  EXPECT_EQ(attempts, 1);
  watch->onCursor = nullptr;
  manifest->setItem(itemCalled("key"));
  EXPECT_THAT(keysOf(manifest->getAllItems()), ElementsAre("key"));
}

TEST_F(SQLiteManifestPersistenceTest, OpeningTranslatesBothClassesAndLetsOthersPass) {
  onOpen = [] { throw SQLiteStoreCorruptedException("bad", SQLITE_FORMAT); };
  const Failure corrupted = failureOf([this] { openWatched(); });
  EXPECT_EQ(corrupted.description, "bad");
  EXPECT_EQ(corrupted.code, SQLITE_FORMAT);
  EXPECT_TRUE(corrupted.corrupted);
  onOpen = [] { throw std::domain_error("mine"); };
  EXPECT_THROW(openWatched(), std::domain_error);
}

TEST_F(SQLiteManifestPersistenceTest, AWriteWhileAnotherHoldsTheDatabaseIsAPlainErrorAndChangesNothing) {
  open();
  manifest->setItem(itemCalled("key"));
  const Outsider other(path);
  other.run("BEGIN IMMEDIATE");
  const Failure failure = failureOf([this] { manifest->removeItem("key"); });
  EXPECT_EQ(failure.description, "SQLite Error #5: database is locked (" + path + ")");
  EXPECT_EQ(failure.code, SQLITE_BUSY);
  EXPECT_FALSE(failure.corrupted);
  EXPECT_NE(manifest->getItem("key"), nullptr);
  other.run("COMMIT");
  manifest->removeItem("key");
  EXPECT_EQ(manifest->getItem("key"), nullptr);
}

TEST_F(SQLiteManifestPersistenceTest, ATableThatIsDroppedBehindItIsAPlainError) {
  open();
  Outsider(path).run("DROP TABLE LarderManifest");
  const Failure failure = failureOf([this] { manifest->getAllItems(); });
  EXPECT_EQ(failure.description, "SQLite Error #1: no such table: LarderManifest (" + path + ")");
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteManifestPersistenceTest, ADamagedPageIsCorruption) {
  open();
  for (int i = 0; i < 500; ++i) manifest->setItem(itemCalled("key" + std::to_string(i)));
  manifest.reset();
  std::string bytes = directory.read("manifest_v1.sqlite");
  ASSERT_GT(bytes.size(), 3 * 4096U);
  std::fill(bytes.begin() + 2 * 4096, bytes.end(), '\xff');
  bytes.replace(4096, 4096, std::string(4096, '\xff'));
  directory.write("manifest_v1.sqlite", bytes);
  open();
  const Failure failure = failureOf([this] { manifest->getAllItems(); });
  EXPECT_EQ(failure.description, "SQLite Error #11: database disk image is malformed (" + path + ")");
  EXPECT_EQ(failure.code, SQLITE_CORRUPT);
  EXPECT_TRUE(failure.corrupted);
}

// --- Several threads ---

TEST_F(SQLiteManifestPersistenceTest, ThreadsMayUseItAtOnce) {
  open(std::make_shared<BytesMetadataFactory>());
  constexpr std::size_t threads = 4;
  constexpr int rounds = 25;
  test::runOnThreads(threads, [this](std::size_t thread) {
    for (int round = 0; round < rounds; ++round) {
      const std::string key = std::to_string(thread) + "-" + std::to_string(round);
      manifest->setItem({key, "f", 1, false, 2, 3, std::make_shared<BytesMetadata>()});
      manifest->setInlineData(key, {static_cast<unsigned char>(round)});
      manifest->updateLastAccessDate(key, round);
      EXPECT_EQ(manifest->getInlineData(key), Bytes{static_cast<unsigned char>(round)});
      EXPECT_EQ(manifest->getItem(key)->lastAccessDate, round);
      manifest->getItemsLastAccessedBefore(round);
      if (round % 2 == 1) manifest->removeItem(key);
    }
  });
  EXPECT_EQ(manifest->getAllItems().size(), threads * (rounds / 2 + 1));
}

TEST_F(SQLiteManifestPersistenceTest, ItMayBeInvalidatedAndClearedWhileOthersUseIt) {
  open();
  test::runOnThreads(4, [this](std::size_t thread) {
    for (int round = 0; round < 20; ++round) {
      if (thread == 0 && round == 10) manifest->invalidate();
      if (thread == 1) manifest->clearItems();
      manifest->setItem(itemCalled("key"));
      const auto item = manifest->getItem("key");
      EXPECT_TRUE(item == nullptr || item->filename == "key.file");
    }
  });
  EXPECT_EQ(manifest->getItem("key"), nullptr);
  EXPECT_THAT(seenFromOutside("SELECT key FROM LarderManifest"), ElementsAre("key"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
