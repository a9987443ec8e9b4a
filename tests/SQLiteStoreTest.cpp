#include "SQLiteStore.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <chrono>
#include <functional>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;

constexpr long long mebibyte = 1024 * 1024;

// What an SQLite call threw: "" when it threw nothing.
struct Failure {
  std::string description;
  int code = 0;
  bool corrupted = false;
};

Failure failureOf(const std::function<void()>& action) {
  try {
    action();
  } catch (const SQLiteStoreCorruptedException& exception) {
    return {exception.description(), exception.code(), true};
  } catch (const SQLiteStoreException& exception) {
    return {exception.description(), exception.code(), false};
  }
  return {};
}

std::vector<std::string> declared(const std::vector<SQLiteStoreColumn>& columns) {
  std::vector<std::string> texts;
  for (const SQLiteStoreColumn& column : columns) texts.push_back(column.name + " " + column.type);
  return texts;
}

class SQLiteStoreTest : public testing::Test {
 protected:
  // Columns of a table made by the statement and called "t".
  std::vector<std::string> columnsOf(const std::string& createTable) {
    SQLiteStore store(path);
    store.exec(createTable);
    return declared(store.info("t"));
  }

  // The value of an expression in SQL.
  template <class T> T valueOf(const std::string& expression) {
    SQLiteStore store(path);
    SQLiteStoreCursor cursor = store.cursor("SELECT " + expression);
    EXPECT_TRUE(cursor.next());
    return cursor.get<T>(0);
  }

  // What SQL says about a bound value, say typeof(?1).
  template <class T> std::string askAbout(const T& value, const std::string& expression) {
    SQLiteStore store(path);
    SQLiteStoreCursor cursor = store.cursor("SELECT " + expression);
    cursor.bind<T>(1, value);
    EXPECT_TRUE(cursor.next());
    return cursor.get<std::string>(0);
  }

  template <class T> T thereAndBack(const T& value) {
    SQLiteStore store(path);
    SQLiteStoreCursor cursor = store.cursor("SELECT ?1");
    cursor.bind<T>(1, value);
    EXPECT_TRUE(cursor.next());
    return cursor.get<T>(0);
  }

  void makeNumbers(SQLiteStore& store) const {
    store.exec("PRAGMA journal_mode = WAL;CREATE TABLE t(n INTEGER PRIMARY KEY);INSERT INTO t VALUES(1),(2),(3)");
  }

  // SQLite keeps this file beside the database for as long as some connection is open.
  bool connectionIsOpen() const { return directory.exists("db-wal"); }

  const test::TemporaryDirectory directory;
  const std::string path = directory.file("db");
};

// --- Errors ---

TEST(ThrowSQLiteException, LetsOkRowAndDonePass) {
  for (const int code : {SQLITE_OK, SQLITE_ROW, SQLITE_DONE}) EXPECT_NO_THROW(throwSQLiteException(code, "text"));
  EXPECT_NO_THROW(throwIfSQLiteError(nullptr, SQLITE_OK));
}

TEST(ThrowSQLiteException, ThrowsForEveryOtherCodeWithItsNumberAndText) {
  for (const int code : {-1, 1,  2,  3,  4,  5,  6,  7,  8,  9,  10, 11, 12, 13, 14, 15,
                         16, 17, 18, 19, 20, 21, 22, 23, 24, 25, 26, 27, 28, 99, 102}) {
    const Failure failure = failureOf([&] { throwSQLiteException(code, "the text"); });
    EXPECT_EQ(failure.description, "SQLite Error #" + std::to_string(code) + ": the text");
    EXPECT_EQ(failure.code, code);
  }
}

TEST(ThrowSQLiteException, CallsExactlyFourCodesCorruption) {
  std::vector<int> corrupted;
  for (int code = -1; code < 110; ++code) {
    if (failureOf([&] { throwSQLiteException(code, ""); }).corrupted) corrupted.push_back(code);
  }
  EXPECT_THAT(corrupted, ElementsAre(2, 11, 24, 26));
}

TEST(ThrowSQLiteException, BothClassesCarryTheSameDomain) {
  for (const int code : {SQLITE_BUSY, SQLITE_CORRUPT}) {
    try {
      throwSQLiteException(code, "");
      ADD_FAILURE() << code;
    } catch (const SQLiteStoreException& exception) {
      EXPECT_STREQ(exception.domain(), "QZSQLiteStoreCorruptedErrorDomain");
    }
  }
}

TEST_F(SQLiteStoreTest, AnErrorNamesItsNumberTheReasonAndTheFile) {
  SQLiteStore store(path);
  const Failure failure = failureOf([&] { store.exec("SELECT * FROM nowhere"); });
  EXPECT_EQ(failure.description, "SQLite Error #1: no such table: nowhere (" + path + ")");
  EXPECT_EQ(failure.code, SQLITE_ERROR);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteStoreTest, AnErrorWithoutAFileHasEmptyBrackets) {
  SQLiteStore store(":memory:");
  EXPECT_EQ(failureOf([&] { store.exec("SELECT * FROM nowhere"); }).description,
            "SQLite Error #1: no such table: nowhere ()");
}

TEST_F(SQLiteStoreTest, CodesAreThePrimaryOnes) {
  SQLiteStore store(path);
  store.exec("CREATE TABLE t(n INTEGER PRIMARY KEY);INSERT INTO t VALUES(1)");
  EXPECT_EQ(failureOf([&] { store.exec("INSERT INTO t VALUES(1)"); }).code, SQLITE_CONSTRAINT);
}

// --- Opening and closing ---

TEST_F(SQLiteStoreTest, OpeningCreatesAMissingDatabase) {
  SQLiteStore store(path);
  store.exec("CREATE TABLE t(n INTEGER)");
  EXPECT_TRUE(directory.exists("db"));
}

TEST_F(SQLiteStoreTest, OpeningFindsWhatAnotherStoreWrote) {
  SQLiteStore(path).exec("CREATE TABLE t(n INTEGER);INSERT INTO t VALUES(7)");
  EXPECT_EQ(valueOf<unsigned long long>("n FROM t"), 7U);
}

TEST_F(SQLiteStoreTest, OpeningInAMissingDirectoryNamesThePath) {
  const std::string missing = directory.file("missing/db");
  const Failure failure = failureOf([&] { SQLiteStore store(missing); });
  EXPECT_EQ(failure.description, "SQLite Error #14: Cannot open database: '" + missing + "'");
  EXPECT_EQ(failure.code, SQLITE_CANTOPEN);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteStoreTest, AFailedOpenClosesItsHandle) {
  const std::string missing = directory.file("missing/db");
  EXPECT_THROW(SQLiteStore store(missing), SQLiteStoreException);  // SQLite sets itself up at its first use
  const auto before = sqlite3_memory_used();
  EXPECT_THROW(SQLiteStore store(missing), SQLiteStoreException);
  EXPECT_EQ(sqlite3_memory_used(), before);
  const SQLiteStore open(path);
  EXPECT_GT(sqlite3_memory_used(), before) << "this SQLite does not count its memory: the line above shows nothing";
}

TEST_F(SQLiteStoreTest, AFileThatIsNoDatabaseFailsAtTheFirstStatement) {
  directory.write("db", std::string(4096, 'x'));
  SQLiteStore store(path);
  const Failure failure = failureOf([&] { store.exec("CREATE TABLE t(n INTEGER)"); });
  EXPECT_EQ(failure.description, "SQLite Error #26: file is not a database (" + path + ")");
  EXPECT_EQ(failure.code, SQLITE_NOTADB);
  EXPECT_TRUE(failure.corrupted);
}

TEST_F(SQLiteStoreTest, ADamagedDatabaseIsCorrupted) {
  SQLiteStore(path).exec("CREATE TABLE t(n INTEGER);INSERT INTO t VALUES(7)");
  std::string bytes = directory.read("db");
  const std::string header = bytes.substr(0, 100);
  directory.write("db", header + std::string(bytes.size() - header.size(), '\xff'));
  SQLiteStore store(path);
  const Failure failure = failureOf([&] { store.exec("SELECT * FROM t"); });
  EXPECT_EQ(failure.code, SQLITE_CORRUPT);
  EXPECT_TRUE(failure.corrupted);
}

TEST_F(SQLiteStoreTest, ADatabaseLockedByAnotherIsAPlainError) {
  SQLiteStore holder(path);
  holder.exec("CREATE TABLE t(n INTEGER);BEGIN EXCLUSIVE");
  SQLiteStore store(path);
  const Failure failure = failureOf([&] { store.exec("INSERT INTO t VALUES(1)"); });
  EXPECT_EQ(failure.code, SQLITE_BUSY);
  EXPECT_FALSE(failure.corrupted);
  holder.exec("COMMIT");
  EXPECT_NO_THROW(store.exec("INSERT INTO t VALUES(1)"));
}

TEST_F(SQLiteStoreTest, DestroyingTheStoreClosesTheConnection) {
  auto store = std::make_unique<SQLiteStore>(path);
  makeNumbers(*store);
  EXPECT_TRUE(connectionIsOpen());
  store.reset();
  EXPECT_FALSE(connectionIsOpen());
}

TEST_F(SQLiteStoreTest, ACursorOutlivesItsStoreAndThenClosesTheConnection) {
  auto store = std::make_unique<SQLiteStore>(path);
  makeNumbers(*store);
  auto cursor = std::make_unique<SQLiteStoreCursor>(store->cursor("SELECT n FROM t ORDER BY n"));
  ASSERT_TRUE(cursor->next());
  store.reset();
  EXPECT_TRUE(connectionIsOpen());
  ASSERT_TRUE(cursor->next());
  EXPECT_EQ(cursor->get<unsigned long long>(0), 2U);
  cursor.reset();
  EXPECT_FALSE(connectionIsOpen());
}

TEST_F(SQLiteStoreTest, TheLastOfSeveralCursorsClosesTheConnection) {
  auto store = std::make_unique<SQLiteStore>(path);
  makeNumbers(*store);
  auto first = std::make_unique<SQLiteStoreCursor>(store->cursor("SELECT n FROM t"));
  auto second = std::make_unique<SQLiteStoreCursor>(store->cursor("SELECT n FROM t"));
  first.reset();
  store.reset();
  EXPECT_TRUE(connectionIsOpen());
  second.reset();
  EXPECT_FALSE(connectionIsOpen());
}

// --- Trying again ---

class CreateEnsuredSQLiteStoreTest : public SQLiteStoreTest {
 protected:
  // Opens through a factory that throws the first `failures` times.
  template <class Exception> std::unique_ptr<SQLiteStore> openAfter(int failures, const Exception& exception) {
    const auto factory = [this, failures, exception](const std::string& file) {
      askedFor.push_back(file);
      if (++calls <= failures) throw exception;
      return std::make_unique<SQLiteStore>(file);
    };
    return SQLiteStore::createEnsuredSQLiteStore(path, factory);
  }

  int calls = 0;
  std::vector<std::string> askedFor;
};

TEST_F(CreateEnsuredSQLiteStoreTest, TriesOnceWhenThatSucceeds) {
  EXPECT_NE(openAfter(0, SQLiteStoreException("no", 5)), nullptr);
  EXPECT_EQ(calls, 1);
  EXPECT_THAT(askedFor, ElementsAre(path));
}

TEST_F(CreateEnsuredSQLiteStoreTest, TriesAgainThirtyMillisecondsLater) {
  const auto start = std::chrono::steady_clock::now();
  EXPECT_NE(openAfter(1, SQLiteStoreException("busy", SQLITE_BUSY)), nullptr);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(30));
  EXPECT_EQ(calls, 2);
}

TEST_F(CreateEnsuredSQLiteStoreTest, TheFifthAttemptMaySucceed) {
  EXPECT_NE(openAfter(4, SQLiteStoreException("busy", SQLITE_BUSY)), nullptr);
  EXPECT_EQ(calls, 5);
  EXPECT_EQ(askedFor, std::vector<std::string>(5, path));
}

TEST_F(CreateEnsuredSQLiteStoreTest, TheFifthFailureReachesTheCallerAndThereIsNoSixthAttempt) {
  const auto start = std::chrono::steady_clock::now();
  const Failure failure = failureOf([this] { openAfter(99, SQLiteStoreException("busy", SQLITE_BUSY)); });
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(120));
  EXPECT_EQ(failure.description, "busy");
  EXPECT_EQ(failure.code, SQLITE_BUSY);
  EXPECT_EQ(calls, 5);
}

TEST_F(CreateEnsuredSQLiteStoreTest, CorruptionIsTriedAgainToo) {
  EXPECT_NE(openAfter(1, SQLiteStoreCorruptedException("bad", SQLITE_CORRUPT)), nullptr);
  EXPECT_EQ(calls, 2);
}

TEST_F(CreateEnsuredSQLiteStoreTest, OtherExceptionsPassAtOnce) {
  EXPECT_THROW(openAfter(99, std::logic_error("mine")), std::logic_error);
  EXPECT_EQ(calls, 1);
  EXPECT_THROW(openAfter(99, ManifestPersistenceException("theirs", 1)), ManifestPersistenceException);
  EXPECT_EQ(calls, 2);
}

TEST_F(CreateEnsuredSQLiteStoreTest, AnEmptyFactoryOpensAPlainStore) {
  const auto store = SQLiteStore::createEnsuredSQLiteStore(path, nullptr);
  store->exec("CREATE TABLE t(n INTEGER)");
  EXPECT_TRUE(directory.exists("db"));
}

TEST_F(CreateEnsuredSQLiteStoreTest, AnEmptyFactoryGivesUpAMissingDirectoryWithThePlainClass) {
  const std::string missing = directory.file("missing/db");
  const Failure failure = failureOf([&] { SQLiteStore::createEnsuredSQLiteStore(missing, SQLiteStoreFactory()); });
  EXPECT_EQ(failure.description, "SQLite Error #14: Cannot open database: '" + missing + "'");
  EXPECT_EQ(failure.code, SQLITE_CANTOPEN);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(CreateEnsuredSQLiteStoreTest, LeavesAFileThatIsNoDatabaseAsItIs) {
  directory.write("db", std::string(4096, 'x'));
  const auto store = SQLiteStore::createEnsuredSQLiteStore(path, nullptr);
  EXPECT_THROW(store->exec("CREATE TABLE t(n INTEGER)"), SQLiteStoreCorruptedException);
  EXPECT_EQ(directory.read("db"), std::string(4096, 'x'));
}

// --- Scripts ---

TEST_F(SQLiteStoreTest, AScriptIsRunWhole) {
  SQLiteStore store(path);
  store.exec("CREATE TABLE t(n INTEGER);INSERT INTO t VALUES(1);INSERT INTO t VALUES(2);SELECT * FROM t;");
  EXPECT_EQ(valueOf<unsigned long long>("count(*) FROM t"), 2U);
}

TEST_F(SQLiteStoreTest, AScriptStopsWhereItFailsAndKeepsWhatIsDone) {
  SQLiteStore store(path);
  EXPECT_THROW(store.exec("CREATE TABLE t(n INTEGER);nonsense;INSERT INTO t VALUES(1);"), SQLiteStoreException);
  EXPECT_EQ(valueOf<unsigned long long>("count(*) FROM t"), 0U);
}

TEST_F(SQLiteStoreTest, AnEmptyScriptDoesNothing) {
  SQLiteStore store(path);
  EXPECT_NO_THROW(store.exec(""));
  EXPECT_NO_THROW(store.exec(";;"));
}

// --- Cursors ---

TEST_F(SQLiteStoreTest, NextIsTrueForEachRowAndThenFalse) {
  SQLiteStore store(path);
  makeNumbers(store);
  SQLiteStoreCursor cursor = store.cursor("SELECT n FROM t ORDER BY n");
  std::vector<unsigned long long> numbers;
  while (cursor.next()) numbers.push_back(cursor.get<unsigned long long>(0));
  EXPECT_THAT(numbers, ElementsAre(1, 2, 3));
}

TEST_F(SQLiteStoreTest, NextIsFalseWithoutRows) {
  SQLiteStore store(path);
  makeNumbers(store);
  EXPECT_FALSE(store.cursor("SELECT n FROM t WHERE n > 3").next());
  EXPECT_FALSE(store.cursor("INSERT INTO t VALUES(4)").next());
  EXPECT_EQ(valueOf<unsigned long long>("count(*) FROM t"), 4U);
}

TEST_F(SQLiteStoreTest, PreparingNonsenseThrows) {
  SQLiteStore store(path);
  const Failure failure = failureOf([&] { store.cursor("nonsense"); });
  EXPECT_EQ(failure.description, "SQLite Error #1: near \"nonsense\": syntax error (" + path + ")");
}

TEST_F(SQLiteStoreTest, PreparingReadsUpToAZeroByte) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor(std::string("SELECT 5\0nonsense", 17));
  ASSERT_TRUE(cursor.next());
  EXPECT_EQ(cursor.get<unsigned long long>(0), 5U);
}

TEST_F(SQLiteStoreTest, ACursorOverNoStatementThrowsWhenUsed) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("");
  EXPECT_THROW(cursor.next(), SQLiteStoreException);
  EXPECT_THROW(cursor.bind<bool>(1, true), SQLiteStoreException);
}

TEST_F(SQLiteStoreTest, AFailingStepThrowsAndIsLoggedOnceMoreWhenTheCursorGoes) {
  SQLiteStore store(path);
  makeNumbers(store);
  const test::LogCapture log;
  {
    SQLiteStoreCursor cursor = store.cursor("INSERT INTO t VALUES(1)");
    const Failure failure = failureOf([&] { cursor.next(); });
    EXPECT_EQ(failure.description, "SQLite Error #19: UNIQUE constraint failed: t.n (" + path + ")");
    EXPECT_EQ(failure.code, SQLITE_CONSTRAINT);
    EXPECT_THAT(log.lines(), IsEmpty());
  }
  ASSERT_EQ(log.lines().size(), 1U);
  const test::LogLine line = log.lines().front();
  EXPECT_EQ(line.message,
            "Could not finalize sqlite3 statement: domain: QZSQLiteStoreCorruptedErrorDomain; code: 19; "
            "description: SQLite Error #19: UNIQUE constraint failed: t.n (" +
                path + ") .");
  EXPECT_EQ(line.severity, google::GLOG_ERROR);
  EXPECT_EQ(line.file, "SQLiteStore.cpp");
}

TEST_F(SQLiteStoreTest, ACursorThatGoesBeforeItsLastRowLogsNothing) {
  SQLiteStore store(path);
  makeNumbers(store);
  const test::LogCapture log;
  EXPECT_TRUE(store.cursor("SELECT n FROM t").next());
  store.cursor("SELECT n FROM t");
  EXPECT_THAT(log.lines(), IsEmpty());
}

// --- Statements that are kept ---

sqlite3* lastOpened = nullptr;

int noteOpened(sqlite3* database, char** /*message*/, const sqlite3_api_routines* /*routines*/) {
  lastOpened = database;
  return SQLITE_OK;
}

class SQLiteStoreStatements : public SQLiteStoreTest {
 protected:
  SQLiteStoreStatements() {
    using Entry = void (*)();
    sqlite3_auto_extension(reinterpret_cast<Entry>(noteOpened));
    store = std::make_unique<SQLiteStore>(path);
    sqlite3_reset_auto_extension();
    store->exec("CREATE TABLE t (n INTEGER PRIMARY KEY, v TEXT); INSERT INTO t VALUES(1, 'a'), (2, 'b')");
  }

  // Compiled, whether a cursor has them or not.
  static std::size_t statements() {
    std::size_t count = 0;
    for (sqlite3_stmt* it = nullptr; (it = sqlite3_next_stmt(lastOpened, it)) != nullptr;) ++count;
    return count;
  }

  std::string firstOf(const std::string& sql) {
    SQLiteStoreCursor cursor = store->cursor(sql);
    return cursor.next() ? cursor.get<std::string>(0) : "<none>";
  }

  std::unique_ptr<SQLiteStore> store;
};

TEST_F(SQLiteStoreStatements, AreCompiledOnceForAllCursorsWithTheirText) {
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(firstOf("SELECT v FROM t"), "a");
    EXPECT_EQ(statements(), 1U);
  }
  EXPECT_EQ(firstOf("SELECT n FROM t"), "1");
  EXPECT_EQ(statements(), 2U);
}

TEST_F(SQLiteStoreStatements, OfTwoCursorsAtATimeAreTwo) {
  SQLiteStoreCursor first = store->cursor("SELECT n FROM t ORDER BY n");
  SQLiteStoreCursor second = store->cursor("SELECT n FROM t ORDER BY n");
  EXPECT_TRUE(first.next());
  EXPECT_TRUE(second.next());
  EXPECT_TRUE(first.next());
  EXPECT_EQ(first.get<unsigned long long>(0), 2U);
  EXPECT_EQ(second.get<unsigned long long>(0), 1U);
  EXPECT_EQ(statements(), 2U);
}

TEST_F(SQLiteStoreStatements, ForgetTheValuesThatWereBound) {
  {
    SQLiteStoreCursor cursor = store->cursor("SELECT ?1 IS NULL");
    cursor.bind<std::string>(1, "text");
    ASSERT_TRUE(cursor.next());
    EXPECT_FALSE(cursor.get<bool>(0));
  }
  EXPECT_EQ(firstOf("SELECT ?1 IS NULL"), "1");
  EXPECT_EQ(statements(), 1U);
}

TEST_F(SQLiteStoreStatements, ThatWereNotReadToTheirEndHoldNothing) {
  EXPECT_EQ(firstOf("SELECT v FROM t"), "a");  // there is a second row
  store->exec("DROP TABLE t");
  EXPECT_EQ(failureOf([&] { firstOf("SELECT v FROM t"); }).code, SQLITE_ERROR);
}

TEST_F(SQLiteStoreStatements, FollowChangesOfTheSchema) {
  EXPECT_EQ(firstOf("SELECT * FROM t WHERE n = 2"), "2");
  store->exec(
      "CREATE TABLE u (w TEXT, n INTEGER); INSERT INTO u VALUES('w', 2); DROP TABLE t; "
      "ALTER TABLE u RENAME TO t");
  EXPECT_EQ(firstOf("SELECT * FROM t WHERE n = 2"), "w");
}

TEST_F(SQLiteStoreStatements, ThatFailedAreNotKept) {
  EXPECT_THROW(firstOf("INSERT INTO t VALUES(1, 'again')"), SQLiteStoreException);
  EXPECT_EQ(statements(), 0U);
  EXPECT_THROW(firstOf("INSERT INTO t VALUES(1, 'again')"), SQLiteStoreException);
  EXPECT_EQ(firstOf("INSERT INTO t VALUES(3, 'c')"), "<none>");
}

TEST_F(SQLiteStoreStatements, AreAFewAtMostAndThoseThatWereUsedLast) {
  for (int i = 0; i < 20; ++i) {
    EXPECT_EQ(firstOf("SELECT 'kept'"), "kept");
    EXPECT_EQ(firstOf("SELECT " + std::to_string(i)), std::to_string(i));
  }
  EXPECT_EQ(statements(), 8U);
  EXPECT_EQ(firstOf("SELECT 'kept'"), "kept");
  EXPECT_EQ(statements(), 8U);
  EXPECT_EQ(firstOf("SELECT 0"), "0");  // compiled again, in place of another
  EXPECT_EQ(statements(), 8U);
}

TEST_F(SQLiteStoreStatements, GoWithTheConnectionThatACursorKeepsOpen) {
  const auto before = sqlite3_memory_used();
  {
    SQLiteStore other(directory.file("other"));
    SQLiteStoreCursor outliving = other.cursor("SELECT 1");
    EXPECT_TRUE(other.cursor("SELECT 2").next());
  }
  EXPECT_EQ(sqlite3_memory_used(), before);
  SQLiteStoreCursor outliving = store->cursor("SELECT 'alive'");
  EXPECT_EQ(firstOf("SELECT 2"), "2");
  store.reset();
  EXPECT_TRUE(outliving.next());
  EXPECT_EQ(outliving.get<std::string>(0), "alive");
}

TEST_F(SQLiteStoreTest, ACursorIsMovedAndNotCopied) {
  EXPECT_FALSE(std::is_copy_constructible_v<SQLiteStoreCursor>);
  EXPECT_FALSE(std::is_copy_assignable_v<SQLiteStoreCursor>);
  EXPECT_TRUE(std::is_nothrow_move_constructible_v<SQLiteStoreCursor>);
  EXPECT_TRUE(std::is_nothrow_move_assignable_v<SQLiteStoreCursor>);
}

TEST_F(SQLiteStoreTest, AMovedCursorGoesOnWhereItWas) {
  SQLiteStore store(path);
  makeNumbers(store);
  SQLiteStoreCursor first = store.cursor("SELECT n FROM t ORDER BY n");
  ASSERT_TRUE(first.next());
  SQLiteStoreCursor second = std::move(first);
  ASSERT_TRUE(second.next());
  EXPECT_EQ(second.get<unsigned long long>(0), 2U);
}

TEST_F(SQLiteStoreTest, AssigningACursorReleasesTheOneBefore) {
  auto store = std::make_unique<SQLiteStore>(path);
  makeNumbers(*store);
  SQLiteStoreCursor cursor = store->cursor("SELECT n FROM t");
  const test::TemporaryDirectory elsewhere;
  cursor = SQLiteStore(elsewhere.file("db")).cursor("SELECT 9");
  store.reset();
  EXPECT_FALSE(connectionIsOpen());
  ASSERT_TRUE(cursor.next());
  EXPECT_EQ(cursor.get<unsigned long long>(0), 9U);
}

TEST_F(SQLiteStoreTest, AssigningACursorToItselfChangesNothing) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT 5");
  SQLiteStoreCursor& same = cursor;
  cursor = std::move(same);
  ASSERT_TRUE(cursor.next());
  EXPECT_EQ(cursor.get<unsigned long long>(0), 5U);
}

TEST_F(SQLiteStoreTest, ACursorThatWasMovedFromThrowsWhenUsed) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT ?1");
  const SQLiteStoreCursor taken = std::move(cursor);
  EXPECT_THROW(cursor.next(), SQLiteStoreException);  // NOLINT(bugprone-use-after-move): that is what is tested
  EXPECT_THROW(cursor.bind<std::string>(1, "x"), SQLiteStoreException);
  EXPECT_THROW(cursor.get<std::string>(0), SQLiteStoreException);
}

// --- Values ---

TEST_F(SQLiteStoreTest, AStringComesBackAsItWas) {
  for (const std::string& value : {std::string(), std::string("text"), std::string("a\0b\0", 4), std::string(1, '\0'),
                                   std::string("\xff\xfe not UTF-8"), std::string(70000, 'x')}) {
    EXPECT_EQ(thereAndBack(value), value);
  }
}

TEST_F(SQLiteStoreTest, AStringWithZeroBytesIsStoredWhole) {
  const std::string value("a\0b", 3);
  EXPECT_EQ(askAbout(value, "hex(?1)"), "610062");
  EXPECT_EQ(askAbout(value, "?1 = 'a'"), "0");
}

TEST_F(SQLiteStoreTest, BytesComeBackAsTheyWere) {
  for (const Bytes& value : {Bytes(), Bytes{0}, Bytes{0, 255, 0}, Bytes(70000, 7)}) {
    EXPECT_EQ(thereAndBack(value), value);
  }
}

TEST_F(SQLiteStoreTest, EmptyValuesAreEmptyAndNotNull) {
  EXPECT_EQ(askAbout(std::string(), "typeof(?1) || length(?1)"), "text0");
  EXPECT_EQ(askAbout(Bytes(), "typeof(?1) || length(?1)"), "blob0");
  Bytes emptied{1};
  emptied.clear();
  EXPECT_EQ(askAbout(emptied, "typeof(?1) || length(?1)"), "blob0");
}

TEST_F(SQLiteStoreTest, StringsAreTextAndBytesAreBlobs) {
  EXPECT_EQ(askAbout(std::string("x"), "typeof(?1)"), "text");
  EXPECT_EQ(askAbout(Bytes{'x'}, "typeof(?1)"), "blob");
  EXPECT_EQ(askAbout(true, "typeof(?1)"), "integer");
  EXPECT_EQ(askAbout(1ULL, "typeof(?1)"), "integer");
}

TEST_F(SQLiteStoreTest, ABoolIsOneOrZero) {
  EXPECT_TRUE(thereAndBack(true));
  EXPECT_FALSE(thereAndBack(false));
  EXPECT_EQ(askAbout(true, "?1"), "1");
  EXPECT_EQ(askAbout(false, "?1"), "0");
  EXPECT_TRUE(valueOf<bool>("-7"));
  EXPECT_FALSE(valueOf<bool>("0"));
}

TEST_F(SQLiteStoreTest, ANumberKeepsItsSixtyFourBits) {
  constexpr unsigned long long largest = std::numeric_limits<unsigned long long>::max();
  constexpr unsigned long long largestSigned = std::numeric_limits<long long>::max();
  for (const unsigned long long value : {0ULL, 1ULL, 4294967296ULL, largestSigned, largestSigned + 1, largest}) {
    EXPECT_EQ(thereAndBack(value), value);
  }
  EXPECT_EQ(askAbout(largest, "?1"), "-1");
  EXPECT_EQ(valueOf<unsigned long long>("-1"), largest);
}

TEST_F(SQLiteStoreTest, NullReadsAsNothing) {
  EXPECT_EQ(valueOf<std::string>("NULL"), "");
  EXPECT_EQ(valueOf<Bytes>("NULL"), Bytes());
  EXPECT_EQ(valueOf<unsigned long long>("NULL"), 0U);
  EXPECT_FALSE(valueOf<bool>("NULL"));
}

TEST_F(SQLiteStoreTest, ZeroBytesReadAsNothing) {
  EXPECT_EQ(valueOf<std::string>("''"), "");
  EXPECT_EQ(valueOf<std::string>("x''"), "");
  EXPECT_EQ(valueOf<Bytes>("''"), Bytes());
  EXPECT_EQ(valueOf<Bytes>("x''"), Bytes());
}

TEST_F(SQLiteStoreTest, OneKindReadsAsAnother) {
  EXPECT_EQ(valueOf<std::string>("x'6100'"), std::string("a\0", 2));
  EXPECT_EQ(valueOf<Bytes>("'ab'"), (Bytes{'a', 'b'}));
  EXPECT_EQ(valueOf<std::string>("42"), "42");
  EXPECT_EQ(valueOf<unsigned long long>("'42'"), 42U);
}

TEST_F(SQLiteStoreTest, AParameterThatIsNotBoundIsNull) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT ?1 IS NULL");
  ASSERT_TRUE(cursor.next());
  EXPECT_TRUE(cursor.get<bool>(0));
}

TEST_F(SQLiteStoreTest, ABoundValueMayGoAtOnce) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT ?1, ?2");
  auto text = std::make_unique<std::string>(1000, 'x');
  auto bytes = std::make_unique<Bytes>(1000, static_cast<unsigned char>(7));
  cursor.bind<std::string>(1, *text);
  cursor.bind<Bytes>(2, *bytes);
  text.reset();
  bytes.reset();
  ASSERT_TRUE(cursor.next());
  EXPECT_EQ(cursor.get<std::string>(0), std::string(1000, 'x'));
  EXPECT_EQ(cursor.get<Bytes>(1), Bytes(1000, 7));
}

TEST_F(SQLiteStoreTest, BindingWhereThereIsNoParameterThrows) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT ?1");
  for (const int index : {-1, 0, 2}) {
    EXPECT_EQ(failureOf([&] { cursor.bind<std::string>(index, "x"); }).code, SQLITE_RANGE);
    EXPECT_EQ(failureOf([&] { cursor.bind<bool>(index, true); }).code, SQLITE_RANGE);
    EXPECT_EQ(failureOf([&] { cursor.bind<unsigned long long>(index, 1); }).code, SQLITE_RANGE);
    EXPECT_EQ(failureOf([&] { cursor.bind<Bytes>(index, {1}); }).code, SQLITE_RANGE);
  }
}

TEST_F(SQLiteStoreTest, BindingWhileRowsAreReadThrows) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT ?1");
  ASSERT_TRUE(cursor.next());
  EXPECT_EQ(failureOf([&] { cursor.bind<std::string>(1, "x"); }).code, SQLITE_MISUSE);
}

TEST_F(SQLiteStoreTest, ReadingTextWhereThereIsNoColumnThrows) {
  SQLiteStore store(path);
  SQLiteStoreCursor cursor = store.cursor("SELECT 1");
  ASSERT_TRUE(cursor.next());
  EXPECT_EQ(failureOf([&] { cursor.get<std::string>(1); }).code, SQLITE_RANGE);
  EXPECT_EQ(failureOf([&] { cursor.get<Bytes>(-1); }).code, SQLITE_RANGE);
}

TEST_F(SQLiteStoreTest, AValueThatIsTooBigToStoreIsAPlainError) {
  SQLiteStore store(path);
  const Failure failure = failureOf([&] { store.exec("SELECT zeroblob(2000000000)"); });
  EXPECT_EQ(failure.code, SQLITE_TOOBIG);
  EXPECT_FALSE(failure.corrupted);
}

TEST_F(SQLiteStoreTest, RunningOutOfMemoryWhileReadingThrows) {
  SQLiteStore store(path);
  // Not a constant, so that SQLite makes the zeros when they are read and not before.
  SQLiteStoreCursor cursor = store.cursor("SELECT zeroblob(8000000 + abs(random() % 2))");
  ASSERT_TRUE(cursor.next());
  const auto limit = sqlite3_hard_heap_limit64(sqlite3_memory_used() + mebibyte);
  const Failure failure = failureOf([&] { cursor.get<Bytes>(0); });
  sqlite3_hard_heap_limit64(limit);
  EXPECT_EQ(failure.code, SQLITE_NOMEM);
  EXPECT_THAT(failure.description, StartsWith("SQLite Error #7: out of memory"));
}

// --- Columns of a table ---

TEST_F(SQLiteStoreTest, ATableThatDoesNotExistHasNoColumns) {
  SQLiteStore store(path);
  EXPECT_THAT(store.info("t"), IsEmpty());
  EXPECT_THAT(store.info(""), IsEmpty());
}

TEST_F(SQLiteStoreTest, ColumnsComeInTheOrderOfTheirDeclarationWithoutConstraints) {
  EXPECT_THAT(columnsOf("CREATE TABLE t (a TEXT, b INTEGER, PRIMARY KEY(a))"), ElementsAre("a TEXT", "b INTEGER"));
}

TEST_F(SQLiteStoreTest, TheFiveTypesAreFound) {
  EXPECT_THAT(columnsOf("CREATE TABLE t(a INTEGER, b REAL, c TEXT, d BOOLEAN, e BLOB)"),
              ElementsAre("a INTEGER", "b REAL", "c TEXT", "d BOOLEAN", "e BLOB"));
}

TEST_F(SQLiteStoreTest, OtherTypesAreSkipped) {
  EXPECT_THAT(columnsOf("CREATE TABLE t(a BIGINT, b integer, c, d VARCHAR(9), e DECIMAL(10,5), f TEXT)"),
              ElementsAre("f TEXT"));
}

TEST_F(SQLiteStoreTest, WhatFollowsTheTypeIsIgnored) {
  EXPECT_THAT(
      columnsOf("CREATE TABLE t(a TEXT NOT NULL PRIMARY KEY DEFAULT '', b INTEGER CHECK (b > 0)) WITHOUT ROWID"),
      ElementsAre("a TEXT", "b INTEGER"));
}

TEST_F(SQLiteStoreTest, ALineBreakOrTabSeparatesLikeABlank) {
  EXPECT_THAT(columnsOf("CREATE TABLE t(\n  a\tTEXT,\n\n  b\nBLOB\n)"), ElementsAre("a TEXT", "b BLOB"));
}

TEST_F(SQLiteStoreTest, AQuotedNameKeepsItsQuotes) {
  EXPECT_THAT(columnsOf("CREATE TABLE t(\"a\" TEXT, [b] BLOB)"), ElementsAre("\"a\" TEXT", "[b] BLOB"));
}

TEST_F(SQLiteStoreTest, AColumnAddedLaterComesLast) {
  EXPECT_THAT(columnsOf("CREATE TABLE t(a TEXT, b INTEGER, PRIMARY KEY(a));ALTER TABLE t ADD c BLOB"),
              ElementsAre("a TEXT", "b INTEGER", "c BLOB"));
}

TEST_F(SQLiteStoreTest, ATableMadeFromAQueryHasTheColumnsThatSQLiteWroteDown) {
  EXPECT_THAT(columnsOf("CREATE TABLE source(a TEXT);CREATE TABLE t AS SELECT a, 1 AS b FROM source"),
              ElementsAre("a TEXT"));
}

TEST_F(SQLiteStoreTest, AViewOrAnIndexIsNoTable) {
  EXPECT_THAT(columnsOf("CREATE TABLE source(a TEXT);CREATE VIEW t AS SELECT a FROM source"), IsEmpty());
  SQLiteStore store(path);
  store.exec("CREATE INDEX i ON source(a)");
  EXPECT_THAT(store.info("i"), IsEmpty());
}

TEST_F(SQLiteStoreTest, ATableIsFoundByItsExactName) {
  SQLiteStore store(path);
  store.exec("CREATE TABLE t(a TEXT);CREATE TABLE \"o'ne; two\"(b BLOB)");
  EXPECT_THAT(store.info("T"), IsEmpty());
  EXPECT_THAT(declared(store.info("o'ne; two")), ElementsAre("b BLOB"));
}

TEST_F(SQLiteStoreTest, AskingForTheColumnsOfAFileThatIsNoDatabaseIsCorruption) {
  directory.write("db", std::string(4096, 'x'));
  SQLiteStore store(path);
  EXPECT_THROW(store.info("t"), SQLiteStoreCorruptedException);
}

// --- Standing in for the store ---

class StoreWithOneTable final : public SQLiteStore {
 public:
  using SQLiteStore::SQLiteStore;
  std::vector<SQLiteStoreColumn> info(const std::string& table) override { return {{table, "TEXT"}}; }
};

TEST_F(SQLiteStoreTest, AFactoryMayPutAnotherStoreInItsPlace) {
  const auto store = SQLiteStore::createEnsuredSQLiteStore(
      path, [](const std::string& file) { return std::make_unique<StoreWithOneTable>(file); });
  EXPECT_THAT(declared(store->info("mine")), ElementsAre("mine TEXT"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
