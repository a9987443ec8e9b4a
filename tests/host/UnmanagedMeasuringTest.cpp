#include "host/limits/UnmanagedMeasuring.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <filesystem>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "AttributeStore.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "JsonValue.h"
#include "Store.h"
#include "StoreDefinition.h"
#include "StoreManager.h"
#include "host/Host.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using std::string;
using test::EventLog;
using test::FaultyFileUtils;
using test::IncidentLog;
using test::LogCapture;
using test::ManualClock;
using test::ManualExecutor;
using test::ManualQueueFactory;
using test::Operation;
using test::RecordingAnalytics;
using test::TemporaryDirectory;
using test::Watchdog;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

using SteadyClock = std::chrono::steady_clock;
using Texts = std::vector<string>;

constexpr std::time_t kNow = 1'700'000'000;
constexpr std::int64_t kSecond = 1'000'000'000;  // in nanoseconds
constexpr std::chrono::seconds kInterval(60);
constexpr std::int64_t kIntervalNanoseconds = 60 * kSecond;

SteadyClock::time_point steadyTime;  // what the objects under test take for the time

class UnmanagedMeasuringTest : public testing::Test {
 protected:
  UnmanagedMeasuringTest() { start(kInterval); }

  void start(std::chrono::seconds interval) {
    steadyTime = SteadyClock::time_point(std::chrono::hours(1));
    measuring = std::make_shared<UnmanagedMeasuring>(
        interval, UnmanagedMeasuring::Services{queue, files, attributes, sizes, incidents.reporter},
        [] { return steadyTime; });
  }

  // A store as a manager holds it: the fixture holds it once.
  void open(unsigned int maxSize = 1000, bool isCache = true) {
    const auto definition =
        std::make_shared<UnmanagedStoreDefinition>("exports", "media", false, false, 1, maxSize, isCache);
    store = std::make_shared<UnmanagedStore>(directory.makeDirectory("exports"), definition);
  }

  void request() { measuring->noteRequest(store); }

  void write(const string& name, std::size_t bytes) { directory.write("exports/" + name, string(bytes, 'x')); }

  bool fire(std::int64_t delay = kIntervalNanoseconds) { return queue->fireTimer(delay); }

  static string overLimit(std::size_t bytes) {
    return "OverLimit exports: Unmanaged cache \"exports\" has " + std::to_string(bytes) +
           " bytes, more than its limit of 1000.";
  }

  // The size that is kept with the directory; 0 if none is.
  long long kept() { return sizes->fetchDirectorySize(store->path); }

  // A measurement takes so long.
  void measuringTakes(std::chrono::nanoseconds duration) {
    files->onCall = [this, duration](Operation operation, const string& path) {
      if (operation == Operation::ListDirectory && path == store->path) steadyTime += duration;
    };
  }

  const LogCapture log;
  const ManualClock clock{kNow};
  const TemporaryDirectory directory;
  const std::shared_ptr<FaultyFileUtils> files = std::make_shared<FaultyFileUtils>();
  const std::shared_ptr<AttributeStore> attributes = std::make_shared<AttributeStore>(files);
  const std::shared_ptr<DiskSizeCalculator> sizes = std::make_shared<DiskSizeCalculator>(files, attributes, nullptr);
  const std::shared_ptr<ManualExecutor> queue = std::make_shared<ManualExecutor>();
  IncidentLog incidents;
  std::shared_ptr<UnmanagedMeasuring> measuring;
  std::shared_ptr<UnmanagedStore> store;
};

// Limits

TEST_F(UnmanagedMeasuringTest, ReportsNothingAtTheLimit) {
  open();
  request();
  write("file", 1000);
  EXPECT_TRUE(fire());
  EXPECT_THAT(incidents.take(), IsEmpty());
  EXPECT_EQ(kept(), 1000);
}

TEST_F(UnmanagedMeasuringTest, ReportsTheNextByte) {
  open();
  request();
  write("file", 1001);
  EXPECT_THAT(incidents.take(), IsEmpty());
  fire();
  EXPECT_THAT(incidents.take(), ElementsAre(overLimit(1001)));
  EXPECT_EQ(log.messages(), Texts{overLimit(1001).substr(19)});
  EXPECT_TRUE(directory.exists("exports/file"));
}

TEST_F(UnmanagedMeasuringTest, ReportsOnceUntilTheCacheIsWithinItsLimit) {
  open();
  const auto held = store;
  request();
  write("file", 1001);
  fire();
  write("file", 2000);
  fire();
  EXPECT_THAT(incidents.take(), ElementsAre(overLimit(1001)));
  write("file", 1000);
  fire();
  write("file", 3000);
  fire();
  EXPECT_THAT(incidents.take(), ElementsAre(overLimit(3000)));
}

TEST_F(UnmanagedMeasuringTest, RemembersWhatItHasReportedWhileTheCacheIsNotInUse) {
  open();
  request();
  write("file", 1001);
  fire();
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
  request();
  fire();
  EXPECT_THAT(incidents.take(), SizeIs(1));
}

TEST_F(UnmanagedMeasuringTest, IsOnlyLoggedWithoutAReporter) {
  measuring = std::make_shared<UnmanagedMeasuring>(
      kInterval, UnmanagedMeasuring::Services{queue, files, attributes, sizes, nullptr});
  open();
  request();
  write("file", 1001);
  fire();
  EXPECT_THAT(log.messages(), SizeIs(1));
}

TEST_F(UnmanagedMeasuringTest, LeavesOtherStoresAlone) {
  open(1000, false);
  request();
  open(0, true);
  request();
  measuring->noteRequest(nullptr);
  EXPECT_THAT(queue->timers(), IsEmpty());
}

// Measuring

TEST_F(UnmanagedMeasuringTest, WalksEachDirectoryEachTime) {
  open();
  const auto held = store;
  request();
  write("a/b/file", 600);
  fire();
  EXPECT_EQ(kept(), 600);
  write("a/b/other", 401);
  fire();
  EXPECT_THAT(incidents.take(), ElementsAre(overLimit(1001)));
  EXPECT_EQ(kept(), 1001);
  EXPECT_EQ(directory.names("exports/a"), Texts{"b"});  // no results in there
}

TEST_F(UnmanagedMeasuringTest, DoesNotCountTheFilesOfAttributes) {
  open();
  attributes->set(store->path, {{"large", string(2000, 'x')}});
  request();
  fire();
  EXPECT_THAT(incidents.take(), IsEmpty());
}

TEST_F(UnmanagedMeasuringTest, KeepsASizeOnlyWhenItHasChanged) {
  open();
  const auto held = store;
  request();
  write("file", 10);
  fire();
  files->clearTrace();
  fire();
  EXPECT_EQ(files->calls(Operation::WriteFile), 0U);
  write("file", 11);
  fire();
  EXPECT_EQ(files->calls(Operation::WriteFile), 1U);
  EXPECT_EQ(kept(), 11);
}

TEST_F(UnmanagedMeasuringTest, LeavesTheMarkForTrashingAlone) {
  open();
  request();
  write("file", 10);
  attributes->set(store->path, {{"trash_on_start_up", true}});
  fire();
  EXPECT_EQ(attributes->get(store->path), (JsonValue{{"trash_on_start_up", true}}));
}

TEST_F(UnmanagedMeasuringTest, GoesOnAfterAFailure) {
  open();
  const auto held = store;
  request();
  write("file", 1001);
  files->failNext(Operation::ListDirectory, EIO);
  fire();
  EXPECT_TRUE(log.contains("Cannot measure an unmanaged cache. "));
  EXPECT_EQ(kept(), 0);
  EXPECT_THAT(incidents.take(), IsEmpty());
  fire();
  EXPECT_THAT(incidents.take(), ElementsAre(overLimit(1001)));
}

TEST_F(UnmanagedMeasuringTest, SaysNothingOfADirectoryThatIsGone) {
  open();
  const auto held = store;
  request();
  std::filesystem::remove_all(store->path);
  fire();
  files->onCall = [](Operation operation, const string& path) {
    if (operation == Operation::ListDirectory) std::filesystem::remove_all(path);
  };
  write("file", 2000);
  fire();
  EXPECT_THAT(log.messages(), IsEmpty());
  EXPECT_THAT(incidents.take(), IsEmpty());
}

// In use

TEST_F(UnmanagedMeasuringTest, MeasuresOnceForARequest) {
  open();
  request();
  EXPECT_THAT(queue->armedDelays(), ElementsAre(kIntervalNanoseconds));
  request();
  EXPECT_THAT(queue->armedDelays(), SizeIs(1));
  EXPECT_TRUE(fire());
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
  request();
  EXPECT_TRUE(fire());
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
}

TEST_F(UnmanagedMeasuringTest, GoesOnWhileSomebodyHoldsTheStore) {
  open();
  auto held = store;
  request();
  for (int i = 0; i < 5; ++i) EXPECT_TRUE(fire());
  held = nullptr;
  write("file", 1001);
  EXPECT_TRUE(fire());  // what was written before it was let go
  EXPECT_THAT(incidents.take(), SizeIs(1));
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
}

TEST_F(UnmanagedMeasuringTest, GoesOnForARequestDuringAMeasurement) {
  open();
  request();
  files->onCall = [this](Operation operation, const string&) {
    if (operation == Operation::ListDirectory) request();
  };
  EXPECT_TRUE(fire());
  EXPECT_THAT(queue->armedDelays(), SizeIs(1));
}

TEST_F(UnmanagedMeasuringTest, EndsWithTheStore) {
  open();
  request();
  store = nullptr;
  files->clearTrace();
  EXPECT_TRUE(fire());
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
}

TEST_F(UnmanagedMeasuringTest, ReportsNothingForAStoreThatEndsMeanwhile) {
  open();
  request();
  write("file", 1001);
  files->onCall = [this](Operation operation, const string&) {
    if (operation == Operation::ListDirectory) store = nullptr;
  };
  fire();
  EXPECT_THAT(incidents.take(), IsEmpty());
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
}

TEST_F(UnmanagedMeasuringTest, ReportsNothingForAStoreWhoseDirectoryIsAnothersMeanwhile) {
  open();
  request();
  write("file", 1001);
  files->onCall = [this](Operation operation, const string&) {
    if (operation != Operation::ListDirectory) return;
    files->onCall = nullptr;
    open();
    request();
  };
  fire();
  EXPECT_THAT(incidents.take(), IsEmpty());
  EXPECT_TRUE(fire());
  EXPECT_THAT(incidents.take(), SizeIs(1));
}

TEST_F(UnmanagedMeasuringTest, CancelsTheTimersOfStoresThatHaveEndedForTheNextOne) {
  open();
  request();
  store = nullptr;
  const auto definition = std::make_shared<UnmanagedStoreDefinition>("other", "media", false, false, 1, 1000, true);
  store = std::make_shared<UnmanagedStore>(directory.makeDirectory("other"), definition);
  request();
  EXPECT_THAT(queue->armedDelays(), SizeIs(1));
  EXPECT_THAT(queue->timers(), SizeIs(2));
}

TEST_F(UnmanagedMeasuringTest, ReportsADirectoryThatIsFilledAgain) {
  open();
  const auto held = store;
  request();
  write("file", 1001);
  fire();
  std::filesystem::remove_all(store->path);
  fire();
  write("file", 1002);
  fire();
  EXPECT_THAT(incidents.take(), ElementsAre(overLimit(1001), overLimit(1002)));
}

TEST_F(UnmanagedMeasuringTest, ForgetsStoresThatHaveEnded) {
  for (int i = 0; i < 3; ++i) {
    open();
    request();
    write("file", 1001);
    fire();
    EXPECT_THAT(incidents.take(), SizeIs(1)) << "as of a store of its own";
    store = nullptr;
  }
}

// How often

TEST_F(UnmanagedMeasuringTest, RestsAHundredTimesAsLongAsItHasTaken) {
  open();
  const auto held = store;
  request();
  measuringTakes(std::chrono::milliseconds(600));
  fire();
  EXPECT_THAT(queue->armedDelays(), ElementsAre(kIntervalNanoseconds));
  measuringTakes(std::chrono::milliseconds(601));
  fire();
  EXPECT_THAT(queue->armedDelays(), ElementsAre(60'100'000'000));
  measuringTakes(std::chrono::milliseconds(1));
  fire(60'100'000'000);
  EXPECT_THAT(queue->armedDelays(), ElementsAre(kIntervalNanoseconds));
}

TEST_F(UnmanagedMeasuringTest, RestsAlsoWhenTheCacheIsRequestedAnew) {
  open();
  request();
  measuringTakes(std::chrono::seconds(2));
  fire();
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
  request();
  EXPECT_THAT(queue->armedDelays(), ElementsAre(200 * kSecond));
}

TEST_F(UnmanagedMeasuringTest, RestsAlsoWhenTheDirectoryIsAnotherStores) {
  open();
  request();
  measuringTakes(std::chrono::seconds(2));
  fire();
  open();
  request();
  EXPECT_THAT(queue->armedDelays(), ElementsAre(200 * kSecond));
}

TEST_F(UnmanagedMeasuringTest, TakesAnyInterval) {
  start(std::chrono::seconds::max());
  open();
  const auto held = store;
  request();
  measuringTakes(std::chrono::hours(24 * 365 * 50));
  ASSERT_THAT(queue->armedDelays(), SizeIs(1));
  EXPECT_GT(queue->armedDelays().front(), 0);
  EXPECT_TRUE(fire(queue->armedDelays().front()));
  ASSERT_THAT(queue->armedDelays(), SizeIs(1));
  EXPECT_GT(queue->armedDelays().front(), 0);
}

// Queues and lifetimes

class RefusingExecutor final : public ManualExecutor {
 public:
  bool refuses = true;

  [[nodiscard]] std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                                          std::function<void()> companion) override {
    if (refuses) throw std::runtime_error("No timers.");
    return ManualExecutor::dispatchAfter(delayNanoseconds, std::move(task), std::move(companion));
  }
};

TEST_F(UnmanagedMeasuringTest, TriesAgainWhenATimerIsRefused) {
  const auto refusing = std::make_shared<RefusingExecutor>();
  measuring = std::make_shared<UnmanagedMeasuring>(
      kInterval, UnmanagedMeasuring::Services{refusing, files, attributes, sizes, incidents.reporter});
  open();
  const auto held = store;
  request();
  EXPECT_TRUE(log.contains("Cannot measure an unmanaged cache. No timers."));
  refusing->refuses = false;
  request();
  refusing->refuses = true;
  write("file", 1001);
  EXPECT_TRUE(refusing->fireTimer(kIntervalNanoseconds));
  EXPECT_THAT(incidents.take(), SizeIs(1));
  EXPECT_THAT(refusing->armedDelays(), IsEmpty());
  refusing->refuses = false;
  request();
  EXPECT_THAT(refusing->armedDelays(), SizeIs(1));
}

TEST_F(UnmanagedMeasuringTest, CancelsItsTimersAtTheEnd) {
  open();
  request();
  measuring = nullptr;
  EXPECT_THAT(queue->armedDelays(), IsEmpty());
}

TEST_F(UnmanagedMeasuringTest, MayEndInTheMiddleOfAMeasurement) {
  open();
  const auto held = store;
  request();
  write("file", 1001);
  files->onCall = [this](Operation operation, const string&) {
    if (operation == Operation::ListDirectory) measuring = nullptr;
  };
  EXPECT_TRUE(fire());
  EXPECT_THAT(incidents.take(), SizeIs(1));
  EXPECT_THAT(queue->armedDelays(), IsEmpty());  // of the one that has ended
}

// In a host

class HostThatMeasures : public testing::Test {
 protected:
  void TearDown() override {
    host.reset();
    queues->runAll();
  }

  HostOptions options(std::chrono::seconds interval) {
    HostOptions options;
    options.configuration = R"({"media": {"stores": {
      "exports": {"type": "unmanaged", "is_cache": true, "max_size": "1000B"},
      "thumbs": {"type": "disk_cache"}
    }}})";
    options.root = directory.path();
    options.lazyDelaySeconds = 86400;
    options.taskQueueFactory = queues;
    options.analytics = std::make_unique<RecordingAnalytics>(events);
    options.onIncident = [this](const Incident& incident) { told.push_back(test::textOf(incident)); };
    options.measureUnmanagedEvery = interval;
    return options;
  }

  void start(std::chrono::seconds interval = kInterval) { host = std::make_unique<Host>(options(interval)); }

  std::size_t armed() const {
    std::size_t count = 0;
    for (const auto& queue : queues->all()) {
      const auto delays = queue->armedDelays();
      count += static_cast<std::size_t>(std::count(delays.begin(), delays.end(), kIntervalNanoseconds));
    }
    return count;
  }

  bool fire() {
    const auto all = queues->all();
    const bool hasFired =
        std::any_of(all.begin(), all.end(), [](auto& q) { return q->fireTimer(kIntervalNanoseconds); });
    queues->runAll();
    return hasFired;
  }

  // With queues that run tasks at once, as stores wait for them.
  void logOut() {
    for (const auto& queue : queues->all()) queue->onDispatch = [&queue = *queue] { queue.runAll(); };
    host->logOut();
    for (const auto& queue : queues->all()) queue->onDispatch = nullptr;
  }

  static string writeInto(const Store& store, std::size_t bytes) {
    FileUtils().writeFile(store.path + "/file", std::vector<unsigned char>(bytes));
    return "OverLimit exports: Unmanaged cache \"exports\" has " + std::to_string(bytes) +
           " bytes, more than its limit of 1000.";
  }

  const Watchdog watchdog{60};
  const LogCapture log;
  const TemporaryDirectory directory;
  const std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  const std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  Texts told;
  std::unique_ptr<Host> host;
};

TEST_F(HostThatMeasures, TellsOfACacheThatIsOverItsLimit) {
  start();
  const auto exports = host->store<UnmanagedStore>("exports");
  queues->runAll();
  const string text = writeInto(*exports, 1001);
  EXPECT_EQ(armed(), 1U);
  EXPECT_THAT(told, IsEmpty());
  EXPECT_TRUE(fire());
  EXPECT_THAT(told, ElementsAre(text));
  EXPECT_EQ(host->metrics().managers.at(0).stores.at(0).bytes, 1001U);
  EXPECT_THAT(events->named("qzdisk_size_calculator_logging"), IsEmpty());
  EXPECT_EQ(armed(), 1U);  // it is held
}

TEST_F(HostThatMeasures, CountsWhoHoldsAStoreBesideTheManagerOnly) {
  start();
  host->store<UnmanagedStore>("exports");
  host->openSession("").store<UnmanagedStore>("exports");
  queues->runAll();
  EXPECT_EQ(armed(), 1U);
  EXPECT_TRUE(fire());
  EXPECT_EQ(armed(), 0U);
  const auto held = host->manager("media")->getStore<UnmanagedStore>("exports");
  EXPECT_EQ(armed(), 0U);
  EXPECT_NE(held, nullptr);
}

TEST_F(HostThatMeasures, LetsTheNextOpeningUseWhatWasMeasured) {
  start();
  const string text = writeInto(*host->store<UnmanagedStore>("exports"), 1001);
  queues->runAll();
  fire();
  host.reset();
  queues->runAll();
  start();
  const auto exports = host->store<UnmanagedStore>("exports", "");
  EXPECT_FALSE(FileUtils().pathExists(exports->path + "/file"));
}

TEST_F(HostThatMeasures, MeasuresNothingUnlessItIsAskedTo) {
  for (const int seconds : {0, -1}) {
    start(std::chrono::seconds(seconds));
    const auto exports = host->store<UnmanagedStore>("exports");
    queues->runAll();
    writeInto(*exports, 1001);
    for (const auto& queue : queues->all()) {
      for (const std::int64_t delay : queue->armedDelays()) EXPECT_EQ(delay, 86400 * kSecond);
    }
    host.reset();
    queues->runAll();
  }
  EXPECT_EQ(HostOptions().measureUnmanagedEvery.count(), 0);
  EXPECT_THAT(told, IsEmpty());
}

TEST_F(HostThatMeasures, EndsWithTheSession) {
  start();
  const auto exports = host->store<UnmanagedStore>("exports", "alice");
  queues->runAll();
  writeInto(*exports, 1001);
  logOut();
  EXPECT_TRUE(fire());
  EXPECT_EQ(armed(), 0U);  // although it is held
  EXPECT_THAT(told, IsEmpty());
  EXPECT_EQ(log.errorCount(), 0U);
}

TEST_F(HostThatMeasures, MeasuresTheSessionsOfTheSameName) {
  start();
  host->store<UnmanagedStore>("exports", "alice");
  queues->runAll();
  logOut();
  const auto again = host->store<UnmanagedStore>("exports", "alice");
  queues->runAll();
  const string text = writeInto(*again, 1001);
  while (told.empty() && fire()) {
  }
  EXPECT_THAT(told, ElementsAre(text));
}

TEST_F(HostThatMeasures, EndsWithTheHost) {
  start();
  const auto exports = host->store<UnmanagedStore>("exports");
  queues->runAll();
  writeInto(*exports, 1001);
  host.reset();
  EXPECT_FALSE(fire());
  EXPECT_THAT(told, IsEmpty());
}

TEST_F(HostThatMeasures, WorksOnThreads) {
  auto threaded = options(std::chrono::seconds(1));
  threaded.taskQueueFactory = nullptr;
  std::atomic<int> count{0};
  threaded.onIncident = [&](const Incident&) { ++count; };
  host = std::make_unique<Host>(std::move(threaded));
  std::vector<std::thread> users;
  for (int i = 0; i < 3; ++i) {
    users.emplace_back([this] {
      for (int visit = 0; visit < 200; ++visit) host->store<UnmanagedStore>("exports", "alice");
    });
  }
  for (std::thread& user : users) user.join();
  writeInto(*host->store<UnmanagedStore>("exports", "alice"), 1001);
  while (count == 0) std::this_thread::yield();
  host->logOut();
  EXPECT_EQ(count, 1);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
