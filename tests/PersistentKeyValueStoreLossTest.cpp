// What a key-value store has acknowledged stays: when it is closed while it is busy, when its manifest cannot be opened
// for a moment, when it cannot be purged, and when it goes over from files to inline values.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <future>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include "DiskCacheManifest.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::isA;
using test::KeyValueStoreFixture;
using test::LogCapture;
using test::ManifestCall;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;

// --- Closing while writes wait ---

class PersistentKeyValueStoreClosing : public KeyValueStoreFixture {
 protected:
  // Queues overwrites whose records are in the manifest and whose writers have not started.
  std::vector<Written> overwrite(const std::vector<std::string>& keys) {
    std::vector<Written> written;
    written.reserve(keys.size());
    for (const std::string& key : keys) written.push_back(watch(store->store(key, bytesOf("newer value"))));
    work().runAll();
    return written;
  }

  void reopenAfterLoss() {
    settle();
    store.reset();
    open();
  }

  static constexpr const char* kRow = "key key 3 0 1000000 1000000 -";
};

TEST_F(PersistentKeyValueStoreClosing, ReleasedStoreKeepsTheRecordAndFileOfAnOverwriteThatHasNotStarted) {
  open();
  put("key", "old");
  clock.advance(10);
  overwrite({"key"});
  store.reset();
  EXPECT_THAT(rowsOnDisk(), ElementsAre(kRow));
  EXPECT_EQ(valueFile("key"), "old");
  reopenAfterLoss();
  EXPECT_EQ(get("key"), "old");
}

TEST_F(PersistentKeyValueStoreClosing, ReleasedStoreKeepsTheLastFinishedOfManyOverwrites) {
  open();
  put("key", "old");
  overwrite({"key", "key", "key"});
  ASSERT_TRUE(file().runNext());
  store.reset();
  reopenAfterLoss();
  EXPECT_EQ(get("key"), "newer value");
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 11 0 1000000 1000000 -"));
}

TEST_F(PersistentKeyValueStoreClosing, ReleasedStoreForgetsAFirstWriteThatHasNotStarted) {
  open();
  put("other", "old");
  overwrite({"key", "key"});
  store.reset();
  reopenAfterLoss();
  EXPECT_EQ(contents(), (Contents{{"other", "old"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("other"));
}

TEST_F(PersistentKeyValueStoreClosing, DroppedOverwritesLeaveRecordsAndFilesAsTheyWere) {
  open();
  put("key", "old");
  put("second", "old");
  const auto rows = rowsOnDisk();
  clock.advance(10);
  const auto written = overwrite({"key", "second", "key", "key"});
  file().dropAll();
  for (const Written& outcome : written) EXPECT_TRUE(isA<std::future_error>(outcome->failure)) << told(outcome);
  EXPECT_EQ(rowsOnDisk(), rows);
  EXPECT_EQ(contents(), (Contents{{"key", "old"}, {"second", "old"}}));
  reopenAfterLoss();
  EXPECT_EQ(contents(), (Contents{{"key", "old"}, {"second", "old"}}));
}

TEST_F(PersistentKeyValueStoreClosing, RefusedOverwriteLeavesRecordAndFileAsTheyWere) {
  open();
  put("key", "old");
  file().throwOnDispatch(true);
  const auto written = overwrite({"key"});
  file().throwOnDispatch(false);
  EXPECT_EQ(told(written[0]), "<error> The queue takes no tasks.");
  EXPECT_THAT(rowsOnDisk(), ElementsAre(kRow));
  EXPECT_EQ(get("key"), "old");
}

TEST_F(PersistentKeyValueStoreClosing, RefusedOverwriteBetweenTwoOthersLeavesThemTheirValues) {
  open();
  put("key", "old");
  overwrite({"key"});
  file().throwOnDispatch(true);
  watch(store->store("key", bytesOf("refused")));
  work().runAll();
  file().throwOnDispatch(false);
  settle();
  EXPECT_EQ(get("key"), "newer value");
}

TEST_F(PersistentKeyValueStoreClosing, RefusedWriteBehindAFirstWriteLeavesItItsValue) {
  open();
  const Written first = watch(store->store("key", bytesOf("first")));
  ASSERT_TRUE(work().runNext());
  file().throwOnDispatch(true);
  const Written refused = watch(store->store("key", bytesOf("refused")));
  work().runAll();
  ASSERT_TRUE(file().runNext());
  file().throwOnDispatch(false);
  settle();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(refused), "<error> The queue takes no tasks.");
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 5 0 1000000 1000000 -"));
  EXPECT_EQ(get("key"), "first");
}

TEST_F(PersistentKeyValueStoreClosing, TheTotalIsThatOfTheRestoredRecords) {
  open();
  put("key", "old");
  overwrite({"key"});
  file().dropAll();
  sizes.clear();
  store->reportSize();
  settle();
  EXPECT_THAT(sizes, ElementsAre(3U));
}

TEST_F(PersistentKeyValueStoreClosing, AnInlineValueComesBackWhereAFileWasToReplaceIt) {
  options.inlineData = true;
  open();
  put("key", "old");
  close();
  options.inlineData = false;
  open();
  overwrite({"key"});
  file().dropAll();
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 3 1 1000000 1000000 old"));
  EXPECT_EQ(get("key"), "old");
  reopenAfterLoss();
  EXPECT_EQ(get("key"), "old");
}

TEST_F(PersistentKeyValueStoreClosing, DroppedAfterAnInvalidationTheOlderValueStays) {
  open();
  put("key", "old");
  overwrite({"key"});
  file().throwOnDispatch(true);
  store->invalidate();
  EXPECT_THAT(rowsOnDisk(), ElementsAre(kRow));
  file().dropAll();
  store.reset();
  EXPECT_THAT(rowsOnDisk(), ElementsAre(kRow));
  EXPECT_EQ(valueFile("key"), "old");
}

TEST_F(PersistentKeyValueStoreClosing, AValueThatWasRemovedBehindADroppedOverwriteStaysRemoved) {
  open();
  put("key", "old");
  overwrite({"key"});
  const Written removed = watch(store->removeItem("key"));
  work().runAll();
  file().dropAll();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  reopenAfterLoss();
  EXPECT_EQ(get("key"), "<miss>");
}

TEST_F(PersistentKeyValueStoreClosing, AValueThatWasRemovedBetweenDroppedOverwritesStaysRemoved) {
  open();
  put("key", "old");
  overwrite({"key"});
  watch(store->removeItem("key"));
  overwrite({"key"});
  file().dropAll();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClosing, AnOverwriteThatFailedLeavesAMissThoughAnotherIsDropped) {
  open();
  put("key", "old");
  watch(store->store("key", nullptr, [](const std::string&) -> unsigned int { throw std::runtime_error("no"); }));
  overwrite({"key"});
  ASSERT_TRUE(file().runNext());
  file().dropAll();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClosing, AValueThatAClearHasYetToTakeDoesNotComeBack) {
  options.batchSize = 1;
  open();
  put("first", "old");
  clock.advance(1);
  put("key", "old");
  store->clear(onSuccess(), onError());
  ASSERT_TRUE(work().runNext());  // takes "first"
  const Written written = watch(store->store("key", bytesOf("newer")));
  ASSERT_TRUE(work().runNext());
  ASSERT_TRUE(file().runNext());  // the file of "first"
  file().dropAll();
  settle();
  EXPECT_TRUE(isA<std::future_error>(written->failure)) << told(written);
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), Contents());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClosing, ARecordThatCannotBeRestoredIsOneLineThatNamesStoreAndKey) {
  openWatched();
  put("key", "old");
  overwrite({"key"});
  manifest->failNext(ManifestCall::SetItem, unwritable);
  const LogCapture log;
  file().dropAll();
  EXPECT_THAT(errorLines(log), ElementsAre(std::string("Store \"larder\" could not restore the record of \"key\": ") +
                                           unwritable.what()));
  EXPECT_EQ(valueFile("key"), "old");
}

// --- A manifest that cannot be opened for a moment ---

class PersistentKeyValueStoreOpening : public KeyValueStoreFixture {
 protected:
  // Opens a store over one that holds a value, whose manifest cannot be opened: a directory is in the way of its
  // write-ahead log.
  void openBlocked() {
    open();
    put("key", "old");
    close();
    std::filesystem::create_directory(obstacle());
    openUnloaded();
    EXPECT_THROW(work().runNext(), ManifestPersistenceException);
  }

  // The same, but it can be opened for reading: the directory is in the way of the log's shared memory.
  void openReadOnly() {
    companion = "-shm";
    open();
    put("key", "old");
    close();
    std::filesystem::create_directory(obstacle());
    open();
    EXPECT_EQ(get("key"), "old");
  }

  std::string obstacle() const { return pathOf("manifest_v1.sqlite" + companion); }
  void unblock() const { std::filesystem::remove(obstacle()); }

  void expectUnharmed(const Written& written) {
    EXPECT_TRUE(isA<ManifestPersistenceException>(written->failure)) << told(written);
    EXPECT_EQ(trash->collected(), std::vector<std::string>());
    unblock();
    EXPECT_EQ(get("key"), "old");
    put("second", "value");
    reopen();
    EXPECT_EQ(contents(), (Contents{{"key", "old"}, {"second", "value"}}));
  }

  std::string companion = "-wal";
};

TEST_F(PersistentKeyValueStoreOpening, ForReadingOnlyFailsTheWriteAndPurgesNothing) {
  openReadOnly();
  const Written written = watch(store->store("second", bytesOf("value")));
  settle();
  expectUnharmed(written);
}

TEST_F(PersistentKeyValueStoreOpening, ForReadingOnlyFailsAnInlineWriteAndPurgesNothing) {
  options.inlineData = true;
  openReadOnly();
  const Written written = watch(store->store("second", bytesOf("value")));
  settle();
  expectUnharmed(written);
}

TEST_F(PersistentKeyValueStoreOpening, ThatFailsForAMomentFailsTheWriteAndPurgesNothing) {
  openBlocked();
  const LogCapture log;
  const Written written = watch(store->store("second", bytesOf("value")));
  settle();
  EXPECT_THAT(errorLines(log), IsEmpty());
  expectUnharmed(written);
}

TEST_F(PersistentKeyValueStoreOpening, ThatFailsForAMomentFailsAnInlineWriteAndPurgesNothing) {
  options.inlineData = true;
  openBlocked();
  const Written written = watch(store->store("second", bytesOf("value")));
  settle();
  expectUnharmed(written);
}

TEST_F(PersistentKeyValueStoreOpening, ThatFailsForAMomentFailsAWriteAtCapacityAndPurgesNothing) {
  options.capacity = 2;
  openBlocked();
  const Written written = watch(store->store("second", bytesOf("value")));
  settle();
  expectUnharmed(written);
}

TEST_F(PersistentKeyValueStoreOpening, OfADamagedManifestIsLoggedLikeAnyOtherPurge) {
  open();
  put("key", "old");
  close();
  directory.write("store/manifest_v1.sqlite", std::string(8192, 'x'));
  const LogCapture log;
  open();
  ASSERT_EQ(errorLines(log).size(), 1U);
  EXPECT_THAT(errorLines(log)[0], testing::StartsWith("Store \"larder\" purged due to corrupted manifest. domain: "
                                                      "QZManifestPersistenceErrorDomain; code: 26; "));
  EXPECT_EQ(contents(), Contents());
}

TEST_F(PersistentKeyValueStoreOpening, OfADamagedManifestThatCannotBeCollectedFailsTheOperation) {
  open();
  put("key", "old");
  close();
  directory.write("store/manifest_v1.sqlite", std::string(8192, 'x'));
  trash->refuses = true;
  openUnloaded();
  EXPECT_THROW(work().runNext(), ManifestCorruptedException);
  const Written written = watch(store->store("key", bytesOf("new")));
  settle();
  EXPECT_TRUE(isA<ManifestCorruptedException>(written->failure)) << told(written);
  trash->refuses = false;
  put("key", "new");
  reopen();
  EXPECT_EQ(get("key"), "new");
}

// --- A purge that cannot take the old manifest away ---

class PersistentKeyValueStorePurge : public KeyValueStoreFixture {
 protected:
  // A store with values whose directory cannot be collected, over a manifest that is a real file.
  void openUncollectable() {
    open();
    for (const std::string key : {"k1", "k2", "k3"}) put(key, "old");
    trash->refuses = true;
    close();
    manifest = std::make_shared<test::FaultyManifest>(DiskCacheManifest::createDiskCacheManifest(
        pathOf("manifest_v1.sqlite"), queues->createWorkQueue(), nullptr, nullptr));
    options.manifest = manifest;
    open();
  }

  const Contents old = {{"k1", "old"}, {"k2", "old"}, {"k3", "old"}};
};

TEST_F(PersistentKeyValueStorePurge, ThatCannotCollectFailsTheWriteAndKeepsEveryValue) {
  openUncollectable();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  const LogCapture log;
  const Written written = watch(store->store("k1", bytesOf("new")));
  settle();
  EXPECT_EQ(told(written), std::string("<error> ") + unwritable.what());
  EXPECT_THAT(errorLines(log), IsEmpty());
  EXPECT_EQ(contents(), old);
}

TEST_F(PersistentKeyValueStorePurge, ThatCannotCollectLetsNoRemovalBeUndoneByARestart) {
  openUncollectable();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  watch(store->store("k1", bytesOf("new")));
  settle();
  EXPECT_EQ(drop("k2"), "<done>");
  manifest->failNext(ManifestCall::RemoveItem, unwritable);
  EXPECT_EQ(drop("k3"), std::string("<error> ") + unwritable.what());
  reopen();
  EXPECT_EQ(contents(), (Contents{{"k1", "old"}, {"k3", "old"}}));
  EXPECT_EQ(clear(), "<done>");
  reopen();
  EXPECT_EQ(contents(), Contents());
}

TEST_F(PersistentKeyValueStorePurge, ThatCannotCollectFailsTheFetchThatMetTheDamage) {
  openUncollectable();
  manifest->failNext(ManifestCall::GetItem, corrupted);
  EXPECT_EQ(get("k1"), std::string("<error> ") + corrupted.what());
  EXPECT_EQ(get("k1"), "old");
}

TEST_F(PersistentKeyValueStorePurge, ThatCannotCollectAtTheFinalRecordFailsTheWrite) {
  openUncollectable();
  const Written written = watch(store->store("new", bytesOf("value")));
  work().runAll();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  settle();
  EXPECT_EQ(told(written), std::string("<error> ") + unwritable.what());
  EXPECT_EQ(contents(), old);
  EXPECT_THAT(valueFiles(), ElementsAre("k1", "k2", "k3"));
}

TEST_F(PersistentKeyValueStorePurge, ThatCannotCollectIsTriedAgainByTheNextDamage) {
  openUncollectable();
  manifest->failNext(ManifestCall::GetItem, corrupted);
  EXPECT_EQ(get("k1"), std::string("<error> ") + corrupted.what());
  trash->refuses = false;
  manifest->failNext(ManifestCall::GetItem, corrupted);
  EXPECT_EQ(get("k1"), "<miss>");
  EXPECT_EQ(contents(), Contents());
}

TEST_F(PersistentKeyValueStorePurge, CalledByTheHostThrowsWhenItCannotCollect) {
  openUncollectable();
  EXPECT_THROW(store->handleCorruptedManifest(corrupted), LarderException);
  EXPECT_EQ(contents(), old);
}

// --- Dates that are asked for ---

class PersistentKeyValueStoreModificationDate : public KeyValueStoreFixture {};

TEST_F(PersistentKeyValueStoreModificationDate, PurgesNothingOnceTheStoreIsInvalidated) {
  openWatched();
  put("key", "value");
  std::future<void> invalidated;
  manifest->onCall = [&](ManifestCall call, const std::string&) {
    if (call != ManifestCall::GetModificationDate) return;
    invalidated = std::async(std::launch::async, [this] { watch(store->invalidateWithFuture()); });
    invalidated.wait_for(std::chrono::milliseconds(50));  // it has to wait until the date is known
  };
  trash->onCollect = [this](const std::string&) { EXPECT_NO_THROW(store->throwIfInvalid()); };
  manifest->failNext(ManifestCall::GetModificationDate, corrupted);
  EXPECT_EQ(store->fetchModificationDate("key"), std::nullopt);
  invalidated.get();
  EXPECT_THROW(store->fetchModificationDate("key"), InvalidatedException);
}

TEST_F(PersistentKeyValueStoreModificationDate, IsNotReadInTheMiddleOfAPurge) {
  open();
  put("key", "value");
  std::future<std::optional<std::int32_t>> date;
  trash->onCollect = [&](const std::string&) {
    date = std::async(std::launch::async, [this] { return store->fetchModificationDate("key"); });
    EXPECT_EQ(date.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
  };
  store->handleCorruptedManifest(corrupted);
  EXPECT_EQ(date.get(), std::nullopt);
}

TEST_F(PersistentKeyValueStoreModificationDate, APurgeOfAnInvalidatedStoreIsRefused) {
  open();
  put("key", "value");
  file().onDispatch = [&queue = file()] { queue.runAll(); };
  store->invalidate();
  EXPECT_THROW(store->handleCorruptedManifest(corrupted), InvalidatedException);
  EXPECT_EQ(valueFile("key"), "value");
}

// --- Clearing while others write ---

class PersistentKeyValueStoreClear : public KeyValueStoreFixture {};

TEST_F(PersistentKeyValueStoreClear, OfWritesInFlightAloneSucceedsWhenTheirFilesAreGone) {
  open();
  put("key", "old");
  const Written written = watch(store->store("key", bytesOf("newer")));
  ASSERT_TRUE(work().runNext());
  store->clear(onSuccess(), onError());
  work().runAll();
  EXPECT_EQ(ending, "");
  EXPECT_EQ(valueFile("key"), "old");
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClear, SucceedsWhenTheFilesThatAnotherClearHasTakenAreGone) {
  open();
  put("key", "old");
  store->clear(nullptr, nullptr);
  store->clear(onSuccess(), onError());
  work().runAll();
  EXPECT_EQ(ending, "");
  EXPECT_EQ(valueFile("key"), "old");
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClear, OfAnEmptyStoreDoesNotWaitForTheFileQueue) {
  open();
  store->clear(onSuccess(), onError());
  work().runAll();
  EXPECT_EQ(ending, "<done>");
}

TEST_F(PersistentKeyValueStoreClear, ListsTheKeysOnceWhateverIsStoredMeanwhile) {
  options.batchSize = 2;
  openWatched();
  putMany(20);
  store->clear(onSuccess(), onError());
  ASSERT_TRUE(work().runNext());
  watch(store->store("later", bytesOf("value")));
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), (Contents{{"later", "value"}}));
  EXPECT_LE(manifest->calls(ManifestCall::GetAllKeys), 2U);  // one of them is this test's
}

TEST_F(PersistentKeyValueStoreClear, ListsTheKeysOnceWhenItemsHaveNoSize) {
  options.batchSize = 2;
  openWatched();
  putMany(20, "");
  EXPECT_EQ(clear(), "<done>");
  EXPECT_EQ(manifest->calls(ManifestCall::GetAllKeys), 1U);
  EXPECT_THAT(keysInMedium(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClear, TakesAValueThatAnotherWriteHasFailedToReplaceMeanwhile) {
  options.batchSize = 1;
  openWatched();
  put("first", "old");
  clock.advance(1);
  put("key", "old");
  store->clear(onSuccess(), onError());
  ASSERT_TRUE(work().runNext());  // takes "first"
  manifest->failNext(ManifestCall::SetItem, std::runtime_error("odd manifest"));
  const Written written = watch(store->store("key", bytesOf("newer")));
  settle();
  EXPECT_EQ(told(written), "<error> odd manifest");
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(keysInMedium(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClear, ThatFailsMidwayGoesOnWhereItFailed) {
  options.batchSize = 2;
  openWatched();
  putMany(5, "");
  int removals = 0;
  manifest->onCall = [&](ManifestCall call, const std::string&) {
    if (call == ManifestCall::RemoveItem && ++removals == 4) manifest->failNext(call, unwritable);
  };
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(keysInMedium(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

// --- From files to inline values ---

class PersistentKeyValueStoreGoingInline : public KeyValueStoreFixture {
 protected:
  // A store that kept "key" in a file and takes values inline from now on.
  void openInlineOverFile() {
    open();
    put("key", "old");
    close();
    options.inlineData = true;
    open();
  }
};

TEST_F(PersistentKeyValueStoreGoingInline, DeletesTheFileOfTheValueThatIsReplaced) {
  openInlineOverFile();
  put("key", "new");
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_EQ(get("key"), "new");
  put("key", "newer");
  reopen();
  EXPECT_EQ(get("key"), "newer");
}

TEST_F(PersistentKeyValueStoreGoingInline, IsAcknowledgedWhenTheFileIsGone) {
  openInlineOverFile();
  const Written written = watch(store->store("key", bytesOf("new")));
  work().runAll();
  EXPECT_TRUE(written->isPending());
  settle();
  EXPECT_EQ(told(written), "<done>");
}

TEST_F(PersistentKeyValueStoreGoingInline, LetsAFetchThatWaitsForTheFileHaveIt) {
  openInlineOverFile();
  const Fetched fetched = watch(store->fetch("key"));
  watch(store->store("key", bytesOf("new")));
  settle();
  EXPECT_EQ(told(fetched), "old");
}

TEST_F(PersistentKeyValueStoreGoingInline, AnswersAFetchWithAMissWhenTheFileIsRemovedAndTheKeyStoredInline) {
  openInlineOverFile();
  const Fetched fetched = watch(store->fetch("key"));
  watch(store->removeItem("key"));
  watch(store->store("key", bytesOf("new")));
  work().runAll();
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(get("key"), "new");
}

TEST_F(PersistentKeyValueStoreGoingInline, LogsAFileThatCannotBeDeletedAndIsDone) {
  openInlineOverFile();
  files->failNext(Operation::DeleteFile, EACCES);
  const LogCapture log;
  put("key", "new");
  ASSERT_EQ(errorLines(log).size(), 1U);
  EXPECT_THAT(errorLines(log)[0], testing::StartsWith("Failed to delete file at \"" + pathOf("key") + "\" domain: "));
}

TEST_F(PersistentKeyValueStoreGoingInline, DeletesTheFileThoughTheQueueTakesNoTasks) {
  openInlineOverFile();
  file().throwOnDispatch(true);
  const Written written = watch(store->store("key", bytesOf("new")));
  work().runAll();
  file().throwOnDispatch(false);
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreGoingInline, HasTheOldValueWhenTheBytesCannotBeWritten) {
  openWatched();
  put("key", "old");
  options.inlineData = true;
  reopenWatched();
  manifest->failNext(ManifestCall::SetInlineData, std::runtime_error("odd manifest"));
  const Written written = watch(store->store("key", bytesOf("new")));
  settle();
  EXPECT_EQ(told(written), "<error> odd manifest");
  EXPECT_EQ(get("key"), "old");
  manifest->failNext(ManifestCall::SetInlineData, std::runtime_error("odd manifest"));
  watch(store->store("other", bytesOf("new")));
  settle();
  EXPECT_EQ(get("other"), "<miss>");
}

// A kill between record and bytes leaves a record that is not inline, under a key that no file may have.
TEST_F(PersistentKeyValueStoreGoingInline, NeverTakesTheManifestForAValueFile) {
  options.inlineData = true;
  open();
  for (const std::string key : {"manifest_v1.sqlite", "below/manifest_v1.sqlite-wal"}) {
    store->getManifest()->setItem({key, key, 3, false, kStart, kStart, nullptr});
  }
  put("manifest_v1.sqlite", "new");
  EXPECT_EQ(get("manifest_v1.sqlite"), "new");
  store->getManifest()->setItem({"manifest_v1.sqlite", "manifest_v1.sqlite", 3, false, kStart, kStart, nullptr});
  EXPECT_EQ(drop("manifest_v1.sqlite"), "<done>");
  EXPECT_TRUE(directory.exists("store/manifest_v1.sqlite"));
  store->getManifest()->setItem({"manifest_v1.sqlite", "manifest_v1.sqlite", 3, false, kStart, kStart, nullptr});
  EXPECT_EQ(clear(), "<done>");
  EXPECT_TRUE(directory.exists("store/manifest_v1.sqlite"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
