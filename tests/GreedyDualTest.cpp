#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <ostream>
#include <random>
#include <string>
#include <vector>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "PruneStrategy.h"
#include "support/KeyValueStoreFixture.h"
#include "support/MemoryPersistence.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::KeyValueStoreFixture;
using test::ManualClock;
using test::ManualExecutor;
using test::MemoryMedium;
using test::MemoryPersistence;
using test::told;
using test::watch;
using testing::AllOf;
using testing::ElementsAre;
using testing::Ge;
using testing::IsEmpty;
using testing::Le;
using testing::SizeIs;

// The strategy in its plainest form: looks at every item for each eviction, and its numbers never need to be lowered.
class Simulation {
 public:
  bool contains(const std::string& key) const { return items_.count(key) != 0; }
  std::size_t evictions() const { return evictions_; }
  std::int64_t level() const { return level_; }
  std::vector<std::string> keys() const {
    std::vector<std::string> keys;
    for (const auto& item : items_) keys.push_back(item.first);
    return keys;
  }

  bool use(const std::string& key, std::int64_t date) {
    const auto found = items_.find(key);
    if (found == items_.end()) return false;
    learn(found->second.size, 0);
    place(found->second, date);
    return true;
  }
  void store(const std::string& key, std::uint32_t size, std::int64_t date) {
    Item& item = items_[key];
    item.size = size;
    place(item, date);
  }
  void remove(const std::string& key) { items_.erase(key); }
  void clear() { items_.clear(); }

  std::vector<std::string> prune(std::uint64_t limit) {
    std::vector<std::string> evicted;
    for (std::uint64_t total = totalSize(); total > limit;) {
      const auto lowest = std::min_element(items_.begin(), items_.end(), [](const auto& a, const auto& b) {
        const Item& x = a.second;
        const Item& y = b.second;
        return x.priority != y.priority ? x.priority < y.priority : x.turn < y.turn;
      });
      level_ = std::max(level_, lowest->second.priority);
      learn(lowest->second.size, 1);
      total -= lowest->second.size;
      evicted.push_back(lowest->first);
      items_.erase(lowest);
    }
    evictions_ += evicted.size();
    return evicted;
  }

  // What is left after a restart: sizes and dates of use.
  void restart() {
    outcomes_ = {};
    level_ = 0;
    if (items_.empty()) return;
    std::int64_t oldest = items_.begin()->second.date;
    std::int64_t newest = oldest;
    double worth = 0;
    double bytes = 0;
    for (const auto& [key, item] : items_) {
      oldest = std::min(oldest, item.date);
      newest = std::max(newest, item.date);
      worth += static_cast<double>(worthOf(item.size)) * item.size;
      bytes += item.size;
    }
    const double rise = newest == oldest ? 0 : worth / bytes / 2 / static_cast<double>(newest - oldest);
    const auto levelAt = [&](std::int64_t date) {
      return static_cast<std::int64_t>(rise * static_cast<double>(date - oldest));
    };
    for (auto& [key, item] : items_) item.priority = levelAt(item.date) + worthOf(item.size);
    level_ = levelAt(newest);
  }

 private:
  struct Item {
    std::uint32_t size = 0;
    std::int64_t date = 0;
    std::int64_t priority = 0;
    std::uint64_t turn = 0;
  };

  std::uint64_t totalSize() const {
    std::uint64_t total = 0;
    for (const auto& item : items_) total += item.second.size;
    return total;
  }
  void place(Item& item, std::int64_t date) {
    item.date = date;
    item.priority = level_ + worthOf(item.size);
    item.turn = ++turns_;
  }
  static int classOf(std::uint32_t size) { return static_cast<int>(std::floor(std::log2(size))); }
  std::array<double, 2> sum() const {
    std::array<double, 2> sum = {};
    for (const auto& [key, counts] : outcomes_) sum = {sum[0] + counts[0], sum[1] + counts[1]};
    return sum;
  }
  void learn(std::uint32_t size, std::size_t outcome) {
    ++outcomes_[classOf(size)].at(outcome);
    if (sum()[0] + sum()[1] < 4096) return;
    for (auto& [key, counts] : outcomes_) counts = {counts[0] / 2, counts[1] / 2};
  }
  std::int64_t worthOf(std::uint32_t size) const {
    const auto all = sum();
    double weight = 1;
    if (all[0] > 0) {
      const auto found = outcomes_.find(classOf(size));
      const std::array<int, 2> own = found == outcomes_.end() ? std::array<int, 2>{} : found->second;
      weight = (own[0] / (all[0] / (all[0] + all[1])) + 16) / (own[0] + own[1] + 16.0);
    }
    return std::lround(65536 * std::min(10.0, std::max(0.1, weight)) * std::sqrt(65536.0 / size));
  }

  std::map<std::string, Item> items_;
  std::map<int, std::array<int, 2>> outcomes_;  // uses and evictions of the sizes from 2^n on
  std::int64_t level_ = 0;
  std::uint64_t turns_ = 0;
  std::size_t evictions_ = 0;
};

struct Case {
  std::string name;
  Durability durability;
  bool inlineData;
  bool oneSize;
};

void PrintTo(const Case& what, std::ostream* out) { *out << what.name; }

class GreedyDualCache : public KeyValueStoreFixture, public testing::WithParamInterface<Case> {
 protected:
  static constexpr std::uint32_t kLimit = 20'000;

  GreedyDualCache() {
    isDiskCache = true;
    options.durability = GetParam().durability;
    options.inlineData = GetParam().inlineData;
    options.pruneStrategy = std::make_shared<GreedyDualPruneStrategy>();
    options.normalSize = kLimit;
    options.survivalSize = kLimit / 4;
    options.staleAge = 1'000'000;
  }

  std::uint32_t sizeOf(std::size_t key) {
    if (GetParam().oneSize) return 700;
    return 1U << (key % 14U) | static_cast<std::uint32_t>(random() % 64);
  }
  void prune(bool survival = false) {
    store->pruneBackToNormal(onSuccess(), onError(), survival);
    settle();
    simulation.prune(survival ? kLimit / 4 : kLimit);
    ASSERT_EQ(store->getManifest()->count(), simulation.keys().size());
  }
  void write(const std::string& key, std::uint32_t size) {
    put(key, std::string(size, 'x'));
    simulation.store(key, size, now);
  }
  // A request of an application: what is not found is stored, and some of what is found is stored anew.
  void request() {
    now += 1 + static_cast<std::int64_t>(random() % 3);
    clock.set(now);
    const std::size_t number = random() % 4 == 0 ? 40 + random() % 400 : random() % 40;
    const std::string key = std::to_string(number);
    const bool isFound = get(key) != "<miss>";
    ASSERT_EQ(isFound, simulation.use(key, now)) << key;
    hits += isFound ? 1 : 0;
    if (!isFound || random() % 20 == 0) write(key, sizeOf(number));
    if (random() % 50 == 0) {
      EXPECT_EQ(drop(key), "<done>");
      simulation.remove(key);
    }
    prune();
  }

  std::mt19937 random{4711};
  Simulation simulation;
  std::int64_t now = kStart;
  int hits = 0;
};

std::vector<std::string> sorted(std::vector<std::string> keys) {
  std::sort(keys.begin(), keys.end());
  return keys;
}

TEST_P(GreedyDualCache, FindsWhatASimulationFinds) {
  open();
  for (int i = 0; i < 1500; ++i) ASSERT_NO_FATAL_FAILURE(request()) << i;
  EXPECT_EQ(sorted(store->getAllKeys()), simulation.keys());
  EXPECT_GT(hits, 150);
  EXPECT_GT(simulation.evictions(), 150U);
}

TEST_P(GreedyDualCache, StartsAgainFromDatesAndSizes) {
  open();
  for (int i = 0; i < 1200; ++i) {
    if (i % 300 == 299) {
      reopen();
      simulation.restart();
    }
    ASSERT_NO_FATAL_FAILURE(request()) << i;
  }
  EXPECT_EQ(sorted(store->getAllKeys()), simulation.keys());
  EXPECT_GT(hits, 100);
}

TEST_P(GreedyDualCache, KeepsWhatItHasLearntThroughASurvivalPruneAndAClear) {
  open();
  for (int i = 0; i < 300; ++i) ASSERT_NO_FATAL_FAILURE(request()) << i;
  prune(true);
  EXPECT_EQ(sorted(store->getAllKeys()), simulation.keys());
  for (int i = 0; i < 300; ++i) ASSERT_NO_FATAL_FAILURE(request()) << i;
  EXPECT_EQ(clear(), "<done>");
  simulation.clear();  // what was learnt stays
  for (int i = 0; i < 300; ++i) ASSERT_NO_FATAL_FAILURE(request()) << i;
  EXPECT_EQ(sorted(store->getAllKeys()), simulation.keys());
}

INSTANTIATE_TEST_SUITE_P(AllStores, GreedyDualCache,
                         testing::Values(Case{"Relaxed", Durability::Relaxed, false, false},
                                         Case{"RelaxedInline", Durability::Relaxed, true, false},
                                         Case{"Safe", Durability::Safe, false, false},
                                         Case{"SafeInline", Durability::Safe, true, false},
                                         Case{"OneSize", Durability::Relaxed, true, true}),
                         [](const auto& tested) { return tested.param.name; });

// --- A manifest alone ---

class GreedyDualManifest : public testing::Test {
 protected:
  void put(const std::string& key, std::uint32_t size) {
    manifest->setItem({key, key, size, false, date, date, nullptr});
  }
  void use(const std::string& key) {
    clock.set(date);
    manifest->updateLastAccessDate(key);
  }
  std::vector<std::string> prune(std::uint32_t limit, std::uint32_t count = 1000) {
    std::vector<std::string> keys;
    for (const DiskCacheItem& item : manifest->pruneToSize(limit, count)) keys.push_back(item.key);
    return keys;
  }
  static std::shared_ptr<DiskCacheManifest> make(std::shared_ptr<MemoryMedium> medium) {
    auto manifest = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(std::move(medium)),
                                                        std::make_shared<ManualExecutor>(),
                                                        std::make_shared<GreedyDualPruneStrategy>());
    manifest->load();
    return manifest;
  }

  std::int32_t date = 1'000'000;
  ManualClock clock{date};
  std::shared_ptr<MemoryMedium> medium = std::make_shared<MemoryMedium>();
  std::shared_ptr<DiskCacheManifest> manifest = make(medium);
};

TEST_F(GreedyDualManifest, EvictsTheLargestOfTheSameUseFirst) {
  put("small", 100);
  put("large", 10'000);
  put("middle", 1000);
  EXPECT_THAT(prune(0), ElementsAre("large", "middle", "small"));
}

TEST_F(GreedyDualManifest, EvictsTheLeastRecentlyUsedOfOneSizeFirst) {
  for (const char* key : {"a", "b", "c", "d"}) put(key, 100);
  use("a");
  use("c");
  put("b", 100);
  EXPECT_THAT(prune(0), ElementsAre("d", "a", "c", "b"));
}

TEST_F(GreedyDualManifest, MayEvictTheItemJustWritten) {
  for (int i = 0; i < 50; ++i) put(std::to_string(i), 100);
  put("huge", 1'000'000);
  EXPECT_THAT(prune(5000), ElementsAre("huge"));
}

TEST_F(GreedyDualManifest, LetsSmallItemsAgeToo) {
  put("small", 100);
  int writes = 0;
  for (; manifest->getItem("small") != nullptr && writes < 100; ++writes) {
    put("large" + std::to_string(writes), 10'000);
    prune(10'100);
  }
  EXPECT_THAT(writes, AllOf(Ge(20), Le(22)));  // worth ten of the large ones, of which two come to each level
}

TEST_F(GreedyDualManifest, LearnsWhichSizesAreUsedAgain) {
  for (int i = 0; i < 200; ++i) {
    put("used", 3000);
    use("used");
    put("unused" + std::to_string(i), 1000);
    prune(3500);
    put("used", 3000);
  }
  ASSERT_THAT(prune(4000), SizeIs(Le(1U)));
  prune(0);
  put("large", 3000);
  put("small", 1000);
  EXPECT_THAT(prune(3000), ElementsAre("small"));
}

TEST_F(GreedyDualManifest, CountsNeitherRemovalNorExpiryAsEviction) {
  for (const char* key : {"a", "b"}) put(key, 100);
  put("c", 1000);
  EXPECT_THAT(prune(250), ElementsAre("c"));
  manifest->removeItem("a");
  date += 100;
  put("d", 100);
  EXPECT_EQ(manifest->pruneOldEntries(date, 10).size(), 1U);  // b
  put("e", 100);
  EXPECT_THAT(prune(0), ElementsAre("d", "e"));
}

TEST_F(GreedyDualManifest, CapacityAndExpiryGoByTheDateOfUse) {
  put("old and small", 10);
  ++date;
  put("large", 10'000);
  EXPECT_EQ(manifest->pruneOldestItem()->key, "old and small");
}

// The transaction of a prune fails and is taken back; the prune then succeeds one by one, or fails for good.
TEST_F(GreedyDualManifest, GoesOnAsBeforeWhenAPruneIsTakenBack) {
  Simulation simulation;
  std::mt19937 random{7};
  for (int i = 0; i < 400; ++i) {
    const std::string key = std::to_string(random() % 100);
    const auto size = static_cast<std::uint32_t>(1 + random() % 1000);
    put(key, size);
    simulation.store(key, size, date);
    if (i % 3 != 0 || manifest->size() <= 4000) continue;
    if (i % 2 == 0) {
      medium->failOnce("commit", 0);
    } else {
      medium->fail("removeItem");
      EXPECT_THROW(prune(4000), ManifestPersistenceException);
      medium->heal();
    }
    ASSERT_EQ(prune(4000), simulation.prune(4000)) << i;
  }
  EXPECT_GT(medium->failures(), 50U);
}

TEST_F(GreedyDualManifest, LearnsNothingFromAPruneOfEverything) {
  Simulation simulation;
  const auto write = [&](const std::string& key, std::uint32_t size) {
    put(key, size);
    simulation.store(key, size, date);
  };
  for (int i = 0; i < 100; ++i) {
    write("used", 1000);
    use("used");
    simulation.use("used", date);
    write("unused" + std::to_string(i), 2500);
    EXPECT_EQ(prune(3000), simulation.prune(3000));
    if (i % 10 != 0) continue;
    for (int k = 0; k < 20; ++k) write("more" + std::to_string(k), 1000);
    prune(0);
    simulation.clear();
  }
  for (int k = 0; k < 20; ++k) write(std::to_string(k), 1000U + 100U * static_cast<unsigned>(k));
  EXPECT_EQ(prune(9000), simulation.prune(9000));
}

// Each eviction lifts the level by the worth of a byte, far more often than the level can be lifted within its range.
TEST_F(GreedyDualManifest, LowersAllPrioritiesBeforeTheyLeaveTheirRange) {
  Simulation simulation;
  std::mt19937 random{1};
  for (int i = 0; i < 20'000; ++i) {
    const std::string key = std::to_string(random() % 200);
    const std::uint32_t size = random() % 5 == 0 ? 2 : 1;
    put(key, size);
    simulation.store(key, size, date);
    ASSERT_EQ(prune(30), simulation.prune(30)) << i;
  }
  EXPECT_GT(simulation.level(), std::int64_t{1} << 32);
}

TEST_F(GreedyDualManifest, PrunesInBatchesAsItDoesAtOnce) {
  const auto other = make(std::make_shared<MemoryMedium>());
  for (int i = 0; i < 100; ++i) {
    const std::string key = std::to_string(i);
    const auto size = static_cast<std::uint32_t>(1 + i * 37 % 1000);
    put(key, size);
    other->setItem({key, key, size, false, date, date, nullptr});
  }
  std::vector<std::string> inBatches;
  for (auto batch = prune(1000, 3); !batch.empty(); batch = prune(1000, 3)) {
    inBatches.insert(inBatches.end(), batch.begin(), batch.end());
  }
  std::vector<std::string> atOnce;
  for (const DiskCacheItem& item : other->pruneToSize(1000, 1000)) atOnce.push_back(item.key);
  EXPECT_EQ(inBatches, atOnce);
}

TEST_F(GreedyDualManifest, StartsWithNothing) { EXPECT_THAT(prune(0), IsEmpty()); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
