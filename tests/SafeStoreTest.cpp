// What a safe store promises, in the order of docs/reliability.md: old or new, undamaged or not at all, one failure for
// one operation, and what becomes of a manifest that cannot be used.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdint>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Clock.h"
#include "DiskCacheManifest.h"
#include "Durability.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Fetched;
using test::isA;
using test::KeyValueStoreFixture;
using test::LogCapture;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::MatchesRegex;
using testing::SizeIs;
using testing::StartsWith;

using Contents = std::map<std::string, std::string>;

class SafeStore : public KeyValueStoreFixture {
 protected:
  SafeStore() { options.durability = Durability::Safe; }

  std::string onlyFile() const {
    const auto names = valueFiles();
    return names.size() == 1 ? names.front() : "there are " + std::to_string(names.size());
  }

  void overwriteFile(const std::string& name, const std::string& text) const {
    std::ofstream(pathOf(name), std::ios::binary) << text;
  }

  // The store is dropped as a process that is killed drops it: nothing that waits is done any more.
  void kill() {
    for (std::size_t i = 0; i < queues->queueCount(); ++i) queues->queue(i)->dropAll();
    for (std::size_t i = 0; i < queues->workQueueCount(); ++i) queues->workQueue(i)->dropAll();
    store.reset();
    for (std::size_t i = 0; i < queues->queueCount(); ++i) queues->queue(i)->dropAll();
  }

  std::string manifestPath() const { return pathOf("manifest_v1.sqlite"); }

  void damageManifest() const {
    std::filesystem::remove(manifestPath() + "-wal");
    std::filesystem::remove(manifestPath() + "-shm");
    std::ofstream(manifestPath(), std::ios::binary) << "This is not a database, and it is long enough to be read.";
  }

  void execute(const std::string& statement) const {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(manifestPath().c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, statement.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << statement;
    sqlite3_close(database);
  }

  static constexpr std::time_t k1970 = 100;
  static constexpr std::time_t k2038 = 2'147'483'000;
};

// --- Values ---

TEST_F(SafeStore, KeepsAValueInAFileThatTellsItsKeyAndItsChecksum) {
  open();
  put("Letter one", "Dear Ada");
  EXPECT_THAT(onlyFile(), MatchesRegex("%4cetter%20one\\.1\\.[0-9a-f]{8}"));
  EXPECT_EQ(get("Letter one"), "Dear Ada");
  reopen();
  EXPECT_EQ(get("Letter one"), "Dear Ada");
}

TEST_F(SafeStore, WritesANewFileForEachValueAndDeletesTheOldOneAfterwards) {
  open();
  put("a", "old");
  const std::string old = onlyFile();
  const Written written = watch(store->store("a", bytesOf("new")));
  file().runNext();
  EXPECT_THAT(valueFiles(), SizeIs(2));
  EXPECT_TRUE(written->isPending());
  work().runNext();
  EXPECT_TRUE(written->hasSucceeded());
  settle();
  EXPECT_NE(onlyFile(), old);
  EXPECT_EQ(get("a"), "new");
}

TEST_F(SafeStore, WritesOneRowForAValue) {
  open();
  put("a", "1");
  EXPECT_THAT(rowsOnDisk(), ElementsAre(MatchesRegex("a a\\.1\\.[0-9a-f]{8} 1 0 1000000 1000000 -")));
}

TEST_F(SafeStore, HasItsManifestBeforeTheFirstFile) {
  openUnloaded();
  watch(store->store("a", bytesOf("1")));
  file().runNext();
  EXPECT_THAT(valueFiles(), SizeIs(1));
  EXPECT_GT(std::filesystem::file_size(manifestPath()), 0U);
}

TEST_F(SafeStore, HasTheOldValueWhenItIsKilledBeforeTheRecordIsReplacedAndNoStrayFileAfterwards) {
  open();
  put("a", "old");
  watch(store->store("a", bytesOf("new")));
  watch(store->store("b", bytesOf("first")));
  file().runAll();
  EXPECT_THAT(valueFiles(), SizeIs(3));
  kill();
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "old"}}));
  EXPECT_THAT(valueFiles(), SizeIs(1));
}

TEST_F(SafeStore, HasTheNewValueWhenItIsKilledBeforeTheOldFileIsDeleted) {
  open();
  put("a", "old");
  put("b", "gone");
  const Written written = watch(store->store("a", bytesOf("new")));
  file().runAll();
  work().runAll();
  const Written removed = watch(store->removeItem("b"));
  files->failAlways(Operation::DeleteFile, EIO);
  work().runAll();
  EXPECT_TRUE(written->hasSucceeded());
  kill();
  files->heal();
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "new"}}));
  EXPECT_THAT(valueFiles(), SizeIs(1));
}

TEST_F(SafeStore, RemovesWhatAWriterHadNotFinishedWhenItWasKilled) {
  open();
  put("a", "1");
  overwriteFile("b.7.00000000.part", "a par");
  reopen();
  EXPECT_THAT(valueFiles(), ElementsAre(StartsWith("a.1.")));
  put("b", "2");
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"b", "2"}}));
}

TEST_F(SafeStore, LeavesOtherFilesAlone) {
  open();
  put("a", "1");
  overwriteFile("a stranger's", "?");
  overwriteFile("a.1", "?");
  overwriteFile("A.1.00000000", "?");
  reopen();
  EXPECT_THAT(valueFiles(), SizeIs(4));
}

TEST_F(SafeStore, KeepsInlineValues) {
  options.inlineData = true;
  open();
  put("a", "old");
  put("a", "new");
  put("empty", "");
  EXPECT_EQ(contents(), (Contents{{"a", "new"}, {"empty", ""}}));
  EXPECT_THAT(valueFiles(), IsEmpty());
  reopen();
  EXPECT_EQ(contents(), (Contents{{"a", "new"}, {"empty", ""}}));
}

TEST_F(SafeStore, TakesAWritersFileUnderAnotherNameUntilItIsFinished) {
  open();
  std::string given;
  const auto writer = [&](const std::string& path) {
    given = path;
    files->writeFile(path, bytesOf("a film"));
    return 6U;
  };
  const Written written = watch(store->store("film", nullptr, writer));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(given, testing::EndsWith(".part"));
  EXPECT_THAT(valueFiles(), ElementsAre(MatchesRegex("film\\.1\\.[0-9a-f]{8}")));
  EXPECT_EQ(get("film"), "a film");
}

TEST_F(SafeStore, KeepsTheOldValueWhenAWriterFails) {
  open();
  put("film", "old");
  const auto writer = [&](const std::string& path) -> unsigned int {
    files->writeFile(path, bytesOf("hal"));
    throw std::runtime_error("The camera is gone.");
  };
  const Written written = watch(store->store("film", nullptr, writer));
  settle();
  EXPECT_EQ(told(written), "<error> The camera is gone.");
  EXPECT_EQ(get("film"), "old");
  EXPECT_THAT(valueFiles(), SizeIs(1));
}

TEST_F(SafeStore, TakesOperationsOnAKeyInTheirOrderThoughTheyGoByDifferentQueues) {
  open();
  const Written first = watch(store->store("a", bytesOf("1")));
  const Fetched afterFirst = watch(store->fetch("a"));
  const Written removed = watch(store->removeItem("a"));
  const Fetched afterRemoval = watch(store->fetch("a"));
  const Written second = watch(store->store("a", bytesOf("2")));
  const Fetched afterSecond = watch(store->fetch("a"));
  work().runAll();
  file().runAll();
  settle();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(told(second), "<done>");
  EXPECT_EQ(told(afterRemoval), "<miss>");
  EXPECT_EQ(told(afterSecond), "2");
  EXPECT_THAT(told(afterFirst), testing::AnyOf("1", "<miss>"));  // its file may be gone before it is read
  EXPECT_EQ(get("a"), "2");
}

TEST_F(SafeStore, ClearsWhatWasStoredBefore) {
  open();
  put("a", "1");
  watch(store->store("b", bytesOf("2")));
  store->clear(onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

// Behind a write of any key, the clear goes by way of the file queue: so must what is called after it.
TEST_F(SafeStore, LetsNothingOvertakeAClear) {
  open();
  put("a", "1");
  watch(store->store("b", bytesOf("2")));
  store->clear(onSuccess(), onError());
  const Fetched afterClear = watch(store->fetch("a"));
  const Written written = watch(store->store("a", bytesOf("3")));
  const Fetched afterWrite = watch(store->fetch("a"));
  work().runAll();
  file().runAll();
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(told(afterClear), "<miss>");
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(afterWrite), "3");
  EXPECT_EQ(contents(), (Contents{{"a", "3"}}));
}

TEST_F(SafeStore, EvictsAtCapacity) {
  options.capacity = 2;
  open();
  for (const char* key : {"a", "b", "c"}) {
    clock.set(Clock::now() + 1);
    put(key, key);
  }
  EXPECT_EQ(contents(), (Contents{{"b", "b"}, {"c", "c"}}));
  EXPECT_THAT(valueFiles(), SizeIs(2));
}

TEST_F(SafeStore, EvictsNothingForAWriteThatFails) {
  options.capacity = 2;
  open();
  put("a", "a");
  put("b", "b");
  files->failNext(Operation::CreateFile, ENOSPC);
  const Written written = watch(store->store("c", bytesOf("c")));
  settle();
  EXPECT_THAT(told(written), StartsWith("<error> "));
  EXPECT_EQ(contents(), (Contents{{"a", "a"}, {"b", "b"}}));
}

// --- Keys ---

TEST_F(SafeStore, TakesAnyKey) {
  const std::vector<std::string> keys = {"",
                                         ".",
                                         "..",
                                         "../../outside",
                                         "/etc/passwd",
                                         std::string("a\0b", 3),
                                         std::string("a\0c", 3),
                                         "a",
                                         "A",
                                         "\xff\xfe",
                                         "manifest_v1.sqlite",
                                         "manifest_v1.sqlite-wal",
                                         "attributes",
                                         "quarantine",
                                         "a.1.00000000",
                                         std::string(60, 'x'),
                                         std::string(300, 'x'),
                                         std::string(300, 'x') + "y",
                                         std::string(300, 'X'),
                                         std::string(100, '/'),
                                         std::string(1 << 20, 'z')};
  open();
  for (std::size_t i = 0; i < keys.size(); ++i) put(keys[i], "value " + std::to_string(i));
  EXPECT_THAT(valueFiles(), SizeIs(keys.size()));
  for (const bool isReopened : {false, true}) {
    if (isReopened) reopen();
    for (std::size_t i = 0; i < keys.size(); ++i) EXPECT_EQ(get(keys[i]), "value " + std::to_string(i)) << i;
  }
  std::vector<std::string> folded;
  for (std::string name : valueFiles()) {
    for (char& character : name) character = static_cast<char>(std::tolower(static_cast<unsigned char>(character)));
    folded.push_back(name);
  }
  std::sort(folded.begin(), folded.end());
  EXPECT_EQ(std::unique(folded.begin(), folded.end()), folded.end()) << "differ in case alone";
  for (const std::string& key : keys) EXPECT_EQ(drop(key), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

// --- Damage ---

TEST_F(SafeStore, DeliversNoDamagedFile) {
  open();
  put("a", "right");
  for (const std::string damage : {"wrong", "righ", "right!", ""}) {
    const LogCapture log;
    overwriteFile(onlyFile(), damage);
    const Fetched fetched = watch(store->fetch("a"));
    settle();
    EXPECT_TRUE(isA<DamagedValueException>(fetched->failure)) << told(fetched);
    EXPECT_THAT(told(fetched), HasSubstr("The value of 'a' in store 'larder' is damaged."));
    EXPECT_THAT(errorLines(log), ElementsAre("The value of 'a' in store 'larder' is damaged."));
  }
  EXPECT_THAT(store->getAllKeys(), ElementsAre("a"));
  overwriteFile(onlyFile(), "right");
  EXPECT_EQ(get("a"), "right");
}

TEST_F(SafeStore, DeliversNoFileOfAnotherKey) {
  open();
  put("a", "hers");
  const std::string first = onlyFile();
  put("b", "his");
  std::filesystem::copy_file(pathOf(first), pathOf(valueFiles().back()),
                             std::filesystem::copy_options::overwrite_existing);
  EXPECT_THAT(get("b"), HasSubstr("is damaged"));
  EXPECT_EQ(get("a"), "hers");
}

TEST_F(SafeStore, ChecksBeforeAReaderOrLoaderIsGivenTheFile) {
  open();
  put("a", "right");
  overwriteFile(onlyFile(), "wrong");
  bool wasCalled = false;
  const Fetched read = watch(store->fetch("a", [&](const std::string&) {
    wasCalled = true;
    return bytesOf("?");
  }));
  const Fetched loaded = watch(store->fetchFirst({"a"}, [&](const auto&, const auto&, auto&) {
    wasCalled = true;
    return true;
  }));
  settle();
  EXPECT_TRUE(isA<DamagedValueException>(read->failure));
  EXPECT_TRUE(isA<DamagedValueException>(loaded->failure));
  EXPECT_FALSE(wasCalled);
}

TEST_F(SafeStore, DropsADamagedItemOfACache) {
  isDiskCache = true;
  open();
  put("a", "right");
  overwriteFile(onlyFile(), "wrong");
  EXPECT_EQ(get("a"), "<miss>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(SafeStore, DropsAnItemOfACacheWhoseFileSomebodyHasRemoved) {
  isDiskCache = true;
  open();
  put("a", "1");
  std::filesystem::remove(pathOf(onlyFile()));
  EXPECT_EQ(get("a"), "<miss>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

TEST_F(SafeStore, SaysThatAFileIsMissingWhenItIsNotACache) {
  open();
  put("a", "1");
  std::filesystem::remove(pathOf(onlyFile()));
  EXPECT_THAT(get("a"), HasSubstr("Could not open file"));
  EXPECT_THAT(store->getAllKeys(), ElementsAre("a"));
}

TEST_F(SafeStore, DeliversNoDamagedInlineValue) {
  options.inlineData = true;
  open();
  put("a", "right");
  execute("UPDATE LarderManifest SET inline_data = X'00' WHERE key = 'a'");
  EXPECT_THAT(get("a"), HasSubstr("is damaged"));
  EXPECT_THAT(store->getAllKeys(), ElementsAre("a"));
}

// --- Failures ---

TEST_F(SafeStore, FailsOnlyTheOperationAtHandWhenTheDiskIsFull) {
  open();
  put("a", "1");
  files->failNext(Operation::CreateFile, ENOSPC);
  const Written written = watch(store->store("a", bytesOf("2")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(written->failure));
  EXPECT_EQ(get("a"), "1");
  put("a", "3");
  EXPECT_EQ(get("a"), "3");
  EXPECT_THAT(valueFiles(), SizeIs(1));
}

TEST_F(SafeStore, FailsOnlyTheOperationAtHandWhenAFileCannotBeRead) {
  open();
  put("a", "1");
  files->failNext(Operation::ReadFile, EIO);
  EXPECT_THAT(get("a"), StartsWith("<error> "));
  EXPECT_EQ(get("a"), "1");
}

TEST_F(SafeStore, RefusesAManifestOfTheHostsOwn) {
  EXPECT_THROW(openWatchedUnloaded(), std::invalid_argument);
  options.manifest.reset();
}

TEST_F(SafeStore, TellsTheTruthOfOperationsThatItWasReleasedBefore) {
  open();
  put("a", "1");
  const Written written = watch(store->store("a", bytesOf("2")));
  const Written removed = watch(store->removeItem("b"));
  const Fetched fetched = watch(store->fetch("a"));
  const Written used = watch(store->updateLastAccessDate("c"));
  store.reset();
  settle();
  for (const std::string& answer : {told(written), told(removed), told(fetched), told(used)}) {
    EXPECT_THAT(answer, HasSubstr("Store has been released."));
  }
  open();
  EXPECT_EQ(get("a"), "1");
}

TEST_F(SafeStore, LeavesNoFileOfAWriteThatAQueueRefuses) {
  open();
  put("a", "1");
  const Written written = watch(store->store("a", bytesOf("2")));
  work().throwOnDispatch(true);
  file().runNext();
  work().throwOnDispatch(false);
  settle();
  EXPECT_EQ(told(written), "<error> The queue takes no tasks.");
  EXPECT_THAT(valueFiles(), SizeIs(1));
  EXPECT_EQ(get("a"), "1");
}

TEST_F(SafeStore, LeavesNoFileOfAWriteThatAQueueDrops) {
  open();
  put("a", "1");
  const Written written = watch(store->store("a", bytesOf("2")));
  file().runNext();
  work().dropAll();
  settle();
  EXPECT_TRUE(isA<std::future_error>(written->failure));
  EXPECT_THAT(valueFiles(), SizeIs(1));
  EXPECT_EQ(get("a"), "1");
}

TEST_F(SafeStore, TellsThatAValueIsStoredThoughItsSizeCannotBeReported) {
  options.inlineData = true;
  open();
  const Written written = watch(store->store("a", bytesOf("1")));
  work().beforeDispatch = [&] { work().throwOnDispatch(true); };
  const LogCapture log;
  work().runNext();
  work().beforeDispatch = nullptr;
  work().throwOnDispatch(false);
  EXPECT_EQ(told(written), "<done>");
  EXPECT_TRUE(log.contains("could not report its size"));
}

TEST_F(SafeStore, FailsWhatWaitsWhenItIsInvalidated) {
  open();
  put("a", "1");
  const Written written = watch(store->store("a", bytesOf("2")));
  file().runAll();
  const Future<void> barrier = store->invalidateWithFuture();
  settle();
  EXPECT_EQ(told(written), "<error> " + test::kInvalid);
}

// --- The manifest ---

TEST_F(SafeStore, SalvagesADamagedManifestFromTheNamesOfTheFiles) {
  open();
  put("a", "1");
  put("letter", "Dear Ada");
  close();
  damageManifest();
  const LogCapture log;
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"letter", "Dear Ada"}}));
  EXPECT_THAT(errorLines(log),
              testing::Contains(HasSubstr("Store \"larder\" salvaged: 0 records kept, 2 values adopted")));
  EXPECT_TRUE(std::filesystem::exists(pathOf("quarantine/manifest_v1.sqlite")));
  put("a", "2");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"a", "2"}, {"letter", "Dear Ada"}}));
}

TEST_F(SafeStore, AdoptsNoFileThatIsNotWhatItsNameSays) {
  open();
  put("a", "whole");
  put("b", "torn");
  close();
  damageManifest();
  overwriteFile(valueFiles().back(), "to");
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "whole"}}));
  EXPECT_THAT(directory.names("store/quarantine"), testing::Contains(StartsWith("b.2.")));
}

TEST_F(SafeStore, SalvagesAManifestThatIsMissingOrEmpty) {
  open();
  put("a", "1");
  close();
  std::filesystem::remove(manifestPath());
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}}));
  close();
  std::ofstream(manifestPath(), std::ios::trunc).close();
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}}));
}

TEST_F(SafeStore, FinishesASalvageThatWasInterrupted) {
  open();
  put("a", "1");
  close();
  std::filesystem::rename(manifestPath(), manifestPath() + "-salvaged");
  std::ofstream(manifestPath(), std::ios::binary) << "damaged";
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}}));
  EXPECT_TRUE(std::filesystem::exists(pathOf("quarantine/manifest_v1.sqlite")));
}

TEST_F(SafeStore, KeepsTheRowsThatCanBeRead) {
  options.inlineData = true;
  open();
  for (int i = 0; i < 200; ++i) put("key" + std::to_string(i), std::string(500, static_cast<char>('a' + i % 26)));
  close();
  // A page in the middle of the file.
  std::fstream database(manifestPath(), std::ios::binary | std::ios::in | std::ios::out);
  database.seekp(4096 * 12);
  database.write(std::string(4096, '\x5a').data(), 4096);
  database.close();
  open();
  const auto kept = contents();
  EXPECT_GT(kept.size(), 150U);
  EXPECT_LT(kept.size(), 200U);
  for (const auto& [key, value] : kept) {
    EXPECT_EQ(value, std::string(500, static_cast<char>('a' + std::stoi(key.substr(3)) % 26))) << key;
  }
  put("new", "value");
  reopen();
  EXPECT_EQ(get("new"), "value");
}

TEST_F(SafeStore, ChecksValuesThoughTheColumnOfTheirChecksumsHasLostItsName) {
  options.inlineData = true;
  open();
  put("a", "1");
  put("b", "2");
  close();
  execute("UPDATE LarderManifest SET inline_data = X'00' WHERE key = 'a'");
  execute("ALTER TABLE LarderManifest RENAME COLUMN checksum TO cheeksum");
  const LogCapture log;
  open();
  EXPECT_THAT(get("a"), HasSubstr("is damaged"));
  EXPECT_EQ(get("b"), "2");
  put("b", "3");
  reopen();
  EXPECT_THAT(get("a"), HasSubstr("is damaged"));
  EXPECT_EQ(get("b"), "3");
}

TEST_F(SafeStore, KeepsRowsWhateverTheirNumbersAre) {
  options.inlineData = true;
  open();
  for (const char* key : {"a", "b", "c"}) put(key, key);
  close();
  execute("UPDATE LarderManifest SET rowid = -9223372036854775807 WHERE key = 'a'");
  execute("UPDATE LarderManifest SET rowid = 9223372036854775806 WHERE key = 'c'");
  execute("ALTER TABLE LarderManifest RENAME COLUMN size TO sice");
  const LogCapture log;
  open();
  EXPECT_EQ(contents(), (Contents{{"a", "a"}, {"b", "b"}, {"c", "c"}}));
}

TEST_F(SafeStore, ContinuesWhenItsDirectoryIsRemoved) {
  open();
  put("a", "1");
  std::filesystem::remove_all(storePath());
  EXPECT_EQ(get("a"), "<miss>");
  put("b", "2");
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
}

TEST_F(SafeStore, ContinuesWithTheFilesThatAreLeft) {
  open();
  put("a", "1");
  put("b", "2");
  for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(manifestPath() + suffix);
  put("c", "3");
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"b", "2"}, {"c", "3"}}));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"b", "2"}, {"c", "3"}}));
}

TEST_F(SafeStore, ContinuesInlineWhenItsDirectoryIsEmptied) {
  options.inlineData = true;
  open();
  put("a", "1");
  for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(manifestPath() + suffix);
  put("b", "2");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
}

TEST_F(SafeStore, KeepsItsManifestAnewWhenADirectoryLiesInItsPlace) {
  std::filesystem::create_directories(manifestPath() + "/deep");
  open();
  put("a", "1");
  reopen();
  EXPECT_EQ(get("a"), "1");
  EXPECT_TRUE(std::filesystem::exists(pathOf("quarantine/manifest_v1.sqlite/deep")));
}

// One failure in the middle of a salvage, at each operation on files: nothing is lost, here or after a restart.
TEST_F(SafeStore, FinishesASalvageThatFailsInTheMiddle) {
  for (std::size_t n = 1; n < 200; ++n) {
    SCOPED_TRACE(n);
    open();
    put("a", "1");
    put("b", "2");
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(manifestPath() + suffix);
    const std::size_t before = files->failures();
    files->failNth(n, EIO);
    const Written written = watch(store->store("c", bytesOf("3")));
    settle();
    const bool hasFailed = files->failures() > before;
    files->heal();
    put("d", "4");
    Contents expected{{"a", "1"}, {"b", "2"}, {"d", "4"}};
    if (written->hasSucceeded()) expected["c"] = "3";
    EXPECT_EQ(contents(), expected);
    reopen();
    EXPECT_EQ(contents(), expected);
    reopen();
    EXPECT_THAT(valueFiles(), SizeIs(expected.size() + (std::filesystem::exists(pathOf("quarantine")) ? 1 : 0)));
    close();
    std::filesystem::remove_all(storePath());
    if (!hasFailed) return;
  }
  FAIL() << "The salvage never ended.";
}

TEST_F(SafeStore, SalvagesWhenAnEmptyFileTakesThePlaceOfItsManifest) {
  open();
  put("a", "1");
  for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(manifestPath() + suffix);
  std::ofstream(manifestPath()).close();
  put("b", "2");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"b", "2"}}));
}

TEST_F(SafeStore, ContinuesWithTheManifestThatSomebodyPutsInThePlaceOfItsOwn) {
  open();
  put("a", "1");
  close();
  std::filesystem::copy(storePath(), directory.file("backup"), std::filesystem::copy_options::recursive);
  open();
  put("b", "2");
  std::filesystem::remove_all(storePath());
  std::filesystem::rename(directory.file("backup"), storePath());
  put("c", "3");
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"c", "3"}}));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"c", "3"}}));
}

// --- What earlier runs have left ---

TEST_F(SafeStore, TakesNoFileForLeftBehindThatIsReplacedWhileItLooks) {
  open();
  put("a", "old");
  close();
  openUnloaded();
  const Written written = watch(store->store("a", bytesOf("new")));
  file().runAll();
  work().runAll();
  EXPECT_TRUE(written->hasSucceeded());
  file().runNext();
  work().runAll();
  settle();
  EXPECT_EQ(get("a"), "new");
  reopen();
  EXPECT_EQ(get("a"), "new");
  EXPECT_THAT(valueFiles(), SizeIs(1));
}

TEST_F(SafeStore, DeletesNoFileThatIsWrittenAgainUnderItsOwnName) {
  open();
  put("a", "1");
  close();
  std::filesystem::remove(pathOf(onlyFile()));
  openUnloaded();
  const Written written = watch(store->store("a", bytesOf("1")));
  settle();
  EXPECT_TRUE(written->hasSucceeded());
  EXPECT_EQ(get("a"), "1");
}

TEST_F(SafeStore, KeepsTheFilesOfARelaxedStoreThatAreNamedLikeItsOwn) {
  options.durability = Durability::Relaxed;
  open();
  for (const char* key : {"main.12345.abcdef12", "main", "x.1.00000000.part", "quarantine"}) put(key, key);
  close();
  options.durability = Durability::Safe;
  open();
  for (const char* key : {"main.12345.abcdef12", "main", "x.1.00000000.part", "quarantine"}) EXPECT_EQ(get(key), key);
  close();
  damageManifest();
  open();
  EXPECT_EQ(get("main.12345.abcdef12"), "<miss>") << "It is not known to be a value.";
  put("new", "value");
  EXPECT_EQ(get("new"), "value");
}

TEST_F(SafeStore, AdoptsWhatARecordOfAPowerCutHasLost) {
  open();
  put("a", "old");
  const std::string old = onlyFile();
  close();
  std::filesystem::copy(manifestPath(), directory.file("former manifest"));
  open();
  put("a", "new");
  close();
  std::filesystem::rename(directory.file("former manifest"), manifestPath());
  ASSERT_FALSE(std::filesystem::exists(pathOf(old)));
  open();
  EXPECT_EQ(get("a"), "new");
}

TEST_F(SafeStore, RemovesAnItemWhoseFileSomebodyHasRemoved) {
  open();
  put("a", "1");
  std::filesystem::remove(pathOf(onlyFile()));
  EXPECT_EQ(drop("a"), "<done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

// --- Changing over ---

TEST_F(SafeStore, KeepsEveryValueWhenDurabilityIsSwitchedOnAndOff) {
  for (const bool isInline : {false, true}) {
    SCOPED_TRACE(isInline);
    options.inlineData = isInline;
    options.durability = Durability::Relaxed;
    open();
    put("a", "relaxed a");
    put("b", "relaxed b");
    close();
    options.durability = Durability::Synced;
    open();
    EXPECT_EQ(contents(), (Contents{{"a", "relaxed a"}, {"b", "relaxed b"}}));
    put("b", "safe b");
    put("c", "safe c");
    close();
    options.durability = Durability::Relaxed;
    open();
    EXPECT_EQ(contents(), (Contents{{"a", "relaxed a"}, {"b", "safe b"}, {"c", "safe c"}}));
    put("c", "relaxed c");
    close();
    options.durability = Durability::Safe;
    open();
    EXPECT_EQ(contents(), (Contents{{"a", "relaxed a"}, {"b", "safe b"}, {"c", "relaxed c"}}));
    EXPECT_THAT(valueFiles(), SizeIs(isInline ? 0 : 3));
    EXPECT_EQ(clear(), "<done>");
    EXPECT_THAT(valueFiles(), IsEmpty());
  }
}

// --- Time ---

TEST_F(SafeStore, LetsNothingExpireBecauseTheClockIsWrong) {
  for (const std::time_t wrong : {k1970, k2038}) {
    SCOPED_TRACE(wrong);
    clock.set(kStart * 1700);
    options.staleAge = 30L * 86400;
    open();
    put("old", "1");
    put("read", "1");
    clock.set(wrong);
    EXPECT_EQ(get("read"), "1");
    put("new", "2");
    store->startStaleItemRemoval();
    settle();
    reopen();
    EXPECT_EQ(get("read"), "1");
    store->startStaleItemRemoval();
    settle();
    clock.set(kStart * 1700 + 60);
    store->startStaleItemRemoval();
    settle();
    reopen();
    store->startStaleItemRemoval();
    settle();
    EXPECT_EQ(contents(), (Contents{{"old", "1"}, {"read", "1"}, {"new", "2"}}));
    clear();
  }
}

TEST_F(SafeStore, LetsItemsExpire) {
  clock.set(kStart * 1700);
  open();
  put("old", "1");
  clock.set(Clock::now() + options.staleAge);
  put("new", "2");
  clock.set(Clock::now() + 1);
  store->startStaleItemRemoval();
  settle();
  EXPECT_EQ(contents(), (Contents{{"new", "2"}}));
}

TEST_F(SafeStore, LetsNothingExpireByADateThatLiesAhead) {
  clock.set(kStart * 1700);
  options.durability = Durability::Relaxed;
  options.staleAge = 30L * 86400;
  open();
  put("a", "1");
  put("b", "2");
  clock.set(k2038);
  EXPECT_EQ(get("a"), "1");
  close();
  clock.set(kStart * 1700 + 60);
  options.durability = Durability::Safe;
  open();
  store->startStaleItemRemoval();
  settle();
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"b", "2"}}));
}

// --- Synced ---

TEST_F(SafeStore, SyncsFileAndDirectoryBeforeTheRecordWhenItIsSynced) {
  options.durability = Durability::Synced;
  open();
  files->clearTrace();
  const Written first = watch(store->store("a", bytesOf("1")));
  const Written second = watch(store->store("b", bytesOf("2")));
  file().runNext();
  std::vector<std::string> trace;
  for (const std::string& line : files->trace()) {
    if (line.rfind("sync", 0) == 0 || line.rfind("createFile", 0) == 0) {
      trace.push_back(line.substr(0, line.find(' ')) + " " + line.substr(line.rfind('/') + 1, 1));
    }
  }
  EXPECT_THAT(trace, ElementsAre("createFile a", "createFile b", "sync a", "sync b", "sync s"));
  EXPECT_TRUE(first->isPending());
  EXPECT_TRUE(second->isPending());
  settle();
  EXPECT_TRUE(first->hasSucceeded());
  EXPECT_TRUE(second->hasSucceeded());
}

// The greatest number of a key's files is the latest value's, by whichever way it was stored.
TEST_F(SafeStore, NumbersFilesInTheOrderOfTheirWrites) {
  options.durability = Durability::Synced;
  open();
  std::vector<Written> written = {watch(store->store("other", bytesOf("1")))};
  written.push_back(watch(store->store("a", nullptr, writing("older", 5))));
  written.push_back(watch(store->store("a", bytesOf("newer"))));
  file().runNext();
  file().runNext();
  file().runNext();
  for (const std::string& name : valueFiles()) {
    if (name.rfind("a.", 0) != 0) continue;
    EXPECT_EQ(valueFile(name), name.rfind("a.2.", 0) == 0 ? "older" : "newer") << name;
  }
  settle();
  for (const Written& one : written) EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(get("a"), "newer");
}

TEST_F(SafeStore, NumbersFilesInTheOrderOfTheirWritesBesideOtherThreads) {
  options.durability = Durability::Synced;
  open();
  std::vector<Written> written;
  file().beforeDispatch = [&] {
    const auto self = std::exchange(file().beforeDispatch, nullptr);
    written.push_back(watch(store->store("other", bytesOf("1"))));
  };
  written.push_back(watch(store->store("a", bytesOf("older"))));
  written.push_back(watch(store->store("a", bytesOf("newer"))));
  file().runAll();
  std::map<std::string, std::string> values;
  for (const std::string& name : valueFiles()) values[name.substr(0, name.rfind('.'))] = valueFile(name);
  EXPECT_EQ(values, (Contents{{"a.2", "older"}, {"a.3", "newer"}, {"other.1", "1"}}));
  settle();
  for (const Written& one : written) EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(get("a"), "newer");
}

TEST_F(SafeStore, FailsAWriteThatCannotBeSynced) {
  options.durability = Durability::Synced;
  open();
  put("a", "1");
  files->failNext(Operation::Sync, EIO);
  const Written written = watch(store->store("a", bytesOf("2")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(written->failure));
  EXPECT_EQ(get("a"), "1");
  EXPECT_THAT(valueFiles(), SizeIs(1));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
