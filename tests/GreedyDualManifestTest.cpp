#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "PruneStrategy.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/GreedyDualSimulation.h"
#include "support/MemoryPersistence.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::GreedyDualSimulation;
using test::ManualClock;
using test::ManualExecutor;
using test::MemoryMedium;
using test::MemoryPersistence;
using testing::AllOf;
using testing::ElementsAre;
using testing::Ge;
using testing::IsEmpty;
using testing::Le;
using testing::SizeIs;

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

// Long enough for the counts to be halved several times, while the sizes that are used again change.
TEST_F(GreedyDualManifest, ForgetsWhatWasLearntLongAgo) {
  GreedyDualSimulation simulation;
  std::mt19937 random{3};
  int hits = 0;
  for (int i = 0; i < 20'000; ++i) {
    const auto popular = static_cast<unsigned>(i / 5000);
    const auto draw = static_cast<unsigned>(random() % 3000);
    const unsigned number = draw % 3 == 0 ? draw / 3 : 8 * (draw % 20) + popular;
    const std::string key = std::to_string(number);
    const bool isFound = manifest->getItem(key) != nullptr;
    ASSERT_EQ(isFound, simulation.use(key, date)) << i;
    hits += isFound ? 1 : 0;
    if (isFound) {
      use(key);
    } else {
      const std::uint32_t size = 100U << (number % 8);
      put(key, size);
      simulation.store(key, size, date);
    }
    ASSERT_EQ(prune(20'000), simulation.prune(20'000)) << i;
  }
  EXPECT_GT(hits, 8192);
}

// The transaction of a prune fails and is taken back; the prune then succeeds one by one, or fails for good.
TEST_F(GreedyDualManifest, GoesOnAsBeforeWhenAPruneIsTakenBack) {
  GreedyDualSimulation simulation;
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
  GreedyDualSimulation simulation;
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
  GreedyDualSimulation simulation;
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

// Of one size the order is that of least recent use, after a restart too: not that of the keys, in which they are read.
TEST_F(GreedyDualManifest, StartsInTheOrderOfUseAmongItemsOfOneSize) {
  std::vector<std::string> keys;
  for (int i = 0; i < 500; ++i) {
    keys.push_back(std::to_string(i * 7919 % 500));
    put(keys.back(), 1 << 20);
    date += 3600;
  }
  manifest = make(medium);
  EXPECT_EQ(prune(0), keys);
}

TEST_F(GreedyDualManifest, StartsInTheOrderOfUseThoughAClockWasWrongForAWhile) {
  std::vector<std::string> keys;
  const auto putAt = [&](std::int32_t when, std::uint32_t size) {
    keys.push_back(std::to_string(keys.size() * 7919 % 500));
    date = when;
    put(keys.back(), size);
  };
  putAt(0, 1 << 20);
  for (int i = 0; i < 300; ++i) putAt(1'000'000 + 3600 * i, 1 << 20);
  putAt(2'000'000'000, 1 << 20);
  manifest = make(medium);
  put("large", 4 << 20);  // worth half as much: goes before what was used last, behind what was used long ago
  const auto evicted = prune(0);
  const auto large = std::find(evicted.begin(), evicted.end(), "large") - evicted.begin();
  EXPECT_THAT(large, AllOf(Ge(1), Le(300)));
  EXPECT_EQ(evicted.front(), keys.front());
  EXPECT_EQ(evicted.size(), keys.size() + 1);
}

TEST_F(GreedyDualManifest, LearnsNothingFromAPruneOfNoItems) {
  for (int i = 0; i < 50; ++i) put("old" + std::to_string(i), 1000);
  manifest = make(medium);
  date += 3600;
  EXPECT_THAT(prune(1, 0), IsEmpty());
  put("new", 1000);
  EXPECT_EQ(prune(0).back(), "new");
}

TEST_F(GreedyDualManifest, StartsWithNothing) { EXPECT_THAT(prune(0), IsEmpty()); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
