// File writes that come while another thread is busy with the manifest: the task of the first goes on to the files of
// the next ones, and then all their records are written under one lock. Whatever stands between, each of them ends as
// it would by itself.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <exception>
#include <functional>
#include <future>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::KeyValueStoreFixture;
using test::Latch;
using test::ManifestCall;
using test::Operation;
using test::runOnThreads;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;

class PersistentKeyValueStoreWrittenTogether : public KeyValueStoreFixture {
 protected:
  void SetUp() override {
    openWatched();
    manifest->onCall = [this](ManifestCall call, const std::string& text) {
      if (call == ManifestCall::SetItem) settings.push_back(text);
      if (text != "updateLastAccessDate busy") return;
      isBusy.countDown();
      mayGoOn.wait();
    };
    files->onCall = [this](Operation operation, const std::string& path) {
      if (operation != Operation::WriteFile) return;
      written.push_back(path.substr(path.rfind('/') + 1));
      if (written.back() == "two") mayGoOn.countDown();
      if (onWrite) onWrite(written.back());
    };
  }

  void TearDown() override { files->onCall = nullptr; }

  // Stores the key as its own value; the file of "two" frees the manifest. So it has to be among those that are written
  // meanwhile, or the test stands still.
  Written write(const std::string& key) { return watch(store->store(key, bytesOf(key))); }

  // All of the work, and then the file queue's first task, at whose time another thread is in the manifest. An
  // exception that leaves the task is thrown again in the end.
  void runFirstOfFiles() {
    work().runAll();
    settings.clear();
    written.clear();
    const Written busy = watch(store->updateLastAccessDate("busy"));
    std::thread other([this] { work().runNext(); });
    isBusy.wait();
    std::exception_ptr failure;
    try {
      file().runNext();
    } catch (...) {
      failure = std::current_exception();
    }
    other.join();
    EXPECT_EQ(told(busy), "<done>");
    if (failure != nullptr) std::rethrow_exception(failure);
  }

  std::vector<std::string> written;   // the keys whose files have been written
  std::vector<std::string> settings;  // of records
  std::function<void(const std::string& key)> onWrite;
  Latch isBusy{1};
  Latch mayGoOn{1};
};

TEST_F(PersistentKeyValueStoreWrittenTogether, TheFilesComeFirstAndThenTheRecordsEachOnce) {
  const Written one = write("one");
  const Written two = write("two");
  const Written three = write("three");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two", "three"));
  EXPECT_THAT(settings, ElementsAre("setItem one 3", "setItem two 3", "setItem three 5"));
  EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(told(three), "<done>");
  EXPECT_EQ(file().pending(), 2U);
  settle();
  EXPECT_EQ(written.size(), 3U);
  EXPECT_EQ(settings.size(), 3U);
  EXPECT_THAT(sizes, ElementsAre(3U, 6U, 11U));
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}, {"three", "three"}}));
  EXPECT_EQ(store->operationCounts().stores, 3U);
}

TEST_F(PersistentKeyValueStoreWrittenTogether, AloneWithTheManifestEachTaskWritesItsOwn) {
  write("one");
  const Written two = write("two");
  work().runAll();
  file().runNext();
  EXPECT_THAT(written, ElementsAre("one"));
  EXPECT_EQ(told(two), "<pending>");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotMoreThanThirtyTwo) {
  write("one");
  write("two");
  for (int number = 3; number <= 40; ++number) write("key" + std::to_string(number));
  runFirstOfFiles();
  EXPECT_EQ(written.size(), 32U);
  EXPECT_TRUE(file().runNext());
  EXPECT_EQ(written.size(), 32U);
  settle();
  EXPECT_EQ(written.size(), 40U);
  EXPECT_EQ(store->getAllKeys().size(), 40U);
  EXPECT_EQ(sizes.size(), 40U);
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NoMoreAfterAMebibyte) {
  const Written one = watch(store->store("one", nullptr, writing("one", (1 << 20) - 3)));
  const Written two = write("two");
  const Written three = write("three");
  runFirstOfFiles();
  EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(told(three), "<pending>");
  settle();
  EXPECT_EQ(told(three), "<done>");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotTwoOfOneKey) {
  write("one");
  write("two");
  const Written first = watch(store->store("key", bytesOf("first")));
  const Written second = watch(store->store("key", bytesOf("second")));
  runFirstOfFiles();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(valueFile("key"), "first");
  EXPECT_EQ(told(second), "<pending>");
  settle();
  EXPECT_EQ(get("key"), "second");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotPastAFetch) {
  put("key", "old");
  write("one");
  write("two");
  const Fetched between = watch(store->fetch("key"));
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two"));
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(told(between), "old");
  EXPECT_EQ(get("key"), "key");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, AFetchOfNothingStandsInNobodysWay) {
  write("one");
  const Fetched between = watch(store->fetch("nothing"));
  write("two");
  runFirstOfFiles();
  EXPECT_EQ(told(between), "<miss>");
  EXPECT_THAT(written, ElementsAre("one", "two"));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotPastTheRemovalOfAWrite) {
  write("one");
  write("two");
  const Written called = write("key");
  const Written removed = watch(store->removeItem("key"));
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two"));
  EXPECT_EQ(told(called), "<done>");
  EXPECT_EQ(told(removed), "<pending>");
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(get("key"), "key");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotPastTheDeletionOfStaleFiles) {
  put("key", "old");
  clock.advance(2000);
  write("one");
  write("two");
  work().runAll();
  store->startStaleItemRemoval();
  work().runAll();
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two"));
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(get("key"), "key");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotPastADeletionThatSomebodyElseProvides) {
  put("key", "old");
  write("one");
  write("two");
  work().runAll();
  bool isTaken = false;
  const auto takeOnce = [&]() -> std::vector<DiskCacheItem> {
    if (std::exchange(isTaken, true)) return {};
    const auto item = manifest->getItem("key");
    manifest->removeItem("key");
    return {*item};
  };
  store->deleteFilesInBatches(takeOnce, onSuccess(), onError());
  EXPECT_TRUE(work().runNext());
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two"));
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(get("key"), "key");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotPastTheDeletionOfABatch) {
  put("key", "old");
  write("one");
  write("two");
  work().runAll();
  const Written deleted = watch(store->deleteBatch({pathOf("key")}));
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two"));
  EXPECT_EQ(told(deleted), "<pending>");
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(told(deleted), "<done>");
  EXPECT_EQ(get("key"), "key");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, NotPastAnEviction) {
  close();
  options.capacity = 3;
  SetUp();
  put("key", "old");
  clock.advance(1);
  write("one");
  write("two");
  work().runAll();
  write("three");  // evicts "key"
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("two"));  // the last has evicted "one"
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(contents(), (Contents{{"two", "two"}, {"three", "three"}, {"key", "key"}}));
  EXPECT_EQ(valueFiles().size(), 3U);
}

// It may take its time, or wait for what was stored before.
TEST_F(PersistentKeyValueStoreWrittenTogether, NotByAWriterOfTheHosts) {
  const Written one = write("one");
  write("two");
  bool isOneThere = false;
  const Written host = watch(store->store("key", nullptr, [&](const std::string& path) {
    isOneThere = told(one) == "<done>";
    files->writeFile(path, bytesOf("value"));
    return 5U;
  }));
  runFirstOfFiles();
  EXPECT_THAT(written, ElementsAre("one", "two"));
  EXPECT_EQ(told(host), "<pending>");
  settle();
  EXPECT_TRUE(isOneThere);
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, AFileThatCannotBeWrittenFailsAlone) {
  write("one");
  write("two");
  const Written failed = write("key");
  const Written last = write("last");
  files->tearFailingWrites(true);
  files->failPath(Operation::WriteFile, pathOf("key"), ENOSPC);
  runFirstOfFiles();
  EXPECT_NE(failed->failure, nullptr);
  EXPECT_EQ(told(last), "<done>");
  settle();
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}, {"last", "last"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("last", "one", "two"));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, ACallbackThatThrowsHarmsNoOther) {
  store->store("one", bytesOf("one")).then(nullptr, [](std::future<void>&) {
    throw std::runtime_error("The callback gave up.");
  });
  const Written two = write("two");
  const Written called = write("key");
  const Written last = write("last");
  onWrite = [&](const std::string& key) {
    if (key == "key") watch(store->removeItem("key"));
    if (key == "last") work().runNext();
  };
  EXPECT_THROW(runFirstOfFiles(), std::runtime_error);
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(told(called), "<done>");
  EXPECT_EQ(told(last), "<done>");
  settle();
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}, {"last", "last"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("last", "one", "two"));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, AReportThatFindsNoQueueFailsItsWrite) {
  const Written one = write("one");
  const Written two = write("two");
  work().runAll();
  manifest->onCall = [this](ManifestCall, const std::string& text) {
    if (text == "setItem two 3") work().throwOnDispatch(true);
    if (text != "updateLastAccessDate busy") return;
    isBusy.countDown();
    mayGoOn.wait();
  };
  runFirstOfFiles();
  work().throwOnDispatch(false);
  EXPECT_NE(one->failure, nullptr);
  EXPECT_NE(two->failure, nullptr);
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}}));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, ARemovalWhileTheFilesAreWrittenTakesThemAway) {
  write("one");
  write("two");
  Written removed;
  onWrite = [&](const std::string& key) {
    if (key == "key") removed = watch(store->removeItem("key"));
  };
  const Written stored = write("key");
  runFirstOfFiles();
  settle();
  EXPECT_EQ(told(stored), "<done>");
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("one", "two"));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, ARecordThatCannotBeWrittenPurgesTheStoreAndAllThatWereOnTheirWay) {
  const Written one = write("one");
  const Written two = write("two");
  const Written three = write("three");
  work().runAll();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  manifest->failNext(ManifestCall::SetItem, unwritable);  // by itself, too
  runFirstOfFiles();
  settle();
  EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(told(three), "<done>");
  EXPECT_EQ(sizes.back(), 0U);
  EXPECT_THAT(contents(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
  put("key", "value");
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, TheStoreMayGoBeforeTheTasksThatHaveNothingLeftToDo) {
  write("one");
  const Written two = write("two");
  runFirstOfFiles();
  work().runAll();
  store.reset();
  EXPECT_EQ(file().runAll(), 1U);
  EXPECT_EQ(told(two), "<done>");
}

TEST_F(PersistentKeyValueStoreWrittenTogether, AQueueMayDropTheTasksThatHaveNothingLeftToDo) {
  write("one");
  const Written two = write("two");
  runFirstOfFiles();
  file().dropAll();
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}}));
}

// The file queue refuses the task of a write that an earlier one's task has begun, and ended, meanwhile.
TEST_F(PersistentKeyValueStoreWrittenTogether, AWriteThatIsDoneStaysDoneThoughItsOwnTaskIsRefused) {
  Latch isAtTwo(1);
  Latch threeIsBegun(1);
  write("one");
  write("two");
  onWrite = [&](const std::string& key) {
    if (key != "two") return;
    isAtTwo.countDown();
    threeIsBegun.wait();
  };
  work().runAll();
  watch(store->updateLastAccessDate("busy"));
  std::thread other([this] { work().runNext(); });
  isBusy.wait();
  std::thread writer([this] { file().runNext(); });
  isAtTwo.wait();
  other.join();
  const Written three = write("three");
  file().onDispatch = [&] {
    threeIsBegun.countDown();
    writer.join();
    file().dropAll();
    throw std::runtime_error("The queue takes no tasks.");
  };
  EXPECT_NO_THROW(work().runNext());
  file().onDispatch = nullptr;
  EXPECT_THAT(written, ElementsAre("one", "two", "three"));
  EXPECT_EQ(told(three), "<done>");
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}, {"three", "three"}}));
}

TEST_F(PersistentKeyValueStoreWrittenTogether, TheNextWriteMayHaveBeenDropped) {
  write("one");
  write("two");
  const Written dropped = watch(store->store("key", bytesOf("value")));
  work().runAll();
  file().dropAll();
  EXPECT_EQ(dropped->completions, 1);
  EXPECT_THAT(contents(), IsEmpty());
  write("one");
  write("two");
  runFirstOfFiles();
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}}));
}

// Whoever lets go of a write last takes it back, and that may be who begins the next one just now.
TEST_F(PersistentKeyValueStoreWrittenTogether, AWriteMayBeDroppedWhileTheNextBegins) {
  std::atomic<bool> begins{false};
  manifest->onCall = [&](ManifestCall, const std::string& text) { begins = begins || text == "setItem two 0"; };
  for (int round = 0; round < 1000; ++round) {
    const Written dropped = write("one");
    work().runAll();
    const Written next = write("two");
    begins = false;
    runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) return static_cast<void>(work().runAll());
      while (!begins) std::this_thread::yield();
      for (int i = 0; i < round; ++i) begins = true;  // a little later each time
      file().dropAll();
    });
    file().dropAll();
    EXPECT_EQ(dropped->completions, 1);
    EXPECT_EQ(next->completions, 1);
  }
  EXPECT_THAT(contents(), IsEmpty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
