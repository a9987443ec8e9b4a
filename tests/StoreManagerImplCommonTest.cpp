#include "StoreManagerImplCommon.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/Barrier.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FakeStore;
using test::Latch;
using test::Operation;

class StoreManagerImplCommonTest : public testing::Test, protected test::ManagerServices {
 protected:
  using Common = StoreManagerImplCommon;

  // What a test leaves valid would keep its stores alive through their callbacks.
  void TearDown() override {
    if (common_ != nullptr) common_->invalidate();
  }

  // Builds a sessionless manager of these stores over the area.
  Common& build(Stores definitions) { return build(std::move(definitions), names.createStoreDirectoryNameBuilder()); }

  Common& buildForSession(const string& tag, Stores definitions = {}) {
    return build(std::move(definitions), names.createStoreDirectoryNameBuilder(tag));
  }

  Common& build(Stores definitions, std::shared_ptr<StoreDirectoryNameBuilder> nameBuilder) {
    common_ = std::make_unique<Common>(areaPath(), trash, files, std::move(nameBuilder), attributes,
                                       manager(std::move(definitions)));
    return *common_;
  }

  std::shared_ptr<Store> get(const string& identifier) {
    bool created = false;
    return get(identifier, created);
  }

  std::shared_ptr<Store> get(const string& identifier, bool& created) {
    return common_->getStore(identifier, queues, trash, reporter, nullptr, PruneStrategyIdentifier::Null, created);
  }

  // Waits until another caller holds the slot, beside those that hold it as this is called.
  void waitForAnotherHolder(const std::shared_ptr<Common::Item>& item, long holdersBefore) {
    while (item.use_count() <= holdersBefore) std::this_thread::yield();
  }

  string inManager(const string& name) const { return "area/_sessionlessStore/" + name; }
  string managerPath() const { return directory.file("area/_sessionlessStore"); }

  string ioFailure(int code, const string& text) {
    return "domain: QZLarderIoErrorErrorDomain; code: " + std::to_string(code) + "; description: " + text + " .";
  }

  string thrownText(const std::function<void()>& operation) {
    try {
      operation();
    } catch (const std::logic_error& error) {
      return error.what();
    }
    return "nothing thrown";
  }

  std::unique_ptr<Common> common_;
  test::LogCapture log_;
};

class StoreManagerImplCommonInvalidation : public StoreManagerImplCommonTest {};

class StoreManagerImplCommonIncidents : public StoreManagerImplCommonTest {
 protected:
  void buildReporting(Stores definitions) {
    build(std::move(definitions));
    common_->setIncidents(incidents_.reporter);
    common_->retryFailedCreations();
  }

  static string failed(const string& name) {
    return "CreationFailed " + name + ": Could not create store \"" + name + "\": ";
  }

  test::IncidentLog incidents_;
};

// Construction

TEST_F(StoreManagerImplCommonTest, TheFixedNamesAreWhatIsOnDisk) {
  EXPECT_EQ(StoreManagerImplCommon::TemporaryDirectoryName, "tmp");
  EXPECT_EQ(StoreManagerImplCommon::TrashOnStartupKey, "trash_on_start_up");
}

TEST_F(StoreManagerImplCommonTest, ConstructionCreatesTheManagersTreeWithItsParents) {
  build({{"a", fake("a")}});
  EXPECT_EQ(directory.names(), std::vector<string>{"area"});
  EXPECT_EQ(directory.names("area"), std::vector<string>{"_sessionlessStore"});
  EXPECT_EQ(directory.names("area/_sessionlessStore"), std::vector<string>{"tmp"});
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_TRUE(stores->creations().empty());
  EXPECT_TRUE(common_->isValid());
}

TEST_F(StoreManagerImplCommonTest, PathsFollowFromAreaAndSession) {
  buildForSession("42");
  EXPECT_EQ(common_->parentPath(), areaPath());
  EXPECT_EQ(common_->managerDirectoryName(), "_store_42");
  EXPECT_EQ(common_->managerPath(), areaPath() + "/_store_42");
  EXPECT_EQ(common_->getTemporaryDirectory(), areaPath() + "/_store_42/tmp");
  EXPECT_EQ(common_->getStorePath(fake("thumbs")), areaPath() + "/_store_42/thumbs_250_v1");
  EXPECT_TRUE(directory.exists("area/_store_42/tmp"));
}

TEST_F(StoreManagerImplCommonTest, ATemporaryDirectoryOfAnEarlierRunIsTrashedAndAFreshOneCreated) {
  directory.write(inManager("tmp/left"), "bytes");
  build({});
  EXPECT_EQ(trash->collected(), std::vector<string>{managerPath() + "/tmp"});
  EXPECT_TRUE(directory.names(inManager("tmp")).empty());
  EXPECT_EQ(directory.names("trash").size(), 1U);
}

TEST_F(StoreManagerImplCommonTest, OnlyTheTemporaryDirectoryIsTrashedAtConstruction) {
  directory.write(inManager("a_250_v1/value"), "bytes");
  directory.write(inManager("old_1_v1/value"), "bytes");
  build({{"a", fake("a")}});
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_TRUE(directory.exists(inManager("a_250_v1/value")));
  EXPECT_TRUE(directory.exists(inManager("old_1_v1/value")));
}

TEST_F(StoreManagerImplCommonTest, ATemporaryDirectoryThatCannotBeTrashedIsKept) {
  directory.write(inManager("tmp/left"), "bytes");
  trash->refuses = true;
  build({});
  EXPECT_TRUE(directory.exists(inManager("tmp/left")));
  EXPECT_TRUE(common_->isValid());
}

TEST_F(StoreManagerImplCommonTest, AManagerDirectoryThatCannotBeCreatedFailsTheConstruction) {
  files->failAlways(Operation::CreateDirectory, ENOSPC);
  try {
    build({});
    FAIL();
  } catch (const FileUtilsIoException& error) {
    EXPECT_EQ(error.code(), ENOSPC);
  }
}

TEST_F(StoreManagerImplCommonTest, TheDefinitionIsCopied) {
  auto definition = std::make_unique<StoreManagerDefinition>(manager({{"a", fake("a", {77})}}));
  common_ = std::make_unique<Common>(areaPath(), trash, files, names.createStoreDirectoryNameBuilder(), attributes,
                                     *definition);
  definition.reset();
  EXPECT_EQ(common_->definition().name, "media");
  EXPECT_EQ(common_->getStoreDefinition("a")->maxSize, 77U);
}

// Creating a store

TEST_F(StoreManagerImplCommonTest, TheFirstCallCreatesTheStoreWithEverythingItNeeds) {
  build({{"id", fake("thumbs")}});
  bool created = false;
  unsigned int reported = 0;
  const auto otherTrash = std::make_shared<TrashCollector>(directory.file("t2"), files, nullptr, nullptr);
  const auto store = common_->getStore(
      "id", queues, otherTrash, reporter, [&](unsigned int size) { reported = size; },
      PruneStrategyIdentifier::VideoDownload, created);
  EXPECT_TRUE(created);
  ASSERT_EQ(stores->creations().size(), 1U);
  const test::Creation creation = stores->creations()[0];
  EXPECT_EQ(creation.name, "thumbs");
  EXPECT_EQ(creation.storePath, managerPath() + "/thumbs_250_v1");
  EXPECT_EQ(creation.temporaryDirectoryPath, managerPath() + "/tmp");
  EXPECT_EQ(creation.taskQueueFactory, queues.get());
  EXPECT_EQ(creation.trashCollector, otherTrash.get());
  EXPECT_EQ(creation.analyticsReporter, reporter.get());
  EXPECT_EQ(creation.fileUtils, files.get());
  EXPECT_EQ(creation.pruneStrategy, PruneStrategyIdentifier::VideoDownload);
  EXPECT_EQ(creation.definition, common_->getStoreDefinition("id").get());
  (*stores)["thumbs"]->reportSize(12);
  EXPECT_EQ(reported, 12U);
  EXPECT_EQ(store, (*stores)["thumbs"]);
  EXPECT_TRUE(std::filesystem::is_directory(directory.file(inManager("thumbs_250_v1"))));
}

TEST_F(StoreManagerImplCommonTest, LaterCallsGetTheSameStoreAndLeaveTheCreatedFlagAlone) {
  build({{"a", fake("a")}});
  bool created = false;
  const auto store = get("a", created);
  EXPECT_TRUE(created);
  created = false;
  EXPECT_EQ(get("a", created), store);
  EXPECT_FALSE(created);
  EXPECT_EQ(stores->creations().size(), 1U);
}

TEST_F(StoreManagerImplCommonTest, TheSlotIsFilledFromTheDefinition) {
  build({{"id", fake("thumbs", {4000})}});
  EXPECT_EQ(common_->getExistingStore("id"), nullptr);
  const auto store = get("id");
  const auto item = common_->getExistingStore("id");
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->store, store);
  EXPECT_EQ(item->name, "thumbs");
  EXPECT_EQ(item->maxSize, 4000U);
  EXPECT_EQ(item->currentSize, 0U);
  EXPECT_FALSE(item->isPruning);
  EXPECT_FALSE(item->sizeReported);
}

TEST_F(StoreManagerImplCommonTest, TheSlotIsEmptyWhileTheStoreIsBeingCreated) {
  bool looked = false;
  stores->onCreate = [&](const string&, const auto&) {
    const auto item = common_->getExistingStore("id");
    ASSERT_NE(item, nullptr);
    EXPECT_EQ(item->store, nullptr);
    EXPECT_EQ(item->name, "");
    EXPECT_EQ(item->maxSize, 0U);
    looked = true;
  };
  build({{"id", fake("thumbs", {4000})}});
  get("id");
  EXPECT_TRUE(looked);
}

TEST_F(StoreManagerImplCommonTest, LookingForASlotCreatesNothing) {
  build({{"a", fake("a")}});
  EXPECT_EQ(common_->getExistingStore("a"), nullptr);
  EXPECT_EQ(common_->getExistingStore("unknown"), nullptr);
  EXPECT_TRUE(common_->copyStoreMap().empty());
  EXPECT_TRUE(stores->creations().empty());
}

TEST_F(StoreManagerImplCommonTest, ACopyOfTheStoreMapSharesTheSlotsAndNotTheMap) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  get("a");
  const auto copy = common_->copyStoreMap();
  get("b");
  ASSERT_EQ(copy.size(), 1U);
  EXPECT_EQ(copy.at("a"), common_->getExistingStore("a"));
  EXPECT_EQ(common_->copyStoreMap().size(), 2U);
}

TEST_F(StoreManagerImplCommonTest, AnExistingStoreDirectoryIsKeptWithItsContents) {
  directory.write(inManager("a_250_v1/value"), "bytes");
  build({{"a", fake("a")}});
  get("a");
  EXPECT_EQ(directory.read(inManager("a_250_v1/value")), "bytes");
}

// Failed creation

TEST_F(StoreManagerImplCommonTest, AnUnknownIdentifierThrowsAndNamesIdentifierAndManager) {
  build({{"a", fake("a")}});
  EXPECT_EQ(thrownText([&] { common_->getStoreDefinition("b"); }),
            "Definition not defined for store with identifier b in StoreManager with name 'media'");
  EXPECT_EQ(thrownText([&] { get("b"); }),
            "Definition not defined for store with identifier b in StoreManager with name 'media'");
}

TEST_F(StoreManagerImplCommonTest, AFailedCreationLeavesAnEmptySlotInWhichLaterCallersWait) {
  build({});
  bool created = false;
  EXPECT_THROW(get("b", created), std::logic_error);
  EXPECT_TRUE(created);
  const auto item = common_->getExistingStore("b");
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(item->store, nullptr);

  std::atomic<bool> returned{false};
  std::shared_ptr<Store> waitersStore;
  const long holders = item.use_count();
  std::thread waiter([&] {
    waitersStore = get("b");
    returned = true;
  });
  waitForAnotherHolder(item, holders);
  for (int i = 0; i < 1000; ++i) std::this_thread::yield();
  EXPECT_FALSE(returned);

  const auto published = std::make_shared<FakeStore>("/late", nullptr, false);  // nobody but a test would
  {
    const std::lock_guard<std::mutex> lock(item->mutex);
    item->store = published;
  }
  item->condition.notify_all();
  waiter.join();
  EXPECT_EQ(waitersStore, published);
}

TEST_F(StoreManagerImplCommonTest, AManagerThatRetriesCreatesWhatHasFailedOnTheNextRequest) {
  int attempts = 0;
  stores->onCreate = [&](const string&, const auto&) {
    if (++attempts <= 2) throw FileUtilsIoException(EIO, "no luck");
  };
  build({{"a", fake("a")}});
  bool created = false;
  EXPECT_THROW(get("a", created), FileUtilsIoException);
  common_->retryFailedCreations();  // what has failed before counts, too
  created = false;
  EXPECT_THROW(get("a", created), FileUtilsIoException);
  EXPECT_TRUE(created);
  created = false;
  const auto store = get("a", created);
  EXPECT_NE(store, nullptr);
  EXPECT_TRUE(created);
  created = false;
  EXPECT_EQ(get("a", created), store);
  EXPECT_FALSE(created);
  EXPECT_EQ(attempts, 3);
}

TEST_F(StoreManagerImplCommonTest, AManagerThatRetriesThrowsForAnUnknownIdentifierEachTime) {
  build({});
  common_->retryFailedCreations();
  for (int i = 0; i < 2; ++i) EXPECT_THROW(get("b"), std::logic_error);
}

TEST_F(StoreManagerImplCommonIncidents, TellOfEachAttemptToCreateAStoreThatThrows) {
  int attempts = 0;
  stores->onCreate = [&](const string&, const auto&) {
    if (++attempts == 1) throw FileUtilsIoException(EIO, "no luck");
    if (attempts == 2) throw 2;  // NOLINT: a definition is free to
  };
  buildReporting({{"id", fake("thumbs")}});
  EXPECT_THROW(get("id"), FileUtilsIoException);
  EXPECT_EQ(incidents_.take(), std::vector<string>{failed("thumbs") + ioFailure(EIO, "no luck")});
  EXPECT_THROW(get("id"), int);
  EXPECT_EQ(incidents_.take(), std::vector<string>{failed("thumbs") + "unknown exception"});
  EXPECT_NE(get("id"), nullptr);
  EXPECT_TRUE(incidents_.take().empty());
}

TEST_F(StoreManagerImplCommonIncidents, TellOfADirectoryThatCannotBeCreated) {
  buildReporting({{"a", fake("a")}, {"b", fake("b")}});
  files->failPath(Operation::CreateDirectory, managerPath() + "/a_250_v1", ENOSPC);
  EXPECT_THROW(get("a"), FileUtilsIoException);
  EXPECT_NE(get("b"), nullptr);
  EXPECT_EQ(incidents_.take(), std::vector<string>{failed("a") + ioFailure(ENOSPC, "No space left on device")});
}

TEST_F(StoreManagerImplCommonIncidents, TellOfNoStoreThatTheManagerDoesNotHave) {
  buildReporting({});
  EXPECT_THROW(get("b"), std::logic_error);
  EXPECT_TRUE(incidents_.take().empty());
}

TEST_F(StoreManagerImplCommonIncidents, TellOfNoCreationThatAnInvalidationHasTakenTheDirectoryFrom) {
  stores->onCreate = [&](const string&, const auto&) {
    common_->invalidate();
    throw FileUtilsIoException(ENOENT, "gone");
  };
  buildReporting({{"a", fake("a")}});
  EXPECT_THROW(get("a"), FileUtilsIoException);
  EXPECT_TRUE(incidents_.take().empty());
}

TEST_F(StoreManagerImplCommonIncidents, AreToldWithoutALockSoThatTheHandlerMayAskForTheStore) {
  incidents_.runAtOnce();
  incidents_.onIncident = [&](const Incident&) { EXPECT_NE(get("a"), nullptr); };
  int attempts = 0;
  stores->onCreate = [&](const string&, const auto&) {
    if (++attempts == 1) throw FileUtilsIoException(EIO, "no luck");
  };
  buildReporting({{"a", fake("a")}});
  EXPECT_THROW(get("a"), FileUtilsIoException);
  EXPECT_EQ(attempts, 2);
}

TEST_F(StoreManagerImplCommonIncidents, OfAStoreReachTheReporterOfItsManager) {
  buildReporting(
      {{"letters", std::make_shared<PKVSDefinition>("letters", "media", false, false, 1U, std::nullopt, false, 100U)}});
  directory.write(inManager("letters_250_v1/manifest_v1.sqlite"), string(20'000, 'G'));
  EXPECT_NE(get("letters"), nullptr);
  queues->runAll();
  const std::vector<string> told = incidents_.take();
  ASSERT_EQ(told.size(), 1U);
  EXPECT_EQ(told[0].rfind("StorePurged letters: Store \"letters\" purged due to corrupted manifest. ", 0), 0U)
      << told[0];
  for (const auto& queue : queues->all()) queue->onDispatch = [&queue = *queue] { queue.runAll(); };
  common_->invalidate();
}

TEST_F(StoreManagerImplCommonTest, OfThoseWhoWaitForACreationThatFailsOneTriesAgainAndTheOthersGetItsStore) {
  Latch creating(1);
  Latch release(1);
  std::atomic<int> attempts{0};
  stores->onCreate = [&](const string&, const auto&) {
    if (++attempts > 1) return;
    creating.countDown();
    release.wait();
    throw FileUtilsIoException(EIO, "no luck");
  };
  build({{"a", fake("a")}});
  common_->retryFailedCreations();
  bool failed = false;
  std::thread creator([&] {
    try {
      get("a");
    } catch (const FileUtilsIoException&) {
      failed = true;
    }
  });
  creating.wait();
  const auto item = common_->getExistingStore("a");
  std::vector<std::shared_ptr<Store>> waitersStores(3);
  std::vector<std::thread> waiters;
  for (auto& waitersStore : waitersStores) {
    const long holders = item.use_count();
    waiters.emplace_back([&] { waitersStore = get("a"); });
    waitForAnotherHolder(item, holders);
  }
  release.countDown();
  creator.join();
  for (std::thread& waiter : waiters) waiter.join();
  EXPECT_TRUE(failed);
  EXPECT_EQ(attempts, 2);
  ASSERT_NE(waitersStores[0], nullptr);
  for (const auto& waitersStore : waitersStores) EXPECT_EQ(waitersStore, waitersStores[0]);
}

TEST_F(StoreManagerImplCommonTest, ACallerThatWaitsWithoutEndGetsTheStoreThatALaterOneCreates) {
  std::atomic<int> attempts{0};
  stores->onCreate = [&](const string&, const auto&) {
    if (++attempts == 1) throw FileUtilsIoException(EIO, "no luck");
  };
  build({{"a", fake("a")}});
  EXPECT_THROW(get("a"), FileUtilsIoException);
  const auto item = common_->getExistingStore("a");
  const long holders = item.use_count();
  std::shared_ptr<Store> waitersStore;
  std::thread waiter([&] { waitersStore = get("a"); });
  waitForAnotherHolder(item, holders);
  common_->retryFailedCreations();
  const auto store = get("a");
  waiter.join();
  EXPECT_NE(store, nullptr);
  EXPECT_EQ(waitersStore, store);
}

TEST_F(StoreManagerImplCommonTest, WhatTheDefinitionThrowsReachesTheCreator) {
  stores->onCreate = [](const string& name, const auto&) {
    if (name == "io") throw FileUtilsIoException(EIO, "no luck");
    throw 42;
  };
  build({{"io", fake("io")}, {"odd", fake("odd")}});
  EXPECT_THROW(get("io"), FileUtilsIoException);
  EXPECT_THROW(get("odd"), int);
  EXPECT_EQ(common_->getExistingStore("io")->store, nullptr);
}

TEST_F(StoreManagerImplCommonTest, ADirectoryThatCannotBeCreatedReachesTheCreatorAndNoStoreIsMade) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  files->failPath(Operation::CreateDirectory, managerPath() + "/a_250_v1", EACCES);
  try {
    get("a");
    FAIL();
  } catch (const FileUtilsIoException& error) {
    EXPECT_EQ(error.code(), EACCES);
  }
  EXPECT_TRUE(stores->creations().empty());
  EXPECT_NE(get("b"), nullptr);  // its neighbours are not concerned
}

// Concurrent callers

TEST_F(StoreManagerImplCommonTest, ManyThreadsThatAskAtOnceGetOneStoreAndOneCreatedFlag) {
  for (int round = 0; round < 30; ++round) {
    build({{"a", fake("a")}});
    const std::size_t before = stores->creations().size();
    std::atomic<int> createdFlags{0};
    std::vector<std::shared_ptr<Store>> got(8);
    test::runOnThreads(got.size(), [&](std::size_t thread) {
      bool created = false;
      got[thread] = get("a", created);
      if (created) ++createdFlags;
    });
    for (const auto& store : got) ASSERT_EQ(store, got[0]);
    ASSERT_NE(got[0], nullptr);
    ASSERT_EQ(createdFlags, 1);
    ASSERT_EQ(stores->creations().size(), before + 1);
    common_->invalidate();
  }
}

TEST_F(StoreManagerImplCommonTest, WhileAStoreIsBeingCreatedTheManagerAndItsOtherStoresCanBeUsed) {
  Latch creating(1);
  Latch release(1);
  stores->onCreate = [&](const string& name, const auto&) {
    if (name != "slow") return;
    creating.countDown();
    release.wait();
  };
  build({{"slow", fake("slow")}, {"b", fake("b")}});
  std::shared_ptr<Store> creatorsStore;
  std::thread creator([&] { creatorsStore = get("slow"); });
  creating.wait();

  EXPECT_NE(get("b"), nullptr);
  EXPECT_TRUE(common_->isValid());
  EXPECT_EQ(common_->copyStoreMap().size(), 2U);
  const auto item = common_->getExistingStore("slow");
  {
    const std::lock_guard<std::mutex> lock(item->mutex);  // the slot is not locked meanwhile either
    EXPECT_EQ(item->store, nullptr);
  }

  std::vector<std::shared_ptr<Store>> waitersStores(3);
  std::vector<std::thread> waiters;
  for (auto& waitersStore : waitersStores) {
    const long holders = item.use_count();
    waiters.emplace_back([&] { waitersStore = get("slow"); });
    waitForAnotherHolder(item, holders);
  }
  release.countDown();
  creator.join();
  for (std::thread& waiter : waiters) waiter.join();
  ASSERT_NE(creatorsStore, nullptr);
  for (const auto& waitersStore : waitersStores) EXPECT_EQ(waitersStore, creatorsStore);
  EXPECT_EQ(stores->createdNames(), (std::vector<string>{"b", "slow"}));
}

TEST_F(StoreManagerImplCommonTest, AStoreBeingCreatedMayAskTheManagerForAnother) {
  std::shared_ptr<Store> inner;
  stores->onCreate = [&](const string& name, const auto&) {
    if (name == "outer") inner = get("inner");
  };
  build({{"outer", fake("outer")}, {"inner", fake("inner")}});
  EXPECT_NE(get("outer"), nullptr);
  EXPECT_NE(inner, nullptr);
}

// Invalidation

TEST_F(StoreManagerImplCommonTest, InvalidatingInvalidatesTheStoresAndTrashesTheManagersDirectory) {
  build({{"a", fake("a")}, {"b", fake("b")}, {"c", fake("c")}});
  get("a");
  get("b");
  const auto a = (*stores)["a"];
  const auto b = (*stores)["b"];
  std::vector<std::size_t> invalidationsAtCollect;
  trash->onCollect = [&](const string&) { invalidationsAtCollect = {a->invalidations(), b->invalidations()}; };
  directory.write(inManager("a_250_v1/value"), "bytes");

  common_->invalidate();

  EXPECT_FALSE(common_->isValid());
  EXPECT_EQ(a->invalidations(), 1U);
  EXPECT_EQ(b->invalidations(), 1U);
  EXPECT_EQ(invalidationsAtCollect, (std::vector<std::size_t>{1, 1}));  // stores first, then their directory
  EXPECT_EQ(trash->collected(), std::vector<string>{managerPath()});
  EXPECT_FALSE(directory.exists("area/_sessionlessStore"));
  EXPECT_EQ(stores->creations().size(), 2U);  // nothing was created for it
}

TEST_F(StoreManagerImplCommonTest, AfterInvalidatingThereAreNoStores) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  get("a");
  common_->invalidate();
  bool created = false;
  EXPECT_EQ(get("a", created), nullptr);
  EXPECT_EQ(get("b", created), nullptr);
  EXPECT_EQ(get("unknown", created), nullptr);
  EXPECT_FALSE(created);
  EXPECT_EQ(common_->getExistingStore("a"), nullptr);
  EXPECT_TRUE(common_->copyStoreMap().empty());
}

TEST_F(StoreManagerImplCommonTest, InvalidatingTwiceDoesNothingMore) {
  build({{"a", fake("a")}});
  const auto store = get("a");
  common_->invalidate();
  common_->invalidate();
  EXPECT_EQ(trash->collected().size(), 1U);
  EXPECT_EQ((*stores)["a"]->invalidations(), 1U);
}

TEST_F(StoreManagerImplCommonTest, OfManyThreadsThatInvalidateOneDoes) {
  build({{"a", fake("a")}});
  const auto store = get("a");
  test::runOnThreads(6, [&] { common_->invalidate(); });
  EXPECT_EQ(trash->collected().size(), 1U);
  EXPECT_EQ((*stores)["a"]->invalidations(), 1U);
}

TEST_F(StoreManagerImplCommonInvalidation, ASecondOneWaitsForTheFirstSoThatTheNextManagerKeepsItsFiles) {
  build({{"a", fake("a")}});
  get("a");
  Latch collecting(1);
  Latch release(1);
  trash->onCollect = [&](const string& path) {
    if (path != managerPath()) return;
    collecting.countDown();
    release.wait();
  };
  Latch started(1);
  std::atomic<bool> returned{false};
  std::thread first([&] { common_->invalidate(); });
  collecting.wait();
  std::thread second([&] {
    started.countDown();
    common_->invalidate();
    directory.write(inManager("a_250_v1/value"), "of the next session");
    returned = true;
  });
  started.wait();
  for (int i = 0; i < 10000 && !returned; ++i) std::this_thread::yield();
  EXPECT_FALSE(returned);
  release.countDown();
  first.join();
  second.join();
  EXPECT_EQ(directory.read(inManager("a_250_v1/value")), "of the next session");
}

TEST_F(StoreManagerImplCommonInvalidation, IsNotOverBeforeTheStoresAreReleased) {
  build({{"a", fake("a")}});
  get("a");
  bool isInvalidating = false;
  const auto look = [&](void*) { isInvalidating = common_->isInvalidatingHere(); };
  (*stores)["a"]->onInvalidate = [atRelease = std::shared_ptr<void>(nullptr, look)] {};
  common_->invalidate();
  EXPECT_TRUE(isInvalidating);
}

TEST_F(StoreManagerImplCommonInvalidation, AnotherOneFromWithinItReturnsAtOnce) {
  const test::Watchdog watchdog(60);
  int calls = 0;
  const auto invalidateAgain = [&] {
    common_->invalidate();
    ++calls;
  };
  stores->onCreated = [&](const string&, FakeStore& store) { store.onInvalidate = invalidateAgain; };
  trash->onCollect = [&](const string&) { invalidateAgain(); };
  build({{"a", fake("a")}, {"b", fake("b")}});
  get("a");
  get("b");
  EXPECT_FALSE(common_->isInvalidatingHere());
  common_->invalidate();
  EXPECT_EQ(calls, 3);
  EXPECT_FALSE(common_->isInvalidatingHere());
  EXPECT_EQ(trash->collected().size(), 1U);
}

TEST_F(StoreManagerImplCommonInvalidation, ThatIsLeftByAnExceptionLetsOthersGo) {
  const test::Watchdog watchdog(60);
  build({});
  trash->onCollect = [](const string&) { throw std::runtime_error("odd host"); };
  EXPECT_THROW(common_->invalidate(), std::runtime_error);
  std::thread([&] { common_->invalidate(); }).join();
  EXPECT_FALSE(common_->isValid());
}

TEST_F(StoreManagerImplCommonTest, ADirectoryThatCannotBeTrashedLeavesTheManagerInvalidAllTheSame) {
  build({});
  trash->refuses = true;
  EXPECT_NO_THROW(common_->invalidate());
  EXPECT_FALSE(common_->isValid());
}

TEST_F(StoreManagerImplCommonTest, AStoreThatFailsToInvalidateIsLoggedAndStopsNothing) {
  stores->onCreated = [](const string&, FakeStore& store) {
    store.onInvalidate = [] { throw std::runtime_error("stuck"); };
  };
  build({{"a", fake("a")}, {"b", fake("b")}});
  const auto a = get("a");
  const auto b = get("b");
  EXPECT_NO_THROW(common_->invalidate());
  EXPECT_EQ((*stores)["a"]->invalidations(), 1U);
  EXPECT_EQ((*stores)["b"]->invalidations(), 1U);
  EXPECT_EQ(trash->collected(), std::vector<string>{managerPath()});
  EXPECT_EQ(log_.errorCount(), 2U);
  EXPECT_TRUE(log_.contains("stuck"));
}

TEST_F(StoreManagerImplCommonTest, AStoreThatWaitsForAnotherThreadToUseTheManagerCanBeInvalidated) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  get("a");
  get("b");
  const auto itemA = common_->getExistingStore("a");
  const auto itemB = common_->getExistingStore("b");
  bool used = false;
  (*stores)["a"]->onInvalidate = [&] {
    std::thread([&] {
      EXPECT_FALSE(common_->isValid());  // marked before it waits
      EXPECT_EQ(get("b"), nullptr);
      EXPECT_EQ(common_->getExistingStore("a"), nullptr);
      EXPECT_TRUE(common_->copyStoreMap().empty());
      const std::lock_guard<std::mutex> lockA(itemA->mutex);
      const std::lock_guard<std::mutex> lockB(itemB->mutex);
      used = true;
    }).join();
  };
  common_->invalidate();
  EXPECT_TRUE(used);
}

TEST_F(StoreManagerImplCommonTest, AManagerInvalidatedWhileAStoreIsCreatedHasItsCreatorInvalidateIt) {
  Latch creating(1);
  Latch release(1);
  stores->onCreate = [&](const string&, const auto&) {
    creating.countDown();
    release.wait();
  };
  build({{"a", fake("a")}});
  std::shared_ptr<Store> creatorsStore;
  std::size_t invalidationsAtReturn = 0;
  std::thread creator([&] {
    creatorsStore = get("a");
    invalidationsAtReturn = (*stores)["a"]->invalidations();
  });
  creating.wait();
  const auto item = common_->getExistingStore("a");
  const long holders = item.use_count();
  std::shared_ptr<Store> waitersStore;
  std::thread waiter([&] { waitersStore = get("a"); });
  waitForAnotherHolder(item, holders);

  common_->invalidate();  // does not wait for the creator
  EXPECT_EQ(trash->collected(), std::vector<string>{managerPath()});
  release.countDown();
  creator.join();
  waiter.join();

  ASSERT_NE(creatorsStore, nullptr);
  EXPECT_EQ(invalidationsAtReturn, 1U);
  EXPECT_EQ(waitersStore, creatorsStore);
  EXPECT_EQ(get("a"), nullptr);
}

// The next session's manager may be at work in the same directory by then.
TEST_F(StoreManagerImplCommonTest, AManagerInvalidatedBeforeAStoreIsMadeMakesNoneAndLetsWaitersGo) {
  Latch creating(1);
  Latch release(1);
  files->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::CreateDirectory || path != managerPath() + "/a_250_v1") return;
    creating.countDown();
    release.wait();
  };
  build({{"a", fake("a")}});
  std::shared_ptr<Store> creatorsStore;
  std::thread creator([&] { creatorsStore = get("a"); });
  creating.wait();
  const auto item = common_->getExistingStore("a");
  const long holders = item.use_count();
  std::shared_ptr<Store> waitersStore;
  std::thread waiter([&] { waitersStore = get("a"); });
  waitForAnotherHolder(item, holders);
  common_->invalidate();
  release.countDown();
  creator.join();
  waiter.join();
  EXPECT_EQ(creatorsStore, nullptr);
  EXPECT_EQ(waitersStore, nullptr);
  EXPECT_THROW((*stores)["a"], std::out_of_range);
}

TEST_F(StoreManagerImplCommonTest, AStoreMayInvalidateItsManagerAsItIsCreated) {
  stores->onCreate = [&](const string&, const auto&) { common_->invalidate(); };
  build({{"a", fake("a")}});
  const auto store = get("a");
  ASSERT_NE(store, nullptr);
  EXPECT_EQ((*stores)["a"]->invalidations(), 1U);
}

TEST_F(StoreManagerImplCommonTest, EveryStoreHandedOutBesideAnInvalidationIsInvalidatedInTheEnd) {
  for (int round = 0; round < 60; ++round) {
    build({{"a", fake("a")}, {"b", fake("b")}, {"c", fake("c")}, {"d", fake("d")}});
    std::vector<std::shared_ptr<Store>> got(4);
    test::runOnThreads(got.size() + 1, [&](std::size_t thread) {
      if (thread == got.size()) return common_->invalidate();
      try {
        got[thread] = get(string(1, static_cast<char>('a' + thread)));
      } catch (const FileUtilsIoException&) {
        // The manager's directory was trashed under the store's: no store was handed out.
      }
    });
    for (const auto& store : got) {
      if (store != nullptr) {
        ASSERT_GE(dynamic_cast<FakeStore&>(*store).invalidations(), 1U);
      }
    }
  }
}

TEST_F(StoreManagerImplCommonTest, InvalidatingLetsTheStoresGo) {
  build({{"a", fake("a")}});
  std::weak_ptr<Store> kept = get("a");
  EXPECT_FALSE(kept.expired());
  common_->invalidate();
  EXPECT_TRUE(kept.expired());
}

TEST_F(StoreManagerImplCommonTest, AKeyValueStoreCreatedForAnInvalidManagerIsInvalidatedWithoutWaitingForItsQueues) {
  build({{"kv", std::make_shared<PKVSDefinition>("kv", "media", false, false, 1U, std::nullopt, false, 1U)}});
  int calls = 0;
  files->onCall = [&](Operation operation, const string& path) {
    const bool isTheStores = operation == Operation::CreateDirectory && path == managerPath() + "/kv_250_v1";
    if (isTheStores && ++calls == 2) common_->invalidate();  // the store itself makes sure of its directory
  };
  const auto store = std::dynamic_pointer_cast<PersistentKeyValueStore>(get("kv"));  // nobody runs its queues
  ASSERT_NE(store, nullptr);
  EXPECT_THROW(store->throwIfInvalid(), InvalidatedException);
  queues->runAll();
}

TEST_F(StoreManagerImplCommonTest, ClosingLetsTheStoresGoAndHandsOutNoMoreButDiscardsNothing) {
  build({{"a", fake("a")}, {"b", fake("b")}});
  std::weak_ptr<Store> released = get("a");
  get("b");
  const auto held = (*stores)["b"];
  common_->close();
  EXPECT_TRUE(released.expired());
  EXPECT_EQ(held->invalidations(), 0U);
  bool created = false;
  EXPECT_EQ(get("a", created), nullptr);
  EXPECT_EQ(get("b", created), nullptr);
  EXPECT_FALSE(created);
  EXPECT_EQ(common_->getExistingStore("a")->getStore(), nullptr);
  EXPECT_EQ(common_->getExistingStore("b")->getStore(), held);
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_TRUE(directory.exists(inManager("a_250_v1")));
}

TEST_F(StoreManagerImplCommonTest, DestroyingAManagerDiscardsNothing) {
  build({{"a", fake("a")}});
  const auto store = get("a");
  common_.reset();
  EXPECT_TRUE(directory.exists(inManager("a_250_v1")));
  EXPECT_EQ((*stores)["a"]->invalidations(), 0U);
  EXPECT_TRUE(trash->collected().empty());
}

// The mark for trashing at start-up

TEST_F(StoreManagerImplCommonTest, MarkingAStoreWritesTheMarkAndDeletesNothing) {
  build({{"a", fake("a")}});
  get("a");
  directory.write(inManager("a_250_v1/value"), "bytes");
  common_->trashStoreOnStartup("a");
  EXPECT_EQ(directory.read(inManager("a_250_v1/_cellar_extended_attributes")), R"({"trash_on_start_up":true})");
  EXPECT_EQ(directory.read(inManager("a_250_v1/value")), "bytes");
  EXPECT_TRUE(trash->collected().empty());
}

TEST_F(StoreManagerImplCommonTest, TheMarkReplacesTheDirectorysOtherAttributes) {
  build({{"a", fake("a")}});
  get("a");
  attributes->set(managerPath() + "/a_250_v1", {{"other", 1}});
  common_->trashStoreOnStartup("a");
  EXPECT_EQ(attributes->get(managerPath() + "/a_250_v1"), (JsonValue{{"trash_on_start_up", true}}));
}

TEST_F(StoreManagerImplCommonTest, AMarkedStoreIsTrashedAndRecreatedEmptyTheNextTimeItIsCreated) {
  build({{"a", fake("a")}});
  get("a");
  directory.write(inManager("a_250_v1/value"), "bytes");
  common_->trashStoreOnStartup("a");
  EXPECT_NE(get("a"), nullptr);  // the store that exists already stays as it is
  EXPECT_TRUE(trash->collected().empty());

  const auto first = std::move(common_);
  build({{"a", fake("a")}});
  get("a");
  EXPECT_EQ(trash->collected(), (std::vector<string>{managerPath() + "/tmp", managerPath() + "/a_250_v1"}));
  EXPECT_TRUE(directory.names(inManager("a_250_v1")).empty());

  common_ = nullptr;
  build({{"a", fake("a")}});
  get("a");
  EXPECT_EQ(trash->collected().size(), 3U);  // the temporary directory again, the store not
}

TEST_F(StoreManagerImplCommonTest, AMarkedStoreThatCannotBeTrashedIsCreatedOverWhatIsThere) {
  directory.write(inManager("a_250_v1/value"), "bytes");
  build({{"a", fake("a")}});
  common_->trashStoreOnStartup("a");
  trash->refuses = true;
  EXPECT_NE(get("a"), nullptr);
  EXPECT_TRUE(directory.exists(inManager("a_250_v1/value")));
}

TEST_F(StoreManagerImplCommonTest, OnlyAMarkThatIsTrueCounts) {
  for (const string document :
       {R"({"trash_on_start_up":false})", R"({"trash_on_start_up":1})", R"({"trash_on_start_up":"true"})",
        R"({"trash_on_start_up":null})", R"({"other":true})", R"(["trash_on_start_up"])", "true", "null", "{}"}) {
    directory.write(inManager("a_250_v1/_cellar_extended_attributes"), document);
    build({{"a", fake("a")}});
    EXPECT_NE(get("a"), nullptr) << document;
    EXPECT_TRUE(directory.exists(inManager("a_250_v1/_cellar_extended_attributes"))) << document;
    common_->invalidate();
  }
}

TEST_F(StoreManagerImplCommonTest, DamagedAttributesCountAsNoMark) {
  directory.write(inManager("a_250_v1/_cellar_extended_attributes"), "{\"trash_on_");
  build({{"a", fake("a")}});
  EXPECT_NE(get("a"), nullptr);
  EXPECT_TRUE(trash->collected().empty());
}

TEST_F(StoreManagerImplCommonTest, MarkingAStoreWithoutADirectoryDoesNothing) {
  build({{"a", fake("a")}});
  common_->trashStoreOnStartup("a");
  EXPECT_FALSE(directory.exists(inManager("a_250_v1")));
  EXPECT_EQ(files->calls(Operation::WriteFile), 0U);
  EXPECT_TRUE(stores->creations().empty());
}

TEST_F(StoreManagerImplCommonTest, MarkingAnUnknownStoreThrows) {
  build({});
  EXPECT_EQ(thrownText([&] { common_->trashStoreOnStartup("b"); }),
            "Definition not defined for store with identifier b in StoreManager with name 'media'");
}

// Cleaning up

TEST_F(StoreManagerImplCommonTest, CleaningUpTrashesDirectoriesThatAreNoCurrentStores) {
  build({{"thumbs", fake("thumbs")}});
  directory.makeDirectory(inManager("thumbs_250_v1"));
  directory.makeDirectory(inManager("thumbs_249_v1"));
  common_->cleanupOldStores();
  EXPECT_EQ(trash->collected(), std::vector<string>{managerPath() + "/thumbs_249_v1"});
  EXPECT_EQ(directory.names(inManager("")), (std::vector<string>{"thumbs_250_v1", "tmp"}));
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplCommonTest, CleaningUpLeavesFilesAndLinksAlone) {
  build({});
  directory.write(inManager("file"), "bytes");
  directory.makeDirectory("elsewhere");
  std::filesystem::create_directory_symlink(directory.file("elsewhere"), directory.file(inManager("link")));
  common_->cleanupOldStores();
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(directory.names(inManager("")), (std::vector<string>{"file", "link", "tmp"}));
}

TEST_F(StoreManagerImplCommonTest, CleaningUpComparesNamesExactly) {
  build({{"a", fake("a")}, {"b", fake("b", {0, true, true, 7})}});
  for (const string name : {"a_250_v1", "b_250_v7", "A_250_v1", "a_250_v11", "b_250_v1", "TMP", ".hidden"}) {
    directory.makeDirectory(inManager(name));
  }
  common_->cleanupOldStores();
  EXPECT_EQ(directory.names(inManager("")), (std::vector<string>{"a_250_v1", "b_250_v7", "tmp"}));
}

TEST_F(StoreManagerImplCommonTest, CleaningUpWithoutAManagerDirectoryDoesNothing) {
  build({});
  std::filesystem::remove_all(managerPath());
  common_->cleanupOldStores();
  EXPECT_EQ(files->calls(Operation::ListDirectories), 0U);
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplCommonTest, AFailedCleanUpOfOldStoresIsOneErrorLine) {
  build({});
  files->failAlways(Operation::ListDirectories, EIO);
  EXPECT_NO_THROW(common_->cleanupOldStores());
  EXPECT_EQ(log_.messages(), std::vector<string>{"Cleanup of old stores failed " +
                                                 ioFailure(EIO, std::generic_category().message(EIO))});
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(StoreManagerImplCommonTest, CleaningUpGoesOnWhenADirectoryCannotBeTrashed) {
  build({});
  directory.makeDirectory(inManager("x"));
  directory.makeDirectory(inManager("y"));
  trash->refuses = true;
  common_->cleanupOldStores();
  EXPECT_EQ(trash->collected().size(), 2U);
}

TEST_F(StoreManagerImplCommonTest, OtherExceptionsPassThroughTheCleanUps) {
  buildForSession("2");
  files->onCall = [](Operation operation, const string&) {
    if (operation == Operation::ListDirectories) throw std::runtime_error("odd");
  };
  EXPECT_THROW(common_->cleanupOldStores(), std::runtime_error);
  EXPECT_THROW(common_->cleanupParentDirectory(), std::runtime_error);
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerImplCommonTest, CleaningUpTheParentTrashesOtherSessions) {
  directory.makeDirectory("area/_store_1");
  directory.makeDirectory("area/_store_2");
  directory.makeDirectory("area/_sessionlessStore");
  directory.makeDirectory("area/other");
  directory.write("area/_store_file", "bytes");
  buildForSession("2");
  common_->cleanupParentDirectory();
  EXPECT_EQ(trash->collected(), std::vector<string>{areaPath() + "/_store_1"});
  EXPECT_EQ(directory.names("area"), (std::vector<string>{"_sessionlessStore", "_store_2", "_store_file", "other"}));
}

TEST_F(StoreManagerImplCommonTest, ASessionlessManagerDoesNotCleanUpItsParent) {
  directory.makeDirectory("area/_store_1");
  directory.makeDirectory("area/_store_2");
  build({});
  common_->cleanupParentDirectory();
  EXPECT_TRUE(trash->collected().empty());
  EXPECT_EQ(files->calls(Operation::ListDirectories), 0U);
}

TEST_F(StoreManagerImplCommonTest, AnEmptySessionTagsDirectoryIsKeptBesideOthers) {
  directory.makeDirectory("area/_store_1");
  buildForSession("");
  common_->cleanupParentDirectory();
  EXPECT_EQ(directory.names("area"), std::vector<string>{"_store_"});
}

TEST_F(StoreManagerImplCommonTest, AFailedCleanUpOfTheParentIsOneErrorLine) {
  buildForSession("2");
  files->failAlways(Operation::ListDirectories, EACCES);
  EXPECT_NO_THROW(common_->cleanupParentDirectory());
  EXPECT_EQ(log_.messages(), std::vector<string>{"Cleanup of parent directory failed " +
                                                 ioFailure(EACCES, std::generic_category().message(EACCES))});
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(StoreManagerImplCommonTest, TrashingDirectoriesGoesInOrderPastWhatIsKept) {
  build({});
  common_->trashDirectories("/p", {"c", "a", "keep", "b", "a"}, {"x", "keep"});
  EXPECT_EQ(trash->collected(), (std::vector<string>{"/p/c", "/p/a", "/p/b", "/p/a"}));
}

TEST_F(StoreManagerImplCommonTest, TrashingDirectoriesWithNothingToKeepOrNothingAtAll) {
  build({});
  common_->trashDirectories("/p/", {"a"}, {});
  common_->trashDirectories("/p/", {}, {"a"});
  EXPECT_EQ(trash->collected(), std::vector<string>{"/p/a"});
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
