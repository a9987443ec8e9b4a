#include <glog/logging.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "support/Barrier.h"
#include "support/FaultyFileUtils.h"
#include "support/LogCapture.h"
#include "support/ManualQueue.h"
#include "support/RecordingAnalytics.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;
using testing::ElementsAre;

constexpr std::int64_t kSecond = 1000000000;

// ManualExecutor

TEST(ManualExecutor, RunsNothingUntilItIsTold) {
  ManualExecutor queue;
  int ran = 0;
  queue.dispatch([&] { ++ran; });
  EXPECT_EQ(ran, 0);
  EXPECT_EQ(queue.pending(), 1U);
  EXPECT_TRUE(queue.runNext());
  EXPECT_EQ(ran, 1);
  EXPECT_FALSE(queue.runNext());
}

TEST(ManualExecutor, RunsTasksInOrderAndThoseAddedMeanwhileToo) {
  ManualExecutor queue;
  std::vector<int> order;
  queue.dispatch([&] {
    order.push_back(1);
    queue.dispatch([&] { order.push_back(3); });
  });
  queue.dispatch([&] { order.push_back(2); });
  EXPECT_EQ(queue.runAll(), 3U);
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
}

TEST(ManualExecutor, DestroysATaskOnceItHasRun) {
  ManualExecutor queue;
  auto held = std::make_shared<int>(0);
  queue.dispatch([held] { ++*held; });
  queue.runNext();
  EXPECT_EQ(*held, 1);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(ManualExecutor, DropsTasksUnrun) {
  ManualExecutor queue;
  auto held = std::make_shared<int>(0);
  queue.dispatch([held] { ++*held; });
  queue.dropAll();
  EXPECT_EQ(queue.pending(), 0U);
  EXPECT_EQ(*held, 0);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(ManualExecutor, ATaskMayDispatchWhileItIsDropped) {
  ManualExecutor queue;
  std::shared_ptr<int> dispatching(new int(0), [&](const int* value) {
    queue.dispatch([] {});
    delete value;
  });
  queue.dispatch([held = std::move(dispatching)] {});
  queue.dropAll();
  EXPECT_EQ(queue.pending(), 1U);
}

TEST(ManualExecutor, AnExceptionReachesTheRunnerAndTheTaskIsGone) {
  ManualExecutor queue;
  queue.dispatch([] { throw std::domain_error("task"); });
  EXPECT_THROW(queue.runNext(), std::domain_error);
  EXPECT_EQ(queue.pending(), 0U);
  queue.dispatch([] {});
  EXPECT_TRUE(queue.runNext());
}

TEST(ManualExecutor, TheHookSeesEveryDispatchAndMayRunTheTaskAtOnce) {
  ManualExecutor queue;
  queue.onDispatch = [&] { queue.runAll(); };
  int ran = 0;
  queue.dispatch([&] { queue.dispatch([&] { ++ran; }); });
  EXPECT_EQ(ran, 1);
}

TEST(ManualExecutor, CanRefuseTasks) {
  ManualExecutor queue;
  queue.throwOnDispatch(true);
  EXPECT_THROW(queue.dispatch([] {}), std::runtime_error);
  EXPECT_EQ(queue.pending(), 0U);
  queue.throwOnDispatch(false);
  queue.dispatch([] {});
  EXPECT_EQ(queue.pending(), 1U);
}

TEST(ManualExecutor, RunsOneTaskAtATimeWhoeverRunsIt) {
  ManualExecutor queue;
  int running = 0;
  int most = 0;
  for (int i = 0; i < 200; ++i) {
    queue.dispatch([&] {  // plain integers: the queue itself keeps the tasks apart
      most = std::max(most, ++running);
      --running;
    });
  }
  std::atomic<std::size_t> ran{0};
  runOnThreads(4, [&] { ran += queue.runAll(); });
  EXPECT_EQ(ran, 200U);
  EXPECT_EQ(most, 1);
}

TEST(ManualExecutor, ATaskMayLetGoOfTheLastReferenceToItsQueue) {
  auto queue = std::make_shared<ManualExecutor>();
  ManualExecutor* const raw = queue.get();
  raw->dispatch([held = std::move(queue)] {});
  EXPECT_TRUE(raw->runNext());
}

TEST(ManualExecutor, ATimerFiresWhenItsDelayIsNamed) {
  ManualExecutor queue;
  int fired = 0;
  const auto timer = queue.dispatchAfter(
      5 * kSecond, [&] { ++fired; }, nullptr);
  EXPECT_EQ(queue.runAll(), 0U);
  EXPECT_FALSE(queue.fireTimer(4 * kSecond));
  EXPECT_THAT(queue.armedDelays(), ElementsAre(5 * kSecond));
  EXPECT_TRUE(queue.fireTimer(5 * kSecond));
  EXPECT_EQ(fired, 1);
  EXPECT_FALSE(queue.fireTimer(5 * kSecond));
  EXPECT_TRUE(queue.armedDelays().empty());
}

TEST(ManualExecutor, DestroyingTheHandleCancelsTheTimerAndFreesItsTask) {
  ManualExecutor queue;
  auto held = std::make_shared<int>(0);
  auto timer = queue.scheduleAfter(
      kSecond, [held] { ++*held; }, nullptr);
  timer.reset();
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_FALSE(queue.fireTimer(kSecond));
  ASSERT_EQ(queue.timers().size(), 1U);
  EXPECT_TRUE(queue.timers()[0].cancelled);
  EXPECT_FALSE(queue.timers()[0].fired);
}

TEST(ManualExecutor, AFiredTimerDoesNotCountAsCancelled) {
  ManualExecutor queue;
  std::unique_ptr<AsyncTimer> timer;
  timer = queue.dispatchAfter(
      kSecond, [&] { timer.reset(); }, nullptr);
  EXPECT_TRUE(queue.fireTimer(kSecond));
  EXPECT_EQ(timer, nullptr);
  EXPECT_TRUE(queue.timers()[0].fired);
  EXPECT_FALSE(queue.timers()[0].cancelled);
}

TEST(ManualExecutor, RemembersHowEachTimerWasArmed) {
  ManualExecutor queue;
  const auto first = queue.dispatchAfter(
      kSecond, [] {}, nullptr);
  const auto second = queue.scheduleAfter(
      2 * kSecond, [] {}, [] {});
  ASSERT_EQ(queue.timers().size(), 2U);
  EXPECT_FALSE(queue.timers()[0].viaSchedule);
  EXPECT_TRUE(queue.timers()[1].viaSchedule);
  EXPECT_EQ(queue.timers()[1].delayNanoseconds, 2 * kSecond);
  EXPECT_EQ(queue.companions(), 1U);
}

TEST(ManualExecutor, OfTwoTimersOfOneDelayTheOlderFiresFirst) {
  ManualExecutor queue;
  std::vector<int> order;
  const auto first = queue.dispatchAfter(
      kSecond, [&] { order.push_back(1); }, nullptr);
  const auto second = queue.dispatchAfter(
      kSecond, [&] { order.push_back(2); }, nullptr);
  EXPECT_TRUE(queue.fireTimer(kSecond));
  EXPECT_TRUE(queue.fireTimer(kSecond));
  EXPECT_THAT(order, ElementsAre(1, 2));
}

TEST(ManualExecutor, AHandleMayOutliveTheQueue) {
  auto held = std::make_shared<int>(0);
  std::unique_ptr<AsyncTimer> timer;
  {
    ManualExecutor queue;
    timer = queue.dispatchAfter(
        kSecond, [held] {}, nullptr);
  }
  EXPECT_EQ(held.use_count(), 1);
  timer.reset();
}

// ManualQueueFactory

TEST(ManualQueueFactory, KeepsItsQueuesInTheOrderOfTheirCreation) {
  ManualQueueFactory factory;
  const auto queue = factory.createQueue();
  const auto firstWork = factory.createWorkQueue();
  const auto secondWork = factory.createWorkQueue();
  EXPECT_EQ(factory.queueCount(), 1U);
  EXPECT_EQ(factory.workQueueCount(), 2U);
  EXPECT_EQ(factory.queue(0), queue);
  EXPECT_EQ(factory.workQueue(0), firstWork);
  EXPECT_EQ(factory.workQueue(1), secondWork);
  EXPECT_THROW(factory.queue(1), std::out_of_range);
}

TEST(ManualQueueFactory, RunsAllItsQueuesInTurnUntilTheyAreEmpty) {
  ManualQueueFactory factory;
  const auto queue = factory.createQueue();
  const auto work = factory.createWorkQueue();
  std::vector<string> order;
  queue->dispatch([&] {
    order.emplace_back("queue 1");
    factory.createWorkQueue()->dispatch([&] { order.emplace_back("new"); });
  });
  queue->dispatch([&] { order.emplace_back("queue 2"); });
  work->dispatch([&] { order.emplace_back("work 1"); });
  EXPECT_EQ(factory.runAll(), 4U);
  EXPECT_THAT(order, ElementsAre("queue 1", "work 1", "queue 2", "new"));
  EXPECT_EQ(factory.runAll(), 0U);
}

TEST(ManualQueueFactory, ATaskThatHoldsItsOwnQueueIsFreedWithTheFactory) {
  auto held = std::make_shared<int>(0);
  {
    ManualQueueFactory factory;
    const auto queue = factory.createQueue();
    queue->dispatch([queue, held] {});
  }
  EXPECT_EQ(held.use_count(), 1);
}

// Latch, runOnThreads

TEST(Latch, OpensWhenItIsCountedDown) {
  Latch latch(2);
  latch.countDown();
  EXPECT_FALSE(latch.isOpen());
  latch.countDown();
  EXPECT_TRUE(latch.isOpen());
  latch.countDown();
  latch.wait();
  EXPECT_TRUE(latch.isOpen());
}

TEST(Latch, HoldsThreadsBackUntilItOpens) {
  Latch latch(1);
  std::atomic<bool> passed{false};
  std::thread thread([&] {
    latch.wait();
    passed = true;
  });
  EXPECT_FALSE(passed);
  latch.countDown();
  thread.join();
  EXPECT_TRUE(passed);
}

TEST(RunOnThreads, GivesEachThreadItsNumberAndHasThemAllAtOnce) {
  Latch together(3);  // opens only when all three are running
  std::vector<int> seen(3);
  runOnThreads(3, [&](std::size_t i) {
    together.arriveAndWait();
    seen[i] = static_cast<int>(i) + 1;
  });
  EXPECT_THAT(seen, ElementsAre(1, 2, 3));
}

TEST(RunOnThreads, ThrowsWhatAThreadThrew) {
  std::atomic<int> ran{0};
  EXPECT_THROW(runOnThreads(2,
                            [&] {
                              ++ran;
                              throw std::domain_error("thread");
                            }),
               std::domain_error);
  EXPECT_EQ(ran, 2);
}

// LogCapture

TEST(LogCapture, RemembersTheLinesLoggedWhileItLives) {
  LOG(ERROR) << "before";
  const LogCapture capture;
  LOG(ERROR) << "an error " << 1;
  LOG(WARNING) << "a warning";
  EXPECT_THAT(capture.messages(), ElementsAre("an error 1", "a warning"));
  EXPECT_EQ(capture.errorCount(), 1U);
  EXPECT_EQ(capture.lines()[0].file, "SupportTest.cpp");
  EXPECT_EQ(capture.lines()[1].severity, google::GLOG_WARNING);
  EXPECT_TRUE(capture.contains("error 1"));
  EXPECT_FALSE(capture.contains("before"));
}

TEST(LogCapture, TwoMayListenAtOnceAndOneStops) {
  const LogCapture outer;
  {
    const LogCapture inner;
    LOG(ERROR) << "both";
    EXPECT_TRUE(inner.contains("both"));
  }
  LOG(ERROR) << "one";
  EXPECT_THAT(outer.messages(), ElementsAre("both", "one"));
}

// RecordingAnalytics

TEST(RecordingAnalytics, RemembersEventsInOrder) {
  const auto log = std::make_shared<EventLog>();
  RecordingAnalytics analytics(log);
  analytics.logEvent("name", "category", R"({"a":1})", "12");
  analytics.logEvent("other", "", "{}", "");
  ASSERT_EQ(log->events().size(), 2U);
  const LoggedEvent first = log->named("name").at(0);
  EXPECT_EQ(first.category, "category");
  EXPECT_EQ(first.json().at("a"), 1);
  EXPECT_EQ(first.time, "12");
  EXPECT_TRUE(log->named("unknown").empty());
  log->clear();
  EXPECT_TRUE(log->events().empty());
}

TEST(RecordingAnalytics, TheReporterOverItKeepsWritingIntoTheLog) {
  const auto log = std::make_shared<EventLog>();
  const auto reporter = recordingReporter(log);
  reporter->reportEvent(StoreManagerEvent(StoreManagerEvent::Type::Pruning, "store", 1, 2));
  EXPECT_EQ(log->events().size(), 1U);
}

// TemporaryDirectory

TEST(TemporaryDirectory, IsEmptyOfItsOwnAndGoneAtTheEnd) {
  string path;
  {
    const TemporaryDirectory one;
    const TemporaryDirectory two;
    EXPECT_NE(one.path(), two.path());
    EXPECT_TRUE(one.names().empty());
    one.write("a/b/c", "content");
    path = one.path();
    EXPECT_TRUE(std::filesystem::exists(path));
  }
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST(TemporaryDirectory, ReadsBackWhatItWrote) {
  const TemporaryDirectory directory;
  const string bytes("a\0\n\xff", 4);
  EXPECT_EQ(directory.write("deep/file", bytes), directory.file("deep/file"));
  EXPECT_EQ(directory.read("deep/file"), bytes);
  directory.makeDirectory("made/too");
  EXPECT_THAT(directory.names(), ElementsAre("deep", "made"));
  EXPECT_THAT(directory.names("deep"), ElementsAre("file"));
  EXPECT_TRUE(directory.exists("made/too"));
  EXPECT_FALSE(directory.exists("missing"));
  EXPECT_THROW(directory.read("missing"), std::runtime_error);
}

// FaultyFileUtils

class FaultyFileUtilsTest : public testing::Test {
 protected:
  int codeOf(const std::function<void()>& operation) {
    try {
      operation();
      return 0;
    } catch (const FileUtilsIoException& exception) {
      return exception.code();
    }
  }

  TemporaryDirectory directory_;
  FaultyFileUtils files_;
};

TEST_F(FaultyFileUtilsTest, WorksLikeTheRealOneUntilToldOtherwise) {
  files_.createDirectory(directory_.file("a"), false);
  files_.writeFile(directory_.file("a/b"), {'x'});
  EXPECT_EQ(files_.readFile(directory_.file("a/b")), std::vector<unsigned char>{'x'});
  files_.rename(directory_.file("a/b"), directory_.file("a/c"));
  EXPECT_TRUE(files_.isDirectory(directory_.file("a")));
  EXPECT_EQ(files_.listDirectories(directory_.path()), std::vector<string>{"a"});
  EXPECT_EQ(files_.listDirectory(directory_.file("a")).size(), 1U);
  files_.createSymLink(directory_.file("link"), "a");
  EXPECT_TRUE(files_.isSymLink(directory_.file("link")));
  EXPECT_GT(files_.getDiskSpace(directory_.path()).total, 0);
  files_.deleteFile(directory_.file("link"));
  files_.recursiverDirectoryDelete(directory_.file("a"));
  EXPECT_TRUE(directory_.names().empty());
}

TEST_F(FaultyFileUtilsTest, FailsAsOftenAsTold) {
  files_.failNext(Operation::WriteFile, ENOSPC);
  files_.failNext(Operation::WriteFile, EIO);
  const auto write = [&] { files_.writeFile(directory_.file("file"), {}); };
  EXPECT_EQ(codeOf(write), ENOSPC);
  EXPECT_EQ(codeOf(write), EIO);
  EXPECT_FALSE(directory_.exists("file"));
  EXPECT_EQ(codeOf(write), 0);
  EXPECT_TRUE(directory_.exists("file"));
}

TEST_F(FaultyFileUtilsTest, FailsAlwaysOrOnOnePathUntilHealed) {
  files_.failAlways(Operation::ReadFile, EIO);
  files_.failPath(Operation::DeleteFile, directory_.file("a"), EBUSY);
  directory_.write("a", "");
  directory_.write("b", "");
  EXPECT_EQ(codeOf([&] { files_.readFile(directory_.file("a")); }), EIO);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), EBUSY);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), EBUSY);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("b")); }), 0);
  files_.heal();
  EXPECT_EQ(codeOf([&] { files_.readFile(directory_.file("a")); }), 0);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), 0);
}

TEST_F(FaultyFileUtilsTest, AFailingQueryAnswersFalse) {
  files_.failNext(Operation::PathExists, EACCES);
  files_.failNext(Operation::IsDirectory, EACCES);
  EXPECT_FALSE(files_.pathExists(directory_.path()));
  EXPECT_FALSE(files_.isDirectory(directory_.path()));
  EXPECT_TRUE(files_.pathExists(directory_.path()));
  EXPECT_TRUE(files_.isDirectory(directory_.path()));
}

TEST_F(FaultyFileUtilsTest, ATornWriteLeavesItsBeginning) {
  files_.tearNextWrite(2, ENOSPC);
  EXPECT_EQ(codeOf([&] { files_.writeFile(directory_.file("file"), {'a', 'b', 'c'}); }), ENOSPC);
  EXPECT_EQ(directory_.read("file"), "ab");
  EXPECT_EQ(codeOf([&] { files_.writeFile(directory_.file("file"), {'a', 'b', 'c'}); }), 0);
  EXPECT_EQ(directory_.read("file"), "abc");
}

TEST_F(FaultyFileUtilsTest, RecordsEveryCall) {
  files_.failNext(Operation::Rename, EIO);
  EXPECT_EQ(codeOf([&] { files_.rename("/a", "/b"); }), EIO);
  files_.pathExists("/c");
  EXPECT_THAT(files_.trace(), ElementsAre("rename /a /b", "pathExists /c"));
  EXPECT_EQ(files_.calls(Operation::Rename), 1U);
  EXPECT_EQ(files_.calls(Operation::ReadFile), 0U);
  files_.clearTrace();
  EXPECT_TRUE(files_.trace().empty());
}

TEST_F(FaultyFileUtilsTest, TheHookComesBeforeTheFailureAndMayArmIt) {
  std::vector<string> seen;
  files_.onCall = [&](Operation operation, const string& path) {
    seen.push_back(path);
    if (operation == Operation::ReadFile) files_.failNext(Operation::ReadFile, EIO);
  };
  EXPECT_EQ(codeOf([&] { files_.readFile("/missing"); }), EIO);
  EXPECT_THAT(seen, ElementsAre("/missing"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
