// Every promise to an application that uses all there is, each held against a model of every store.

#include <gmock/gmock.h>

#include <array>
#include <exception>
#include <filesystem>
#include <random>
#include <set>
#include <utility>

#include "AttributeStore.h"
#include "DiskSizeCalculator.h"
#include "LarderException.h"
#include "Store.h"
#include "StoreManager.h"
#include "TrashCollector.h"
#include "acceptance/MediaApp.h"
#include "host/Await.h"

namespace velmora::mobile::xplat::cellar::acceptance {
namespace {

namespace fs = std::filesystem;

using host::await;
using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

// --- Directories ---

TEST_F(MediaApp, AtItsFirstStartHasADirectoryForEveryStoreAndNothingInIt) {
  start();
  for (const auto& stores : {unmanagedStores(), keyedStores()}) {
    for (const std::string& store : stores) {
      EXPECT_EQ(managerOf(store)->getStore<Store>(store)->path, pathOf(store));
      const std::string temporary = directoryOf(store).substr(0, directoryOf(store).rfind('/')) + "/tmp";
      EXPECT_EQ(managerOf(store)->getTemporaryDirectory(), directory_.file(temporary));
      EXPECT_TRUE(exists(temporary));
    }
  }
  expectAsModelled();
}

// --- Measuring, and caches that a host fills itself ---

TEST_F(MediaApp, CountsWhatLiesInADirectoryOnceAndThenKeepsTheFigures) {
  start();
  fillEverything();
  for (const bool isKept : {false, true}) {
    files_->clearTrace();
    for (const std::string& store : unmanagedStores()) {
      const auto stats = host_->sizes()->calculateDirectorySize(pathOf(store));
      EXPECT_EQ(stats.valid, isKept) << store;
      EXPECT_EQ(stats.fileCount, 3) << store;
      EXPECT_EQ(stats.size, 1000) << store;
    }
    EXPECT_EQ(files_->calls(test::Operation::ListDirectory) == 0, isKept);
  }
  expectAsModelled();
}

TEST_F(MediaApp, ACacheOverItsLimitIsEmptyAtTheNextStartAndTheOthersAreAsTheyWere) {
  start();
  fillEverything();
  write("covers", "large", 7 * kKilobyte);
  write("previews", "large", 500 * kKilobyte);  // within its own
  host_->sizes()->calculateDirectorySize(pathOf("covers"));
  restart();
  EXPECT_THAT(managerEvents("eviction"), IsEmpty());  // 8168 bytes of 8192
  expectAsModelled();

  write("covers", "more", 25);
  fs::remove(pathOf("covers") + "/" + AttributeStore::fileName);  // else the figures are kept
  EXPECT_EQ(host_->sizes()->calculateDirectorySize(pathOf("covers")).size, 8193);
  restart();
  EXPECT_THAT(managerEvents("eviction"), ElementsAre("covers 8193 8192"));
  forget("covers");
  expectAsModelled();
  expectAllFetched();
}

// --- Values by key ---

TEST_F(MediaApp, ValuesAreStoredAsManyAtOnceAsThereAre) {
  start();
  fillEverything();
  std::vector<Future<void>> stores;
  const Bytes value(100, 'x');
  tick();
  for (const std::string& store : keyedStores()) {
    for (int i = 0; i < 32; ++i) {
      const std::string key = "at-once-" + std::to_string(i);
      stores.push_back(open(store)->store(key, value));
      values_[store].put(key, {value, now_, now_, std::nullopt});
    }
  }
  settle();
  for (const auto& stored : stores) await(stored);
  expectAsModelled();
  expectAllFetched();
}

TEST_F(MediaApp, AStoreAtItsCapacityMakesRoomForEachNewValueByTheOneUsedLeastRecently) {
  start();
  fillEverything();
  for (std::size_t i = 0; i < 100; ++i) {
    put("settings", "new-" + std::to_string(i), i);
    if (i % 3 == 0) expectFetched("settings", values_["settings"].keys().front());
  }
  EXPECT_EQ(values_["settings"].items.size(), 64U);
  expectAsModelled();
  stop();
  expectRowsAsModelled();
}

TEST_F(MediaApp, WhatIsFetchedIsReportedAndIsWhatWasStored) {
  start();
  fillEverything();
  std::mt19937 random(20240229);
  for (int i = 0; i < 200; ++i) {
    const std::string store = keyedStores()[random() % 4];
    expectFetched(store, store + "-" + std::to_string(random() % 7));  // 5 of them are there
  }
  remove("drafts", "drafts-3");
  expectFetched("drafts", "drafts-3");
  expectAsModelled();

  std::map<int, std::size_t> reported;
  for (const auto& event : events_->named("qzpkvs_access")) ++reported[event.json().at("hit").get<int>()];
  EXPECT_GT(hits_, 100U);
  EXPECT_GT(misses_, 20U);
  EXPECT_EQ(reported[0], hits_);
  EXPECT_EQ(reported[1], misses_);
}

TEST_F(MediaApp, TheManifestsSayWhatTheApplicationHasNotedItself) {
  start();
  fillEverything();
  expectFetched("drafts", "drafts-0");
  expectFetched("settings", "settings-4");
  put("thumbnails", "thumbnails-1", 33);  // again
  remove("videos", "videos-2");
  stop();
  expectRowsAsModelled();
}

TEST_F(MediaApp, EveryValueIsFoundAgainAfterARestart) {
  start();
  fillEverything();
  for (int i = 0; i < 2; ++i) {
    restart();
    expectAsModelled();
    expectAllFetched();
  }
  stop();
  expectRowsAsModelled();
}

// --- Limits and age ---

TEST_F(MediaApp, DiskCachesArePrunedInTheirOrderAndNoFurtherThanTheyHaveTo) {
  start();
  fillEverything();
  for (const std::string store : {"thumbnails", "videos"}) {
    for (const std::string& key : values_[store].keys()) remove(store, key);
  }
  for (int i = 0; i < 20; ++i) put("thumbnails", "thumbnail-" + std::to_string(i), kKilobyte);
  for (int i = 0; i < 44; ++i) put("videos", "chunk-" + std::to_string(i), kKilobyte, i);
  for (int i = 0; i < 20; i += 3) expectFetched("thumbnails", "thumbnail-" + std::to_string(i));
  files_->clearTrace();
  EXPECT_THAT(managerEvents("pruning"), IsEmpty());  // both over their own limits, their manager just at its own
  expectAsModelled();

  put("videos", "last", 1, 60);
  EXPECT_THAT(managerEvents("pruning"), UnorderedElementsAre("thumbnails 20480 16384", "videos 45057 28672"));
  EXPECT_THAT(deletedFilesOf("thumbnails"), ElementsAreArray(values_["thumbnails"].prune(16 * kKilobyte)));
  const auto gone = values_["videos"].prune(28 * kKilobyte);
  EXPECT_THAT(deletedFilesOf("videos"), ElementsAreArray(gone));
  // The early chunks have their grace, and not more than that.
  EXPECT_THAT(std::vector<std::string>(gone.begin() + 9, gone.begin() + 13),
              ElementsAre("chunk-20", "chunk-0", "chunk-21", "chunk-1"));
  expectAsModelled();
  expectAllFetched();
  restart();
  expectAsModelled();
}

TEST_F(MediaApp, WhatHasNotBeenUsedForItsStaleAgeExpires) {
  start();
  fillEverything();
  stop();
  const std::array<long, 5> days = {0, 25, 30, 31, 40};
  for (std::size_t i = 0; i < days.size(); ++i) {
    const long extra = days[i] == 30 ? -20 : 0;  // a little less than 30 days when it is looked at
    backdate("thumbnails", "thumbnails-" + std::to_string(i), now_ - days[i] * kDay - extra);
  }
  start();
  expectAsModelled();
  fireTimers(299);
  fireTimers(3600);  // there are none yet
  expectAsModelled();
  tick();
  fireTimers(300);
  values_["thumbnails"].expire(now_ - 30 * kDay);
  EXPECT_THAT(values_["thumbnails"].keys(), ElementsAre("thumbnails-0", "thumbnails-1", "thumbnails-2"));
  expectAsModelled();

  open("thumbnails")->overrideConfiguration(20 * kDay);
  fireTimers(300);  // has come already
  expectAsModelled();
  fireTimers(3600);
  values_["thumbnails"].expire(now_ - 20 * kDay);
  EXPECT_THAT(values_["thumbnails"].keys(), ElementsAre("thumbnails-0"));
  expectAsModelled();
  expectAllFetched();
}

TEST_F(MediaApp, AClearedStoreIsEmptyAndGoesOnBesideOthersThatAreAsTheyWere) {
  start();
  fillEverything();
  const auto keys = values_["thumbnails"].keys();
  std::string ending;
  open("thumbnails")->clear([&] { ending += "done"; }, [&](const std::exception& error) { ending += error.what(); });
  settle();
  EXPECT_EQ(ending, "done");
  forget("thumbnails");
  expectAsModelled();
  for (const std::string& key : keys) expectFetched("thumbnails", key);
  put("thumbnails", "again", 4 * kKilobyte);
  expectFetched("thumbnails", "again");
  expectAsModelled();
  expectAllFetched();
}

// --- What comes to an end, and how its data goes ---

TEST_F(MediaApp, AnUpdateRetiresTheStoresWithoutAVersionOfTheirOwn) {
  start();
  fillEverything();
  std::vector<std::string> retired;
  for (const char* store : {"covers", "previews", "videos", "catalogue"}) {
    retired.push_back(directoryOf(store));
    EXPECT_TRUE(exists(retired.back()));
    forget(store);
  }
  stop();
  release_ = "101";
  start();
  expectAsModelled();
  expectAllFetched();
  for (const std::string& directory : retired) EXPECT_FALSE(exists(directory)) << directory;
}

TEST_F(MediaApp, AnotherUserFindsNothingOfTheFirstAndAllThatBelongsToNoSession) {
  start();
  fillEverything();
  forgetBelow("caches/_store_alice");
  forgetBelow("documents/_store_alice");
  stop();
  user_ = "bob";
  start();
  expectAsModelled();
  expectAllFetched();
  EXPECT_FALSE(exists("caches/_store_alice"));
  EXPECT_FALSE(exists("documents/_store_alice"));
}

TEST_F(MediaApp, AStoreThatIsMarkedForTheTrashBeginsEmptyAtTheNextStartAndNotBefore) {
  start();
  fillEverything();
  managerOf("downloads")->trashStoreOnStartup("downloads");
  managerOf("drafts")->trashStoreOnStartup("drafts");
  EXPECT_TRUE(exists(directoryOf("downloads") + "/deep/er/second"));
  expectFetched("drafts", "drafts-4");
  restart();
  forget("downloads");
  forget("drafts");
  expectAsModelled();
  restart();
  expectAsModelled();
  expectAllFetched();
}

TEST_F(MediaApp, AForcedCleanseDiscardsEverything) {
  start();
  fillEverything();
  stop();
  StoreManager::setForceCleanseOnInit(true);
  start();
  StoreManager::setForceCleanseOnInit(false);
  forgetBelow("");
  expectAsModelled();
  fillEverything();
  restart();
  expectAsModelled();
  expectAllFetched();
}

TEST_F(MediaApp, TrashThatAPowerCutLeftBehindIsEmptiedAndReported) {
  start();
  fillEverything();
  stop();
  // What a collector leaves that is killed right after its rename.
  directory_.makeDirectory("trash");
  fs::rename(pathOf("previews"), directory_.file("trash/0123456789abcdef"));
  forget("previews");
  launch();
  runBeside([&] { host_->trash()->emptyAllTrash(); });
  EXPECT_FALSE(exists("trash"));
  const auto reports = events_->named("qztrash_collector");
  ASSERT_EQ(reports.size(), 1U);
  EXPECT_EQ(reports.front().json().at("file_count"), 7);  // three files, their three directories, the trash
  openStores();
  expectAsModelled();
  expectAllFetched();
}

TEST_F(MediaApp, LoggingOutTakesTheSessionAndLeavesTheRest) {
  start();
  fillEverything();
  const auto manager = managerOf("downloads");
  const auto drafts = open("drafts");
  runBeside([&] { host_->logOut(); });
  EXPECT_FALSE(exists("caches/_store_alice"));
  EXPECT_FALSE(exists("documents/_store_alice"));
  EXPECT_FALSE(manager->isValid());
  EXPECT_EQ(manager->getStore<Store>("downloads"), nullptr);
  for (const std::string store : {"thumbnails", "videos", "settings"}) {
    for (const std::string& key : values_[store].keys()) expectFetched(store, key);
  }
  forgetBelow("caches/_store_alice");
  forgetBelow("documents/_store_alice");
  settle();
  EXPECT_FALSE(exists("trash"));
  user_ = "bob";
  openStores();
  expectAsModelled();
}

// What an operation on a store of an ended session says.
template <class Operation> std::string refusalOf(const Operation& operation) {
  try {
    operation();
    return "nothing";
  } catch (const InvalidatedException& refusal) {
    return refusal.description();
  }
}

TEST_F(MediaApp, AStoreOfASessionThatHasEndedRefusesEverything) {
  start();
  fillEverything();
  const auto drafts = open("drafts");
  runBeside([&] { host_->logOut(); });
  std::string refusalOfClear;
  drafts->clear([] {}, [&](const std::exception& error) { refusalOfClear = error.what(); });
  std::vector<std::string> refusals;
  for (const std::function<void()>& operation : std::vector<std::function<void()>>{
           [&] { await(drafts->store("key", {1})); }, [&] { (void)await(drafts->fetch("key")); },
           [&] { await(drafts->removeItem("key")); }, [&] { await(drafts->updateLastAccessDate("key")); },
           [&] { drafts->fetchModificationDate("key"); }, [&] { drafts->getAllKeys(); }}) {
    refusals.push_back(refusalOf(operation));
  }
  settle();
  EXPECT_EQ(std::set<std::string>(refusals.begin(), refusals.end()),
            std::set<std::string>{"Store has been invalidated."});
  EXPECT_THAT(refusalOfClear, testing::HasSubstr("Store has been invalidated."));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::acceptance
