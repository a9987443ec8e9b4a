// How a key-value store keeps within its limits: expiry, capacity, clearing, batched deletion.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::KeyValueStoreFixture;
using test::kInvalid;
using test::kSecond;
using test::LogCapture;
using test::ManifestCall;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Not;
using testing::UnorderedElementsAre;

using Batch = std::vector<DiskCacheItem>;
using Provider = std::function<const Batch()>;

class MaintenanceFixture : public KeyValueStoreFixture {
 protected:
  DiskCacheItem itemOf(const std::string& key, bool isInline = false) const {
    return {key, key, 1, isInline, 0, 0, nullptr};
  }

  // Yields the batches one after the other, then empty ones.
  static Provider yielding(std::vector<Batch> batches) {
    return [batches = std::move(batches), next = std::make_shared<std::size_t>(0)]() -> const Batch {
      return *next < batches.size() ? batches[(*next)++] : Batch();
    };
  }
};

class PersistentKeyValueStoreExpiry : public MaintenanceFixture {};
class PersistentKeyValueStoreCapacity : public MaintenanceFixture {};
class PersistentKeyValueStoreClearing : public MaintenanceFixture {};
class PersistentKeyValueStoreDeletingInBatches : public MaintenanceFixture {};
class PersistentKeyValueStoreSizeReport : public MaintenanceFixture {};

// --- Expiry ---

TEST_F(PersistentKeyValueStoreExpiry, KeepsAnItemThatWasUsedExactlyAtTheCutoff) {
  open();
  put("key", "value");
  clock.set(kStart + 1000);
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreExpiry, TakesAnItemThatWasUsedASecondBeforeTheCutoffWithItsFile) {
  open();
  put("key", "value");
  clock.set(kStart + 1001);
  put("fresh", "value");
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(store->getAllKeys(), ElementsAre("fresh"));
  EXPECT_THAT(valueFiles(), ElementsAre("fresh"));
  EXPECT_EQ(rowsOnDisk().size(), 1U);
}

TEST_F(PersistentKeyValueStoreExpiry, GoesByTheLastUseAndNotByTheDateOfWriting) {
  open();
  put("used", "value");
  put("idle", "value");
  clock.set(kStart + 900);
  EXPECT_EQ(get("used"), "value");
  clock.set(kStart + 1500);
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(store->getAllKeys(), ElementsAre("used"));
}

TEST_F(PersistentKeyValueStoreExpiry, ComesAnHourAfterTheLastOne) {
  open();
  ASSERT_TRUE(fire(300));
  EXPECT_THAT(work().armedDelays(), Not(Contains(3600 * kSecond)));  // only when the cycle is through
  settle();
  EXPECT_THAT(work().armedDelays(), UnorderedElementsAre(120 * kSecond, 3600 * kSecond));  // and the manifest's own
  ASSERT_TRUE(fire(3600));
  settle();
  EXPECT_THAT(work().armedDelays(), UnorderedElementsAre(120 * kSecond, 3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, WithAStaleAgeBeyondTheClockTakesNothing) {
  options.staleAge = kStart + 1;
  openWatched();
  put("key", "value");
  manifest->setItem({"ancient", "ancient", 1, false, 0, 0, nullptr});
  manifest->clearTrace();
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(manifest->trace(), ElementsAre("pruneOldEntries 0 50"));
  EXPECT_THAT(store->getAllKeys(), UnorderedElementsAre("key", "ancient"));
}

TEST_F(PersistentKeyValueStoreExpiry, CutsAtZeroWhenTheStaleAgeIsTheClockAndAboveItWhenItIsLess) {
  options.staleAge = kStart;
  openWatched();
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(manifest->trace(), ElementsAre("pruneOldEntries 0 50"));
  store->overrideConfiguration(kStart - 1);
  manifest->clearTrace();
  ASSERT_TRUE(fire(3600));
  settle();
  EXPECT_THAT(manifest->trace(), ElementsAre("pruneOldEntries 1 50"));
}

TEST_F(PersistentKeyValueStoreExpiry, FollowsAnOverriddenStaleAgeFromTheNextCycleOn) {
  open();
  put("key", "value");
  clock.advance(500);
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_EQ(store->getAllKeys().size(), 1U);
  store->overrideConfiguration(499);
  EXPECT_EQ(store->getAllKeys().size(), 1U);
  ASSERT_TRUE(fire(3600));
  settle();
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreExpiry, WithTheSmallestAndTheLargestStaleAgeGoesOn) {
  open();
  put("key", "value");
  store->overrideConfiguration(std::numeric_limits<long>::min());
  ASSERT_TRUE(fire(300));
  settle();
  store->overrideConfiguration(std::numeric_limits<long>::max());
  put("key", "value");
  ASSERT_TRUE(fire(3600));
  settle();
  EXPECT_EQ(get("key"), "value");
  EXPECT_THAT(work().armedDelays(), Contains(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, ReportsTheSizeBeforeAndAfter) {
  open();
  put("key", "value");
  sizes.clear();
  clock.advance(1001);
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(sizes, ElementsAre(5U, 0U));
}

TEST_F(PersistentKeyValueStoreExpiry, TakesFiftyAtATimeAndWaitsForTheirFiles) {
  openWatched();
  putMany(101);
  clock.advance(1001);
  keepJournal();
  ASSERT_TRUE(fire(300));
  EXPECT_THAT(takeJournal(), IsEmpty());  // the first step is a task of its own
  const auto deletions = [this] {
    std::size_t count = 0;
    for (const std::string& line : takeJournal()) count += line.rfind("deleteFile ", 0) == 0 ? 1U : 0U;
    return count;
  };
  const std::vector<std::size_t> left = {51, 1, 0};
  const std::vector<std::size_t> gone = {50, 50, 1};
  for (std::size_t batch = 0; batch < 3; ++batch) {
    work().runAll();
    EXPECT_THAT(takeJournal(), ElementsAre("pruneOldEntries 1000001 50"));
    EXPECT_EQ(medium->rows().size(), left[batch]);
    EXPECT_EQ(work().pending(), 0U);  // nothing goes on before the files are gone
    EXPECT_EQ(file().pending(), 1U);
    ASSERT_TRUE(file().runNext());
    EXPECT_EQ(deletions(), gone[batch]);
    EXPECT_EQ(work().pending(), 1U);
  }
  EXPECT_THAT(work().armedDelays(), Not(Contains(3600 * kSecond)));
  work().runAll();
  EXPECT_THAT(work().armedDelays(), Contains(3600 * kSecond));
  EXPECT_EQ(file().pending(), 0U);
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreExpiry, OfInlineItemsDeletesNoFile) {
  options.inlineData = true;
  openWatched();
  put("key", "value");
  directory.write("store/key", "a file that is not the store's");
  clock.advance(1001);
  files->clearTrace();
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(files->trace(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreExpiry, ThatFailsLogsAndComesAgainInAnHour) {
  openWatched();
  manifest->failNext(ManifestCall::PruneOldEntries, unwritable);
  const LogCapture log;
  ASSERT_TRUE(fire(300));
  settle();
  ASSERT_THAT(errorLines(log), ElementsAre(std::string("Failed to delete stale items: ") + unwritable.what()));
  EXPECT_EQ(log.lines().front().file, "PersistentKeyValueStore.cpp");
  EXPECT_THAT(work().armedDelays(), ElementsAre(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, WhoseFilesCannotBeDeletedLogsEachAndIsNoFailure) {
  open();
  put("a", "1");
  put("b", "2");
  clock.advance(1001);
  files->failPath(Operation::DeleteFile, pathOf("a"), EACCES);
  const LogCapture log;
  ASSERT_TRUE(fire(300));
  settle();
  const FileUtilsIoException failure(EACCES, std::generic_category().message(EACCES));
  ASSERT_THAT(errorLines(log), ElementsAre("Failed to delete file at \"" + pathOf("a") + "\" " + failure.what()));
  EXPECT_EQ(log.lines().front().file, "PersistentKeyValueStore.cpp");
  EXPECT_THAT(valueFiles(), ElementsAre("a"));
  EXPECT_THAT(work().armedDelays(), Contains(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, ReplacesTheTimerThatIsArmed) {
  openWatched();
  store->scheduleStaleRemoval(10);
  EXPECT_THAT(work().armedDelays(), ElementsAre(10 * kSecond));
  store->scheduleStaleRemoval(20);
  EXPECT_THAT(work().armedDelays(), ElementsAre(20 * kSecond));
  EXPECT_EQ(work().companions(), 0U);
}

TEST_F(PersistentKeyValueStoreExpiry, TakesAnyDelay) {
  openWatched();
  for (const long delay : {0L, -1L, std::numeric_limits<long>::max(), std::numeric_limits<long>::min()}) {
    store->scheduleStaleRemoval(delay);
    EXPECT_EQ(work().armedDelays().size(), 1U);
  }
  store->scheduleStaleRemoval(-1);
  EXPECT_THAT(work().armedDelays(), ElementsAre(-kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, LoadsFirstWhenTheFirstLoadingFailed) {
  manifest.reset();
  openWatchedUnloaded();
  manifest->failNext(ManifestCall::Load, unwritable);
  EXPECT_THROW(work().runNext(), ManifestPersistenceException);
  EXPECT_THAT(work().armedDelays(), ElementsAre(300 * kSecond));
  ASSERT_TRUE(fire(300));
  settle();
  EXPECT_TRUE(manifest->isLoaded());
  EXPECT_EQ(manifest->calls(ManifestCall::Load), 2U);
}

TEST_F(PersistentKeyValueStoreExpiry, WhoseLoadingFailsAgainLogsAndComesAgain) {
  openWatchedUnloaded();
  manifest->failNext(ManifestCall::Load, unwritable);
  manifest->failNext(ManifestCall::Load, unwritable);
  EXPECT_THROW(work().runNext(), ManifestPersistenceException);
  const LogCapture log;
  ASSERT_TRUE(fire(300));
  EXPECT_THAT(errorLines(log), ElementsAre(std::string("Failed to delete stale items: ") + unwritable.what()));
  EXPECT_THAT(work().armedDelays(), ElementsAre(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, IsArmedThoughTheFirstLoadingCouldNotEvenPurge) {
  openWatchedUnloaded();
  manifest->failNext(ManifestCall::Load, corrupted);
  files->failNext(Operation::CreateDirectory, ENOSPC);
  EXPECT_ANY_THROW(work().runNext());
  EXPECT_THAT(work().armedDelays(), ElementsAre(300 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, ComesAgainThoughTheQueueTookNoWork) {
  options.onSizeChanged = nullptr;
  openWatched();
  work().throwOnDispatch(true);
  try {
    fire(300);
  } catch (const std::exception&) {
    // Either way: the next cycle must be armed.
  }
  work().throwOnDispatch(false);
  EXPECT_THAT(work().armedDelays(), ElementsAre(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, ComesAgainThoughTheQueueDroppedItsDeletions) {
  open();
  put("key", "value");
  clock.advance(1001);
  const LogCapture log;
  ASSERT_TRUE(fire(300));
  work().runAll();
  file().dropAll();
  settle();
  EXPECT_THAT(errorLines(log), ElementsAre(testing::StartsWith("Failed to delete stale items: ")));
  EXPECT_THAT(work().armedDelays(), Contains(3600 * kSecond));
}

TEST_F(PersistentKeyValueStoreExpiry, ThatWaitsWhenItsStoreGoesDoesNothing) {
  openWatched();
  put("key", "value");
  clock.advance(1001);
  ASSERT_TRUE(fire(300));
  manifest->clearTrace();
  store.reset();
  settle();
  EXPECT_THAT(manifest->trace(), IsEmpty());
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

// --- Capacity ---

TEST_F(PersistentKeyValueStoreCapacity, OfThreeEvictsExactlyTheOldestForTheFourthBeforeItIsRecorded) {
  options.capacity = 3;
  openWatched();
  for (const char* key : {"a", "b", "c"}) {
    put(key, "value");
    clock.advance(1);
  }
  EXPECT_EQ(manifest->calls(ManifestCall::PruneOldestItem), 0U);
  keepJournal();
  const Written written = watch(store->store("d", bytesOf("value")));
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("pruneOldestItem", "setItem d 0"));
  EXPECT_THAT(valueFiles(), ElementsAre("a", "b", "c"));
  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("deleteFile a"));
  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(takeJournal(), ElementsAre("writeFile d", "setItem d 5"));
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(keysInMedium(), (std::vector<std::string>{"b", "c", "d"}));
  EXPECT_THAT(valueFiles(), ElementsAre("b", "c", "d"));
}

TEST_F(PersistentKeyValueStoreCapacity, EvictsWhatWasUsedLeastRecently) {
  options.capacity = 2;
  open();
  put("a", "1");
  clock.advance(1);
  put("b", "2");
  clock.advance(1);
  EXPECT_EQ(get("a"), "1");
  put("c", "3");
  EXPECT_EQ(contents(), (Contents{{"a", "1"}, {"c", "3"}}));
}

TEST_F(PersistentKeyValueStoreCapacity, EvictsAlsoWhenItOverwrites) {
  options.capacity = 2;
  open();
  put("a", "1");
  clock.advance(1);
  put("b", "2");
  clock.advance(1);
  put("b", "new");
  EXPECT_EQ(contents(), (Contents{{"b", "new"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("b"));
}

TEST_F(PersistentKeyValueStoreCapacity, MayEvictTheVeryItemThatIsOverwritten) {
  options.capacity = 1;
  open();
  put("a", "1");
  put("a", "2");
  EXPECT_EQ(contents(), (Contents{{"a", "2"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("a"));
  const Written first = watch(store->store("a", bytesOf("3")));
  const Written second = watch(store->store("a", bytesOf("4")));
  settle();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(second), "<done>");
  EXPECT_EQ(contents(), (Contents{{"a", "4"}}));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"a", "4"}}));
}

TEST_F(PersistentKeyValueStoreCapacity, OfZeroHoldsTheLastItemAlone) {
  options.capacity = 0;
  openWatched();
  put("a", "1");
  EXPECT_EQ(manifest->calls(ManifestCall::PruneOldestItem), 1U);  // and there was none
  EXPECT_EQ(get("a"), "1");
  put("b", "2");
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("b"));
}

TEST_F(PersistentKeyValueStoreCapacity, AbsentNeverEvicts) {
  openWatched();
  putMany(60);
  EXPECT_EQ(manifest->calls(ManifestCall::PruneOldestItem), 0U);
  EXPECT_EQ(store->getAllKeys().size(), 60U);
}

TEST_F(PersistentKeyValueStoreCapacity, BeyondThirtyTwoBitsNeverEvicts) {
  options.capacity = std::uint64_t{1} << 32U;
  openWatched();
  putMany(3);
  EXPECT_EQ(manifest->calls(ManifestCall::PruneOldestItem), 0U);
}

TEST_F(PersistentKeyValueStoreCapacity, FarExceededIsWorkedOffOneItemAWrite) {
  open();
  putMany(5);
  close();
  options.capacity = 2;
  open();
  clock.advance(1);
  put("a", "1");
  EXPECT_EQ(store->getAllKeys().size(), 5U);
  put("b", "2");
  EXPECT_EQ(store->getAllKeys().size(), 5U);
  EXPECT_EQ(valueFiles().size(), 5U);
}

TEST_F(PersistentKeyValueStoreCapacity, OfInlineItemsEvictsWithoutDeletingAFile) {
  options.capacity = 1;
  options.inlineData = true;
  openWatched();
  put("a", "1");
  clock.advance(1);
  directory.write("store/a", "a file that is not the store's");
  keepJournal();
  put("b", "2");
  EXPECT_THAT(takeJournal(), ElementsAre("pruneOldestItem", "setItem b 1", "setInlineData b 1"));
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
}

TEST_F(PersistentKeyValueStoreCapacity, WhoseEvictedFileCannotBeDeletedLogsAndStoresAllTheSame) {
  options.capacity = 1;
  open();
  put("a", "1");
  clock.advance(1);
  files->failPath(Operation::DeleteFile, pathOf("a"), EACCES);
  const LogCapture log;
  put("b", "2");
  const FileUtilsIoException failure(EACCES, std::generic_category().message(EACCES));
  ASSERT_THAT(errorLines(log), ElementsAre(std::string("Failed to remove the oldest item ") + failure.what()));
  EXPECT_EQ(log.lines().front().file, "PersistentKeyValueStore.cpp");
  EXPECT_EQ(get("b"), "2");
}

TEST_F(PersistentKeyValueStoreCapacity, EvictsAWriteThatIsStillOnItsWayWithoutATrace) {
  options.capacity = 1;
  open();
  const Written first = watch(store->store("a", bytesOf("1")));
  const Written second = watch(store->store("b", bytesOf("2")));
  const Fetched fetched = watch(store->fetch("a"));
  work().runAll();
  settle();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(second), "<done>");
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(contents(), (Contents{{"b", "2"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("b"));
}

// --- Clearing ---

TEST_F(PersistentKeyValueStoreClearing, TakesEveryItemOfNoSizeToo) {
  open();
  put("empty", "");
  put("key", "value");
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  EXPECT_EQ(sizes.back(), 0U);
}

TEST_F(PersistentKeyValueStoreClearing, TakesEmptyItemsAloneToo) {
  open();
  put("a", "");
  put("b", "");
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, OfAnEmptyStoreSucceedsAfterOneEmptyBatchAndReportsTheSize) {
  open();
  store->clear(onSuccess(), onError());
  EXPECT_EQ(ending, "");
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(file().pending(), 0U);
  settle();
  EXPECT_THAT(sizes, ElementsAre(0U));
}

TEST_F(PersistentKeyValueStoreClearing, TakesABatchAtATime) {
  options.batchSize = 2;
  openWatched();
  putMany(5);
  store->clear(onSuccess(), onError());
  for (const std::size_t left : {3U, 1U, 0U}) {
    EXPECT_EQ(work().runAll(), 1U);
    EXPECT_EQ(medium->rows().size(), left);
    EXPECT_EQ(file().runAll(), 1U);
    EXPECT_EQ(valueFiles().size(), left);
    EXPECT_EQ(ending, "");
  }
  settle();
  EXPECT_EQ(ending, "<done>");
}

TEST_F(PersistentKeyValueStoreClearing, TakesWhatWasStoredBeforeItAndIsStillOnItsWay) {
  open();
  put("old", "value");
  const Written first = watch(store->store("new", bytesOf("1")));
  const Written overwrite = watch(store->store("old", bytesOf("2")));
  store->clear(onSuccess(), onError());
  work().runAll();
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(overwrite), "<done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, LeavesWhatIsStoredAfterIt) {
  open();
  put("old", "value");
  put("kept", "old value");
  store->clear(onSuccess(), onError());
  watch(store->store("kept", bytesOf("new")));
  watch(store->store("empty", bytesOf("")));
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), (Contents{{"kept", "new"}, {"empty", ""}}));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"kept", "new"}, {"empty", ""}}));
}

TEST_F(PersistentKeyValueStoreClearing, LeavesWhatIsStoredBetweenItsBatches) {
  options.batchSize = 1;
  open();
  putMany(4);
  store->clear(onSuccess(), onError());
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(store->getAllKeys().size(), 3U);
  for (int i = 0; i < 4; ++i) watch(store->store("key" + std::to_string(i), bytesOf("new")));
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), (Contents{{"key0", "new"}, {"key1", "new"}, {"key2", "new"}, {"key3", "new"}}));
}

TEST_F(PersistentKeyValueStoreClearing, TellsThatTheQueueTakesItsNextBatchNoMore) {
  options.batchSize = 1;
  open();
  putMany(3);
  store->clear(onSuccess(), onError());
  work().runAll();
  work().throwOnDispatch(true);
  file().runAll();
  work().throwOnDispatch(false);
  settle();
  EXPECT_EQ(ending, "<error> The queue takes no tasks.");
}

TEST_F(PersistentKeyValueStoreClearing, TwiceAtOnceSucceedsTwice) {
  options.batchSize = 1;
  open();
  putMany(5);
  store->clear(onSuccess(), onError());
  store->clear(onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<done><done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, AgainTakesWhatTheFirstOneLeft) {
  options.batchSize = 1;
  open();
  putMany(3);
  store->clear(onSuccess(), onError());
  ASSERT_TRUE(work().runNext());
  watch(store->store("between", bytesOf("new")));
  store->clear(onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<done><done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, OfInlineItemsDeletesNoFile) {
  options.inlineData = true;
  openWatched();
  put("key", "value");
  put("empty", "");
  directory.write("store/key", "a file that is not the store's");
  files->clearTrace();
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(keysInMedium(), IsEmpty());
  EXPECT_THAT(files->trace(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, LoadsTheManifestWhenThatHasNotBeenDone) {
  open();
  put("key", "value");
  close();
  openUnloaded();
  work().dropAll();
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, TellsWhenTheManifestFails) {
  openWatched();
  put("key", "value");
  manifest->failNext(ManifestCall::PruneToSize, unwritable);
  EXPECT_EQ(clear(), std::string("<error> ") + unwritable.what());
  EXPECT_EQ(get("key"), "value");
  EXPECT_EQ(clear(), "<done>");
}

TEST_F(PersistentKeyValueStoreClearing, DeletesTheFilesOfThoseThatWentBeforeTheManifestFailed) {
  openWatched();
  for (const char* key : {"a", "b", "c"}) put(key, "");
  int removals = 0;
  manifest->onCall = [&](ManifestCall call, const std::string&) {
    if (call == ManifestCall::RemoveItem && ++removals == 2) throw unwritable;
  };
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(keysInMedium(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearing, WithoutCallbacksClears) {
  openWatched();
  put("key", "value");
  store->clear(nullptr, nullptr);
  settle();
  EXPECT_THAT(keysInMedium(), IsEmpty());
  manifest->failNext(ManifestCall::PruneToSize, unwritable);
  put("key", "value");
  store->clear(nullptr, nullptr);
  settle();
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreClearing, OfAnInvalidatedStoreIsRefused) {
  open();
  put("key", "value");
  watch(store->invalidateWithFuture());
  EXPECT_EQ(clear(), "<error> " + kInvalid);
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

// A clear takes the records batch by batch, but a write on its way is called off at once: its record must not stand
// there without a file until its batch comes.
class PersistentKeyValueStoreClearingInBatches : public PersistentKeyValueStoreClearing {
 protected:
  void SetUp() override {
    options.batchSize = 1;
    open();
    putMany(2);
    clock.advance(1);
    const Written queued = watch(store->store("queued", bytesOf("value")));
    ASSERT_TRUE(work().runNext());
    store->clear(onSuccess(), onError());
    ASSERT_TRUE(work().runNext());  // the first batch
    file().runAll();                // the write comes by, and finds that it has been called off
    ASSERT_EQ(told(queued), "<done>");
    ASSERT_EQ(ending, "");
  }
};

TEST_F(PersistentKeyValueStoreClearingInBatches, LetsAKeyBeRemovedMeanwhile) {
  EXPECT_EQ(drop("queued"), "<done>");
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(store->getAllKeys(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreClearingInBatches, LetsAWriteThatWasCalledOffBeAMiss) {
  EXPECT_EQ(store->fetchModificationDate("queued"), std::nullopt);
  EXPECT_EQ(get("queued"), "<miss>");
  EXPECT_EQ(ending, "<done>");
}

TEST_F(PersistentKeyValueStoreClearingInBatches, LeavesNoRecordWithoutAFileToAProcessThatIsKilledMeanwhile) {
  for (const std::string& key : store->getAllKeys()) EXPECT_TRUE(directory.exists("store/" + key)) << key;
}

// --- Deleting in batches ---

TEST_F(PersistentKeyValueStoreDeletingInBatches, DeletesBatchAfterBatchOnTheQueuesOfEach) {
  open();
  for (const char* name : {"a", "b", "c"}) directory.write(std::string("store/") + name, "x");
  store->deleteFilesInBatches(yielding({{itemOf("a"), itemOf("b")}, {itemOf("c")}}), onSuccess(), onError());
  EXPECT_THAT(valueFiles(), ElementsAre("a", "b", "c"));
  ASSERT_TRUE(work().runNext());
  EXPECT_THAT(valueFiles(), ElementsAre("a", "b", "c"));
  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(valueFiles(), ElementsAre("c"));
  ASSERT_TRUE(work().runNext());
  ASSERT_TRUE(file().runNext());
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_EQ(ending, "");
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(ending, "<done>");
  settle();
  EXPECT_THAT(sizes, ElementsAre(0U));
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, SkipsInlineItems) {
  open();
  for (const char* name : {"a", "b"}) directory.write(std::string("store/") + name, "x");
  store->deleteFilesInBatches(yielding({{itemOf("a", true), itemOf("b")}, {itemOf("a", true)}}), onSuccess(),
                              onError());
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(valueFiles(), ElementsAre("a"));
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, LogsAFileThatCannotBeDeletedAndGoesOn) {
  open();
  for (const char* name : {"a", "c"}) directory.write(std::string("store/") + name, "x");
  const LogCapture log;
  store->deleteFilesInBatches(yielding({{itemOf("a"), itemOf("gone"), itemOf("c")}}), onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  ASSERT_THAT(errorLines(log),
              ElementsAre(testing::StartsWith("Failed to delete file at \"" + pathOf("gone") + "\" domain: ")));
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, EndsWithAnyOtherFailureAfterTheFilesBefore) {
  open();
  for (const char* name : {"a", "b", "c"}) directory.write(std::string("store/") + name, "x");
  files->onCall = [this](Operation operation, const std::string& path) {
    if (operation == Operation::DeleteFile && path == pathOf("b")) throw std::runtime_error("No more.");
  };
  const LogCapture log;
  store->deleteFilesInBatches(yielding({{itemOf("a"), itemOf("b"), itemOf("c")}, {itemOf("c")}}), onSuccess(),
                              onError());
  work().runAll();
  file().runAll();
  EXPECT_EQ(ending, "");  // told on the work queue
  settle();
  EXPECT_EQ(ending, "<error> No more.");
  EXPECT_THAT(valueFiles(), ElementsAre("b", "c"));
  EXPECT_THAT(errorLines(log), IsEmpty());
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, EndsWithWhatTheProviderThrows) {
  open();
  store->deleteFilesInBatches([]() -> const Batch { throw std::out_of_range("No batch."); }, onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<error> No batch.");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, EndsWithAnErrorWhenTheFileQueueDropsABatch) {
  open();
  store->deleteFilesInBatches(yielding({{itemOf("a")}}), onSuccess(), onError());
  work().runAll();
  file().dropAll();
  EXPECT_EQ(ending, "");
  settle();
  EXPECT_THAT(ending, testing::StartsWith("<error> "));
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, EndsWithAnErrorWhenTheFileQueueTakesNone) {
  open();
  file().throwOnDispatch(true);
  store->deleteFilesInBatches(yielding({{itemOf("a")}}), onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<error> The queue takes no tasks.");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, LetsProviderAndCallbacksCallTheStoreAgain) {
  open();
  put("key", "value");
  Batch batch = {itemOf("key")};
  int rounds = 0;
  std::function<void()> again = [&] {
    store->overrideConfiguration(77);
    store->scheduleStaleRemoval(5);
    watch(store->store("after", bytesOf("1")));
    store->handleCorruptedManifest(corrupted);
    if (++rounds < 3) store->deleteFilesInBatches(yielding({}), again, nullptr);
  };
  const Provider provider = [&]() -> const Batch {
    store->overrideConfiguration(78);
    store->reportSize();
    store->startStaleItemRemoval();
    const Batch now = std::exchange(batch, {});
    if (now.empty()) store->clear(nullptr, nullptr);
    return now;
  };
  const LogCapture log;
  store->deleteFilesInBatches(provider, again, onError());
  settle();
  EXPECT_EQ(rounds, 3);
  EXPECT_EQ(ending, "");
  EXPECT_EQ(get("after"), "1");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, LetsAnErrorCallbackCallTheStoreAgain) {
  open();
  store->deleteFilesInBatches([]() -> const Batch { throw std::runtime_error("No batch."); }, nullptr,
                              [&](const std::exception&) {
                                store->overrideConfiguration(1);
                                store->handleCorruptedManifest(corrupted);
                                store->clear(onSuccess(), onError());
                              });
  settle();
  EXPECT_EQ(ending, "<done>");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, WhoseStoreGoesCallsNothing) {
  open();
  directory.write("store/a", "x");
  bool asked = false;
  store->deleteFilesInBatches(
      [&]() -> const Batch {
        asked = true;
        return {};
      },
      onSuccess(), onError());
  store.reset();
  settle();
  EXPECT_FALSE(asked);
  EXPECT_EQ(ending, "");
  open();
  store->deleteFilesInBatches(yielding({{itemOf("a")}}), onSuccess(), onError());
  ASSERT_TRUE(work().runNext());
  store.reset();
  settle();
  EXPECT_EQ(ending, "");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, OneBatchIsDeletedInOrderOnTheFileQueue) {
  open();
  for (const char* name : {"a", "b"}) directory.write(std::string("store/") + name, "x");
  files->clearTrace();
  const Written deleted = watch(store->deleteBatch({pathOf("b"), pathOf("a")}));
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_EQ(file().runAll(), 1U);
  EXPECT_THAT(files->trace(), ElementsAre("deleteFile " + pathOf("b"), "deleteFile " + pathOf("a")));
  EXPECT_EQ(told(deleted), "<done>");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, AnEmptyBatchIsDoneWhenTheFileQueueHasGotSoFar) {
  open();
  const Written deleted = watch(store->deleteBatch({}));
  EXPECT_TRUE(deleted->isPending());
  settle();
  EXPECT_EQ(told(deleted), "<done>");
}

TEST_F(PersistentKeyValueStoreDeletingInBatches, OneBatchThatTheQueueDoesNotTakeIsAFailedFuture) {
  open();
  file().throwOnDispatch(true);
  EXPECT_EQ(told(watch(store->deleteBatch({pathOf("a")}))), "<error> The queue takes no tasks.");
}

// --- Size report ---

TEST_F(PersistentKeyValueStoreSizeReport, ComesAfterEachWriteAndEachDeletionRunAndNeverInBetween) {
  open();
  put("a", "12345");
  put("b", "123");
  EXPECT_EQ(get("a"), "12345");
  EXPECT_EQ(drop("missing"), "<done>");
  EXPECT_THAT(sizes, ElementsAre(5U, 8U));
  EXPECT_EQ(clear(), "<done>");
  EXPECT_THAT(sizes, ElementsAre(5U, 8U, 0U));
}

TEST_F(PersistentKeyValueStoreSizeReport, TellsTheSizeOfTheMomentItWasAskedFor) {
  open();
  watch(store->store("a", bytesOf("12345")));
  work().runAll();
  file().runAll();
  watch(store->store("b", bytesOf("123")));
  settle();
  EXPECT_THAT(sizes, ElementsAre(5U, 8U));
}

TEST_F(PersistentKeyValueStoreSizeReport, IsSilentBeforeLoading) {
  openUnloaded();
  work().dropAll();
  store->reportSize();
  settle();
  EXPECT_THAT(sizes, IsEmpty());
}

TEST_F(PersistentKeyValueStoreSizeReport, MayCallTheStoreAgain) {
  int calls = 0;
  options.onSizeChanged = [&](unsigned int) {
    if (++calls > 3) return;
    store->overrideConfiguration(5);
    store->reportSize();
    watch(store->store("key" + std::to_string(calls), bytesOf("1")));
  };
  open();
  put("key", "value");
  EXPECT_GT(calls, 3);
  EXPECT_EQ(get("key1"), "1");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
