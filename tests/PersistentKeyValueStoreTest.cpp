#include "PersistentKeyValueStore.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <future>
#include <limits>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "base/StaleAge.h"
#include "support/KeyValueStoreFixture.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::isA;
using test::KeyValueStoreFixture;
using test::kInvalid;
using test::kSecond;
using test::LogCapture;
using test::ManifestCall;
using test::Operation;
using test::textOf;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;

using Loader = PersistentKeyValueStore::Loader;

class PersistentKeyValueStoreCreating : public KeyValueStoreFixture {};
class PersistentKeyValueStoreStoring : public KeyValueStoreFixture {};
class PersistentKeyValueStoreFetching : public KeyValueStoreFixture {};
class PersistentKeyValueStoreFetchingTheFirst : public KeyValueStoreFixture {};
class PersistentKeyValueStoreRemoving : public KeyValueStoreFixture {};
class PersistentKeyValueStoreAskingForDates : public KeyValueStoreFixture {};
class PersistentKeyValueStoreStoringInline : public KeyValueStoreFixture {
 protected:
  void SetUp() override { options.inlineData = true; }
};

// --- Creating ---

TEST_F(PersistentKeyValueStoreCreating, MakesItsDirectoryAndTheOnesAboveIt) {
  const std::string path = directory.file("a/b/store");
  const PersistentKeyValueStore made(path, "", "larder", std::nullopt, 10, false, queues, nullptr, trash, nullptr,
                                     nullptr, nullptr, files, nullptr, 50);
  EXPECT_TRUE(std::filesystem::is_directory(path));
  EXPECT_EQ(queues->queueCount(), 1U);
  EXPECT_EQ(queues->workQueueCount(), 1U);
}

TEST_F(PersistentKeyValueStoreCreating, WithoutOptionsTakesEachArgumentInItsPlace) {
  store = PersistentKeyValueStore::createPersistentKeyValueStore(storePath(), directory.file("temporary"), "larder", 3,
                                                                 1000, true, queues, trash, reporter, nullptr, files,
                                                                 options.onSizeChanged, 2);
  settle();
  EXPECT_EQ(store->getTemporaryDirectoryPath(), directory.file("temporary"));
  for (const char* key : {"a", "b", "c", "d"}) {
    put(key, "12345");
    clock.advance(1);
  }
  EXPECT_EQ(contents(), (Contents{{"b", "12345"}, {"c", "12345"}, {"d", "12345"}}));
  EXPECT_THAT(accesses(), testing::SizeIs(3));
  EXPECT_EQ(sizes.back(), 15U);
  EXPECT_THAT(valueFiles(), IsEmpty());
  store->clear(onSuccess(), onError());
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(store->getAllKeys().size(), 1U);  // after a batch
  settle();
  put("old", "value");
  clock.advance(1001);
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreCreating, ThrowsWhatCreatingTheDirectoryThrows) {
  files->failNext(Operation::CreateDirectory, EROFS);
  EXPECT_THROW(openUnloaded(), FileUtilsIoException);
}

TEST_F(PersistentKeyValueStoreCreating, TouchesNoManifestOnTheCallersThread) {
  openUnloaded();
  EXPECT_THAT(directory.names("store"), IsEmpty());
  EXPECT_EQ(work().pending(), 1U);
  EXPECT_EQ(file().pending(), 0U);
  EXPECT_TRUE(work().runNext());
  EXPECT_TRUE(directory.exists("store/manifest_v1.sqlite"));
  EXPECT_EQ(file().pending(), 0U);
}

TEST_F(PersistentKeyValueStoreCreating, LoadsOnceAndArmsTheFirstExpiryInFiveMinutes) {
  openWatchedUnloaded();
  EXPECT_THAT(work().armedDelays(), IsEmpty());
  settle();
  EXPECT_EQ(manifest->calls(ManifestCall::Load), 1U);
  EXPECT_THAT(work().armedDelays(), ElementsAre(300 * kSecond));
  EXPECT_TRUE(work().timers().at(0).viaSchedule);
  EXPECT_THAT(file().armedDelays(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreCreating, IsNotPrunableAndSaysSoWhenAskedToPrune) {
  open();
  EXPECT_FALSE(store->isPrunable());
  EXPECT_THROW(store->pruneBackToNormal(nullptr, nullptr, false), std::logic_error);
}

TEST_F(PersistentKeyValueStoreCreating, KeepsThePathsItWasGiven) {
  open();
  EXPECT_EQ(store->path, storePath());
  EXPECT_EQ(store->getFilePath("name"), storePath() + "/name");
  EXPECT_EQ(store->getFilePath("a/b"), storePath() + "/a/b");
  EXPECT_EQ(store->getTemporaryDirectoryPath(), directory.file("temporary"));
  EXPECT_FALSE(directory.exists("temporary"));
}

TEST_F(PersistentKeyValueStoreCreating, UsesTheManifestItIsGivenAndMakesNoOther) {
  openWatched();
  EXPECT_EQ(store->getManifest(), manifest);
  put("key", "value");
  EXPECT_THAT(directory.names("store"), ElementsAre("key"));
}

TEST_F(PersistentKeyValueStoreCreating, MakesOneManifestHoweverOftenItIsAskedFor) {
  openUnloaded();
  const auto first = store->getManifest();
  EXPECT_NE(first, nullptr);
  settle();
  EXPECT_EQ(store->getManifest(), first);
}

TEST_F(PersistentKeyValueStoreCreating, FromADefinitionDeletesInBatchesOfFiftyFromFiveMinutesOn) {
  const PKVSDefinition definition("larder", "manager", false, false, 0, std::nullopt, false, 100);
  const auto made = definition.createStore(
      storePath(), directory.file("temporary"), queues, trash, reporter, files,
      [this](unsigned int size) { sizes.push_back(size); }, PruneStrategyIdentifier::Null, nullptr);
  store = std::dynamic_pointer_cast<PersistentKeyValueStore>(made);
  ASSERT_NE(store, nullptr);
  settle();
  for (int i = 0; i < 51; ++i) put("key" + std::to_string(i), "v");
  clock.advance(101);
  ASSERT_TRUE(fire(300));
  ASSERT_TRUE(work().runNext());  // the size of the cycle's beginning
  ASSERT_TRUE(work().runNext());  // the first batch leaves the manifest
  EXPECT_EQ(store->getAllKeys().size(), 1U);
  EXPECT_EQ(valueFiles().size(), 51U);
  ASSERT_TRUE(file().runNext());
  EXPECT_EQ(valueFiles().size(), 1U);
  settle();
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(work().armedDelays(), testing::Contains(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreCreating, FromADefinitionTakesOverCapacityAndInlineData) {
  const PKVSDefinition definition("larder", "manager", false, false, 0, 1, true, 100);
  const auto made = definition.createStore(storePath(), "", queues, trash, nullptr, files, nullptr,
                                           PruneStrategyIdentifier::Null, nullptr);
  store = std::dynamic_pointer_cast<PersistentKeyValueStore>(made);
  ASSERT_NE(store, nullptr);
  put("a", "1");
  put("b", "2");
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST(PersistentKeyValueStoreStaleAgeOf, KeepsSecondsAndNeverTurnsNegative) {
  EXPECT_EQ(staleAgeOf(0), 0);
  EXPECT_EQ(staleAgeOf(100), 100);
  EXPECT_GT(staleAgeOf(std::numeric_limits<std::uint32_t>::max()), 0);
}

// --- Storing ---

TEST_F(PersistentKeyValueStoreStoring, IsFetchedAgain) {
  open();
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
  EXPECT_EQ(valueFile("key"), "value");
}

TEST_F(PersistentKeyValueStoreStoring, IsFoundAgainAfterARestart) {
  open();
  put("key", "value");
  put("empty", "");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"key", "value"}, {"empty", ""}}));
}

TEST_F(PersistentKeyValueStoreStoring, WritesARowWithTheKeyAsFileNameAndTheDatesOfNow) {
  open();
  put("key", "value");
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 5 0 1000000 1000000 -"));
}

TEST_F(PersistentKeyValueStoreStoring, DoesNothingOnTheCallersThread) {
  openWatched();
  keepJournal();
  const Written written = watch(store->store("key", bytesOf("value")));
  EXPECT_THAT(takeJournal(), IsEmpty());
  EXPECT_EQ(work().pending(), 1U);
  EXPECT_EQ(file().pending(), 0U);
  EXPECT_TRUE(written->isPending());
}

TEST_F(PersistentKeyValueStoreStoring, RecordsProvisionallyThenWritesTheFileThenRecordsTheSize) {
  openWatched();
  keepJournal();
  const Written written = watch(store->store("key", bytesOf("value")));
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("setItem key 0"));
  EXPECT_TRUE(written->isPending());
  EXPECT_EQ(work().pending(), 0U);
  EXPECT_EQ(file().pending(), 1U);

  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("writeFile key", "setItem key 5"));
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(sizes, IsEmpty());  // the size is told on the work queue
  EXPECT_EQ(work().runAll(), 1U);
  EXPECT_THAT(sizes, ElementsAre(5U));
  EXPECT_THAT(takeJournal(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreStoring, DatesBothRecordsWithTheirOwnNow) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  clock.set(2'000'000);
  ASSERT_TRUE(work().runNext());
  const DiskCacheItem provisional = medium->rows().at("key").item;
  EXPECT_EQ(provisional.filename, "key");
  EXPECT_EQ(provisional.size, 0U);
  EXPECT_FALSE(provisional.hasInlineData);
  EXPECT_EQ(provisional.modificationDate, 2'000'000);
  EXPECT_EQ(provisional.lastAccessDate, 2'000'000);
  clock.set(3'000'000);
  ASSERT_TRUE(file().runNext());
  const DiskCacheItem real = medium->rows().at("key").item;
  EXPECT_EQ(real.filename, "key");
  EXPECT_EQ(real.size, 5U);
  EXPECT_FALSE(real.hasInlineData);
  EXPECT_EQ(real.modificationDate, 3'000'000);
  EXPECT_EQ(real.lastAccessDate, 3'000'000);
}

TEST_F(PersistentKeyValueStoreStoring, KeepsTheMetadataInBothRecords) {
  class Metadata final : public DiskCacheItem::ExtendedMetadata {
   public:
    std::vector<unsigned char> serialize() const override { return {1}; }
    void deserialize(const std::vector<unsigned char>& /*bytes*/) override {}
  };
  openWatched();
  const auto metadata = std::make_shared<Metadata>();
  watch(store->store("key", bytesOf("value"), metadata));
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(medium->rows().at("key").item.extendedMetadata, metadata);
  ASSERT_TRUE(file().runNext());
  EXPECT_EQ(medium->rows().at("key").item.extendedMetadata, metadata);
}

TEST_F(PersistentKeyValueStoreStoring, CopiesTheBytesAtTheCall) {
  open();
  Bytes data = bytesOf("value");
  const Written written = watch(store->store("key", data));
  data = bytesOf("other");
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreStoring, WhereAFifoLiesFailsAndLeavesAMiss) {
  const test::Watchdog watchdog(60);
  open();
  ASSERT_EQ(mkfifo(pathOf("key").c_str(), 0600), 0);
  const Written written = watch(store->store("key", bytesOf("value")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(written->failure)) << told(written);
  EXPECT_THAT(told(written), testing::HasSubstr("Could not open file: No such device or address"));
  EXPECT_EQ(get("key"), "<miss>");
}

TEST_F(PersistentKeyValueStoreStoring, OverwritesTheFileInPlaceAndReplacesTheRow) {
  open();
  put("key", "a long value");
  std::filesystem::create_hard_link(pathOf("key"), directory.file("same file"));
  files->clearTrace();
  clock.set(2'000'000);
  put("key", "short");
  EXPECT_EQ(directory.read("same file"), "short");
  EXPECT_EQ(files->calls(Operation::DeleteFile), 0U);
  EXPECT_EQ(files->calls(Operation::Rename), 0U);
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 5 0 2000000 2000000 -"));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

TEST_F(PersistentKeyValueStoreStoring, ChangesTheReportedTotalByTheDifferenceWhenItOverwrites) {
  open();
  put("key", "a long value");
  put("key", "short");
  EXPECT_THAT(sizes, ElementsAre(12U, 5U));
}

TEST_F(PersistentKeyValueStoreStoring, OfAWriterRecordsTheSizeTheWriterReturns) {
  open();
  std::string path;
  const Written written = watch(store->store("key", nullptr, [&](const std::string& filePath) {
    path = filePath;
    files->writeFile(filePath, bytesOf("value"));
    return 77U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(path, pathOf("key"));
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 77 0 1000000 1000000 -"));
  EXPECT_THAT(sizes, ElementsAre(77U));
}

TEST_F(PersistentKeyValueStoreStoring, CallsTheWriterOnTheFileQueueWithNoLockHeld) {
  open();
  bool called = false;
  const Written written = watch(store->store("key", nullptr, [&](const std::string& filePath) {
    called = true;
    store->overrideConfiguration(5);  // takes the store's lock
    files->writeFile(filePath, bytesOf("value"));
    return 5U;
  }));
  ASSERT_TRUE(work().runNext());
  EXPECT_FALSE(called);
  ASSERT_TRUE(file().runNext());
  EXPECT_TRUE(called);
  EXPECT_EQ(told(written), "<done>");
}

TEST_F(PersistentKeyValueStoreStoring, NeedsNoManifestThatCanTellWhatItReplaces) {
  for (const bool inlineData : {false, true}) {
    options.inlineData = inlineData;
    openWatched();
    manifest->cannotReplace = true;
    put("key", "old");
    put("key", "new");
    EXPECT_EQ(get("key"), "new");
    EXPECT_EQ(drop("key"), "<done>");
    close();
  }
}

TEST_F(PersistentKeyValueStoreStoring, WithoutAWriterFailsAndLeavesAMiss) {
  open();
  const Written written = watch(store->store("key", nullptr, nullptr));
  settle();
  EXPECT_TRUE(isA<std::bad_function_call>(written->failure)) << told(written);
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreStoring, WorksWithoutReporterAndSizeCallback) {
  reporter = nullptr;
  options.onSizeChanged = nullptr;
  open();
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
  EXPECT_EQ(get("other"), "<miss>");
  const Written used = watch(store->updateLastAccessDate("key"));
  settle();
  EXPECT_EQ(told(used), "<done>");
}

TEST_F(PersistentKeyValueStoreStoring, BeforeTheManifestIsLoadedWorksAndReportsNoSize) {
  openWatchedUnloaded();
  work().dropAll();  // the loading never comes
  put("key", "value");
  EXPECT_THAT(sizes, IsEmpty());
  EXPECT_EQ(get("key"), "value");
  EXPECT_EQ(keysInMedium(), (std::vector<std::string>{"key"}));
}

// --- Fetching ---

TEST_F(PersistentKeyValueStoreFetching, OfAnUnknownKeyIsAMissThatTouchesNoFile) {
  openWatched();
  keepJournal();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(takeJournal(), ElementsAre("getItem key"));
  EXPECT_THAT(accesses(), ElementsAre("1 key 0 0"));
}

TEST_F(PersistentKeyValueStoreFetching, LooksUpOnTheWorkQueueAndReadsOnTheFileQueue) {
  openWatched();
  put("key", "value");
  keepJournal();
  const Fetched fetched = watch(store->fetch("key"));
  EXPECT_THAT(takeJournal(), IsEmpty());
  EXPECT_EQ(file().pending(), 0U);
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("getItem key"));
  EXPECT_EQ(file().pending(), 1U);
  EXPECT_TRUE(fetched->isPending());
  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("readFile key", "updateLastAccessDate key"));
  EXPECT_EQ(told(fetched), "value");
  EXPECT_EQ(work().pending() + file().pending(), 0U);
}

TEST_F(PersistentKeyValueStoreFetching, TellsTheKeyAndWhenItWasStored) {
  open();
  put("key", "value");
  clock.advance(70);
  const Fetched fetched = watch(store->fetch("key"));
  settle();
  ASSERT_EQ(told(fetched), "value");
  EXPECT_EQ((*fetched->value)->key, "key");
  EXPECT_EQ((*fetched->value)->modificationDate, kStart);
}

TEST_F(PersistentKeyValueStoreFetching, ReportsOneHitWithAgeAndSize) {
  open();
  put("key", "value");
  clock.advance(70);
  EXPECT_EQ(get("key"), "value");
  EXPECT_THAT(accesses(), ElementsAre("0 key 70 5"));
}

TEST_F(PersistentKeyValueStoreFetching, ReportsAnAgeBeyondWhatLongHoldsAsTheGreatestAndNeverAsANegativeOne) {
  open();
  clock.set(std::numeric_limits<std::int32_t>::min());  // what a date after 2038 is read as
  put("key", "value");
  clock.set(kStart);
  EXPECT_EQ(get("key"), "value");
  const std::int64_t age = std::int64_t{kStart} - std::numeric_limits<std::int32_t>::min();
  const std::int64_t reported = std::min<std::int64_t>(age, std::numeric_limits<long>::max());
  EXPECT_THAT(accesses(), ElementsAre("0 key " + std::to_string(reported) + " 5"));
}

TEST_F(PersistentKeyValueStoreFetching, ReportsBeforeTheFileIsRead) {
  open();
  put("key", "value");
  watch(store->fetch("key"));
  EXPECT_THAT(accesses(), IsEmpty());
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(accesses(), ElementsAre("0 key 0 5"));
  settle();
  EXPECT_EQ(accesses().size(), 1U);
}

TEST_F(PersistentKeyValueStoreFetching, CountsAsAUseOfTheItem) {
  openWatched();
  put("key", "value");
  clock.advance(70);
  EXPECT_EQ(get("key"), "value");
  EXPECT_EQ(manifest->getItem("key")->lastAccessDate, kStart + 70);
  EXPECT_EQ(manifest->getItem("key")->modificationDate, kStart);
}

TEST_F(PersistentKeyValueStoreFetching, WithAReaderGivesWhatTheReaderReturns) {
  open();
  put("key", "value");
  std::string path;
  const Fetched fetched = watch(store->fetch("key", [&](const std::string& filePath) {
    path = filePath;
    return bytesOf("read");
  }));
  settle();
  EXPECT_EQ(told(fetched), "read");
  EXPECT_EQ(path, pathOf("key"));
}

TEST_F(PersistentKeyValueStoreFetching, WithAReaderThatThrowsFailsWithThatAndIsNoUse) {
  openWatched();
  put("key", "value");
  const Fetched fetched =
      watch(store->fetch("key", [](const std::string&) -> Bytes { throw std::out_of_range("Not here."); }));
  settle();
  EXPECT_EQ(told(fetched), "<error> Not here.");
  EXPECT_TRUE(isA<std::out_of_range>(fetched->failure));
  EXPECT_EQ(manifest->calls(ManifestCall::UpdateLastAccessDate), 0U);
}

TEST_F(PersistentKeyValueStoreFetching, WithALoaderPassesTheItemThePathAndEmptyBytes) {
  open();
  put("key", "value");
  std::shared_ptr<const DiskCacheItem> seen;
  std::string path;
  const Fetched fetched = watch(
      store->fetch("key", [&](std::shared_ptr<const DiskCacheItem> item, const std::string& filePath, Bytes& value) {
        seen = std::move(item);
        path = filePath;
        EXPECT_THAT(value, IsEmpty());
        value = bytesOf("loaded");
        return true;
      }));
  settle();
  EXPECT_EQ(told(fetched), "loaded");
  ASSERT_NE(seen, nullptr);
  EXPECT_EQ(seen->key, "key");
  EXPECT_EQ(seen->size, 5U);
  EXPECT_EQ(path, pathOf("key"));
}

TEST_F(PersistentKeyValueStoreFetching, WithALoaderThatRefusesIsAMissAndNoUse) {
  openWatched();
  put("key", "value");
  const Fetched fetched =
      watch(store->fetch("key", [](const std::shared_ptr<const DiskCacheItem>&, const std::string&, Bytes& value) {
        value = bytesOf("half");
        return false;
      }));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(manifest->calls(ManifestCall::UpdateLastAccessDate), 0U);
  EXPECT_THAT(accesses(), ElementsAre("0 key 0 5"));  // the item was there
}

TEST_F(PersistentKeyValueStoreFetching, CallsTheLoaderWithNoLockHeld) {
  open();
  put("key", "value");
  const Fetched fetched = watch(
      store->fetch("key", [&](const std::shared_ptr<const DiskCacheItem>& item, const std::string& path, Bytes& value) {
        store->overrideConfiguration(5);
        return store->readValue(item, path, value);
      }));
  settle();
  EXPECT_EQ(told(fetched), "value");
}

TEST_F(PersistentKeyValueStoreFetching, WhoseFileVanishedBehindTheStoreIsTheErrorOfReading) {
  open();
  put("key", "value");
  std::filesystem::remove(pathOf("key"));
  const Fetched fetched = watch(store->fetch("key"));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(fetched->failure)) << told(fetched);
  EXPECT_THAT(told(fetched), testing::HasSubstr("Could not open file"));
  EXPECT_THAT(store->getAllKeys(), ElementsAre("key"));
}

TEST_F(PersistentKeyValueStoreFetching, WhoseFileIsAFifoIsTheErrorOfReadingUntilTheKeyIsRemoved) {
  const test::Watchdog watchdog(60);
  open();
  put("key", "value");
  std::filesystem::remove(pathOf("key"));
  ASSERT_EQ(mkfifo(pathOf("key").c_str(), 0600), 0);
  EXPECT_THAT(get("key"), testing::HasSubstr("Could not seek to end of file: Illegal seek"));
  EXPECT_EQ(drop("key"), "<done>");
  put("key", "other");
  EXPECT_EQ(get("key"), "other");
}

TEST_F(PersistentKeyValueStoreFetching, WhoseFileIsTakenByALaterRemovalIsAMiss) {
  open();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  const Written removed = watch(store->removeItem("key"));
  EXPECT_EQ(work().runAll(), 2U);  // looked up, then removed; the reading comes after both
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(told(removed), "<done>");
}

TEST_F(PersistentKeyValueStoreFetching, WhoseFileIsTakenByALaterRemovalAndWrittenAnewIsAMissAndNoError) {
  open();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  watch(store->removeItem("key"));
  watch(store->store("key", bytesOf("new")));
  work().runAll();
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(get("key"), "new");
}

TEST_F(PersistentKeyValueStoreFetching, CompletesAPendingWriteOfTheKeyFirst) {
  open();
  watch(store->store("key", bytesOf("value")));
  const Fetched fetched = watch(store->fetch("key"));
  settle();
  EXPECT_EQ(told(fetched), "value");
}

TEST_F(PersistentKeyValueStoreFetching, BeforeTheManifestIsLoadedReadsTheOneRecord) {
  open();
  put("key", "value");
  close();
  openUnloaded();
  work().dropAll();
  EXPECT_EQ(get("key"), "value");
  EXPECT_FALSE(store->getManifest()->isLoaded());
}

TEST_F(PersistentKeyValueStoreFetching, FailsWithWhatTheManifestThrowsWhenItIsNotDamaged) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::GetItem, unwritable);
  EXPECT_EQ(get("key"), std::string("<error> ") + unwritable.what());
  EXPECT_EQ(get("key"), "value");
}

// --- readValue ---

TEST_F(PersistentKeyValueStoreFetching, ReadValueReadsTheFileOfAnOrdinaryItem) {
  open();
  const std::string path = directory.write("elsewhere", "bytes");
  const auto item = std::make_shared<DiskCacheItem>("key", "key", 5, false, 0, 0, nullptr);
  Bytes value;
  EXPECT_TRUE(store->readValue(item, path, value));
  EXPECT_EQ(textOf(value), "bytes");
  EXPECT_THROW(store->readValue(item, directory.file("nowhere"), value), FileUtilsIoException);
}

TEST_F(PersistentKeyValueStoreFetching, ReadValueReadsTheManifestForAnInlineItem) {
  options.inlineData = true;
  openWatched();
  put("key", "value");
  const std::shared_ptr<const DiskCacheItem> item = manifest->getItem("key");
  Bytes value;
  EXPECT_TRUE(store->readValue(item, directory.file("nowhere"), value));
  EXPECT_EQ(textOf(value), "value");
}

TEST_F(PersistentKeyValueStoreFetching, ReadValueOfADamagedManifestPurgesAndRefuses) {
  options.inlineData = true;
  openWatched();
  put("key", "value");
  const std::shared_ptr<const DiskCacheItem> item = manifest->getItem("key");
  manifest->failNext(ManifestCall::GetInlineData, corrupted);
  const LogCapture log;
  Bytes value;
  EXPECT_FALSE(store->readValue(item, "", value));
  EXPECT_THAT(errorLines(log), ElementsAre(purgeLine(corrupted)));
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

// --- The first of several ---

TEST_F(PersistentKeyValueStoreFetchingTheFirst, OfNoKeysIsAMissThatReportsNothingAndAsksNothing) {
  openWatched();
  keepJournal();
  const Fetched fetched = watch(store->fetchFirst({}, answering("x")));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_THAT(takeJournal(), IsEmpty());
  EXPECT_THAT(events->events(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, OfUnknownKeysAsksForAllAndReportsOneMissOfTheFirst) {
  openWatched();
  keepJournal();
  const Fetched fetched = watch(store->fetchFirst({"a", "b", "c"}, answering("x")));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_THAT(takeJournal(), ElementsAre("getItem a", "getItem b", "getItem c"));
  EXPECT_THAT(accesses(), ElementsAre("1 a 0 0"));
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, StopsAtTheFirstKeyThatIsThereAndNamesIt) {
  openWatched();
  put("b", "bee");
  put("c", "sea");
  clock.advance(9);
  keepJournal();
  std::string path;
  const Fetched fetched = watch(store->fetchFirst({"a", "b", "c"}, [&](const std::shared_ptr<const DiskCacheItem>& item,
                                                                       const std::string& filePath, Bytes& value) {
    path = filePath;
    return store->readValue(item, filePath, value);
  }));
  settle();
  EXPECT_EQ(told(fetched), "bee");
  EXPECT_EQ((*fetched->value)->key, "b");
  EXPECT_EQ((*fetched->value)->modificationDate, kStart);
  EXPECT_EQ(path, pathOf("b"));
  EXPECT_THAT(takeJournal(), ElementsAre("getItem a", "getItem b", "readFile b", "updateLastAccessDate b"));
  EXPECT_THAT(accesses(), ElementsAre("0 b 9 3"));
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, OfKeysInAnotherOrderFindsAnotherOne) {
  open();
  put("b", "bee");
  put("c", "sea");
  const Fetched fetched = watch(store->fetchFirst({"c", "b"}, answering("x")));
  settle();
  EXPECT_EQ(told(fetched), "x");
  EXPECT_EQ((*fetched->value)->key, "c");
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, EndsTheSearchAsAMissWhenTheManifestIsDamaged) {
  openWatched();
  put("b", "bee");
  keepJournal();
  manifest->failNext(ManifestCall::GetItem, corrupted);
  const LogCapture log;
  const Fetched fetched = watch(store->fetchFirst({"a", "b"}, answering("x")));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_THAT(errorLines(log), ElementsAre(purgeLine(corrupted)));
  EXPECT_THAT(accesses(), ElementsAre("1 a 0 0"));
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, PurgesOnceHoweverManyKeysThereAre) {
  openWatched();
  for (int i = 0; i < 3; ++i) manifest->failNext(ManifestCall::GetItem, corrupted);
  const LogCapture log;
  const Fetched fetched = watch(store->fetchFirst({"a", "b", "c"}, answering("x")));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_THAT(errorLines(log), ElementsAre(purgeLine(corrupted)));
  EXPECT_EQ(trash->collected().size(), 1U);
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, DoesNotGoOnToTheNextKeyWhenTheLoaderRefuses) {
  open();
  put("a", "1");
  put("b", "2");
  int calls = 0;
  const Fetched fetched =
      watch(store->fetchFirst({"a", "b"}, [&](const std::shared_ptr<const DiskCacheItem>&, const std::string&, Bytes&) {
        ++calls;
        return false;
      }));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(calls, 1);
}

TEST_F(PersistentKeyValueStoreFetchingTheFirst, OfTheSameKeyTwiceIsLikeOnce) {
  open();
  put("a", "1");
  const Fetched fetched = watch(store->fetchFirst({"a", "a"}, answering("x")));
  settle();
  EXPECT_EQ(told(fetched), "x");
  EXPECT_EQ(accesses().size(), 1U);
}

// --- Removing ---

TEST_F(PersistentKeyValueStoreRemoving, TakesRecordAndFileOnTheWorkQueue) {
  openWatched();
  put("key", "value");
  keepJournal();
  const Written removed = watch(store->removeItem("key"));
  EXPECT_THAT(takeJournal(), IsEmpty());
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("getItem key", "removeItem key", "deleteFile key"));
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(file().pending(), 0U);
}

TEST_F(PersistentKeyValueStoreRemoving, IsAMissAtOnceAndAfterARestart) {
  open();
  put("key", "value");
  put("other", "kept");
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_EQ(get("key"), "<miss>");
  reopen();
  EXPECT_EQ(contents(), (Contents{{"other", "kept"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("other"));
}

TEST_F(PersistentKeyValueStoreRemoving, ThatIsNotThereSucceedsAndTouchesNothing) {
  openWatched();
  keepJournal();
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_THAT(takeJournal(), ElementsAre("getItem key"));
}

TEST_F(PersistentKeyValueStoreRemoving, TwiceSucceedsTwice) {
  open();
  put("key", "value");
  const Written first = watch(store->removeItem("key"));
  const Written second = watch(store->removeItem("key"));
  settle();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(second), "<done>");
}

TEST_F(PersistentKeyValueStoreRemoving, WhoseFileHasVanishedFailsButTakesTheRecord) {
  open();
  put("key", "value");
  std::filesystem::remove(pathOf("key"));
  const Written removed = watch(store->removeItem("key"));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(removed->failure)) << told(removed);
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  EXPECT_EQ(drop("key"), "<done>");
}

TEST_F(PersistentKeyValueStoreRemoving, ThatTheManifestCannotForgetFailsAndKeepsTheFile) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::RemoveItem, unwritable);
  EXPECT_EQ(drop("key"), std::string("<error> ") + unwritable.what());
  EXPECT_EQ(get("key"), "value");
}

// --- Dates ---

TEST_F(PersistentKeyValueStoreAskingForDates, OfAnUnknownKeyIsEmpty) {
  open();
  EXPECT_EQ(store->fetchModificationDate("key"), std::nullopt);
}

TEST_F(PersistentKeyValueStoreAskingForDates, GivesWhenTheValueWasStoredAndIsNoUseAndNoEvent) {
  openWatched();
  put("key", "value");
  clock.advance(50);
  EXPECT_EQ(store->fetchModificationDate("key"), kStart);
  EXPECT_EQ(manifest->getItem("key")->lastAccessDate, kStart);
  EXPECT_THAT(accesses(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreAskingForDates, BeforeTheManifestIsLoadedReadsTheOneRecord) {
  open();
  put("key", "value");
  close();
  openUnloaded();
  EXPECT_EQ(store->fetchModificationDate("key"), kStart);
  EXPECT_FALSE(store->getManifest()->isLoaded());
}

TEST_F(PersistentKeyValueStoreAskingForDates, UpdatingTheAccessDateReportsAHitOfTheKeyAloneAndMovesTheDate) {
  openWatched();
  put("key", "value");
  clock.advance(50);
  const Written used = watch(store->updateLastAccessDate("key"));
  EXPECT_EQ(manifest->calls(ManifestCall::UpdateLastAccessDate), 0U);
  EXPECT_THAT(accesses(), IsEmpty());
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(told(used), "<done>");
  EXPECT_EQ(manifest->getItem("key")->lastAccessDate, kStart + 50);
  EXPECT_THAT(accesses(), ElementsAre("0 key 0 0"));
  EXPECT_EQ(file().pending(), 0U);
}

TEST_F(PersistentKeyValueStoreAskingForDates, UpdatingTheAccessDateOfAnUnknownKeyIsNoError) {
  open();
  const Written used = watch(store->updateLastAccessDate("key"));
  settle();
  EXPECT_EQ(told(used), "<done>");
  EXPECT_THAT(accesses(), ElementsAre("0 key 0 0"));
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreAskingForDates, KeysBeforeLoadingAreRefused) {
  openUnloaded();
  EXPECT_THROW(store->getAllKeys(), DiskCacheManifestException);
  settle();
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

// --- Inline ---

TEST_F(PersistentKeyValueStoreStoringInline, KeepsTheBytesInTheRowAndMakesNoFile) {
  open();
  put("key", "value");
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 5 1 1000000 1000000 value"));
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_EQ(get("key"), "value");
  reopen();
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreStoringInline, RecordsTheItemThenTheBytesOnTheWorkQueueAndReportsTheSize) {
  openWatched();
  keepJournal();
  const Written written = watch(store->store("key", bytesOf("value")));
  EXPECT_THAT(takeJournal(), IsEmpty());
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("setItem key 5", "setInlineData key 5"));
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(file().pending(), 0U);
  EXPECT_EQ(work().runAll(), 1U);
  EXPECT_THAT(sizes, ElementsAre(5U));
}

TEST_F(PersistentKeyValueStoreStoringInline, OfNothingIsAnEmptyValueAndNoMiss) {
  open();
  put("key", "");
  EXPECT_EQ(get("key"), "");
  reopen();
  EXPECT_EQ(get("key"), "");
}

TEST_F(PersistentKeyValueStoreStoringInline, ReplacesTheValue) {
  open();
  put("key", "a long value");
  put("key", "short");
  EXPECT_EQ(get("key"), "short");
  EXPECT_THAT(sizes, ElementsAre(12U, 5U));
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 5 1 1000000 1000000 short"));
}

TEST_F(PersistentKeyValueStoreStoringInline, KeepsBytesOfEveryKind) {
  open();
  const std::string value("a\0b\xff\n\0", 6);
  put("key", value);
  reopen();
  EXPECT_EQ(get("key"), value);
}

TEST_F(PersistentKeyValueStoreStoringInline, IsReadOnTheFileQueue) {
  openWatched();
  put("key", "value");
  keepJournal();
  const Fetched fetched = watch(store->fetch("key"));
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("getItem key"));
  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("getInlineData key", "updateLastAccessDate key"));
  EXPECT_EQ(told(fetched), "value");
}

TEST_F(PersistentKeyValueStoreStoringInline, RefusesAWriterAtOnceAndNeverCallsIt) {
  openWatched();
  keepJournal();
  bool called = false;
  const Written written = watch(store->store("key", nullptr, [&](const std::string&) {
    called = true;
    return 1U;
  }));
  settle();
  EXPECT_EQ(told(written), "<error> Write callback not supported by inline store.");
  EXPECT_TRUE(isA<std::runtime_error>(written->failure));
  EXPECT_FALSE(isA<LarderException>(written->failure));
  EXPECT_FALSE(called);
  EXPECT_THAT(takeJournal(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreStoringInline, RemovesWithoutDeletingAFile) {
  openWatched();
  put("key", "value");
  directory.write("store/key", "a file that is not the store's");
  keepJournal();
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_THAT(takeJournal(), ElementsAre("getItem key", "removeItem key"));
  EXPECT_EQ(get("key"), "<miss>");
}

TEST_F(PersistentKeyValueStoreStoringInline, RemovedBetweenLookingUpAndReadingIsAMiss) {
  open();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  watch(store->removeItem("key"));
  work().runAll();
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
}

TEST_F(PersistentKeyValueStoreStoringInline, WhoseBytesVanishedBehindTheStoreIsAMissAndNoEmptyValue) {
  openWatched();
  put("key", "value");
  medium->change([](auto& rows) { rows.clear(); });
  EXPECT_EQ(get("key"), "<miss>");
}

TEST_F(PersistentKeyValueStoreStoringInline, OverwrittenWhileItIsReadIsReadWhole) {
  openWatched();
  put("key", "old");
  std::promise<void> read;
  const Fetched fetched =
      watch(store->fetch("key", [&](std::shared_ptr<const DiskCacheItem> item, const std::string& path, Bytes& value) {
        const bool found = store->readValue(std::move(item), path, value);
        read.set_value();
        return found;
      }));
  ASSERT_TRUE(work().runNext());
  std::thread reader;
  manifest->onCall = [&](ManifestCall call, const std::string&) {
    if (call != ManifestCall::SetInlineData) return;
    reader = std::thread([this] { file().runNext(); });
    // The reader either gets through here or waits for the writer; only for its sake is there a limit.
    (void)read.get_future().wait_for(std::chrono::milliseconds(200));
  };
  const Written written = watch(store->store("key", bytesOf("new")));
  ASSERT_TRUE(work().runNext());
  reader.join();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(told(fetched), testing::AnyOf("old", "new"));
}

TEST_F(PersistentKeyValueStoreStoringInline, TakesAnyKey) {
  open();
  const std::vector<std::string> keys = {"",
                                         ".",
                                         "..",
                                         "a/b",
                                         "manifest_v1.sqlite",
                                         AttributeStore::fileName,
                                         std::string("a\0b", 3),
                                         "\xff\xfe",
                                         std::string(5000, 'x')};
  for (const std::string& key : keys) put(key, "value of " + key);
  for (const std::string& key : keys) EXPECT_EQ(get(key), "value of " + key);
  reopen();
  EXPECT_EQ(contents().size(), keys.size());
  for (const std::string& key : keys) EXPECT_EQ(get(key), "value of " + key);
  for (const std::string& key : keys) EXPECT_EQ(drop(key), "<done>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

// --- After invalidation ---

// Not what a queue is meant to do, but no lock is held around what it is given.
TEST_F(PersistentKeyValueStoreCreating, OnQueuesThatRunEverythingAtOnceWorks) {
  for (const bool inlineData : {false, true}) {
    options.inlineData = inlineData;
    openUnloaded();
    work().onDispatch = [&queue = work()] { queue.runAll(); };
    file().onDispatch = [&queue = file()] { queue.runAll(); };
    work().runAll();
    EXPECT_EQ(told(watch(store->store("key", bytesOf("value")))), "<done>");
    EXPECT_EQ(told(watch(store->fetch("key"))), "value");
    EXPECT_EQ(told(watch(store->removeItem("key"))), "<done>");
    EXPECT_EQ(told(watch(store->fetch("key"))), "<miss>");
    EXPECT_EQ(told(watch(store->store("other", bytesOf("value")))), "<done>");
    EXPECT_EQ(clear(), "<done>");
    store->invalidate();
    close();
  }
}

TEST_F(PersistentKeyValueStoreCreating, AfterInvalidationEveryOperationIsRefused) {
  open();
  put("key", "value");
  file().onDispatch = [this] { file().runAll(); };
  store->invalidate();
  files->clearTrace();
  const std::vector<Written> written = {watch(store->store("key", bytesOf("x"))),
                                        watch(store->store("key", nullptr, writing("x", 1))),
                                        watch(store->removeItem("key")), watch(store->updateLastAccessDate("key")),
                                        watch(store->store("manifest_v1.sqlite", bytesOf("x")))};
  const std::vector<Fetched> fetched = {
      watch(store->fetch("key")), watch(store->fetch("key", [](const std::string&) { return Bytes(); })),
      watch(store->fetch("key", answering("x"))), watch(store->fetchFirst({"key"}, answering("x"))),
      watch(store->fetchFirst({}, answering("x")))};
  for (const Written& outcome : written) EXPECT_EQ(told(outcome), "<error> " + kInvalid);
  for (const Fetched& outcome : fetched) EXPECT_EQ(told(outcome), "<error> " + kInvalid);
  EXPECT_TRUE(isA<InvalidatedException>(fetched.front()->failure));
  EXPECT_THROW(store->getAllKeys(), InvalidatedException);
  EXPECT_THROW(store->fetchModificationDate("key"), InvalidatedException);
  EXPECT_THROW(store->throwIfInvalid(), InvalidatedException);
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_EQ(valueFile("key"), "value");
}

TEST_F(PersistentKeyValueStoreStoringInline, AfterInvalidationIsRefusedWithAWriterToo) {
  open();
  file().onDispatch = [this] { file().runAll(); };
  store->invalidate();
  EXPECT_EQ(told(watch(store->store("key", bytesOf("x")))), "<error> " + kInvalid);
  EXPECT_EQ(told(watch(store->store("key", nullptr, writing("x", 1)))), "<error> " + kInvalid);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
