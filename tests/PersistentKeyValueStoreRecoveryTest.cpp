// A key-value store on its bad days: damaged manifests, full disks, directories that vanish.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cerrno>
#include <cstddef>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <system_error>
#include <vector>

#include "Configuration.h"
#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::isA;
using test::KeyValueStoreFixture;
using test::kSecond;
using test::LogCapture;
using test::ManifestCall;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;

class RecoveryFixture : public KeyValueStoreFixture {
 protected:
  // The store has begun again, said so once, and works.
  void expectPurged(const LogCapture& log, const std::exception& error) {
    ASSERT_THAT(errorLines(log), ElementsAre(purgeLine(error)));
    EXPECT_EQ(log.lines().front().file, "PersistentKeyValueStore.cpp");
    EXPECT_THAT(trash->collected(), ElementsAre(storePath()));
    EXPECT_EQ(manifest->calls(ManifestCall::Clear), 1U);
    EXPECT_EQ(manifest->calls(ManifestCall::Load), 2U);
    EXPECT_THAT(keysInMedium(), IsEmpty());
    EXPECT_THAT(valueFiles(), IsEmpty());
    put("after", "works");
    EXPECT_EQ(contents(), (Contents{{"after", "works"}}));
  }

  std::string sizedGarbage() const { return std::string(20'000, 'G'); }

  void fill() {
    for (int i = 0; i < 100; ++i) put("key" + std::to_string(i), "value");
  }

  // Tramples on every page of the database but the first.
  void damagePages() const {
    std::fstream database(pathOf("manifest_v1.sqlite"), std::ios::in | std::ios::out | std::ios::binary);
    database.seekg(0, std::ios::end);
    const auto size = static_cast<std::size_t>(database.tellg());
    ASSERT_GT(size, 8192U);
    database.seekp(4096);
    const std::string garbage(size - 4096, '\xAB');
    database.write(garbage.data(), static_cast<std::streamsize>(garbage.size()));
  }
};

class PersistentKeyValueStoreDamagedManifest : public RecoveryFixture {};
class PersistentKeyValueStoreDamagedDatabase : public RecoveryFixture {};
class PersistentKeyValueStoreFullDisk : public RecoveryFixture {};
class PersistentKeyValueStoreVanishedDirectory : public RecoveryFixture {};

// --- What is reported of it ---

class PersistentKeyValueStoreIncidents : public RecoveryFixture {
 protected:
  static std::string purged(const std::string& line) { return "StorePurged larder: " + line; }

  // A database that is none.
  void writeGarbage() const { directory.write("store/manifest_v1.sqlite", sizedGarbage()); }

  void openFrom(const StoreDefinition& definition) {
    store = std::dynamic_pointer_cast<PersistentKeyValueStore>(definition.createStore(
        storePath(), directory.file("temporary"), services(), nullptr, PruneStrategyIdentifier::Null, nullptr));
    ASSERT_NE(store, nullptr);
    settle();
  }
};

TEST_F(PersistentKeyValueStoreIncidents, TellOfAPurgeInTheMidstOfAnOperation) {
  openWatched();
  put("old", "value");
  manifest->failNext(ManifestCall::SetItem, corrupted);
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_EQ(incidents.queue->pending(), 1U);
  EXPECT_THAT(incidents.take(), ElementsAre(purged(purgeLine(corrupted))));
  put("after", "works");
  EXPECT_THAT(incidents.take(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreIncidents, TellOfAPurgeAsTheManifestIsOpened) {
  writeGarbage();
  const LogCapture log;
  open();
  ASSERT_THAT(errorLines(log), testing::SizeIs(1));
  EXPECT_THAT(incidents.take(), ElementsAre(purged(errorLines(log)[0])));
}

TEST_F(PersistentKeyValueStoreIncidents, AreNoneOfAPurgeThatDidNotComeAbout) {
  openWatched();
  put("old", "value");
  directory.write("store/manifest_v1.sqlite", "in the way");
  trash->refuses = true;
  manifest->failNext(ManifestCall::SetItem, corrupted);
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_THAT(incidents.take(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreIncidents, OfAStoreFromADefinitionAreReportedToItsServices) {
  writeGarbage();
  openFrom(PKVSDefinition("larder", "manager", false, false, 0, std::nullopt, false, 100));
  EXPECT_THAT(incidents.take(), testing::SizeIs(1));
  close();
  writeGarbage();
  openFrom(DiskCacheDefinition("larder", "manager", false, false, 0, std::nullopt, 100, false, 55, 25,
                               ExtendedMetadataFactoryIdentifier::Null, PruneStrategyIdentifier::LRU));
  EXPECT_THAT(incidents.take(), testing::SizeIs(1));
}

// --- Each operation that meets the damage ---

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByTheProvisionalRecordPurgesAndWritesNoFile) {
  openWatched();
  put("old", "value");
  manifest->failNext(ManifestCall::SetItem, corrupted);
  const LogCapture log;
  const Written written = watch(store->store("key", bytesOf("value")));
  work().runAll();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(file().pending(), 0U);
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, ThatIsOnlyUnwritableAtTheProvisionalRecordPurgesToo) {
  openWatched();
  put("old", "value");
  manifest->failNext(ManifestCall::SetItem, unwritable);
  const LogCapture log;
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_EQ(told(written), "<done>");
  expectPurged(log, unwritable);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByTheRealRecordPurgesAndTakesTheFileAlong) {
  for (const auto& error : {corrupted, ManifestCorruptedException("Another.", 26)}) {
    SCOPED_TRACE(error.what());
    openWatched();
    put("old", "value");
    const Written written = watch(store->store("key", bytesOf("value")));
    work().runAll();
    manifest->failNext(ManifestCall::SetItem, error);
    const LogCapture log;
    settle();
    EXPECT_EQ(told(written), "<done>");
    EXPECT_EQ(errorLines(log), (std::vector<std::string>{purgeLine(error)}));
    EXPECT_EQ(get("key"), "<miss>");
    EXPECT_THAT(valueFiles(), IsEmpty());
    EXPECT_THAT(keysInMedium(), IsEmpty());
    close();
  }
}

TEST_F(PersistentKeyValueStoreDamagedManifest, ThatIsOnlyUnwritableAtTheRealRecordPurgesToo) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  work().runAll();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  const LogCapture log;
  settle();
  EXPECT_EQ(told(written), "<done>");
  expectPurged(log, unwritable);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByAnInlineWritePurges) {
  options.inlineData = true;
  for (const ManifestCall call : {ManifestCall::SetItem, ManifestCall::SetInlineData}) {
    for (const ManifestPersistenceException& error : {ManifestPersistenceException(corrupted), unwritable}) {
      openWatched();
      put("old", "value");
      if (error.code() == corrupted.code()) {
        manifest->failNext(call, corrupted);
      } else {
        manifest->failNext(call, error);
      }
      const LogCapture log;
      const Written written = watch(store->store("key", bytesOf("value")));
      settle();
      EXPECT_EQ(told(written), "<done>");
      EXPECT_THAT(errorLines(log), ElementsAre(purgeLine(error)));
      EXPECT_THAT(keysInMedium(), IsEmpty());
      put("after", "works");
      EXPECT_EQ(contents(), (Contents{{"after", "works"}}));
      close();
      medium->change([](auto& rows) { rows.clear(); });
    }
  }
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByAnEvictionPurges) {
  options.capacity = 1;
  openWatched();
  put("old", "value");
  manifest->failNext(ManifestCall::PruneOldestItem, corrupted);
  const LogCapture log;
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_EQ(told(written), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByALookUpIsAMissAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::GetItem, corrupted);
  const LogCapture log;
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(accesses(), ElementsAre("1 key 0 0"));
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByNotingTheUseDeliversTheValueAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::UpdateLastAccessDate, corrupted);
  const LogCapture log;
  EXPECT_EQ(get("key"), "value");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByReadingAnInlineValueIsAMissAndPurges) {
  options.inlineData = true;
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::GetInlineData, corrupted);
  const LogCapture log;
  EXPECT_EQ(get("key"), "<miss>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByUpdatingTheAccessDateIsDoneAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::UpdateLastAccessDate, corrupted);
  const LogCapture log;
  const Written used = watch(store->updateLastAccessDate("key"));
  settle();
  EXPECT_EQ(told(used), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByAskingForADateIsEmptyAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::GetModificationDate, corrupted);
  const LogCapture log;
  EXPECT_EQ(store->fetchModificationDate("key"), std::nullopt);
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByTheLookUpOfARemovalIsDoneAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::GetItem, corrupted);
  const LogCapture log;
  EXPECT_EQ(drop("key"), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByARemovalItselfIsDoneAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::RemoveItem, corrupted);
  const LogCapture log;
  EXPECT_EQ(drop("key"), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByTheRemovalOfAWriteInFlightIsDoneAndPurges) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  const Written removed = watch(store->removeItem("key"));
  manifest->failNext(ManifestCall::RemoveItem, corrupted);
  manifest->failNext(ManifestCall::RemoveItem, corrupted);  // by itself, too
  const LogCapture log;
  work().runAll();
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(get("key"), "<miss>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundAfterAFailedWriteLeavesTheWritersErrorAndPurges) {
  openWatched();
  put("old", "value");
  const Written written =
      watch(store->store("key", nullptr, [](const std::string&) -> unsigned int { throw std::runtime_error("No."); }));
  manifest->failNext(ManifestCall::RemoveItem, corrupted);
  const LogCapture log;
  settle();
  EXPECT_EQ(told(written), "<error> No.");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByClearingIsDoneAndPurges) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::PruneToSize, corrupted);
  const LogCapture log;
  EXPECT_EQ(clear(), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByAWriteTakesAnEarlierOneOfItsKeyAlong) {
  openWatched();
  const Written earlier = watch(store->store("key", bytesOf("earlier")));
  ASSERT_TRUE(work().runNext());
  manifest->failNext(ManifestCall::SetItem, corrupted);
  const LogCapture log;
  const Written later = watch(store->store("key", bytesOf("later")));
  ASSERT_TRUE(work().runNext());
  settle();
  EXPECT_EQ(told(earlier), "<done>");
  EXPECT_EQ(told(later), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByAFetchThatLostItsFileToARemovalIsAMissAndPurges) {
  openWatched();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  const Written removed = watch(store->removeItem("key"));
  work().runAll();
  manifest->failNext(ManifestCall::GetItem, corrupted);
  const LogCapture log;
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(told(removed), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByClearingCallsQueuedWritesOff) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  ASSERT_TRUE(work().runNext());
  manifest->failNext(ManifestCall::RemoveItem, corrupted);
  const LogCapture log;
  store->clear(onSuccess(), onError());
  work().runAll();
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(told(written), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByClearingWhatHasNoSizeIsDoneAndPurges) {
  openWatched();
  put("key", "");
  manifest->failNext(ManifestCall::RemoveItem, corrupted);
  manifest->failNext(ManifestCall::RemoveItem, corrupted);  // by itself, too
  const LogCapture log;
  EXPECT_EQ(clear(), "<done>");
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByExpiryPurgesAndExpiryComesAgain) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::PruneOldEntries, corrupted);
  const LogCapture log;
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(work().armedDelays(), ElementsAre(3600 * kSecond));
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, FoundByLoadingPurgesAndExpiryIsArmed) {
  directory.write("store/old", "left over");
  openWatchedUnloaded();
  manifest->failNext(ManifestCall::Load, corrupted);
  const LogCapture log;
  settle();
  EXPECT_THAT(work().armedDelays(), ElementsAre(300 * kSecond));
  expectPurged(log, corrupted);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgesInTheDescribedOrder) {
  openWatched();
  put("key", "value");
  keepJournal();
  trash->onCollect = [this](const std::string& path) { journal.push_back("collect " + path); };
  store->handleCorruptedManifest(corrupted);
  EXPECT_THAT(takeJournal(), ElementsAre("collect " + storePath(), "createDirectory store", "clear", "load"));
  EXPECT_TRUE(std::filesystem::is_directory(storePath()));
  EXPECT_EQ(trashQueues->runAll(), 1U);
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgeTakesAnyLarderExceptionAsItsReason) {
  openWatched();
  const FileUtilsIoException reason(5, "Whatever.");
  const LogCapture log;
  store->handleCorruptedManifest(reason);
  EXPECT_THAT(errorLines(log), ElementsAre(purgeLine(reason)));
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedTwiceInARowWorksOn) {
  openWatched();
  put("key", "value");
  store->handleCorruptedManifest(corrupted);
  put("between", "value");
  store->handleCorruptedManifest(corrupted);
  put("after", "works");
  EXPECT_EQ(contents(), (Contents{{"after", "works"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("after"));
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgesARealStoreDownToAFreshDatabase) {
  open();
  put("key", "value");
  store->handleCorruptedManifest(corrupted);
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  put("after", "works");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"after", "works"}}));
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedWhileAFetchWaitsForItsFileMakesThatAMiss) {
  openWatched();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  work().runAll();
  store->handleCorruptedManifest(corrupted);
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedWhileAWriteWaitsStillTakesThatWrite) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  work().runAll();
  store->handleCorruptedManifest(corrupted);
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedWhileWritesWaitStaysWithinItsCapacity) {
  options.capacity = 2;
  openWatched();
  for (const std::string key : {"a", "b"}) watch(store->store(key, bytesOf("value")));
  work().runAll();
  store->handleCorruptedManifest(corrupted);
  for (const std::string key : {"c", "d"}) watch(store->store(key, bytesOf("value")));
  work().runAll();
  settle();
  EXPECT_EQ(keysInMedium().size(), 2U);
  EXPECT_EQ(valueFiles(), keysInMedium());
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedByARunningWriterLeavesTheValueWholeOrAbsent) {
  for (const bool writesFirst : {true, false}) {
    openWatched();
    put("old", "value");
    const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
      if (writesFirst) files->writeFile(path, bytesOf("value"));
      store->handleCorruptedManifest(corrupted);
      if (!writesFirst) files->writeFile(path, bytesOf("value"));
      return 5U;
    }));
    settle();
    EXPECT_EQ(told(written), "<done>");
    EXPECT_EQ(valueFiles(), keysInMedium());
    const Contents now = contents();
    EXPECT_TRUE(now.empty() || now == (Contents{{"key", "value"}})) << now.size();
    put("key", "again");
    EXPECT_EQ(get("key"), "again");
    close();
    EXPECT_EQ(valueFiles(), keysInMedium());
  }
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedByAWriterThatThenThrowsLeavesNothing) {
  openWatched();
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) -> unsigned int {
    store->handleCorruptedManifest(corrupted);
    files->writeFile(path, bytesOf("val"));
    throw std::runtime_error("No.");
  }));
  settle();
  EXPECT_EQ(told(written), "<error> No.");
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(keysInMedium(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreDamagedManifest, PurgedByARunningWriterLeavesANewerWriteOfTheKeyItsValue) {
  openWatched();
  const Written first = watch(store->store("key", nullptr, [&](const std::string& path) {
    watch(store->store("key", bytesOf("newer")));
    work().runAll();
    store->handleCorruptedManifest(corrupted);
    files->writeFile(path, bytesOf("older"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(contents(), (Contents{{"key", "newer"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

TEST_F(PersistentKeyValueStoreDamagedManifest, ThatCannotEvenBeReplacedFailsTheOperationAndHealsLater) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::GetItem, corrupted);
  manifest->failNext(ManifestCall::Clear, unwritable);
  EXPECT_EQ(get("key"), std::string("<error> ") + unwritable.what());
  manifest->failNext(ManifestCall::GetItem, corrupted);
  EXPECT_EQ(get("key"), "<miss>");
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreDamagedManifest, WhoseDirectoryCannotBeMadeAgainYetIsMadeByTheNextOperation) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::SetItem, unwritable);
  files->failNext(Operation::CreateDirectory, ENOSPC);
  const Written written = watch(store->store("key", bytesOf("new")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(written->failure)) << told(written);
  EXPECT_FALSE(directory.exists("store"));

  EXPECT_EQ(get("key"), "<miss>");
  put("key", "newer");
  EXPECT_EQ(get("key"), "newer");
}

TEST_F(PersistentKeyValueStoreDamagedManifest, WhoseDirectoryCannotBeMadeAgainYetIsMadeByTheNextWrite) {
  openWatched();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  files->failNext(Operation::CreateDirectory, ENOSPC);
  watch(store->store("key", bytesOf("value")));
  settle();
  put("key", "new");
  EXPECT_EQ(get("key"), "new");
}

TEST_F(PersistentKeyValueStoreDamagedManifest, WhoseDirectoryCannotBeCollectedIsEmptiedAllTheSame) {
  openWatched();
  put("key", "value");
  trash->refuses = true;
  manifest->failNext(ManifestCall::GetItem, corrupted);
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(keysInMedium(), IsEmpty());
  put("key", "new");
  EXPECT_EQ(get("key"), "new");
}

// --- Real databases ---

TEST_F(PersistentKeyValueStoreDamagedDatabase, ThatIsNoDatabaseIsReplacedWhenTheStoreOpensTogetherWithAllFiles) {
  directory.write("store/manifest_v1.sqlite", sizedGarbage());
  directory.write("store/old", "value");
  open();
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(trash->collected(), ElementsAre(storePath()));
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  put("key", "value");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, OfAnotherProgramIsReplacedWhenTheStoreOpens) {
  directory.makeDirectory("store");
  sqlite3* database = nullptr;
  ASSERT_EQ(sqlite3_open(pathOf("manifest_v1.sqlite").c_str(), &database), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(database, "CREATE TABLE LarderManifest (name TEXT, last_access_date INTEGER)", nullptr,
                         nullptr, nullptr),
            SQLITE_OK);
  sqlite3_close(database);
  open();
  EXPECT_THAT(trash->collected(), ElementsAre(storePath()));
  put("key", "value");
  EXPECT_EQ(rowsOnDisk().size(), 1U);
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, IsMetByTheFirstOperationJustAsWell) {
  directory.write("store/manifest_v1.sqlite", sizedGarbage());
  openUnloaded();
  EXPECT_EQ(store->fetchModificationDate("key"), std::nullopt);
  EXPECT_THAT(trash->collected(), ElementsAre(storePath()));
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, ThatCannotBeReplacedThrowsAndIsTriedAgain) {
  directory.write("store/manifest_v1.sqlite", sizedGarbage());
  openUnloaded();
  work().dropAll();
  trash->refuses = true;
  EXPECT_THROW(store->getManifest(), ManifestCorruptedException);
  trash->refuses = false;
  EXPECT_NE(store->getManifest(), nullptr);
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, WithDamagedPagesIsPurgedByLoadingAndTheStoreWorks) {
  open();
  fill();
  close();
  damagePages();
  const LogCapture log;
  open();
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(trash->collected(), ElementsAre(storePath()));
  put("key", "value");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, CutShortNeverFailsAnOperation) {
  open();
  fill();
  close();
  const auto whole = std::filesystem::file_size(pathOf("manifest_v1.sqlite"));
  const std::string bytes = directory.read("store/manifest_v1.sqlite");
  for (std::size_t length = 0; length < whole; length += 1500) {
    SCOPED_TRACE(length);
    directory.write("store/manifest_v1.sqlite", bytes.substr(0, length));
    openUnloaded();
    const Fetched fetched = watch(store->fetch("key5"));
    const Written written = watch(store->store("new", bytesOf("value")));
    const Written removed = watch(store->removeItem("key6"));
    const Written used = watch(store->updateLastAccessDate("key7"));
    settle();
    EXPECT_EQ(told(written), "<done>");
    EXPECT_EQ(told(removed), "<done>");
    EXPECT_EQ(told(used), "<done>");
    EXPECT_TRUE(told(fetched) == "<miss>" || told(fetched) == "value") << told(fetched);
    put("newer", "value");
    EXPECT_EQ(get("newer"), "value");
    close();
    std::filesystem::remove_all(storePath());
    std::filesystem::create_directory(storePath());
    for (int i = 0; i < 100; ++i) directory.write("store/key" + std::to_string(i), "value");
  }
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, BeforeLoadingNeverFailsAnOperation) {
  open();
  fill();
  close();
  damagePages();
  openUnloaded();
  work().dropAll();
  EXPECT_EQ(get("key5"), "<miss>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  put("key5", "new");
  EXPECT_EQ(get("key5"), "new");
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, BeforeLoadingNeverFailsARemoval) {
  open();
  fill();
  close();
  damagePages();
  openUnloaded();
  work().dropAll();
  EXPECT_EQ(drop("key5"), "<done>");
  put("key5", "new");
  EXPECT_EQ(get("key5"), "new");
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, BeforeLoadingNeverFailsAWrite) {
  open();
  fill();
  close();
  damagePages();
  openUnloaded();
  work().dropAll();
  const Written written = watch(store->store("key5", bytesOf("new")));
  settle();
  EXPECT_EQ(told(written), "<done>");
  put("key5", "newer");
  EXPECT_EQ(get("key5"), "newer");
}

TEST_F(PersistentKeyValueStoreDamagedDatabase, InWhosePlaceADirectoryStandsFailsEachOperationUntilItIsRemoved) {
  directory.makeDirectory("store/manifest_v1.sqlite");
  openUnloaded();
  EXPECT_ANY_THROW(work().runNext());
  EXPECT_THAT(work().armedDelays(), ElementsAre(300 * kSecond));
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_TRUE(isA<ManifestPersistenceException>(written->failure)) << told(written);
  EXPECT_TRUE(directory.exists("store/manifest_v1.sqlite"));
  std::filesystem::remove(pathOf("manifest_v1.sqlite"));
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

// --- A full disk ---

TEST_F(PersistentKeyValueStoreFullDisk, FailsTheFirstWriteLeavesAMissAndKeepsTheOthers) {
  open();
  put("kept", "value");
  files->tearNextWrite(2, ENOSPC);
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  const FileUtilsIoException failure(ENOSPC, std::generic_category().message(ENOSPC));
  EXPECT_EQ(told(written), std::string("<error> ") + failure.what());
  EXPECT_EQ(contents(), (Contents{{"kept", "value"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("kept"));
  EXPECT_EQ(rowsOnDisk().size(), 1U);
  put("key", "value");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"kept", "value"}, {"key", "value"}}));
}

TEST_F(PersistentKeyValueStoreFullDisk, HalfwayThroughAnOverwriteLeavesAMissAndNotHalfAValue) {
  open();
  put("key", "old value");
  files->tearNextWrite(2, ENOSPC);
  const Written written = watch(store->store("key", bytesOf("new")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(written->failure));
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFullDisk, WhereNotEvenTheHalfCanBeTakenAwaySaysSoOnceAndFailsWithTheFirstReason) {
  open();
  files->tearNextWrite(2, ENOSPC);
  files->failNext(Operation::DeleteFile, EIO);
  const LogCapture log;
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(written->failure));
  EXPECT_THAT(told(written), testing::HasSubstr("code: " + std::to_string(ENOSPC)));
  EXPECT_EQ(errorLines(log).size(), 1U);
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFullDisk, WhereTheRecordCannotBeTakenAwayFailsWithTheFirstReason) {
  openWatched();
  files->tearNextWrite(2, ENOSPC);
  manifest->failNext(ManifestCall::RemoveItem, unwritable);
  const LogCapture log;
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_THAT(told(written), testing::HasSubstr("code: " + std::to_string(ENOSPC)));
  EXPECT_EQ(errorLines(log).size(), 1U);
  EXPECT_THAT(valueFiles(), IsEmpty());
}

// --- A directory that vanishes ---

TEST_F(PersistentKeyValueStoreVanishedDirectory, FailsWritesAndReadsAndIsBackAfterARestart) {
  open();
  put("key", "value");
  std::filesystem::remove_all(storePath());
  const Written written = watch(store->store("new", bytesOf("value")));
  const Fetched fetched = watch(store->fetch("key"));
  settle();
  EXPECT_FALSE(written->isPending());
  EXPECT_TRUE(isA<FileUtilsIoException>(fetched->failure)) << told(fetched);
  reopen();
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

// As a phone does that is short of space, while the application runs.
TEST_F(PersistentKeyValueStoreVanishedDirectory, EmptiedUnderneathTakesNewValuesButForgetsThemAtARestart) {
  open();
  put("key", "value");
  for (const std::string& name : directory.names("store")) std::filesystem::remove(pathOf(name));
  EXPECT_THAT(get("key"), testing::StartsWith("<error>"));
  put("new", "value");
  EXPECT_EQ(get("new"), "value");
  reopen();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_EQ(get("new"), "<miss>");
  EXPECT_THAT(valueFiles(), ElementsAre("new"));  // a file without a record
  put("new", "newer");
  EXPECT_EQ(get("new"), "newer");
}

TEST_F(PersistentKeyValueStoreVanishedDirectory, IsClearedAndExpiredWithoutAnError) {
  open();
  put("key", "value");
  std::filesystem::remove_all(storePath());
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
