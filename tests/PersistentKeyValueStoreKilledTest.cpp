// What a process finds that starts on the directory of a store whose process was killed between two of its steps: the
// directory is copied at that instant, and a new store opened on the copy.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <memory>
#include <string>

#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::FaultyManifest;
using test::ManifestCall;
using test::Operation;
using test::watch;
using testing::HasSubstr;
using testing::StartsWith;

class PersistentKeyValueStoreKilled : public test::KeyValueStoreFixture {
 protected:
  // What the next process would find, had this one been killed now.
  void killNow() {
    std::filesystem::remove_all(directory.file("killed"));
    std::filesystem::copy(storePath(), directory.file("killed"), std::filesystem::copy_options::recursive);
  }

  // From here on `store` is that of the next process.
  void startAgain() {
    close();
    std::filesystem::remove_all(storePath());
    std::filesystem::rename(directory.file("killed"), storePath());
    open();
  }

  // Killed as that operation is about to begin.
  void killBefore(Operation operation) {
    files->onCall = [this, operation](Operation asked, const std::string&) {
      if (asked == operation) killNow();
    };
  }
};

TEST_F(PersistentKeyValueStoreKilled, HasEveryValueThatWasAcknowledged) {
  open();
  put("key", "value");
  put("key", "new");
  put("gone", "value");
  ASSERT_EQ(drop("gone"), "<done>");
  killNow();
  startAgain();
  EXPECT_EQ(get("key"), "new");
  EXPECT_EQ(get("gone"), "<miss>");
}

TEST_F(PersistentKeyValueStoreKilled, BeforeTheFileOfAFirstWriteAnswersWithAnErrorUntilTheKeyIsStoredOrRemoved) {
  open();
  killBefore(Operation::WriteFile);
  put("key", "value");
  files->onCall = nullptr;
  startAgain();
  EXPECT_THAT(get("key"), StartsWith("<error>"));
  put("key", "new");
  EXPECT_EQ(get("key"), "new");
}

TEST_F(PersistentKeyValueStoreKilled, BeforeTheFileOfAnOverwriteStillHasTheOldValue) {
  open();
  put("key", "old");
  killBefore(Operation::WriteFile);
  put("key", "new");
  files->onCall = nullptr;
  startAgain();
  EXPECT_EQ(get("key"), "old");
}

TEST_F(PersistentKeyValueStoreKilled, InTheMidstOfAnOverwriteHasAPartOfTheNewValue) {
  open();
  put("key", "old");
  const auto written = watch(store->store("key", nullptr, [this](const std::string& path) {
    files->writeFile(path, bytesOf("ne"));
    killNow();
    files->writeFile(path, bytesOf("new value"));
    return 9U;
  }));
  settle();
  ASSERT_EQ(told(written), "<done>");
  startAgain();
  EXPECT_EQ(get("key"), "ne");
}

TEST_F(PersistentKeyValueStoreKilled, BetweenAnInlineRecordAndItsBytesHasLostTheOldValueAndAnswersWithAnError) {
  options.inlineData = true;
  open();
  put("key", "old");
  close();
  const auto watched = std::make_shared<FaultyManifest>(DiskCacheManifest::createDiskCacheManifest(
      pathOf("manifest_v1.sqlite"), std::make_shared<test::ManualExecutor>(), nullptr, nullptr));
  watched->onCall = [this](ManifestCall call, const std::string&) {
    if (call == ManifestCall::SetInlineData) killNow();
  };
  options.manifest = watched;
  open();
  put("key", "new");
  startAgain();
  EXPECT_THAT(get("key"), StartsWith("<error>"));
  put("key", "newer");
  EXPECT_EQ(get("key"), "newer");
}

TEST_F(PersistentKeyValueStoreKilled, BetweenTheRecordAndTheFileOfARemovalLeavesAFileThatNobodyDeletes) {
  open();
  put("key", "value");
  killBefore(Operation::DeleteFile);
  ASSERT_EQ(drop("key"), "<done>");
  files->onCall = nullptr;
  startAgain();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_EQ(clear(), "<done>");
  EXPECT_EQ(valueFile("key"), "value");
}

// Harsh, and described: the record of a first write stands before its file does.
TEST_F(PersistentKeyValueStoreKilled, AfterThatAndInAFirstWriteOfTheKeyHasTheRemovedValueAgain) {
  open();
  put("key", "value");
  killBefore(Operation::DeleteFile);
  ASSERT_EQ(drop("key"), "<done>");
  files->onCall = nullptr;
  startAgain();
  killBefore(Operation::WriteFile);
  put("key", "new");
  files->onCall = nullptr;
  startAgain();
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreKilled, LoadsTheSizeThatItsManifestHas) {
  open();
  put("a", "12345");
  put("b", "123");
  killBefore(Operation::WriteFile);
  put("a", "1");
  files->onCall = nullptr;
  startAgain();
  EXPECT_EQ(store->getManifest()->size(), 3U);  // the provisional record of "a" has none
}

// Locked, not damaged: for a write that makes no difference.
TEST_F(PersistentKeyValueStoreKilled, WhoseManifestSomebodyElseHoldsIsPurgedByAWriteAndFailsNoRead) {
  open();
  put("key", "value");
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open(pathOf("manifest_v1.sqlite").c_str(), &other), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);
  EXPECT_EQ(get("key"), "value");
  const test::LogCapture log;
  put("new", "value");
  EXPECT_TRUE(log.contains("Store \"larder\" purged due to corrupted manifest. "));
  EXPECT_EQ(get("key"), "<miss>");
  sqlite3_close(other);
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreKilled, WhoseFileIsCutShortOrReplacedBehindItGivesWhatIsThere) {
  open();
  put("short", "value");
  put("other", "value");
  directory.write("store/short", "va");
  directory.write("store/other", "something else");
  EXPECT_EQ(get("short"), "va");
  EXPECT_EQ(get("other"), "something else");
}

TEST_F(PersistentKeyValueStoreKilled, WhoseDirectoryMayNotBeWrittenFailsWritesAndKeepsWhatItHas) {
  open();
  put("key", "value");
  files->failAlways(Operation::WriteFile, EACCES);
  const auto written = watch(store->store("new", bytesOf("value")));
  settle();
  EXPECT_THAT(told(written), HasSubstr("code: 13"));
  EXPECT_EQ(get("new"), "<miss>");
  EXPECT_EQ(get("key"), "value");
  files->heal();
  put("new", "value");
  EXPECT_EQ(get("new"), "value");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
