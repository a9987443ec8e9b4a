#include "ManifestSnapshot.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "ExtendedMetadata.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::FaultyFileUtils;
using test::TemporaryDirectory;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

using Persistence = std::unique_ptr<SQLiteManifestPersistence>;

// "name bytes inode mtime" of each entry: what any writing, creating or replacing would change.
std::vector<std::string> traceOf(const TemporaryDirectory& directory, const std::string& name) {
  std::vector<std::string> lines;
  for (const std::string& entry : directory.names(name)) {
    struct stat status = {};
    EXPECT_EQ(stat(directory.file(name + "/" + entry).c_str(), &status), 0);
    lines.push_back(entry + " " + directory.read(name + "/" + entry) + " " + std::to_string(status.st_ino) + " " +
                    std::to_string(status.st_mtim.tv_sec) + "." + std::to_string(status.st_mtim.tv_nsec));
  }
  return lines;
}

class ManifestSnapshotTest : public testing::Test {
 protected:
  ManifestSnapshotTest() {
    directory_.makeDirectory("store");
    directory_.makeDirectory("temporary");
  }

  std::string manifestPath() const { return directory_.file("store/" + ManifestSnapshot::manifestName); }

  // The store's own connection, as a running application holds it.
  Persistence openManifest() const {
    return std::make_unique<SQLiteManifestPersistence>(
        manifestPath(), std::make_shared<VideoDownloadExtendedMetadataFactory>(), nullptr);
  }

  std::unique_ptr<ManifestSnapshot> take() {
    return std::make_unique<ManifestSnapshot>(directory_.file("store"), directory_.file("temporary"), files_);
  }

  // Each record as "key filename size inline date date inline-bytes".
  std::vector<std::string> records() {
    std::vector<std::string> lines;
    for (const auto& record : take()->records(nullptr)) {
      const DiskCacheItem& item = record.item;
      lines.push_back(item.key + " " + item.filename + " " + std::to_string(item.size) + " " +
                      std::to_string(item.hasInlineData ? 1 : 0) + " " + std::to_string(item.modificationDate) + " " +
                      std::to_string(item.lastAccessDate) + " " +
                      (record.inlineSize ? std::to_string(*record.inlineSize) : "-"));
    }
    return lines;
  }

  void run(const std::string& script) const {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(manifestPath().c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, script.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(database);
    sqlite3_close(database);
  }

  TemporaryDirectory directory_;
  std::shared_ptr<FaultyFileUtils> files_ = std::make_shared<FaultyFileUtils>();
};

TEST_F(ManifestSnapshotTest, HasEveryRecordWithoutItsValue) {
  auto manifest = openManifest();
  manifest->setItem({"file", "file", 7, false, 10, 20, nullptr});
  manifest->setItem({"inline", "inline", 3, false, 11, 21, nullptr});
  manifest->setInlineData("inline", {1, 2, 3});
  manifest->setItem({"empty", "empty", 0, false, 12, 22, nullptr});
  manifest->setInlineData("empty", {});
  manifest.reset();
  EXPECT_THAT(records(),
              UnorderedElementsAre("file file 7 0 10 20 -", "inline inline 3 1 11 21 3", "empty empty 0 1 12 22 0"));
}

TEST_F(ManifestSnapshotTest, HasTheChecksumsOfASafeStore) {
  openManifest();
  EXPECT_FALSE(take()->hasChecksums());
  EXPECT_EQ(take()->records(nullptr).size(), 0U);
  const std::vector<unsigned char> value = {1, 2, 3};
  {
    SQLiteManifestPersistence manifest(manifestPath(), nullptr, nullptr, Durability::Safe);
    DiskCacheItem item("checked", "checked", 3, true, 10, 20, nullptr);
    item.checksum = 0xfedcba98;
    manifest.storeItem(item, &value);
    manifest.setItem({"unchecked", "unchecked", 1, false, 10, 20, nullptr});
  }
  const auto snapshot = take();
  EXPECT_TRUE(snapshot->hasChecksums());
  std::map<std::string, std::optional<std::uint32_t>> checksums;
  for (const auto& record : snapshot->records(nullptr)) checksums[record.item.key] = record.item.checksum;
  EXPECT_THAT(checksums, ElementsAre(std::pair("checked", 0xfedcba98U), std::pair("unchecked", std::nullopt)));
}

TEST_F(ManifestSnapshotTest, ReadsInlineValues) {
  auto manifest = openManifest();
  manifest->setItem({"file", "file", 7, false, 10, 20, nullptr});
  manifest->setItem({"inline", "inline", 3, false, 11, 21, nullptr});
  manifest->setInlineData("inline", {1, 2, 3});
  std::map<std::string, std::vector<unsigned char>> values;
  const auto snapshot = take();
  snapshot->forEachInlineValue([&](const std::string& key, const auto& value) { values[key] = value; });
  EXPECT_THAT(values, ElementsAre(std::pair(std::string("inline"), std::vector<unsigned char>{1, 2, 3})));
  EXPECT_THROW(snapshot->forEachInlineValue([](const auto&, const auto&) { throw std::length_error("full"); }),
               std::length_error);
}

TEST_F(ManifestSnapshotTest, OfAnEmptyFileHasNoChecksumsAndNoInlineValues) {
  directory_.write("store/manifest_v1.sqlite", "");
  const auto snapshot = take();
  EXPECT_FALSE(snapshot->hasChecksums());
  snapshot->forEachInlineValue([](const auto& key, const auto&) { ADD_FAILURE() << key; });
}

TEST_F(ManifestSnapshotTest, ReadsNoInlineValueOfATableThatCallsFunctions) {
  run("CREATE TABLE LarderManifest (key TEXT, inline_data BLOB AS (zeroblob(length(key))))");
  EXPECT_THROW(take()->forEachInlineValue([](const auto&, const auto&) { ADD_FAILURE(); }), ManifestCorruptedException);
}

TEST_F(ManifestSnapshotTest, HasWhatARunningStoreHasCommittedAndNotYetCheckpointed) {
  const auto manifest = openManifest();
  manifest->setItem({"key", "key", 7, false, 10, 20, nullptr});
  ASSERT_TRUE(directory_.exists("store/manifest_v1.sqlite-wal"));
  EXPECT_THAT(records(), ElementsAre("key key 7 0 10 20 -"));
  manifest->removeItem("key");
  EXPECT_THAT(records(), IsEmpty());
}

TEST_F(ManifestSnapshotTest, IsOfTheMomentInWhichItWasTaken) {
  const auto manifest = openManifest();
  const auto snapshot = take();
  manifest->setItem({"key", "key", 7, false, 10, 20, nullptr});
  EXPECT_THAT(snapshot->records(nullptr), IsEmpty());
}

TEST_F(ManifestSnapshotTest, ChangesNothingInTheStoresDirectory) {
  // As a killed application leaves it: the log is full and its index has gone.
  {
    const auto manifest = openManifest();
    manifest->setItem({"key", "key", 7, false, 10, 20, nullptr});
    std::filesystem::copy(directory_.file("store"), directory_.file("killed"));
  }
  std::filesystem::remove_all(directory_.file("store"));
  std::filesystem::rename(directory_.file("killed"), directory_.file("store"));
  std::filesystem::remove(manifestPath() + "-shm");

  const auto before = traceOf(directory_, "store");
  EXPECT_THAT(records(), ElementsAre("key key 7 0 10 20 -"));
  EXPECT_THAT(take()->integrityErrors(), IsEmpty());
  EXPECT_EQ(traceOf(directory_, "store"), before);
}

TEST_F(ManifestSnapshotTest, OfADirectoryThatCannotBeWrittenIsTaken) {
  openManifest()->setItem({"key", "key", 7, false, 10, 20, nullptr});
  std::filesystem::permissions(directory_.file("store"), std::filesystem::perms(0555));
  EXPECT_THAT(records(), ElementsAre("key key 7 0 10 20 -"));
  std::filesystem::permissions(directory_.file("store"), std::filesystem::perms(0755));
}

TEST_F(ManifestSnapshotTest, LeavesNothingInTheTemporaryDirectory) {
  openManifest();
  {
    const auto snapshot = take();
    EXPECT_EQ(directory_.names("temporary").size(), 1U);
    (void)snapshot->records(nullptr);
    EXPECT_THAT(snapshot->integrityErrors(), IsEmpty());
  }
  EXPECT_THAT(directory_.names("temporary"), IsEmpty());
}

TEST_F(ManifestSnapshotTest, OfAMissingManifestThrowsAndLeavesNothing) {
  EXPECT_THROW(take(), FileUtilsIoException);
  EXPECT_THAT(directory_.names("temporary"), IsEmpty());
  EXPECT_THAT(directory_.names("store"), IsEmpty());
}

TEST_F(ManifestSnapshotTest, IntoAMissingDirectoryThrows) {
  openManifest();
  std::filesystem::remove(directory_.file("temporary"));
  try {
    take();
    FAIL() << "no exception";
  } catch (const FileUtilsIoException& error) {
    EXPECT_EQ(error.code(), ENOENT);
  }
}

TEST_F(ManifestSnapshotTest, ReadsMetadataWhenItKnowsHow) {
  openManifest()->setItem(
      {"chunk", "chunk", 7, false, 10, 20,
       std::make_shared<VideoDownloadExtendedMetadata>(12, VideoDownloadExtendedMetadata::ItemType::VideoChunk)});
  const auto snapshot = take();
  const auto with = snapshot->records(std::make_shared<VideoDownloadExtendedMetadataFactory>());
  const auto* metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(with.at(0).item.extendedMetadata.get());
  ASSERT_NE(metadata, nullptr);
  EXPECT_EQ(metadata->getExtendedMetadata(), 12);
  EXPECT_EQ(snapshot->records(nullptr).at(0).item.extendedMetadata, nullptr);
}

TEST_F(ManifestSnapshotTest, ReadsTheFirstVersionOfTheTableAndLeavesItAsItIs) {
  run("CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, "
      "modification_date INTEGER, last_access_date INTEGER, PRIMARY KEY(key));"
      "INSERT INTO LarderManifest VALUES ('old', 'old', 4, 0, NULL, 1, 2);");
  const auto before = traceOf(directory_, "store");
  EXPECT_THAT(records(), ElementsAre("old old 4 0 1 2 -"));
  EXPECT_EQ(traceOf(directory_, "store"), before);
}

TEST_F(ManifestSnapshotTest, OfAnEmptyFileHasNoRecordsAndNoDamage) {
  directory_.write("store/" + ManifestSnapshot::manifestName, "");
  EXPECT_THAT(records(), IsEmpty());
  EXPECT_THAT(take()->integrityErrors(), IsEmpty());
}

TEST_F(ManifestSnapshotTest, OfSomethingElseThanADatabaseIsDamaged) {
  directory_.write("store/" + ManifestSnapshot::manifestName, std::string(4096, 'x'));
  EXPECT_THROW(take()->records(nullptr), ManifestCorruptedException);
  EXPECT_THAT(take()->integrityErrors(), ElementsAre("SQLite Error #26: file is not a database"));
}

TEST_F(ManifestSnapshotTest, OfAForeignTableIsDamaged) {
  run("CREATE TABLE LarderManifest (key TEXT, last_access_date TEXT);");
  EXPECT_THROW(take()->records(nullptr), ManifestCorruptedException);
  EXPECT_THAT(take()->integrityErrors(), ElementsAre("Invalid schema."));
}

TEST_F(ManifestSnapshotTest, OfATableWithoutDatesIsDamaged) {
  run("CREATE TABLE LarderManifest (key TEXT, name TEXT);");
  EXPECT_THROW(take()->records(nullptr), ManifestPersistenceException);
  EXPECT_THAT(take()->integrityErrors(), ElementsAre(testing::HasSubstr("last_access_date")));
}

TEST_F(ManifestSnapshotTest, FindsWhatTheIntegrityCheckFinds) {
  auto manifest = openManifest();
  for (int i = 0; i < 500; ++i) {
    const std::string key = "key" + std::to_string(i);
    manifest->setItem({key, key, 7, false, 10, i, nullptr});
  }
  manifest.reset();
  std::string bytes = directory_.read("store/" + ManifestSnapshot::manifestName);
  const std::size_t pageSize = 4096;
  ASSERT_GT(bytes.size(), 4 * pageSize);
  for (std::size_t i = bytes.size() - pageSize; i < bytes.size(); ++i) bytes[i] = 'x';
  directory_.write("store/" + ManifestSnapshot::manifestName, bytes);
  EXPECT_THAT(take()->integrityErrors(), testing::Not(IsEmpty()));
}

// --- Beside a running store ---

// Does something when a file is about to be read.
class InterruptedFileUtils final : public FileUtils {
 public:
  std::vector<unsigned char> readFile(const std::string& path) override {
    if (onRead) onRead(path);
    return FileUtils::readFile(path);
  }

  std::function<void(const std::string&)> onRead;
};

bool isLog(const std::string& path) { return path.size() > 4 && path.substr(path.size() - 4) == "-wal"; }

TEST_F(ManifestSnapshotTest, IsTakenAgainWhenACheckpointCameInBetween) {
  run("PRAGMA journal_mode = WAL;");
  auto manifest = openManifest();
  manifest->setItem({"early", "early", 7, false, 10, 20, nullptr});
  const auto files = std::make_shared<InterruptedFileUtils>();
  bool isDone = false;
  // After the manifest has been read: the log begins anew, and what it held stands only in the manifest.
  files->onRead = [&](const std::string& path) {
    static int logReadings = 0;
    if (!isLog(path) || ++logReadings != 2 || isDone) return;
    isDone = true;
    run("PRAGMA wal_checkpoint(TRUNCATE);");
    manifest->setItem({"late", "late", 7, false, 10, 20, nullptr});
  };
  const ManifestSnapshot snapshot(directory_.file("store"), directory_.file("temporary"), files);
  EXPECT_TRUE(isDone);
  EXPECT_EQ(snapshot.records(nullptr).size(), 2U);
  EXPECT_THAT(snapshot.integrityErrors(), IsEmpty());
}

TEST_F(ManifestSnapshotTest, IsTakenAgainWhenAnEmptyLogHasBegunMeanwhile) {
  const auto manifest = openManifest();
  run("PRAGMA wal_checkpoint(TRUNCATE);");
  ASSERT_EQ(directory_.read("store/manifest_v1.sqlite-wal"), "");
  const auto files = std::make_shared<InterruptedFileUtils>();
  int readings = 0;
  files->onRead = [&](const std::string& path) {
    if (!isLog(path) && ++readings == 1) manifest->setItem({"key", "key", 7, false, 10, 20, nullptr});
  };
  const ManifestSnapshot snapshot(directory_.file("store"), directory_.file("temporary"), files);
  EXPECT_EQ(readings, 2);
  EXPECT_EQ(snapshot.records(nullptr).size(), 1U);
}

TEST_F(ManifestSnapshotTest, GivesUpOnAManifestThatNeverStandsStill) {
  const auto manifest = openManifest();
  manifest->setItem({"key", "key", 7, false, 10, 20, nullptr});
  const auto files = std::make_shared<InterruptedFileUtils>();
  files->onRead = [&](const std::string& path) {
    if (isLog(path)) return;
    run("PRAGMA wal_checkpoint(TRUNCATE);");
    manifest->setItem({"key", "key", 8, false, 10, 20, nullptr});
  };
  EXPECT_THROW(ManifestSnapshot(directory_.file("store"), directory_.file("temporary"), files),
               ManifestPersistenceException);
  EXPECT_THAT(directory_.names("temporary"), IsEmpty());
}

TEST_F(ManifestSnapshotTest, OfAStoreThatClosesMeanwhileIsTaken) {
  auto manifest = openManifest();
  manifest->setItem({"key", "key", 7, false, 10, 20, nullptr});
  const auto files = std::make_shared<InterruptedFileUtils>();
  files->onRead = [&](const std::string& path) {
    if (isLog(path)) manifest.reset();  // takes the log along
  };
  const ManifestSnapshot snapshot(directory_.file("store"), directory_.file("temporary"), files);
  EXPECT_EQ(snapshot.records(nullptr).size(), 1U);
}

// --- Correcting a size ---

TEST_F(ManifestSnapshotTest, OfACorrectedSizeHasEverythingElseAsItWas) {
  auto manifest = openManifest();
  manifest->setItem({"inline", "inline", 9, false, 11, 21, nullptr});
  manifest->setInlineData("inline", {1, 2, 3});
  manifest->setSize("inline", 3);
  manifest->setSize("nothing", 3);
  EXPECT_EQ(manifest->getInlineData("inline"), (std::vector<unsigned char>{1, 2, 3}));
  EXPECT_THAT(records(), ElementsAre("inline inline 3 1 11 21 3"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
