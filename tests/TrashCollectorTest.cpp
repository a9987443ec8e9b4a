#include "TrashCollector.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "host/testing/FaultyFileUtils.h"
#include "support/Barrier.h"
#include "support/TrashFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FaultyFileUtils;
using test::ioFailure;
using test::Operation;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

string hexadecimal(std::uint64_t number) {
  char text[17];
  std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(number));
  return text;
}

bool acceptAll(const string&) { return true; }

class TrashCollectorTest : public test::TrashFixture {};

// Collecting from within a pass, by a file layer that does so, on a queue that runs tasks at once.

TEST_F(TrashCollectorTest, APassTakesAlongWhatIsCollectedInTheMiddleOfIt) {
  const string first = makeTree("first");
  const string second = makeTree("second");
  const auto queue = queues_->queue(0);
  queue->onDispatch = [raw = queue.get()] { raw->runAll(); };
  bool isSecond = false;
  files_->onCall = [&](Operation operation, const string&) {
    if (operation != Operation::DeleteFile || std::exchange(isSecond, true)) return;
    EXPECT_TRUE(collector_->collectPath(second));
  };
  EXPECT_TRUE(collector_->collectPath(first));
  EXPECT_TRUE(isSecond);
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_FALSE(directory_.exists("second"));
  files_->onCall = nullptr;
  queue->onDispatch = nullptr;
}

TEST_F(TrashCollectorTest, WhatComesWhileTheTrashIsEmptiedCountsAndSoDoesTheTrash) {
  collector_->collectPath(directory_.write("one", "1"));
  const string two = directory_.write("two", "2");
  bool isTwo = false;
  files_->onCall = [&](Operation operation, const string&) {
    if (operation != Operation::DeleteFile || std::exchange(isTwo, true)) return;
    EXPECT_TRUE(collector_->collectPath(two));
  };
  queues_->queue(0)->runAll();
  EXPECT_TRUE(isTwo);
  collector_->collectPath(directory_.write("three", "3"));
  isTwo = false;
  directory_.write("two", "2");
  empty();
  files_->onCall = nullptr;
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_EQ(reportedCount(), 3U);
}

TEST_F(TrashCollectorTest, TwoThreadsMoveAtTheSameTime) {
  const string one = makeTree("one");
  const string two = makeTree("two");
  test::Latch both(2);
  files_->onCall = [&](Operation operation, const string&) {
    if (operation != Operation::Rename) return;
    both.countDown();
    both.wait();
  };
  std::thread other([&] { EXPECT_TRUE(collector_->collectPath(one)); });
  EXPECT_TRUE(collector_->collectPath(two));
  other.join();
  files_->onCall = nullptr;
}

// Collecting

TEST_F(TrashCollectorTest, ObtainsOneFileQueueAndNoOther) {
  EXPECT_EQ(queues_->queueCount(), 1U);
  EXPECT_EQ(queues_->workQueueCount(), 0U);
  collector_->collectPath(makeTree("tree"));
  empty();
  EXPECT_EQ(queues_->queueCount(), 1U);
}

TEST_F(TrashCollectorTest, CreatesNoTrashDirectoryUntilSomethingIsCollected) {
  EXPECT_THAT(directory_.names(), IsEmpty());
}

TEST_F(TrashCollectorTest, CollectingTakesThePathAwayAtOnceAndLeavesAnEntryUntilThePassRuns) {
  EXPECT_TRUE(collector_->collectPath(makeTree("tree")));
  EXPECT_FALSE(directory_.exists("tree"));
  ASSERT_EQ(trashed().size(), 1U);
  EXPECT_EQ(directory_.read("cache/trash/" + trashed()[0] + "/two"), "2");
  EXPECT_EQ(queues_->queue(0)->pending(), 1U);
  EXPECT_EQ(queues_->runAll(), 1U);
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_TRUE(directory_.exists("cache"));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, CollectingIsOneRenameIntoTheTrash) {
  const string path = makeTree("tree");
  collector_->collectPath(path);
  ASSERT_EQ(files_->calls(Operation::Rename), 1U);
  const std::vector<string> trace = files_->trace();
  EXPECT_THAT(trace, testing::Contains("rename " + path + " " + trashPath() + "/" + trashed().at(0)));
  EXPECT_EQ(files_->calls(Operation::DeleteFile), 0U);
}

TEST_F(TrashCollectorTest, EntriesAreNamedWith16LowerCaseHexadecimalDigits) {
  for (int i = 0; i < 64; ++i) collector_->collectPath(directory_.write("file", ""));
  ASSERT_EQ(trashed().size(), 64U);
  for (const string& name : trashed()) {
    EXPECT_EQ(name.size(), 16U) << name;
    EXPECT_EQ(name.find_first_not_of("0123456789abcdef"), string::npos) << name;
  }
}

TEST_F(TrashCollectorTest, TheNamesAreTheNumbersOfAnEngineSeededWithTheClock) {
  const std::time_t before = std::time(nullptr);
  const auto collector = makeCollector(files_);
  const std::time_t after = std::time(nullptr);
  std::set<string> names;
  for (int i = 0; i < 40; ++i) collector->collectPath(directory_.write("file", ""));
  for (const string& name : trashed()) names.insert(name);
  bool found = false;
  for (std::time_t seed = before; seed <= after; ++seed) {
    std::mt19937_64 engine(static_cast<std::uint64_t>(seed));
    std::set<string> expected;
    for (int i = 0; i < 40; ++i) expected.insert(hexadecimal(engine()));
    found = found || names == expected;
  }
  EXPECT_TRUE(found);
}

TEST_F(TrashCollectorTest, ATakenNameIsDrawnAgainAndTheEntryUnderItIsLeftAlone) {
  class Crowded : public FaultyFileUtils {
   public:
    bool pathExists(const string& path) override {
      const bool isEntry = basename(path).size() == 16;
      if (isEntry && taken.size() < 3) {
        taken.push_back(path);
        return true;
      }
      return FaultyFileUtils::pathExists(path);
    }
    std::vector<string> taken;
  };
  const auto files = std::make_shared<Crowded>();
  const auto collector = makeCollector(files);
  const string path = makeTree("tree");
  EXPECT_TRUE(collector->collectPath(path));
  ASSERT_EQ(files->taken.size(), 3U);
  EXPECT_EQ(std::set<string>(files->taken.begin(), files->taken.end()).size(), 3U);
  ASSERT_EQ(trashed().size(), 1U);
  for (const string& entry : files->taken) {
    EXPECT_NE(files->basename(entry), trashed()[0]);
    EXPECT_FALSE(std::filesystem::exists(entry));
  }
  EXPECT_EQ(files->calls(Operation::Rename), 1U);
}

TEST_F(TrashCollectorTest, FilesAndLinksAreCollectedToo) {
  directory_.write("target/file", "stays");
  EXPECT_TRUE(collector_->collectPath(directory_.write("file", "x")));
  EXPECT_TRUE(collector_->collectPath(link("link", "target")));
  EXPECT_TRUE(collector_->collectPath(link("dangling", "nowhere")));
  EXPECT_EQ(trashed().size(), 3U);
  queues_->runAll();
  EXPECT_THAT(directory_.names(), ElementsAre("cache", "target"));
  EXPECT_EQ(directory_.read("target/file"), "stays");
}

TEST_F(TrashCollectorTest, CollectingAMissingPathReturnsFalseAndLogs) {
  EXPECT_FALSE(collector_->collectPath(directory_.file("missing")));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " + ioFailure(ENOENT, "No such file or directory")));
  EXPECT_EQ(log_.errorCount(), 1U);
  EXPECT_EQ(log_.lines()[0].file, "TrashCollector.cpp");
  EXPECT_EQ(queues_->queue(0)->pending(), 0U);
}

TEST_F(TrashCollectorTest, TheTrashDirectoryMadeBeforeAFailureStays) {
  EXPECT_FALSE(collector_->collectPath(directory_.file("missing")));
  EXPECT_TRUE(directory_.exists("cache/trash"));
  EXPECT_THAT(trashed(), IsEmpty());
}

TEST_F(TrashCollectorTest, AFailedRenameLeavesThePathInItsPlace) {
  makeTree("tree");
  files_->failNext(Operation::Rename, EXDEV);
  EXPECT_FALSE(collector_->collectPath(directory_.file("tree")));
  EXPECT_EQ(directory_.read("tree/two"), "2");
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " + ioFailure(EXDEV, "Invalid cross-device link")));
  EXPECT_EQ(files_->calls(Operation::Rename), 1U);
}

TEST_F(TrashCollectorTest, AFileInThePlaceOfTheTrashDirectoryIsAFailureThatLosesNothing) {
  makeTree("tree");
  directory_.write("cache/trash", "in the way");
  EXPECT_FALSE(collector_->collectPath(directory_.file("tree")));
  EXPECT_THAT(log_.messages(),
              ElementsAre("Cannot collect path. " +
                          ioFailure(0, "Could not create directory at \"" + trashPath() + "\": file exists")));
  EXPECT_EQ(directory_.read("tree/one"), "1");
  EXPECT_EQ(directory_.read("cache/trash"), "in the way");
}

TEST_F(TrashCollectorTest, CollectingWhatHoldsTheTrashFailsAndLosesNothing) {
  directory_.write("cache/file", "stays");
  EXPECT_FALSE(collector_->collectPath(directory_.file("cache")));
  EXPECT_EQ(directory_.read("cache/file"), "stays");
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(TrashCollectorTest, CollectingTheEmptyPathReturnsFalse) {
  EXPECT_FALSE(collector_->collectPath(""));
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(TrashCollectorTest, AQueueThatTakesNoTasksMakesCollectingFailAfterTheMove) {
  queues_->queue(0)->throwOnDispatch(true);
  EXPECT_FALSE(collector_->collectPath(makeTree("tree")));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. The queue takes no tasks."));
  EXPECT_EQ(trashed().size(), 1U);
}

TEST_F(TrashCollectorTest, ATrashDirectoryThatVanishesBeforeTheRenameIsMadeAgain) {
  for (int vanishings = 1; vanishings <= 2; ++vanishings) {
    int left = vanishings;
    files_->onCall = [&](Operation operation, const string&) {
      if (operation == Operation::Rename && left-- > 0) std::filesystem::remove_all(trashPath());
    };
    EXPECT_TRUE(collector_->collectPath(makeTree("tree"))) << vanishings;
    files_->onCall = nullptr;
    EXPECT_FALSE(directory_.exists("tree"));
    EXPECT_EQ(trashed().size(), 1U);
    queues_->runAll();
  }
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, ADanglingLinkIsMovedAgainToo) {
  bool vanished = false;
  files_->onCall = [&](Operation operation, const string&) {
    if (operation == Operation::Rename && !vanished) vanished = std::filesystem::remove_all(trashPath()) > 0;
  };
  EXPECT_TRUE(collector_->collectPath(link("dangling", "nowhere")));
  EXPECT_TRUE(vanished);
  EXPECT_FALSE(directory_.exists("dangling"));
}

TEST_F(TrashCollectorTest, ATrashDirectoryThatVanishesEveryTimeIsGivenUp) {
  files_->onCall = [&](Operation operation, const string&) {
    if (operation == Operation::Rename) std::filesystem::remove_all(trashPath());
  };
  EXPECT_FALSE(collector_->collectPath(makeTree("tree")));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " + ioFailure(ENOENT, "No such file or directory")));
  EXPECT_EQ(directory_.read("tree/one"), "1");
}

TEST_F(TrashCollectorTest, AMissingPathIsNotTriedAgain) {
  collector_->collectPath(directory_.file("missing"));
  EXPECT_EQ(files_->calls(Operation::Rename), 1U);
}

TEST_F(TrashCollectorTest, ARenameThatFailsThoughTheTrashIsThereIsNotTriedAgain) {
  for (const int code : {EIO, EEXIST, EACCES}) {
    const string path = makeTree("tree");
    const std::size_t before = files_->calls(Operation::Rename);
    files_->failNext(Operation::Rename, code);
    EXPECT_FALSE(collector_->collectPath(path)) << code;
    EXPECT_EQ(files_->calls(Operation::Rename), before + 1) << code;
    EXPECT_TRUE(directory_.exists("tree/one"));
  }
  EXPECT_EQ(log_.errorCount(), 3U);
}

TEST_F(TrashCollectorTest, ATrashDirectoryThatAnotherThreadCreatesInBetweenIsUsed) {
  class CreatedInBetween : public FileUtils {
   public:
    explicit CreatedInBetween(string trash) : trash_(std::move(trash)) {}
    bool pathExists(const string& path) override {
      const bool exists = FileUtils::pathExists(path);
      if (path == trash_ && !exists) created = std::filesystem::create_directories(path);
      return exists;
    }
    bool created = false;

   private:
    string trash_;
  };
  const auto files = std::make_shared<CreatedInBetween>(trashPath());
  EXPECT_TRUE(makeCollector(files)->collectPath(makeTree("tree")));
  EXPECT_TRUE(files->created);
  EXPECT_EQ(trashed().size(), 1U);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, ATrashDirectoryThatVanishesWhileItIsBeingLookedAtIsMadeAgain) {
  bool vanished = false;
  directory_.makeDirectory("cache/trash");
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation == Operation::IsDirectory && path == trashPath() && !vanished) {
      vanished = std::filesystem::remove_all(trashPath()) > 0;
    }
  };
  EXPECT_TRUE(collector_->collectPath(makeTree("tree")));
  EXPECT_TRUE(vanished);
  EXPECT_EQ(trashed().size(), 1U);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, SeveralThreadsCollectWhileThePassesRun) {
  constexpr std::size_t threads = 4;
  constexpr int trees = 12;
  for (std::size_t thread = 0; thread < threads; ++thread) {
    for (int i = 0; i < trees; ++i) makeTree(std::to_string(thread) + "/" + std::to_string(i));
  }
  directory_.makeDirectory("cache/trash");
  std::atomic<int> collected{0};
  test::runOnThreads(threads, [&](std::size_t thread) {
    for (int i = 0; i < trees; ++i) {
      if (collector_->collectPath(directory_.file(std::to_string(thread) + "/" + std::to_string(i)))) ++collected;
      queues_->queue(0)->runNext();
    }
  });
  queues_->runAll();
  for (std::size_t thread = 0; thread < threads; ++thread)
    EXPECT_THAT(directory_.names(std::to_string(thread)), IsEmpty());
  EXPECT_EQ(collected, static_cast<int>(threads) * trees);
  EXPECT_THAT(trashed(), IsEmpty());
}

// Without a queue

TEST_F(TrashCollectorTest, WithoutAQueueCollectingDeletesInPlace) {
  const auto collector = makeCollectorWithoutQueue();
  EXPECT_TRUE(collector->collectPath(makeTree("tree")));
  EXPECT_THAT(directory_.names(), IsEmpty());
  EXPECT_EQ(files_->calls(Operation::Rename), 0U);
  EXPECT_EQ(files_->trace().front(), "recursiverDirectoryDelete " + directory_.file("tree"));
}

TEST_F(TrashCollectorTest, WithoutAQueueAFailureReturnsFalseAndLogs) {
  const auto collector = makeCollectorWithoutQueue();
  EXPECT_FALSE(collector->collectPath(directory_.file("missing")));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " +
                                           ioFailure(ENOENT, "Could not open directory: No such file or directory")));
}

TEST_F(TrashCollectorTest, WithoutAQueueALinkIsRemovedAndItsTargetStays) {
  makeTree("target");
  EXPECT_TRUE(makeCollectorWithoutQueue()->collectPath(link("link", "target")));
  EXPECT_THAT(directory_.names(), ElementsAre("target"));
  EXPECT_EQ(directory_.names("target").size(), 2U);
}

TEST_F(TrashCollectorTest, WithoutAQueueEmptyingStillDeletesTheTrashDirectory) {
  const auto collector = makeCollectorWithoutQueue();
  makeTree("cache/trash/left over");
  collector->emptyAllTrash();
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_EQ(reportedCount(), 4U);
}

// Emptying

TEST_F(TrashCollectorTest, EmptyingAnAbsentTrashDirectoryReportsZero) {
  empty();
  EXPECT_EQ(reportedCount(), 0U);
  EXPECT_THAT(directory_.names(), IsEmpty());
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, EmptyingAnEmptyTrashDirectoryReportsZero) {
  directory_.makeDirectory("cache/trash");
  empty();
  EXPECT_EQ(reportedCount(), 0U);
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, EmptyingCountsFilesTheCollectedDirectoryAndTheTrashDirectory) {
  collector_->collectPath(makeTree("tree"));
  empty();
  EXPECT_EQ(reportedCount(), 4U);
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, EmptyingReportsTheTimeInSeconds) {
  collector_->collectPath(makeTree("tree"));
  empty();
  const JsonValue event = onlyEvent();
  ASSERT_TRUE(event.at("time_spent").is_number_float());
  const double milliseconds = event.at("time_spent").get<double>() * 1000;
  EXPECT_GE(milliseconds, 0);
  EXPECT_NEAR(milliseconds, static_cast<double>(static_cast<long long>(milliseconds + 0.5)), 1e-6);
}

TEST_F(TrashCollectorTest, EmptyingDeletesWhatAnEarlierProcessLeft) {
  makeTree("cache/trash/0123456789abcdef");
  directory_.write("cache/trash/deep/er/file", "x");
  directory_.write("cache/trash/file", "x");
  empty();
  EXPECT_EQ(reportedCount(), 8U);
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, ALinkCountsOnceAndItsTargetIsNeitherCountedNorTouched) {
  makeTree("target");
  directory_.makeDirectory("tree");
  link("tree/toDirectory", "../target");
  link("tree/absolute", directory_.file("target"));
  link("tree/dangling", "nowhere");
  collector_->collectPath(directory_.file("tree"));
  collector_->collectPath(link("link", directory_.file("target")));
  empty();
  EXPECT_EQ(reportedCount(), 6U);
  EXPECT_THAT(directory_.names("target"), ElementsAre("one", "two"));
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, PassesInTheBackgroundAreNotReportedAndNotCountedLater) {
  collector_->collectPath(makeTree("tree"));
  queues_->runAll();
  EXPECT_THAT(events_->events(), IsEmpty());
  empty();
  EXPECT_EQ(reportedCount(), 0U);
}

TEST_F(TrashCollectorTest, EachEmptyingCountsAnew) {
  collector_->collectPath(makeTree("tree"));
  empty();
  collector_->collectPath(directory_.write("file", ""));
  empty();
  ASSERT_EQ(events_->events().size(), 2U);
  EXPECT_EQ(events_->events()[1].json().at("file_count"), 2);
}

TEST_F(TrashCollectorTest, EmptyingWaitsForQueuedPassesWhichLeaveTheWorkToIt) {
  collector_->collectPath(makeTree("tree"));
  std::size_t deletedByThePass = 99;
  const auto queue = queues_->queue(0);
  queue->onDispatch = [&] {
    EXPECT_EQ(queue->runAll(), 2U);  // the pass and the empty task behind it
    deletedByThePass = files_->calls(Operation::DeleteFile);
  };
  collector_->emptyAllTrash();
  EXPECT_EQ(deletedByThePass, 0U);
  EXPECT_EQ(reportedCount(), 4U);
  EXPECT_THAT(trashed(), IsEmpty());
}

TEST_F(TrashCollectorTest, EmptyingInterruptsAPassThatIsUnderWay) {
  for (int i = 0; i < 50; ++i) directory_.write("tree/" + std::to_string(i), "");
  collector_->collectPath(directory_.file("tree"));
  const auto queue = queues_->queue(0);
  test::Latch passHasBegun(1);
  test::Latch emptyingHasBegun(1);
  std::atomic<int> deletedByThePass{0};
  const std::thread::id emptier = std::this_thread::get_id();
  files_->onCall = [&](Operation operation, const string&) {
    if (operation != Operation::DeleteFile || std::this_thread::get_id() == emptier) return;
    ++deletedByThePass;
    passHasBegun.countDown();
    emptyingHasBegun.wait();
  };
  queue->onDispatch = [&] { emptyingHasBegun.countDown(); };
  std::thread background([&] {
    queue->runNext();
    emptyingHasBegun.wait();
    queue->runAll();
  });
  passHasBegun.wait();
  collector_->emptyAllTrash();
  background.join();
  EXPECT_EQ(deletedByThePass, 1);
  EXPECT_EQ(reportedCount(), 51U);  // what is left: 49 files and two directories
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, CollectingGoesOnAfterAnEmptying) {
  empty();
  collector_->collectPath(makeTree("tree"));
  queues_->runAll();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, WithoutAReporterEmptyingReportsNothingAndWorks) {
  collector_ = std::make_shared<TrashCollector>(trashPath(), files_, nullptr, nullptr);
  makeTree("cache/trash/tree");
  collector_->emptyAllTrash();
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, AQueueThatDropsItsTasksDoesNotHoldUpAnEmptying) {
  const auto queue = queues_->queue(0);
  queue->onDispatch = [&] { queue->dropAll(); };
  EXPECT_TRUE(collector_->collectPath(makeTree("tree")));
  EXPECT_EQ(trashed().size(), 1U);
  EXPECT_NO_THROW(collector_->emptyAllTrash());
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_EQ(reportedCount(), 4U);
}

TEST_F(TrashCollectorTest, AQueueThatTakesNoTasksDoesNotHoldUpAnEmptying) {
  makeTree("cache/trash/tree");
  queues_->queue(0)->throwOnDispatch(true);
  EXPECT_NO_THROW(collector_->emptyAllTrash());
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_EQ(reportedCount(), 4U);
}

TEST_F(TrashCollectorTest, EmptyingFromTwoThreadsAtOnceEmptiesAll) {
  const auto queue = queues_->queue(0);
  queue->onDispatch = [raw = queue.get()] { raw->runAll(); };
  for (int i = 0; i < 20; ++i) makeTree("cache/trash/" + std::to_string(i));
  test::runOnThreads(2, [&] { collector_->emptyAllTrash(); });
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_EQ(events_->events().size(), 2U);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, EmptyingBesideCollectionsLosesNothingAndEndsEmpty) {
  const auto queue = queues_->queue(0);
  queue->onDispatch = [raw = queue.get()] { raw->runAll(); };
  for (int i = 0; i < 30; ++i) makeTree(std::to_string(i));
  directory_.makeDirectory("cache/trash");
  std::atomic<int> collected{0};
  test::runOnThreads(2, [&](std::size_t thread) {
    for (int i = 0; i < 30; ++i) {
      if (thread == 0) {
        collector_->emptyAllTrash();
      } else if (collector_->collectPath(directory_.file(std::to_string(i)))) {
        ++collected;
      }
    }
  });
  EXPECT_EQ(collected, 30);
  collector_->emptyAllTrash();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

// Passes

TEST_F(TrashCollectorTest, APassDeletesContentsBeforeTheirDirectory) {
  directory_.write("cache/trash/a/b/file", "x");
  collector_->collectPath(directory_.file("cache/trash/a"));
  files_->clearTrace();
  queues_->runAll();
  std::vector<string> deleted;
  for (const string& line : files_->trace()) {
    if (line.rfind("deleteFile ", 0) == 0) deleted.push_back(files_->basename(line));
  }
  ASSERT_EQ(deleted.size(), 4U);
  EXPECT_THAT(std::vector<string>(deleted.begin(), deleted.begin() + 2), ElementsAre("file", "b"));
  EXPECT_EQ(deleted.back(), "trash");
}

TEST_F(TrashCollectorTest, APassThatFindsNoTrashDirectoryDoesNothing) {
  collector_->collectPath(makeTree("tree"));
  collector_->collectPath(makeTree("tree"));
  EXPECT_EQ(queues_->runAll(), 2U);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, WhatIsMovedInDuringAPassIsNotLeftBehind) {
  collector_->collectPath(makeTree("first"));
  bool moved = false;
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::DeleteFile || path != trashPath() || moved) return;
    moved = true;
    makeTree("cache/trash/late");
  };
  queues_->runAll();
  EXPECT_TRUE(moved);
  empty();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, WhatIsMovedInJustAfterTheTrashDirectoryWentIsTakenInTheSamePass) {
  class MovesInLate : public FaultyFileUtils {
   public:
    void deleteFile(const string& path) override {
      FaultyFileUtils::deleteFile(path);
      if (path == trash && !moved) {
        moved = true;
        createDirectory(trash + "/late", true);
      }
    }
    string trash;
    bool moved = false;
  };
  const auto files = std::make_shared<MovesInLate>();
  files->trash = trashPath();
  makeCollector(files)->collectPath(makeTree("tree"));
  const auto collector = makeCollector(files);
  collector->collectPath(directory_.write("file", ""));
  queues_->queue(2)->runAll();
  EXPECT_TRUE(files->moved);
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, ADirectoryThatKeepsFillingIsListedTenTimesAtMost) {
  makeTree("tree");
  collector_->collectPath(directory_.file("tree"));
  const string entry = trashPath() + "/" + trashed().at(0);
  int listings = 0;
  files_->onCall = [&](Operation operation, const string& path) {
    if (path != entry) return;
    if (operation == Operation::ListDirectory) ++listings;
    if (operation == Operation::ListDirectory || operation == Operation::DeleteFile) {
      directory_.write("cache/trash/" + files_->basename(entry) + "/late " + std::to_string(listings), "");
    }
  };
  queues_->runAll();
  EXPECT_EQ(listings, 10);
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. " +
                                           ioFailure(ENOTEMPTY, "Could not remove file: Directory not empty")));
  files_->onCall = nullptr;
  empty();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, ADirectoryThatStopsFillingAtTheTenthListingIsDeleted) {
  makeTree("tree");
  collector_->collectPath(directory_.file("tree"));
  const string entry = trashPath() + "/" + trashed().at(0);
  int listings = 0;
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::ListDirectory || path != entry) return;
    if (++listings <= 10) directory_.write("cache/trash/" + files_->basename(entry) + "/late", "");
  };
  queues_->runAll();
  EXPECT_EQ(listings, 10);
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, AFailureEndsThePassWithOneLineAndTheNextPassGoesOn) {
  makeTree("cache/trash/stuck");
  files_->failPath(Operation::DeleteFile, trashPath() + "/stuck/one", EBUSY);
  collector_->collectPath(directory_.write("file", ""));
  queues_->runAll();
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. " + ioFailure(EBUSY, "Device or resource busy")));
  EXPECT_EQ(log_.errorCount(), 1U);
  EXPECT_TRUE(directory_.exists("cache/trash/stuck/one"));
  files_->heal();
  collector_->collectPath(directory_.write("file", ""));
  queues_->runAll();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, AFailedEmptyingIsLoggedAndReportedWithWhatItDid) {
  makeTree("cache/trash/tree");
  files_->failAlways(Operation::ListDirectory, EIO);
  EXPECT_NO_THROW(empty());
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. " + ioFailure(EIO, "Input/output error")));
  EXPECT_EQ(reportedCount(), 0U);
}

TEST_F(TrashCollectorTest, AFailureOfAnotherTypeDoesNotEscapeAPass) {
  collector_->collectPath(makeTree("tree"));
  files_->onCall = [](Operation operation, const string&) {
    if (operation == Operation::ListDirectory) throw std::logic_error("odd host");
  };
  EXPECT_NO_THROW(queues_->runAll());
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. odd host"));
}

TEST_F(TrashCollectorTest, APassThatMeetsWhatCannotBeListedEndsInsteadOfTryingForEver) {
  directory_.makeDirectory("tree");
  ASSERT_EQ(mkfifo(directory_.file("tree/fifo").c_str(), 0600), 0);
  files_->failAlways(Operation::ListOtherEntries, EMFILE);
  collector_->collectPath(directory_.file("tree"));
  queues_->runAll();
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. " +
                                           ioFailure(ENOTEMPTY, "Could not remove file: Directory not empty")));
}

TEST_F(TrashCollectorTest, ACollectorThatIsGoneLeavesItsQueuedPassHarmless) {
  collector_->collectPath(makeTree("tree"));
  collector_.reset();
  queues_->runAll();
  EXPECT_FALSE(directory_.exists("tree"));
  collector_ = makeCollector(files_);
  queues_->queue(1)->onDispatch = [queue = queues_->queue(1).get()] { queue->runAll(); };
  collector_->emptyAllTrash();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorTest, AQueuedPassDoesNotKeepTheCollectorsServicesAlive) {
  collector_->collectPath(makeTree("tree"));
  collector_.reset();
  const std::weak_ptr<FaultyFileUtils> files = files_;
  files_.reset();
  queues_->runAll();
  EXPECT_TRUE(files.expired());
}

// Deleting by predicate

TEST_F(TrashCollectorTest, AFilterThatAcceptsEverythingDeletesTheTreeWithItsRoot) {
  makeTree("root/a");
  directory_.makeDirectory("root/empty");
  EXPECT_TRUE(collector_->removeFilesWithFilter(directory_.file("root"), acceptAll));
  EXPECT_THAT(directory_.names(), IsEmpty());
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, AFilterThatRejectsTheRootAloneDeletesAllBelowIt) {
  makeTree("root/a");
  const string root = directory_.file("root");
  EXPECT_FALSE(collector_->removeFilesWithFilter(root, [&](const string& path) { return path != root; }));
  EXPECT_THAT(directory_.names("root"), IsEmpty());
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, ARejectedFileKeepsItsDirectoriesAndTheFilterIsNotAskedAboutThem) {
  directory_.write("root/a/keep", "stays");
  directory_.write("root/a/drop", "x");
  directory_.write("root/b/drop", "x");
  std::vector<string> asked;
  EXPECT_FALSE(collector_->removeFilesWithFilter(directory_.file("root"), [&](const string& path) {
    asked.push_back(path);
    return path != directory_.file("root/a/keep");
  }));
  EXPECT_THAT(directory_.names("root"), ElementsAre("a"));
  EXPECT_THAT(directory_.names("root/a"), ElementsAre("keep"));
  EXPECT_THAT(asked, UnorderedElementsAre(directory_.file("root/a/keep"), directory_.file("root/a/drop"),
                                          directory_.file("root/b/drop"), directory_.file("root/b")));
}

TEST_F(TrashCollectorTest, AnEmptyDirectoryIsDecidedByTheFilterAlone) {
  directory_.makeDirectory("empty");
  EXPECT_FALSE(collector_->removeFilesWithFilter(directory_.file("empty"), [](const string&) { return false; }));
  EXPECT_TRUE(directory_.exists("empty"));
  EXPECT_TRUE(collector_->removeFilesWithFilter(directory_.file("empty"), acceptAll));
  EXPECT_FALSE(directory_.exists("empty"));
}

TEST_F(TrashCollectorTest, AFileIsDecidedByTheFilter) {
  const string path = directory_.write("file", "x");
  EXPECT_FALSE(collector_->removeFilesWithFilter(path, [](const string&) { return false; }));
  EXPECT_TRUE(directory_.exists("file"));
  EXPECT_TRUE(collector_->removeFilesWithFilter(path, acceptAll));
  EXPECT_FALSE(directory_.exists("file"));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorTest, TheFilterIsAskedAboutContentsBeforeTheirDirectory) {
  directory_.write("root/a/file", "x");
  std::vector<string> asked;
  collector_->removeFilesWithFilter(directory_.file("root"), [&](const string& path) {
    asked.push_back(path);
    return true;
  });
  EXPECT_THAT(asked, ElementsAre(directory_.file("root/a/file"), directory_.file("root/a"), directory_.file("root")));
}

TEST_F(TrashCollectorTest, LinksAreFilteredAsLinksAndTheirTargetsStay) {
  makeTree("target");
  directory_.makeDirectory("root");
  link("root/toDirectory", "../target");
  link("root/dangling", "nowhere");
  EXPECT_TRUE(collector_->removeFilesWithFilter(directory_.file("root"), acceptAll));
  EXPECT_TRUE(collector_->removeFilesWithFilter(link("link", "target"), acceptAll));
  EXPECT_THAT(directory_.names(), ElementsAre("target"));
  EXPECT_EQ(directory_.names("target").size(), 2U);
}

TEST_F(TrashCollectorTest, ALinkIsAskedAboutOnceUnderItsOwnPath) {
  makeTree("target");
  std::vector<string> asked;
  EXPECT_FALSE(collector_->removeFilesWithFilter(link("link", "target"), [&](const string& path) {
    asked.push_back(path);
    return false;
  }));
  EXPECT_THAT(asked, ElementsAre(directory_.file("link")));
  EXPECT_TRUE(directory_.exists("link"));
}

TEST_F(TrashCollectorTest, AMissingPathIsAskedAboutAndFailsOnlyWhenAccepted) {
  const string missing = directory_.file("missing");
  EXPECT_FALSE(collector_->removeFilesWithFilter(missing, [](const string&) { return false; }));
  EXPECT_THAT(log_.messages(), IsEmpty());
  EXPECT_FALSE(collector_->removeFilesWithFilter(missing, acceptAll));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " +
                                           ioFailure(ENOENT, "Could not remove file: No such file or directory")));
}

TEST_F(TrashCollectorTest, AnUndeletableFileKeepsItsDirectoryAndTheRestGoes) {
  makeTree("root");
  files_->failPath(Operation::DeleteFile, directory_.file("root/one"), EBUSY);
  EXPECT_FALSE(collector_->removeFilesWithFilter(directory_.file("root"), acceptAll));
  EXPECT_THAT(directory_.names("root"), ElementsAre("one"));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " + ioFailure(EBUSY, "Device or resource busy")));
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(TrashCollectorTest, ADirectoryThatCannotBeListedStays) {
  makeTree("root/locked");
  directory_.write("root/open/file", "x");
  files_->failPath(Operation::ListDirectory, directory_.file("root/locked"), EACCES);
  EXPECT_FALSE(collector_->removeFilesWithFilter(directory_.file("root"), acceptAll));
  EXPECT_THAT(directory_.names("root"), ElementsAre("locked"));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. " + ioFailure(EACCES, "Permission denied")));
}

TEST_F(TrashCollectorTest, AFilterThatThrowsIsLoggedAndKeepsItsEntryAlone) {
  makeTree("root");
  EXPECT_FALSE(collector_->removeFilesWithFilter(directory_.file("root"), [&](const string& path) {
    if (path == directory_.file("root/one")) throw std::runtime_error("undecided");
    return true;
  }));
  EXPECT_THAT(directory_.names("root"), ElementsAre("one"));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect path. undecided"));
}

TEST_F(TrashCollectorTest, AnEmptyFilterIsAFailureThatDeletesNothing) {
  makeTree("root");
  EXPECT_FALSE(collector_->removeFilesWithFilter(directory_.file("root"), nullptr));
  EXPECT_EQ(directory_.names("root").size(), 2U);
}

TEST_F(TrashCollectorTest, DeletingByPredicateNeedsNeitherTrashNorQueue) {
  makeTree("root");
  collector_->removeFilesWithFilter(directory_.file("root"), acceptAll);
  EXPECT_EQ(queues_->queue(0)->pending(), 0U);
  EXPECT_EQ(files_->calls(Operation::Rename), 0U);
  EXPECT_THAT(directory_.names(), IsEmpty());
}

TEST_F(TrashCollectorTest, DeletingByPredicateCallsItselfVirtually) {
  class Counting : public TrashCollector {
   public:
    using TrashCollector::TrashCollector;
    bool removeFilesWithFilter(const string& path, const std::function<bool(const string&)>& filter) override {
      ++calls;
      return TrashCollector::removeFilesWithFilter(path, filter);
    }
    int calls = 0;
  };
  makeTree("root");
  Counting collector(trashPath(), files_, nullptr, nullptr);
  EXPECT_TRUE(collector.removeFilesWithFilter(directory_.file("root"), acceptAll));
  EXPECT_EQ(collector.calls, 3);
}

TEST_F(TrashCollectorTest, AFilterMayCollectOtherPaths) {
  makeTree("root");
  makeTree("other");
  int collected = 0;
  EXPECT_TRUE(collector_->removeFilesWithFilter(directory_.file("root"), [&](const string&) {
    if (directory_.exists("other") && collector_->collectPath(directory_.file("other"))) ++collected;
    return true;
  }));
  EXPECT_EQ(collected, 1);
  EXPECT_FALSE(directory_.exists("other"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
