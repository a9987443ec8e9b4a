// Scripts of operations on a tier, interleaved with the steps of its store's queues, against what must come out.

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstddef>
#include <deque>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "host/Await.h"
#include "host/MemoryTierFixture.h"
#include "host/ThreadQueueFactory.h"
#include "support/Barrier.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Got;
using test::told;
using test::Value;
using test::watch;

const std::string kMiss = "<miss>";

#if defined(CELLAR_RUNS_SLOWLY)
constexpr bool kIsSlow = true;
#else
constexpr bool kIsSlow = false;
#endif

// Plays scripts, each on a key of its own. A step is a letter: S stores a new value, R removes, C clears, F fetches,
// P fetches or computes, p ends the oldest production, T trims, w and f run one task of the work and the file queue,
// E lets the next write of a file fail.
class MemoryTierModel : public test::MemoryTierFixture {
 public:
  static inline const std::string kSteps = "SRFPCpTwfE";

  void openInMemory(std::size_t maxBytes) {
    openWatched();
    tier = std::make_unique<host::MemoryTier>(store, maxBytes);
  }

  void play(const std::string& script) {
    key_ = "key" + std::to_string(++scripts_);
    possible_ = {kMiss};
    hasFault_ = script.find('E') != std::string::npos;
    for (const char step : script) take(step);
    do {
      settle();
    } while (produce());
    check(script);
    forget();
  }

 private:
  struct Reading {
    Got got;
    std::set<std::string> possible;
  };

  void take(char step) {
    switch (step) {
      case 'S':
        return put();
      case 'R':
        watched_.push_back(watch(tier->remove(key_)));
        return noteChange({kMiss}, kMiss);
      case 'C':
        watched_.push_back(watch(tier->clear()));
        clears_.push_back(watched_.back());
        return noteChange({kMiss}, kMiss);
      case 'F':
        return read();
      case 'P':
        return compute();
      case 'p':
        produce();
        return;
      case 'T':
        return tier->trim(0);
      case 'w':
        work().runNext();
        return;
      case 'f':
        file().runNext();
        return;
      default:
        files->failNext(test::Operation::WriteFile, ENOSPC);
    }
  }

  // While a clear is under way the value may be cleared, too.
  void put() {
    const std::string value = newValue();
    watched_.push_back(watch(tier->store(key_, bytesOf(value))));
    all_.insert(value);
    noteChange(isClearing() ? std::set<std::string>{value, kMiss} : std::set<std::string>{value}, value);
  }

  // Before a clear comes to the key its value may be read.
  void read() {
    readings_.push_back({watch(tier->fetch(key_)), possible_});
    if (isClearing()) readings_.back().possible.insert(all_.begin(), all_.end());
  }

  bool isClearing() const {
    return std::any_of(clears_.begin(), clears_.end(), [](const test::Written& clear) { return clear->isPending(); });
  }

  // A fetch that is under way may see the change, or the moment in which the store replaces a value.
  void noteChange(std::set<std::string> possible, const std::string& value) {
    possible_ = std::move(possible);
    for (Reading& reading : readings_) reading.possible.insert({value, kMiss});
  }

  // What is made gets into the store only if nothing changes the key before.
  void compute() {
    const std::string value = newValue();
    all_.insert(value);
    computations_.push_back(watch(tier->fetchOrCompute(key_, [this, value] {
      promises.push_back(std::make_unique<Promise<Bytes>>());
      made_.push_back(value);
      return promises.back()->getFuture();
    })));
    for (Reading& reading : readings_) reading.possible.insert(value);
    if (possible_.count(kMiss) != 0) possible_.insert(value);
  }

  bool produce() {
    if (promises.empty()) return false;
    const auto promise = std::move(promises.front());
    promises.pop_front();
    const std::string value = made_.front();
    made_.pop_front();
    promise->setValue(bytesOf(value));
    return true;
  }

  std::string newValue() { return "value" + std::to_string(++values_); }

  void check(const std::string& script) {
    files->heal();
    const std::string disk = onDisk(key_);
    const std::string memory = inMemory(key_);
    EXPECT_TRUE(memory == kMiss || memory == disk) << script << ": " << memory << " but " << disk << " in the store";
    EXPECT_EQ(fetched(key_), disk) << script;
    for (const auto& change : watched_) EXPECT_FALSE(change->isPending()) << script;
    for (const Got& computed : computations_) {
      EXPECT_TRUE(computed->value && *computed->value != nullptr) << script << ": " << told(computed);
    }
    if (hasFault_) return;
    EXPECT_EQ(possible_.count(disk), 1u) << script << ": " << disk << " is in the store";
    for (const Reading& reading : readings_) {
      EXPECT_EQ(reading.possible.count(told(reading.got)), 1u) << script << ": fetched " << told(reading.got);
    }
  }

  // The next script begins with an empty store.
  void forget() {
    watch(tier->remove(key_));
    settle();
    all_ = {kMiss};
    readings_.clear();
    computations_.clear();
    watched_.clear();
    clears_.clear();
  }

  int scripts_ = 0;
  int values_ = 0;
  std::string key_;
  bool hasFault_ = false;
  std::set<std::string> possible_;    // what the store may have when all is done
  std::set<std::string> all_{kMiss};  // that the key has had
  std::vector<Reading> readings_;
  std::vector<Got> computations_;
  std::vector<test::Written> watched_;
  std::vector<test::Written> clears_;
  std::deque<std::string> made_;  // the values of the productions that are under way
};

TEST_F(MemoryTierModel, EveryShortScriptLeavesMemoryAndStoreInAgreement) {
  openInMemory(kRoomy);
  const std::size_t length = kIsSlow ? 3 : 4;
  std::vector<std::size_t> digits(length, 0);
  for (bool isOver = false; !isOver && !HasFailure();) {
    std::string script;
    for (const std::size_t digit : digits) script += kSteps[digit];
    play(script);
    isOver = true;
    for (std::size_t& digit : digits) {
      digit = (digit + 1) % kSteps.size();
      if (digit == 0) continue;
      isOver = false;
      break;
    }
  }
}

void playRandomScripts(MemoryTierModel& model) {
  std::mt19937 random(20240);  // the same scripts each time
  const int scripts = kIsSlow ? 200 : 1500;
  for (int i = 0; i < scripts && !testing::Test::HasFailure(); ++i) {
    std::string script;
    const std::size_t length = 5 + random() % 15;
    while (script.size() < length) script += MemoryTierModel::kSteps[random() % MemoryTierModel::kSteps.size()];
    model.play(script);
  }
}

TEST_F(MemoryTierModel, RandomScriptsLeaveMemoryAndStoreInAgreement) {
  openInMemory(kRoomy);
  playRandomScripts(*this);
}

TEST_F(MemoryTierModel, RandomScriptsWithoutMemoryReadWhatTheStoreHas) {
  openInMemory(0);
  playRandomScripts(*this);
}

TEST_F(MemoryTierModel, RandomScriptsLeaveMemoryAndAnInlineStoreInAgreement) {
  options.inlineData = true;
  openInMemory(kRoomy);
  playRandomScripts(*this);
}

TEST_F(MemoryTierModel, RandomScriptsLeaveMemoryAndASafeStoreInAgreement) {
  options.durability = Durability::Safe;
  openTier();
  playRandomScripts(*this);
}

// --- Threads ---

class MemoryTierThreads : public test::KeyValueStoreFixture {
 public:
  using Producer = host::MemoryTier::Producer;

  void start(std::size_t maxBytes) {
    StoreServices threaded = services();
    threaded.queues = threads;
    options.onSizeChanged = nullptr;
    store = PersistentKeyValueStore::create(options, threaded);
    tier = std::make_unique<host::MemoryTier>(store, maxBytes);
  }

  // Each operation is waited for now and then, so that many are under way.
  void work(std::size_t thread) {
    std::mt19937 random(static_cast<unsigned>(thread));
    for (int i = 0; i < (kIsSlow ? 150 : 1000); ++i) {
      const std::string key(1, static_cast<char>('a' + random() % 3));
      const auto value = bytesOf(std::to_string(thread) + "-" + std::to_string(i));
      const auto make = [this, value] { return dispatchTask<Bytes>(producers, [value] { return value; }); };
      switch (random() % 10) {
        case 0:
        case 1:
          tier->store(key, value);
          break;
        case 2:
          tier->remove(key);
          break;
        case 3:
          if (random() % 10 == 0) tier->clear();
          break;
        case 4:
          tier->trim(300);
          break;
        case 5:
          EXPECT_NE(host::await(tier->fetchOrCompute(key, make)), nullptr);
          break;
        case 6:
          static_cast<void>(host::await(tier->fetch(key)));
          break;
        default:
          EXPECT_NE(told(tier->find(key)), "");
      }
    }
  }

  std::shared_ptr<host::ThreadQueueFactory> threads = std::make_shared<host::ThreadQueueFactory>();
  std::shared_ptr<AsyncExecutor> producers = threads->createQueue();
  std::unique_ptr<host::MemoryTier> tier;
};

TEST_F(MemoryTierThreads, LeaveMemoryAndStoreInAgreement) {
  start(1 << 16U);
  test::runOnThreads(4, [this](std::size_t thread) { work(thread); });
  ASSERT_TRUE(threads->drain(std::chrono::hours(1)));
  for (const std::string key : {"a", "b", "c"}) {
    const auto disk = host::await(store->fetch(key));
    const Value memory = tier->find(key);
    const Value fetched = host::await(tier->fetch(key));
    EXPECT_EQ(told(fetched), disk == nullptr ? kMiss : test::textOf(disk->value)) << key;
    EXPECT_TRUE(memory == nullptr || *memory == *fetched) << key;
  }
  EXPECT_GT(tier->counts().hits, 0u);
}

TEST_F(MemoryTierThreads, ATierMayEndWhileItsWorkIsUnderWay) {
  for (int round = 0; round < 20; ++round) {
    start(1 << 16U);
    std::vector<Future<Value>> futures;
    for (int i = 0; i < 5; ++i) {
      const auto make = [this] { return dispatchTask<Bytes>(producers, [] { return bytesOf("made"); }); };
      futures.push_back(tier->fetchOrCompute(std::to_string(i % 3), make));
      tier->store("other", bytesOf("value"));
    }
    tier.reset();
    for (const Future<Value>& future : futures) EXPECT_NE(host::await(future), nullptr);
    ASSERT_TRUE(threads->drain(std::chrono::hours(1)));
    store.reset();
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
