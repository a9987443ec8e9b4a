// File writes that come while another thread is busy with the manifest: the task of the first goes on to the files of
// the next ones, and then all their records are written under one lock. Whatever stands between, each of them ends as
// it would by itself.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Fetched;
using test::KeyValueStoreFixture;
using test::Latch;
using test::ManifestCall;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;

using Contents = std::map<std::string, std::string>;

class WrittenTogether : public KeyValueStoreFixture {
 protected:
  void SetUp() override {
    openWatched();
    manifest->onCall = [this](ManifestCall call, const std::string& text) {
      if (call == ManifestCall::SetItem) settings.push_back(text);
      if (text != "updateLastAccessDate busy") return;
      isBusy.countDown();
      mayGoOn.wait();
    };
  }

  // Writes the key as its own value; the writer of "two" frees the manifest. So it has to be among those that are
  // written meanwhile, or the test stands still.
  Written write(const std::string& key, const std::function<void()>& meanwhile = nullptr) {
    return watch(store->store(key, nullptr, [this, key, meanwhile](const std::string& path) {
      writers.push_back(key);
      files->writeFile(path, bytesOf(key));
      if (meanwhile) meanwhile();
      if (key == "two") mayGoOn.countDown();
      return static_cast<unsigned int>(key.size());
    }));
  }

  // All of the work, and then the file queue's first task, at whose time another thread is in the manifest.
  void runFirstOfFiles() {
    work().runAll();
    settings.clear();
    const Written busy = watch(store->updateLastAccessDate("busy"));
    std::thread other([this] { work().runNext(); });
    isBusy.wait();
    file().runNext();
    other.join();
    EXPECT_EQ(told(busy), "<done>");
  }

  std::vector<std::string> writers;   // the keys whose writers have been called
  std::vector<std::string> settings;  // of records
  Latch isBusy{1};
  Latch mayGoOn{1};
};

TEST_F(WrittenTogether, TheFilesComeFirstAndThenTheRecordsEachOnce) {
  const Written one = write("one");
  const Written two = write("two");
  const Written three = write("three");
  runFirstOfFiles();
  EXPECT_THAT(writers, ElementsAre("one", "two", "three"));
  EXPECT_THAT(settings, ElementsAre("setItem one 3", "setItem two 3", "setItem three 5"));
  EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(told(three), "<done>");
  EXPECT_EQ(file().pending(), 2U);
  settle();
  EXPECT_EQ(writers.size(), 3U);
  EXPECT_EQ(settings.size(), 3U);
  EXPECT_THAT(sizes, ElementsAre(3U, 6U, 11U));
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}, {"three", "three"}}));
  EXPECT_EQ(store->operationCounts().stores, 3U);
}

TEST_F(WrittenTogether, AloneWithTheManifestEachTaskWritesItsOwn) {
  write("one");
  const Written two = write("two");
  work().runAll();
  file().runNext();
  EXPECT_THAT(writers, ElementsAre("one"));
  EXPECT_EQ(told(two), "<pending>");
}

TEST_F(WrittenTogether, NotMoreThanThirtyTwo) {
  write("one");
  write("two");
  for (int number = 3; number <= 40; ++number) write("key" + std::to_string(number));
  runFirstOfFiles();
  EXPECT_EQ(writers.size(), 32U);
  EXPECT_TRUE(file().runNext());
  EXPECT_EQ(writers.size(), 32U);
  settle();
  EXPECT_EQ(writers.size(), 40U);
  EXPECT_EQ(store->getAllKeys().size(), 40U);
  EXPECT_EQ(sizes.size(), 40U);
}

TEST_F(WrittenTogether, NotTwoOfOneKey) {
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

TEST_F(WrittenTogether, NotPastAFetch) {
  put("key", "old");
  write("one");
  write("two");
  const Fetched between = watch(store->fetch("key"));
  const Written written = write("key");
  runFirstOfFiles();
  EXPECT_THAT(writers, ElementsAre("one", "two"));
  EXPECT_EQ(told(written), "<pending>");
  settle();
  EXPECT_EQ(told(between), "old");
  EXPECT_EQ(get("key"), "key");
}

TEST_F(WrittenTogether, AFetchOfNothingStandsInNobodysWay) {
  write("one");
  const Fetched between = watch(store->fetch("nothing"));
  write("two");
  runFirstOfFiles();
  EXPECT_EQ(told(between), "<miss>");
  EXPECT_THAT(writers, ElementsAre("one", "two"));
}

TEST_F(WrittenTogether, NotPastTheRemovalOfAWrite) {
  write("one");
  write("two");
  const Written called = write("key");
  const Written removed = watch(store->removeItem("key"));
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(writers, ElementsAre("one", "two"));
  EXPECT_EQ(told(called), "<done>");
  EXPECT_EQ(told(removed), "<pending>");
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(get("key"), "key");
}

TEST_F(WrittenTogether, NotPastTheDeletionOfStaleFiles) {
  put("key", "old");
  clock.advance(2000);
  write("one");
  write("two");
  work().runAll();
  store->startStaleItemRemoval();
  work().runAll();
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(writers, ElementsAre("one", "two"));
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(get("key"), "key");
}

TEST_F(WrittenTogether, NotPastAnEviction) {
  close();
  options.capacity = 3;
  SetUp();
  put("key", "old");
  clock.advance(1);
  write("one");
  write("two");
  write("three");  // evicts "key"
  const Written anew = write("key");
  runFirstOfFiles();
  EXPECT_THAT(writers, ElementsAre("two"));  // the last has evicted "one"
  EXPECT_EQ(told(anew), "<pending>");
  settle();
  EXPECT_EQ(contents(), (Contents{{"two", "two"}, {"three", "three"}, {"key", "key"}}));
  EXPECT_EQ(valueFiles().size(), 3U);
}

TEST_F(WrittenTogether, AWriterThatFailsFailsAlone) {
  write("one");
  write("two");
  const Written failed = watch(store->store("key", nullptr, [this](const std::string& path) -> unsigned int {
    files->writeFile(path, bytesOf("half"));
    throw std::runtime_error("The writer gave up.");
  }));
  const Written last = write("last");
  runFirstOfFiles();
  EXPECT_EQ(told(failed), "<error> The writer gave up.");
  EXPECT_EQ(told(last), "<done>");
  settle();
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}, {"last", "last"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("last", "one", "two"));
}

TEST_F(WrittenTogether, AReportThatFindsNoQueueFailsItsWrite) {
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

TEST_F(WrittenTogether, ARemovalWhileTheFilesAreWrittenTakesThemAway) {
  write("one");
  write("two");
  Written removed;
  const Written written = write("key", [&] { removed = watch(store->removeItem("key")); });
  runFirstOfFiles();
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("one", "two"));
}

TEST_F(WrittenTogether, ARecordThatCannotBeWrittenPurgesTheStoreAndAllThatWereOnTheirWay) {
  const Written one = write("one");
  const Written two = write("two");
  const Written three = write("three");
  work().runAll();
  manifest->failNext(ManifestCall::SetItem, unwritable);
  runFirstOfFiles();
  settle();
  EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(told(three), "<done>");
  EXPECT_THAT(contents(), IsEmpty());
  EXPECT_THAT(valueFiles(), IsEmpty());
  put("key", "value");
  EXPECT_EQ(contents(), (Contents{{"key", "value"}}));
}

TEST_F(WrittenTogether, TheStoreMayGoBeforeTheTasksThatHaveNothingLeftToDo) {
  write("one");
  const Written two = write("two");
  runFirstOfFiles();
  work().runAll();
  store.reset();
  EXPECT_EQ(file().runAll(), 1U);
  EXPECT_EQ(told(two), "<done>");
}

TEST_F(WrittenTogether, AQueueMayDropTheTasksThatHaveNothingLeftToDo) {
  write("one");
  const Written two = write("two");
  runFirstOfFiles();
  file().dropAll();
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(contents(), (Contents{{"one", "one"}, {"two", "two"}}));
}

TEST_F(WrittenTogether, TheNextWriteMayHaveBeenDropped) {
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

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
