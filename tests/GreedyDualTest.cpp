#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <ostream>
#include <random>
#include <string>
#include <vector>

#include "PruneStrategy.h"
#include "support/GreedyDualSimulation.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::GreedyDualSimulation;
using test::KeyValueStoreFixture;

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
  GreedyDualSimulation simulation;
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

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
