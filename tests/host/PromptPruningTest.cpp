// How soon the managers of a host prune.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "JsonValue.h"
#include "PersistentKeyValueStore.h"
#include "StoreManager.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::DiskOfChosenSize;
using test::EventLog;
using test::LogCapture;
using test::ManualClock;
using test::ManualExecutor;
using test::ManualQueueFactory;
using test::RecordingAnalytics;
using test::TemporaryDirectory;
using test::Watchdog;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

constexpr std::time_t kNow = 1'700'000'000;
constexpr std::int64_t kSecond = 1'000'000'000;  // in nanoseconds
constexpr std::chrono::seconds kDelay(7);        // of no other timer
constexpr std::int64_t kDelayNanoseconds = 7 * kSecond;

const char* const kConfiguration = R"({
  "media": {"session_scoped": false, "max_size": "2000B", "prune_interval": "1 hours", "stores": {
    "thumbs": {"type": "disk_cache", "lru_size_limit": "1000B"},
    "covers": {"type": "disk_cache", "lru_size_limit": "1000B"},
    "letters": {"type": "pkvs"}
  }},
  "frozen": {"session_scoped": false, "area": "documents", "max_size": "2000B", "prune_interval": "0 hours", "stores": {
    "relics": {"type": "disk_cache", "lru_size_limit": "1000B"}
  }},
  "mail": {"area": "documents", "stores": {
    "drafts": {"type": "disk_cache", "lru_size_limit": "1000B"}
  }},
  "large": {"session_scoped": false, "area": "shared", "stores": {
    "pictures": {"type": "disk_cache", "lru_size_limit": "500KB"}
  }}
})";

// Refuses timers on demand.
class RefusingExecutor final : public ManualExecutor {
 public:
  explicit RefusingExecutor(const bool& refuses) : refuses_(refuses) {}

  [[nodiscard]] std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                                          std::function<void()> companion) override {
    if (refuses_) throw std::runtime_error("No timers.");
    return ManualExecutor::dispatchAfter(delayNanoseconds, std::move(task), std::move(companion));
  }

 private:
  const bool& refuses_;
};

class PromptPruning : public testing::Test {
 protected:
  // What waits on a queue may hold the queue.
  void TearDown() override {
    host.reset();
    queues->runAll();
  }

  HostOptions options(Prune prune) {
    HostOptions options;
    options.configuration = kConfiguration;
    options.root = directory.path();
    options.lazyDelaySeconds = 86400;
    options.fileUtils = files;
    options.taskQueueFactory = queues;
    options.analytics = std::make_unique<RecordingAnalytics>(events);
    options.prune = prune;
    options.pruneDelay = kDelay;
    return options;
  }

  void start(Prune prune = Prune::Promptly) { host = std::make_unique<Host>(options(prune)); }

  template <class StoreType = DiskCache> std::shared_ptr<StoreType> open(const std::string& identifier) {
    auto store = host->store<StoreType>(identifier);
    settle();
    return store;
  }

  void settle() { queues->runAll(); }

  void store(PersistentKeyValueStore& store, const std::string& key, std::size_t bytes) {
    store.store(key, std::vector<unsigned char>(bytes));
    clock.advance(1);  // so that the order of eviction is that of the calls
    settle();
  }

  // Brings the store to so many bytes, of which the last value has but one.
  void fill(PersistentKeyValueStore& filled, std::size_t bytes) {
    store(filled, "most", bytes - 1);
    store(filled, "last", 1);
  }

  // So that the next one is an interval away.
  void useUpTheFirstRound() {
    const auto cache = open("covers");
    store(*cache, "huge", 5000);
    EXPECT_EQ(sizeOf("covers"), 0U);
    fire();  // not exceeded any more
    EXPECT_THAT(pruned(), ElementsAre("covers"));
    events->clear();
  }

  std::uint32_t sizeOf(const std::string& identifier) { return host->managerOfStore(identifier)->sizeOf(identifier); }

  // The timers for prunes that run.
  std::size_t armed() const {
    std::size_t count = 0;
    for (const auto& queue : queues->all()) {
      const auto delays = queue->armedDelays();
      count += static_cast<std::size_t>(std::count(delays.begin(), delays.end(), kDelayNanoseconds));
    }
    return count;
  }

  std::size_t everArmed() const {
    std::size_t count = 0;
    for (const auto& queue : queues->all()) {
      const auto timers = queue->timers();
      count += static_cast<std::size_t>(std::count_if(timers.begin(), timers.end(), [](const test::TimerInfo& timer) {
        return timer.delayNanoseconds == kDelayNanoseconds;
      }));
    }
    return count;
  }

  // False if none runs.
  bool fire() {
    const auto all = queues->all();
    const bool hasFired = std::any_of(all.begin(), all.end(), [](auto& q) { return q->fireTimer(kDelayNanoseconds); });
    settle();
    return hasFired;
  }

  // The stores that were pruned, in that order.
  std::vector<std::string> pruned() const {
    std::vector<std::string> names;
    for (const test::LoggedEvent& event : events->named("qzdiskstore_logging")) {
      const JsonValue payload = event.json();
      if (payload.at("event_type") == "pruning") names.push_back(payload.at("store_name").get<std::string>());
    }
    return names;
  }

  const Watchdog watchdog{60};
  const LogCapture log;
  ManualClock clock{kNow};
  const TemporaryDirectory directory;
  const std::shared_ptr<DiskOfChosenSize> files = std::make_shared<DiskOfChosenSize>();
  const std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  const std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  std::unique_ptr<Host> host;
};

// Limits

TEST_F(PromptPruning, DoesNotBeginATenthAboveACachesLimit) {
  start();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1100);
  EXPECT_EQ(sizeOf("thumbs"), 1100U);
  EXPECT_EQ(armed(), 0U);
}

TEST_F(PromptPruning, BeginsWithTheNextByte) {
  start();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1101);
  EXPECT_EQ(sizeOf("thumbs"), 1101U);
  EXPECT_EQ(armed(), 1U);
  EXPECT_THAT(pruned(), IsEmpty());
  EXPECT_TRUE(fire());
  EXPECT_THAT(pruned(), ElementsAre("thumbs"));
  EXPECT_EQ(sizeOf("thumbs"), 1U);
  EXPECT_EQ(armed(), 0U);
}

TEST_F(PromptPruning, PrunesEachCacheThatIsOverItsLimit) {
  start();
  const auto thumbs = open("thumbs");
  const auto covers = open("covers");
  fill(*covers, 999);
  fill(*thumbs, 1000);
  store(*thumbs, "more", 1);
  fill(*covers, 1101);
  EXPECT_EQ(armed(), 1U);
  fire();
  EXPECT_THAT(pruned(), testing::UnorderedElementsAre("covers", "thumbs"));
}

TEST_F(PromptPruning, DoesNotBeginATenthAboveTheManagersLimit) {
  start();
  useUpTheFirstRound();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1001);
  store(*open<PersistentKeyValueStore>("letters"), "letter", 1199);
  EXPECT_EQ(armed(), 0U);
}

TEST_F(PromptPruning, BeginsMoreThanATenthAboveTheManagersLimit) {
  start();
  useUpTheFirstRound();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1001);
  store(*open<PersistentKeyValueStore>("letters"), "letter", 1200);
  EXPECT_EQ(armed(), 1U);
  fire();
  EXPECT_THAT(pruned(), ElementsAre("thumbs"));
  EXPECT_EQ(sizeOf("letters"), 1200U);
}

TEST_F(PromptPruning, DoesNotBeginWhenNothingCanBePruned) {
  start();
  useUpTheFirstRound();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1000);
  store(*open<PersistentKeyValueStore>("letters"), "letter", 100'000);
  EXPECT_EQ(armed(), 0U);
}

TEST_F(PromptPruning, LeavesACacheAloneThatIsWithinItsLimitWhenTheTimeHasCome) {
  start();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1101);
  store(*thumbs, "last", 0);
  EXPECT_EQ(sizeOf("thumbs"), 1100U);
  EXPECT_TRUE(fire());
  EXPECT_THAT(pruned(), IsEmpty());
  EXPECT_EQ(armed(), 0U);
}

TEST_F(PromptPruning, FindsWhatAnEarlierHostHasLeft) {
  start(Prune::AtIntervals);
  fill(*open("thumbs"), 1500);
  host.reset();
  settle();
  start();
  const auto thumbs = open("thumbs");
  EXPECT_EQ(armed(), 0U);  // a store does not tell its size as it is loaded
  const auto all = queues->all();
  EXPECT_TRUE(std::any_of(all.begin(), all.end(), [](auto& queue) { return queue->fireTimer(300 * kSecond); }));
  settle();
  EXPECT_EQ(armed(), 1U);
  fire();
  EXPECT_EQ(sizeOf("thumbs"), 1U);
}

// The pause

TEST_F(PromptPruning, RunsOneTimerHoweverMuchIsWritten) {
  start();
  useUpTheFirstRound();
  const auto thumbs = open("thumbs");
  const std::size_t before = everArmed();
  for (int i = 0; i < 20; ++i) store(*thumbs, std::to_string(i), 1000);
  EXPECT_EQ(armed(), 1U);
  EXPECT_EQ(everArmed(), before + 1);  // it is not put off by further writes
  fire();
  EXPECT_EQ(sizeOf("thumbs"), 1000U);
  EXPECT_THAT(pruned(), SizeIs(1));
}

TEST_F(PromptPruning, WaitsForAnotherDelayBeforeTheNextPrune) {
  start();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1101);
  fire();
  fill(*thumbs, 1101);
  EXPECT_THAT(pruned(), SizeIs(1));
  EXPECT_EQ(armed(), 1U);
  fire();
  EXPECT_THAT(pruned(), SizeIs(2));
}

TEST_F(PromptPruning, RunsNoTimerWhileNothingIsWritten) {
  start();
  const auto thumbs = open("thumbs");
  thumbs->overrideConfiguration(1000, 5000);  // a prune does nothing, and the configured limit stays exceeded
  fill(*thumbs, 1500);
  EXPECT_TRUE(fire());
  EXPECT_THAT(pruned(), SizeIs(1));
  EXPECT_EQ(sizeOf("thumbs"), 1500U);
  EXPECT_EQ(armed(), 0U);
  store(*thumbs, "more", 1);
  EXPECT_EQ(armed(), 1U);
}

TEST_F(PromptPruning, BoundsACacheThatIsFilledWithoutEnd) {
  constexpr std::size_t kValue = 25 * 1024;
  constexpr std::size_t kValuesPerStep = 8;  // which are written while the timer runs
  constexpr std::size_t kLimit = 500 * 1024;
  constexpr std::size_t kBound = kLimit + kLimit / 10 + (kValuesPerStep + 1) * kValue;
  start();
  const auto pictures = open("pictures");
  std::size_t fired = 0;
  for (std::size_t i = 0; i < 800; ++i) {
    store(*pictures, std::to_string(i), kValue);
    EXPECT_LE(sizeOf("pictures"), kBound);
    if (i % kValuesPerStep != 0 || !fire()) continue;
    EXPECT_LE(sizeOf("pictures"), kLimit);
    ++fired;
  }
  EXPECT_GT(fired, 60U);
  EXPECT_THAT(pruned(), SizeIs(fired));
}

TEST_F(PromptPruning, CountsLessThanASecondAsOne) {
  auto hurried = options(Prune::Promptly);
  hurried.pruneDelay = std::chrono::seconds(-1);
  host = std::make_unique<Host>(std::move(hurried));
  fill(*open("thumbs"), 1101);
  const auto all = queues->all();
  EXPECT_TRUE(std::any_of(all.begin(), all.end(), [](auto& queue) { return queue->fireTimer(kSecond); }));
}

TEST_F(PromptPruning, TakesAnyDelay) {
  auto patient = options(Prune::Promptly);
  patient.pruneDelay = std::chrono::seconds::max();
  host = std::make_unique<Host>(std::move(patient));
  fill(*open("thumbs"), 1101);
  for (const auto& queue : queues->all()) {
    for (const std::int64_t delay : queue->armedDelays()) EXPECT_GT(delay, 0);
  }
}

// Off

TEST_F(PromptPruning, DoesNothingUnlessItIsAskedFor) {
  const auto plain = std::make_shared<ManualQueueFactory>();
  {
    auto off = options(Prune::AtIntervals);
    off.taskQueueFactory = plain;
    const Host other(std::move(off));
    EXPECT_EQ(HostOptions().prune, Prune::AtIntervals);
  }
  start();
  EXPECT_EQ(queues->all().size(), plain->all().size() + 1);
  host.reset();

  start(Prune::AtIntervals);
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1999);
  EXPECT_EQ(armed(), 0U);
  EXPECT_THAT(pruned(), IsEmpty());
}

TEST_F(PromptPruning, DoesNothingWithoutMaintenance) {
  auto idle = options(Prune::Promptly);
  idle.runMaintenance = false;
  host = std::make_unique<Host>(std::move(idle));
  fill(*open("thumbs"), 100'000);
  EXPECT_EQ(armed(), 0U);
  EXPECT_THAT(pruned(), IsEmpty());
}

TEST_F(PromptPruning, DoesNothingForAManagerThatNeverPrunes) {
  start();
  fill(*open("relics"), 100'000);
  EXPECT_EQ(armed(), 0U);
  EXPECT_THAT(pruned(), IsEmpty());
}

// Lifetimes

TEST_F(PromptPruning, DoesNothingForASessionThatHasEnded) {
  start();
  fill(*open("drafts"), 1101);
  EXPECT_EQ(armed(), 1U);
  std::thread([this] {
    for (const auto& queue : queues->all()) queue->onDispatch = [&queue = *queue] { queue.runAll(); };
    host->logOut();
    for (const auto& queue : queues->all()) queue->onDispatch = nullptr;
  }).join();
  fire();
  EXPECT_THAT(pruned(), IsEmpty());
  EXPECT_EQ(armed(), 0U);
}

TEST_F(PromptPruning, EndsWithTheManager) {
  start();
  fill(*open("thumbs"), 1101);
  host.reset();
  settle();
  EXPECT_EQ(armed(), 0U);
  EXPECT_THAT(pruned(), IsEmpty());
}

TEST_F(PromptPruning, OutlivesTheHostWithAHandleOnTheManager) {
  start();
  const auto manager = host->manager("media");
  fill(*open("thumbs"), 1101);
  host.reset();
  settle();
  EXPECT_TRUE(fire());
  EXPECT_EQ(manager->sizeOf("thumbs"), 1U);
}

TEST_F(PromptPruning, NeedsAHandleOnTheManager) {
  start();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1101);
  host.reset();
  settle();
  fire();
  EXPECT_THAT(pruned(), IsEmpty());
  store(*thumbs, "more", 5000);  // works on
  fire();
  EXPECT_THAT(pruned(), ElementsAre("thumbs"));  // the total is over the manager's limit: a round of its own
}

// Queues

TEST_F(PromptPruning, TriesAgainWhenTheManagersQueueHasRefusedThePrune) {
  start();
  const auto thumbs = open("thumbs");
  fill(*thumbs, 1101);
  for (const auto& queue : queues->all()) queue->throwOnDispatch(true);
  EXPECT_TRUE(fire());
  for (const auto& queue : queues->all()) queue->throwOnDispatch(false);
  EXPECT_TRUE(log.contains("Cannot prune promptly. "));
  EXPECT_THAT(pruned(), IsEmpty());
  EXPECT_EQ(armed(), 0U);
  store(*thumbs, "more", 1);
  EXPECT_TRUE(fire());
  EXPECT_THAT(pruned(), ElementsAre("thumbs"));
}

// The manual queues, but for the work queue that is created last before there is a manager.
class RefusingQueues final : public TaskQueueFactory {
 public:
  bool refuses = false;

  explicit RefusingQueues(std::shared_ptr<ManualQueueFactory> manual) : manual_(std::move(manual)) {}

  std::shared_ptr<AsyncExecutor> createQueue() override { return manual_->createQueue(); }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override {
    last = std::make_shared<RefusingExecutor>(refuses);
    return isForHost ? last : manual_->createWorkQueue();
  }

  std::shared_ptr<RefusingExecutor> last;
  bool isForHost = true;

 private:
  const std::shared_ptr<ManualQueueFactory> manual_;
};

TEST_F(PromptPruning, TriesAgainWhenATimerIsRefused) {
  const auto refusing = std::make_shared<RefusingQueues>(queues);
  auto chosen = options(Prune::Promptly);
  chosen.taskQueueFactory = refusing;
  host = std::make_unique<Host>(std::move(chosen));
  refusing->isForHost = false;
  const auto queue = refusing->last;
  const auto thumbs = open("thumbs");
  refusing->refuses = true;
  fill(*thumbs, 1101);
  EXPECT_TRUE(log.contains("Cannot prune promptly. No timers."));
  EXPECT_EQ(sizeOf("thumbs"), 1101U);  // the store is not disturbed
  refusing->refuses = false;
  EXPECT_FALSE(queue->fireTimer(kDelayNanoseconds));
  store(*thumbs, "more", 1);
  EXPECT_TRUE(queue->fireTimer(kDelayNanoseconds));
  settle();
  EXPECT_THAT(pruned(), ElementsAre("thumbs"));
}

TEST_F(PromptPruning, WorksOnQueuesThatRunTasksAtOnce) {
  start();
  const auto thumbs = open("thumbs");
  for (const auto& queue : queues->all()) queue->onDispatch = [&queue = *queue] { queue.runAll(); };
  fill(*thumbs, 1101);
  EXPECT_TRUE(fire());
  EXPECT_THAT(pruned(), ElementsAre("thumbs"));
  for (const auto& queue : queues->all()) queue->onDispatch = nullptr;
}

// Threads

TEST_F(PromptPruning, WorksOnThreads) {
  auto threaded = options(Prune::Promptly);
  threaded.taskQueueFactory = nullptr;
  threaded.pruneDelay = std::chrono::seconds(1);
  host = std::make_unique<Host>(std::move(threaded));
  std::vector<std::thread> writers;
  for (const char* const identifier : {"thumbs", "covers", "letters", "drafts"}) {
    writers.emplace_back([this, identifier] {
      const auto store = host->store<PersistentKeyValueStore>(identifier);
      for (int i = 0; i < 100; ++i) await(store->store(std::to_string(i), std::vector<unsigned char>(100)));
    });
  }
  for (std::thread& writer : writers) writer.join();
  while (sizeOf("thumbs") > 1000 || sizeOf("covers") > 1000 || sizeOf("drafts") > 1000) std::this_thread::yield();
  EXPECT_EQ(sizeOf("letters"), 10'000U);
  host->logOut();
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
