// Changes that wait on the work queue share a transaction. Whatever they are and whichever statement of it fails, each
// ends as it would by itself; nothing is told, deleted or handed on before the transaction is complete.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::KeyValueStoreFixture;
using test::LogCapture;
using test::ManifestCall;
using test::MemoryMedium;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::Each;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

class GroupCommitFixture : public KeyValueStoreFixture {
 protected:
  Written store(const std::string& key, const std::string& value = "value") {
    return watch(KeyValueStoreFixture::store->store(key, bytesOf(value)));
  }
  Written remove(const std::string& key) { return watch(KeyValueStoreFixture::store->removeItem(key)); }

  std::size_t transactions() const { return medium->calls("begin").size(); }
  std::size_t rollBacks() const { return medium->calls("roll back").size(); }

  static std::vector<std::string> allTold(const std::vector<Written>& changes) {
    std::vector<std::string> texts;
    for (const Written& change : changes) texts.push_back(told(change));
    return texts;
  }
};

// --- Which changes ---

class GroupCommit : public GroupCommitFixture {
 protected:
  void SetUp() override {
    openWatched();
    put("old", "value");
    medium->forgetCalls();
  }
};

TEST_F(GroupCommit, TheFirstOnesTaskMakesTheChangesBehindIt) {
  store("one");
  store("two");
  remove("old");
  work().runNext();
  EXPECT_EQ(transactions(), 1U);
  EXPECT_THAT(medium->keys(), ElementsAre("one", "two"));
  EXPECT_EQ(file().pending(), 2U);
  settle();
  EXPECT_EQ(contents(), (Contents{{"one", "value"}, {"two", "value"}}));
}

TEST_F(GroupCommit, TheOtherTasksHaveNothingLeftToDo) {
  store("one");
  const Written removed = remove("old");
  work().runNext();
  EXPECT_EQ(told(removed), "<done>");
  const auto calls = manifest->trace();
  work().runNext();
  EXPECT_EQ(manifest->trace(), calls);
}

TEST_F(GroupCommit, ASingleChangeHasNoTransaction) {
  store("one");
  settle();
  remove("old");
  settle();
  EXPECT_EQ(transactions(), 0U);
}

TEST_F(GroupCommit, NoFetchIsOvertaken) {
  store("one");
  store("old", "newer");
  const Fetched fetched = watch(KeyValueStoreFixture::store->fetch("two"));
  store("two");
  remove("old");
  work().runNext();
  EXPECT_THAT(medium->keys(), ElementsAre("old", "one"));
  settle();
  EXPECT_EQ(told(fetched), "<miss>");
  EXPECT_EQ(contents(), (Contents{{"one", "value"}, {"two", "value"}}));
}

TEST_F(GroupCommit, NoClearIsOvertaken) {
  store("one");
  KeyValueStoreFixture::store->clear(onSuccess(), onError());
  store("two");
  store("three");
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), (Contents{{"two", "value"}, {"three", "value"}}));
}

TEST_F(GroupCommit, NoUseIsOvertaken) {
  clock.advance(10);
  store("one");
  const Written used = watch(KeyValueStoreFixture::store->updateLastAccessDate("old"));
  remove("old");
  work().runNext();
  EXPECT_THAT(medium->keys(), ElementsAre("old", "one"));
  settle();
  EXPECT_EQ(told(used), "<done>");
}

TEST_F(GroupCommit, AReportOfTheSizeIsOvertaken) {
  options.inlineData = true;
  close();
  openWatched();
  store("one", "1");
  work().runNext();  // leaves a report
  store("two", "22");
  store("three", "333");
  sizes.clear();
  settle();
  EXPECT_EQ(transactions(), 1U);
  EXPECT_THAT(sizes, ElementsAre(6U, 8U, 11U));
}

TEST_F(GroupCommit, Has32ChangesAtMost) {
  for (int i = 0; i < 33; ++i) store("key" + std::to_string(i));
  work().runNext();
  EXPECT_THAT(medium->keys(), SizeIs(33));
  settle();
  EXPECT_THAT(medium->keys(), SizeIs(34));
}

TEST_F(GroupCommit, HasSoManyBytesInTheManifestAtMost) {
  options.inlineData = true;
  close();
  openWatched();
  const std::string half(std::size_t{64} << 10U, 'h');
  store("one", half);
  store("two", half);
  store("three", "3");
  work().runNext();
  EXPECT_THAT(medium->keys(), ElementsAre("old", "one", "two"));
  settle();
  store("four", half + half + "4");
  store("five", "5");
  work().runNext();
  EXPECT_THAT(medium->keys(), ElementsAre("four", "old", "one", "three", "two"));
}

TEST_F(GroupCommit, NoneForAManifestThatIsNotLoaded) {
  options.manifest.reset();
  close();
  openWatchedUnloaded();
  medium->forgetCalls();
  medium->fail("getAllItems");
  EXPECT_THROW(work().runNext(), ManifestPersistenceException);
  medium->heal();
  const Written one = store("one");
  const Written two = store("two");
  settle();
  EXPECT_EQ(transactions(), 0U);
  EXPECT_THAT(allTold({one, two}), Each("<done>"));
}

TEST_F(GroupCommit, NoneForAPersistenceWithoutTransactions) {
  medium->canPerformTogether = false;
  const Written one = store("one");
  const Written two = store("two");
  const Written removed = remove("old");
  settle();
  EXPECT_THAT(allTold({one, two, removed}), Each("<done>"));
  EXPECT_EQ(contents(), (Contents{{"one", "value"}, {"two", "value"}}));
}

TEST_F(GroupCommit, NoneForAManifestOfTheHostsOwn) {
  manifest->cannotReplace = true;
  const Written one = store("one");
  const Written removed = remove("old");
  settle();
  EXPECT_EQ(transactions(), 0U);
  EXPECT_THAT(allTold({one, removed}), Each("<done>"));
  EXPECT_EQ(contents(), (Contents{{"one", "value"}}));
}

// --- In which order ---

TEST_F(GroupCommit, NothingIsToldBeforeTheTransactionIsComplete) {
  options.inlineData = true;
  close();
  openWatched();
  put("inline", "value");
  const Written one = store("one");
  const Written removed = remove("inline");
  bool isComplete = false;
  medium->onCall = [&](const std::string& operation, const std::string&) {
    if (operation == "commit") isComplete = true;
    EXPECT_EQ(told(one), "<pending>");
    EXPECT_EQ(told(removed), "<pending>");
  };
  work().runNext();
  medium->onCall = nullptr;
  EXPECT_TRUE(isComplete);
  EXPECT_THAT(allTold({one, removed}), Each("<done>"));
}

TEST_F(GroupCommit, NoFileIsDeletedAndNoTaskQueuedBeforeTheTransactionIsComplete) {
  options.capacity = 2;
  close();
  openWatched();
  put("older", "value");
  clock.advance(1);
  put("removed", "value");
  remove("removed");
  store("one");
  store("two");  // evicts one of the others
  bool isComplete = false;
  medium->onCall = [&](const std::string& operation, const std::string&) {
    isComplete = isComplete || operation == "commit";
    EXPECT_TRUE(isComplete || (valueFiles().size() == 2 && file().pending() == 0));
  };
  work().runNext();
  medium->onCall = nullptr;
  EXPECT_TRUE(isComplete);
  settle();
  EXPECT_EQ(contents(), (Contents{{"one", "value"}, {"two", "value"}}));
  EXPECT_THAT(valueFiles(), SizeIs(2));
}

TEST_F(GroupCommit, ChangesOfOneKeyTakeEffectInTheirOrder) {
  const std::vector<Written> changes = {store("key", "1"), store("key", "2"), remove("key"), store("key", "4"),
                                        remove("old"),     store("old", "6"), remove("old")};
  settle();
  EXPECT_THAT(allTold(changes), Each("<done>"));
  EXPECT_EQ(contents(), (Contents{{"key", "4"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

// What two threads do at once: the second one's operation comes to the queue while a change of the first one is being
// handed over to it.
class GroupCommitBesideOtherThreads : public GroupCommit {
 protected:
  void whileHandingOver(std::function<void()> work_) {
    work().beforeDispatch = [this, work_ = std::move(work_)] {
      const auto self = std::exchange(work().beforeDispatch, nullptr);  // with what this needs
      work_();
    };
  }

  // The first thread removes "old" and stores it again.
  void expectThatTheLastValueStays(std::function<void()> meanwhile) {
    whileHandingOver(std::move(meanwhile));
    const Written removed = remove("old");
    const Written stored = store("old", "newer");
    settle();
    EXPECT_EQ(told(removed), "<done>");
    EXPECT_EQ(told(stored), "<done>");
    EXPECT_EQ(get("old"), "newer");
  }
};

TEST_F(GroupCommitBesideOtherThreads, AChangeKeepsTheOrder) {
  Written another;
  expectThatTheLastValueStays([&] { another = store("another"); });
  EXPECT_EQ(told(another), "<done>");
}

TEST_F(GroupCommitBesideOtherThreads, AFetchAndAChangeKeepTheOrder) {
  expectThatTheLastValueStays([&] {
    watch(KeyValueStoreFixture::store->fetch("one"));
    store("another");
  });
}

TEST_F(GroupCommitBesideOtherThreads, AChangeThatIsRefusedAndAnotherKeepTheOrder) {
  Written refused;
  expectThatTheLastValueStays([&] {
    work().throwOnDispatch(true);
    refused = remove("nothing");
    work().throwOnDispatch(false);
    store("another");
  });
  EXPECT_EQ(told(refused), "<error> The queue takes no tasks.");
}

// The first one's is refused, and the second one's is not.
TEST_F(GroupCommitBesideOtherThreads, OneChangeIsRefusedAndTheOthersAreNotLost) {
  std::vector<Written> changes;
  whileHandingOver([&] {
    changes = {store("another"), store("last")};
    work().throwOnDispatch(true);
  });
  const Written refused = remove("old");
  work().throwOnDispatch(false);
  settle();
  EXPECT_THAT(allTold(changes), Each("<done>"));
  EXPECT_EQ(told(refused), "<error> The queue takes no tasks.");
  EXPECT_EQ(contents(), (Contents{{"another", "value"}, {"last", "value"}, {"old", "value"}}));
}

TEST_F(GroupCommit, ARemovalBehindAStoreOfItsKeyWaitsForTheFileQueue) {
  store("old", "newer");
  const Written removed = remove("old");
  work().runAll();
  EXPECT_EQ(told(removed), "<pending>");
  settle();
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(GroupCommit, AWriteMayEvictTheOneBeforeIt) {
  options.capacity = 1;
  close();
  openWatched();
  const std::vector<Written> changes = {store("one"), store("two"), store("three")};
  settle();
  EXPECT_THAT(allTold(changes), Each("<done>"));
  EXPECT_EQ(contents(), (Contents{{"three", "value"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("three"));
  EXPECT_EQ(KeyValueStoreFixture::store->operationCounts().evictions, 3U);
}

TEST_F(GroupCommit, ACallbackThatThrowsHarmsNoOther) {
  options.inlineData = true;
  close();
  openWatched();
  auto one = KeyValueStoreFixture::store->store("one", bytesOf("1"));
  one.then(nullptr, [](std::future<void>&) { throw std::runtime_error("of the host"); });
  const Written two = store("two");
  EXPECT_THROW(work().runNext(), std::runtime_error);
  EXPECT_EQ(told(two), "<done>");
}

TEST_F(GroupCommit, ACallbackMayUseTheStore) {
  options.inlineData = true;
  close();
  openWatched();
  Written further;
  auto one = KeyValueStoreFixture::store->store("one", bytesOf("1"));
  one.then(nullptr, [&](std::future<void>&) {
    further = store("further");
    EXPECT_EQ(KeyValueStoreFixture::store->getAllKeys().size(), 3U);
  });
  store("two");
  settle();
  EXPECT_EQ(told(further), "<done>");
}

// --- The end of the store ---

TEST_F(GroupCommit, InvalidationBeforeItRefusesEachOfThem) {
  const std::vector<Written> changes = {store("one"), store("old", "newer"), remove("old")};
  KeyValueStoreFixture::store->invalidateSoon();
  settle();
  EXPECT_THAT(allTold(changes), Each("<error> " + test::kInvalid));
  EXPECT_EQ(valueFile("old"), "value");
}

TEST_F(GroupCommit, InvalidationAfterItLetsTheFilesFollow) {
  const Written one = store("one");
  const Written old = store("old", "newer");
  work().runNext();
  KeyValueStoreFixture::store->invalidateSoon();
  settle();
  EXPECT_THAT(allTold({one, old}), Each("<done>"));
  EXPECT_EQ(valueFile("old"), "newer");
}

TEST_F(GroupCommit, AStoreThatGoesBeforeItDoesNothing) {
  const std::vector<Written> changes = {store("one"), store("old", "newer"), remove("old")};
  KeyValueStoreFixture::store.reset();
  settle();
  EXPECT_THAT(allTold(changes), Each("<done>"));
  EXPECT_THAT(medium->keys(), ElementsAre("old"));
  EXPECT_EQ(valueFile("old"), "value");
}

TEST_F(GroupCommit, AStoreThatGoesAfterItTakesNewRecordsBackAndLeavesOldValues) {
  store("one");
  store("old", "newer");
  work().runAll();
  KeyValueStoreFixture::store.reset();
  file().runAll();
  EXPECT_THAT(medium->keys(), ElementsAre("old"));
  EXPECT_EQ(medium->row("old").item.size, 5U);
  EXPECT_EQ(valueFile("old"), "value");
}

TEST_F(GroupCommit, AQueueThatDropsTheTasksLeavesWhatWasDone) {
  const Written one = store("one");
  const Written two = store("two");
  work().runNext();
  work().dropAll();
  settle();
  EXPECT_THAT(allTold({one, two}), Each("<done>"));
  EXPECT_EQ(contents(), (Contents{{"old", "value"}, {"one", "value"}, {"two", "value"}}));
}

TEST_F(GroupCommit, ARemovalBehindAWriteThatIsRefusedDeletesTheFileBeforeItIsTold) {
  store("one");
  const Written old = store("old", "newer");
  const Written removed = remove("old");
  file().throwOnDispatch(true);
  work().runNext();
  file().throwOnDispatch(false);
  EXPECT_THAT(told(old), testing::StartsWith("<error>"));
  EXPECT_THAT(valueFiles(), IsEmpty());
  settle();
  EXPECT_THAT(contents(), IsEmpty());
}

TEST_F(GroupCommit, AFileQueueThatRefusesTakesAllOfThemBack) {
  const Written one = store("one");
  const Written old = store("old", "newer");
  file().throwOnDispatch(true);
  work().runNext();
  file().throwOnDispatch(false);
  EXPECT_THAT(allTold({one, old}), Each(testing::StartsWith("<error>")));
  settle();
  EXPECT_EQ(contents(), (Contents{{"old", "value"}}));
}

// --- Failures: with each statement failing, once and for good ---

struct Failure {
  std::string operation;
  int after;
};

class GroupCommitFailures : public GroupCommitFixture, public testing::WithParamInterface<Failure> {
 protected:
  void SetUp() override {
    options.inlineData = true;
    options.capacity = 4;
    openWatched();
    for (const char* key : {"a", "b", "c", "d"}) {
      put(key, "old");
      clock.advance(1);
    }
    medium->forgetCalls();
  }

  // Everything that a group can have, on a full store.
  std::vector<Written> changeAll() {
    return {store("e", "new"), remove("c"), store("d", "newer"), remove("none"), store("f", "new")};
  }

  // Memory and medium agree.
  void expectAgreement() {
    std::uint32_t total = 0;
    for (const auto& [key, row] : medium->rows()) {
      const auto item = manifest->getItem(key);
      ASSERT_NE(item, nullptr) << key;
      EXPECT_EQ(item->size, row.item.size) << key;
      EXPECT_EQ(item->hasInlineData, row.item.hasInlineData) << key;
      EXPECT_EQ(item->lastAccessDate, row.item.lastAccessDate) << key;
      total += row.item.size;
    }
    EXPECT_EQ(manifest->count(), medium->rows().size());
    EXPECT_EQ(manifest->size(), total);
  }
};

// The transaction fails, and then each change by itself succeeds.
TEST_P(GroupCommitFailures, ThatPassLeaveNoTrace) {
  const auto changes = changeAll();
  const LogCapture log;
  medium->failOnce(GetParam().operation, GetParam().after);
  work().runNext();
  EXPECT_EQ(medium->failures(), 1U);
  EXPECT_EQ(rollBacks(), GetParam().operation == "begin" ? 0U : 1U);
  EXPECT_THAT(allTold(changes), Each("<done>"));
  EXPECT_THAT(errorLines(log), IsEmpty());
  expectAgreement();
  settle();
  EXPECT_EQ(contents(), (Contents{{"b", "old"}, {"d", "newer"}, {"e", "new"}, {"f", "new"}}));
  EXPECT_EQ(KeyValueStoreFixture::store->operationCounts().stores, 7U);
  EXPECT_EQ(KeyValueStoreFixture::store->operationCounts().evictions, 1U);
  EXPECT_TRUE(trash->collected().empty());
}

// The same outcome as with a persistence that has no transactions.
TEST_P(GroupCommitFailures, ThatStayEndLikeThoseOfChangesByThemselves) {
  const auto changes = changeAll();
  medium->fail(GetParam().operation, GetParam().after);
  work().runNext();
  medium->heal();
  expectAgreement();
  const auto outcomes = allTold(changes);
  settle();
  const auto values = contents();

  close();
  medium = std::make_shared<MemoryMedium>();
  medium->canPerformTogether = false;
  clock.set(kStart);
  SetUp();
  const auto alone = changeAll();
  // What the transaction was told before it failed, each change is told again.
  const bool isOfTheTransaction = GetParam().operation == "begin" || GetParam().operation == "commit";
  if (!isOfTheTransaction) medium->fail(GetParam().operation, 0);
  work().runAll();
  medium->heal();
  EXPECT_EQ(allTold(alone), outcomes);
  settle();
  EXPECT_EQ(contents(), values);
}

INSTANTIATE_TEST_SUITE_P(AtEachStatement, GroupCommitFailures,
                         testing::Values(Failure{"begin", 0}, Failure{"setItem", 0}, Failure{"setItem", 1},
                                         Failure{"setItem", 2}, Failure{"setInlineData", 0},
                                         Failure{"setInlineData", 1}, Failure{"setInlineData", 2},
                                         Failure{"removeItem", 0}, Failure{"removeItem", 1}, Failure{"commit", 0}),
                         [](const auto& each) { return each.param.operation + std::to_string(each.param.after); });

TEST_F(GroupCommit, AHostsMetadataThatThrowsFailsItsWriteAlone) {
  class Broken final : public DiskCacheItem::ExtendedMetadata {
   public:
    std::vector<unsigned char> serialize() const override { throw std::runtime_error("No bytes."); }
    void deserialize(const std::vector<unsigned char>& /*data*/) override {}
  };
  options.manifest.reset();
  close();
  open();
  const Written one = store("one");
  const Written broken = watch(KeyValueStoreFixture::store->store("key", bytesOf("v"), std::make_shared<Broken>()));
  const Written two = store("two");
  settle();
  EXPECT_EQ(told(one), "<done>");
  EXPECT_EQ(told(broken), "<error> No bytes.");
  EXPECT_EQ(told(two), "<done>");
  EXPECT_EQ(contents(), (Contents{{"one", "value"}, {"two", "value"}}));
}

// Nothing of what evictions, or their being taken back, have done to the order of eviction is left.
TEST_F(GroupCommit, ThatFailsLeavesTheOrderOfEvictionAsItWas) {
  options.capacity = 3;
  close();
  openWatched();
  clear();
  for (const char* key : {"a", "b", "c"}) put(key, "value");  // within one second
  medium->failOnce("commit", 0);
  store("d");
  store("e");
  settle();
  EXPECT_EQ(rollBacks(), 1U);
  EXPECT_EQ(contents(), (Contents{{"c", "value"}, {"d", "value"}, {"e", "value"}}));
}

// A read that may fail on its own would end the transaction unnoticed.
TEST_F(GroupCommit, AReadThatFailsInItIsNotPassedOver) {
  options.inlineData = true;
  close();
  openWatched();
  put("inline", "value");
  options.inlineData = false;
  close();
  openWatched();
  const Written written = store("inline", "newer");
  const Written removed = remove("old");
  medium->failOnce("getInlineData", 0);
  work().runNext();
  EXPECT_EQ(rollBacks(), 1U);
  settle();
  EXPECT_THAT(allTold({written, removed}), Each("<done>"));
  EXPECT_EQ(contents(), (Contents{{"inline", "newer"}}));
}

// --- Final records, prunes and clears ---

TEST_F(GroupCommit, ABatchOfAClearIsOneTransaction) {
  putMany(10);
  medium->forgetCalls();
  EXPECT_EQ(clear(), "<done>");
  EXPECT_EQ(transactions(), 1U);
  EXPECT_EQ(medium->calls("removeItem").size(), 11U);
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(GroupCommit, ABatchOfAClearBesideAStoreIsOneTransaction) {
  putMany(60);
  medium->forgetCalls();
  KeyValueStoreFixture::store->clear(onSuccess(), onError());
  work().runNext();
  store("new");
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), (Contents{{"new", "value"}}));
  EXPECT_LE(transactions(), 3U);
}

TEST_F(GroupCommit, ABatchOfAClearThatFailsIsRemovedOneByOne) {
  putMany(60, "");
  put("sized", "value");
  KeyValueStoreFixture::store->clear(onSuccess(), onError());
  work().runNext();
  store("new");
  medium->failOnce("commit", 0);
  settle();
  EXPECT_EQ(ending, "<done>");
  EXPECT_EQ(contents(), (Contents{{"new", "value"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("new"));
}

// --- On SQLite ---

class GroupCommitOnSQLite : public GroupCommitFixture {};

TEST_F(GroupCommitOnSQLite, AnotherConnectionThatWritesMakesEachWaitForItselfAsBefore) {
  open();
  put("old", "value");
  sqlite3* other = nullptr;
  ASSERT_EQ(sqlite3_open_v2(pathOf("manifest_v1.sqlite").c_str(), &other, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);
  const Written one = remove("old");
  const Written two = remove("none");
  work().runNext();
  EXPECT_THAT(told(one), testing::HasSubstr("locked"));
  EXPECT_EQ(told(two), "<done>");
  ASSERT_EQ(sqlite3_exec(other, "COMMIT", nullptr, nullptr, nullptr), SQLITE_OK);
  sqlite3_close(other);
  EXPECT_EQ(contents(), (Contents{{"old", "value"}}));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
