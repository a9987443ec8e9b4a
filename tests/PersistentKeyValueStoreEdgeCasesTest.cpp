// What a key-value store does with keys that are no file names, when it goes while work waits, and on queues that fail.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstddef>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::isA;
using test::KeyValueStoreFixture;
using test::kSecond;
using test::ManifestCall;
using test::ManualExecutor;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;

using Loader = PersistentKeyValueStore::Loader;

class PersistentKeyValueStoreReservedKeys : public KeyValueStoreFixture {};
class PersistentKeyValueStoreHostileKeys : public KeyValueStoreFixture {};
class PersistentKeyValueStoreGone : public KeyValueStoreFixture {};
class PersistentKeyValueStoreFailingQueue : public KeyValueStoreFixture {};

// --- Reserved keys ---

TEST_F(PersistentKeyValueStoreReservedKeys, FailEveryOperationOfAStoreWithFilesAndTouchNothing) {
  open();
  put("key", "value");
  const std::string before = directory.read("store/manifest_v1.sqlite");
  const std::vector<std::string> reserved = {"manifest_v1.sqlite",
                                             "manifest_v1.sqlite-journal",
                                             "manifest_v1.sqlite-wal",
                                             "manifest_v1.sqlite-shm",
                                             "_cellar_extended_attributes",
                                             "./manifest_v1.sqlite",
                                             "below/..//_cellar_extended_attributes"};
  files->clearTrace();
  for (const std::string& key : reserved) {
    const std::string message = "Key '" + key + "' is reserved.";
    const std::vector<Written> written = {watch(store->store(key, bytesOf("x"))),
                                          watch(store->store(key, nullptr, writing("x", 1))),
                                          watch(store->removeItem(key)), watch(store->updateLastAccessDate(key))};
    const std::vector<Fetched> fetched = {
        watch(store->fetch(key)), watch(store->fetch(key, [](const std::string&) { return Bytes(); })),
        watch(store->fetch(key, answering("x"))), watch(store->fetchFirst({"key", key}, answering("x")))};
    settle();
    for (const Written& outcome : written) {
      EXPECT_EQ(told(outcome), "<error> " + message);
      EXPECT_TRUE(isA<std::invalid_argument>(outcome->failure));
    }
    for (const Fetched& outcome : fetched) {
      EXPECT_EQ(told(outcome), "<error> " + message);
      EXPECT_TRUE(isA<std::invalid_argument>(outcome->failure));
    }
    try {
      store->fetchModificationDate(key);
      FAIL() << key;
    } catch (const std::invalid_argument& error) {
      EXPECT_EQ(error.what(), message);
    }
  }
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_EQ(directory.read("store/manifest_v1.sqlite"), before);
  EXPECT_THAT(accesses(), IsEmpty());
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
}

TEST_F(PersistentKeyValueStoreReservedKeys, AreThoseNamesAloneAndNotTheirNeighbours) {
  open();
  for (const std::string key : {"manifest_v1.sqlit", "manifest_v1.sqlite-", "manifest_v1.sqlite-walnut",
                                "Manifest_v1.sqlite", "_cellar_extended_attribute"}) {
    put(key, "value");
    EXPECT_EQ(get(key), "value") << key;
  }
}

// --- Hostile keys ---

TEST_F(PersistentKeyValueStoreHostileKeys, ThatNameADirectoryFailAndLeaveNothing) {
  open();
  directory.write("store/sub/file", "kept");
  for (const std::string key : {"", ".", "..", "sub", "sub/"}) {
    const Written written = watch(store->store(key, bytesOf("value")));
    settle();
    EXPECT_TRUE(isA<FileUtilsIoException>(written->failure)) << key << told(written);
    EXPECT_EQ(get(key), "<miss>") << key;
    EXPECT_EQ(drop(key), "<done>") << key;
  }
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  EXPECT_EQ(directory.read("store/sub/file"), "kept");
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreHostileKeys, WithASlashAddressFilesBelow) {
  open();
  const Written refused = watch(store->store("a/b", bytesOf("value")));
  settle();
  EXPECT_TRUE(isA<FileUtilsIoException>(refused->failure)) << told(refused);
  EXPECT_EQ(get("a/b"), "<miss>");
  directory.makeDirectory("store/a");
  put("a/b", "value");
  EXPECT_EQ(directory.read("store/a/b"), "value");
  EXPECT_EQ(get("a/b"), "value");
  EXPECT_EQ(drop("a/b"), "<done>");
  EXPECT_FALSE(directory.exists("store/a/b"));
}

TEST_F(PersistentKeyValueStoreHostileKeys, WithTwoDotsReachOutsideTheStore) {
  open();
  directory.write("neighbour/secret", "value");
  put("../neighbour/secret", "replaced");
  EXPECT_EQ(directory.read("neighbour/secret"), "replaced");
  EXPECT_EQ(drop("../neighbour/secret"), "<done>");
  EXPECT_FALSE(directory.exists("neighbour/secret"));
}

TEST_F(PersistentKeyValueStoreHostileKeys, ThatAreTooLongForAFileNameFailAndTheLongestWorks) {
  open();
  const std::string longest(255, 'x');
  put(longest, "value");
  EXPECT_EQ(get(longest), "value");
  for (const std::size_t length : {256U, 100'000U}) {
    const std::string key(length, 'y');
    const Written written = watch(store->store(key, bytesOf("value")));
    settle();
    EXPECT_TRUE(isA<FileUtilsIoException>(written->failure)) << told(written);
    EXPECT_EQ(get(key), "<miss>");
  }
  EXPECT_EQ(rowsOnDisk().size(), 1U);
}

TEST_F(PersistentKeyValueStoreHostileKeys, ThatAreNotUtf8Work) {
  open();
  const std::string key = "\xff\xfe\x80'; DROP TABLE LarderManifest; --%s\n";
  put(key, "value");
  reopen();
  EXPECT_EQ(get(key), "value");
  EXPECT_EQ(accesses().size(), 1U);
  EXPECT_EQ(drop(key), "<done>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreHostileKeys, WithAZeroByteLeaveOtherKeysAndTheManifestAlone) {
  open();
  put("a", "1");
  watch(store->store(std::string("a\0b", 3), bytesOf("other")));
  settle();
  EXPECT_EQ(get("a"), "1");
  watch(store->store(std::string("manifest_v1.sqlite\0", 19), bytesOf("other")));
  settle();
  reopen();
  EXPECT_EQ(get("a"), "1");
}

// --- A store that has gone ---

TEST_F(PersistentKeyValueStoreGone, FulfilsWhatWaitsOnItsWorkQueueAndDoesNothing) {
  openWatched();
  put("key", "value");
  manifest->clearTrace();
  files->clearTrace();
  const std::vector<Written> written = {watch(store->store("new", bytesOf("x"))),
                                        watch(store->store("newer", nullptr, writing("x", 1))),
                                        watch(store->removeItem("key")), watch(store->updateLastAccessDate("key"))};
  const std::vector<Fetched> fetched = {watch(store->fetch("key")), watch(store->fetchFirst({"key"}, answering("x")))};
  store.reset();
  settle();
  for (const Written& outcome : written) EXPECT_EQ(told(outcome), "<done>");
  for (const Fetched& outcome : fetched) EXPECT_EQ(told(outcome), "<miss>");
  EXPECT_THAT(manifest->trace(), IsEmpty());
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_THAT(accesses(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreGone, FulfilsInlineWritesAndWritesNothing) {
  options.inlineData = true;
  openWatched();
  const Written written = watch(store->store("key", bytesOf("x")));
  store.reset();
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(keysInMedium(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreGone, LeavesNoProvisionalRecordOfAWriteThatHasNotBegun) {
  open();
  bool called = false;
  const Written written = watch(store->store("key", nullptr, [&](const std::string&) {
    called = true;
    return 1U;
  }));
  ASSERT_TRUE(work().runNext());
  EXPECT_EQ(rowsOnDisk().size(), 1U);
  store.reset();
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_FALSE(called);
}

TEST_F(PersistentKeyValueStoreGone, AnswersAFetchThatWaitsForItsFileWithNothing) {
  open();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  ASSERT_TRUE(work().runNext());
  files->clearTrace();
  store.reset();
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_THAT(files->trace(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreGone, IsKeptAliveByATaskThatRuns) {
  open();
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    store.reset();
    files->writeFile(path, bytesOf("value"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  open();
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreGone, LoadsNothingAndTellsNoSize) {
  openWatchedUnloaded();
  store.reset();
  settle();
  EXPECT_EQ(manifest->calls(ManifestCall::Load), 0U);
  openWatched();
  watch(store->store("key", bytesOf("value")));
  ASSERT_TRUE(work().runNext());
  ASSERT_TRUE(file().runNext());
  store.reset();
  settle();
  EXPECT_THAT(sizes, IsEmpty());
}

TEST_F(PersistentKeyValueStoreGone, CancelsItsTimer) {
  openWatched();
  ManualExecutor& queue = work();
  EXPECT_THAT(queue.armedDelays(), ElementsAre(300 * kSecond));
  store.reset();
  EXPECT_THAT(queue.armedDelays(), IsEmpty());
}

// --- Queues that fail ---

TEST_F(PersistentKeyValueStoreFailingQueue, ThatDropsItsTasksBreaksTheirPromises) {
  open();
  put("key", "value");
  const std::vector<Written> written = {watch(store->store("new", bytesOf("x"))), watch(store->removeItem("key")),
                                        watch(store->updateLastAccessDate("key"))};
  const Fetched fetched = watch(store->fetch("key"));
  work().dropAll();
  for (const Written& outcome : written) {
    EXPECT_TRUE(isA<std::future_error>(outcome->failure)) << told(outcome);
    EXPECT_EQ(outcome->completions, 1);
  }
  EXPECT_TRUE(isA<std::future_error>(fetched->failure)) << told(fetched);
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatDropsTheReadingBreaksTheFetch) {
  open();
  put("key", "value");
  const Fetched fetched = watch(store->fetch("key"));
  ASSERT_TRUE(work().runNext());
  file().dropAll();
  EXPECT_TRUE(isA<std::future_error>(fetched->failure)) << told(fetched);
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatDropsAWriteLeavesNoRecordWithoutAFile) {
  open();
  const Written written = watch(store->store("key", bytesOf("value")));
  ASSERT_TRUE(work().runNext());
  file().dropAll();
  EXPECT_TRUE(isA<std::future_error>(written->failure)) << told(written);
  reopen();
  EXPECT_EQ(get("key"), "<miss>");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatDroppedAWriteOnceDoesNotCostALaterValueOfTheKey) {
  open();
  watch(store->store("key", bytesOf("first")));
  ASSERT_TRUE(work().runNext());
  file().dropAll();
  put("key", "second");
  reopen();
  EXPECT_EQ(get("key"), "second");
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatDroppedAWriteOnceDoesNotKeepALaterRemovalFromTheFile) {
  open();
  watch(store->store("key", bytesOf("first")));
  ASSERT_TRUE(work().runNext());
  file().dropAll();
  put("key", "second");
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatTakesNoWorkFailsTheFuturesAndThrowsNothing) {
  open();
  put("key", "value");
  work().throwOnDispatch(true);
  const std::vector<Written> written = {watch(store->store("new", bytesOf("x"))),
                                        watch(store->store("new", nullptr, writing("x", 1))),
                                        watch(store->removeItem("key")), watch(store->updateLastAccessDate("key"))};
  const Fetched fetched = watch(store->fetch("key"));
  for (const Written& outcome : written) EXPECT_EQ(told(outcome), "<error> The queue takes no tasks.");
  EXPECT_EQ(told(fetched), "<error> The queue takes no tasks.");
  work().throwOnDispatch(false);
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatTakesNoFileWorkFailsAFirstWriteAndLeavesAMiss) {
  open();
  file().throwOnDispatch(true);
  const Written written = watch(store->store("key", bytesOf("x")));
  work().runAll();
  file().throwOnDispatch(false);
  EXPECT_EQ(told(written), "<error> The queue takes no tasks.");
  EXPECT_THAT(rowsOnDisk(), IsEmpty());
  put("key", "value");
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatTakesNoFileWorkFailsAnOverwriteAndLeavesNoFileWithoutARecord) {
  open();
  put("key", "old");
  file().throwOnDispatch(true);
  const Written written = watch(store->store("key", bytesOf("new")));
  work().runAll();
  file().throwOnDispatch(false);
  EXPECT_EQ(told(written), "<error> The queue takes no tasks.");
  EXPECT_EQ(valueFiles().size(), rowsOnDisk().size());
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatTakesNoFileWorkFailsTheFetch) {
  open();
  put("key", "value");
  file().throwOnDispatch(true);
  const Fetched fetched = watch(store->fetch("key"));
  work().runAll();
  file().throwOnDispatch(false);
  EXPECT_EQ(told(fetched), "<error> The queue takes no tasks.");
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreFailingQueue, ThatTakesNoEvictionLeavesNoFileWithoutARecord) {
  options.capacity = 1;
  open();
  put("old", "value");
  file().throwOnDispatch(true);
  const Written written = watch(store->store("new", bytesOf("x")));
  work().runAll();
  file().throwOnDispatch(false);
  EXPECT_EQ(told(written), "<error> The queue takes no tasks.");
  EXPECT_EQ(valueFiles().size(), rowsOnDisk().size());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
