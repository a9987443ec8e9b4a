#include "tune/SimulatedCache.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <random>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "PruneStrategy.h"
#include "tools/RealCache.h"
#include "tune/NextFetches.h"
#include "tune/Simulation.h"
#include "tune/StackDistances.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using Accesses = std::vector<Access>;
using Hits = std::vector<bool>;  // by access

Access of(std::uint32_t key, std::int64_t size, AccessKind kind = AccessKind::Fetch) {
  Access access;
  access.key = kind == AccessKind::Clear ? Access::kNoKey : key;
  access.kind = kind;
  access.size = size;
  return access;
}

enum class Sizes { Same, Uniform, PowersOfTwo, LogNormal };

std::int64_t draw(Sizes sizes, std::mt19937& random) {
  if (sizes == Sizes::Same) return 70;
  if (sizes == Sizes::Uniform) return 1 + static_cast<std::int64_t>(random() % 200);
  if (sizes == Sizes::PowersOfTwo) return std::int64_t{1} << (random() % 10);
  const double uniform = (static_cast<double>(random() % 4096) + 0.5) / 4096;  // its logit is nearly normal
  return std::max<std::int64_t>(1, std::llround(50 * std::pow(uniform / (1 - uniform), 0.7)));
}

// Fetches, of which some want another size than before, stores, removals, and the ends of sessions.
Accesses randomAccesses(std::uint32_t seed, std::size_t count) {
  std::mt19937 random(seed);
  const auto sizes = static_cast<Sizes>(seed % 4);
  std::vector<std::int64_t> bytes(60);
  for (std::int64_t& each : bytes) each = draw(sizes, random);
  Accesses accesses;
  while (accesses.size() < count) {
    const auto key = static_cast<std::uint32_t>(std::min(random() % bytes.size(), random() % bytes.size()));
    const unsigned what = static_cast<unsigned>(random() % 200);
    if (what < 16) bytes[key] = draw(sizes, random);
    const AccessKind kind = what < 20   ? AccessKind::Store
                            : what < 30 ? AccessKind::Remove
                            : what < 31 ? AccessKind::Clear
                                        : AccessKind::Fetch;
    accesses.push_back(of(key, bytes[key], kind));
  }
  return accesses;
}

Hits hitsOf(const Accesses& accesses, const std::function<bool(const Access&)>& access) {
  Hits hits;
  for (const Access& each : accesses) hits.push_back(access(each) && each.kind == AccessKind::Fetch);
  return hits;
}

Hits simulated(const Accesses& accesses, const std::string& strategy, std::int64_t limit) {
  const auto cache = simulatedCache(strategy, limit);
  return hitsOf(accesses, [&](const Access& access) { return cache->access(access, SimulatedCache::kNever); });
}

Hits leastRecentlyUsed(const Accesses& accesses, std::int64_t limit) {
  StackDistances distances;
  return hitsOf(accesses, [&](const Access& access) {
    if (access.kind == AccessKind::Clear) distances.clear();
    if (access.kind == AccessKind::Remove) distances.remove(access.key);
    if (access.kind == AccessKind::Clear || access.kind == AccessKind::Remove) return false;
    const auto least = distances.use(access.key, access.size);
    return least && *least <= limit;
  });
}

Hits real(const Accesses& accesses, unsigned int limit, std::shared_ptr<PruneStrategyBase> strategy) {
  RealCache cache(limit, std::move(strategy));
  return hitsOf(accesses, [&](const Access& access) { return cache.access(access); });
}

std::size_t count(const Hits& hits) { return static_cast<std::size_t>(std::count(hits.begin(), hits.end(), true)); }

class SimulatedCaches : public testing::TestWithParam<std::uint32_t> {};

TEST_P(SimulatedCaches, FindWhatTheLibrarysOwnDiskCacheFinds) {
  const Accesses accesses = randomAccesses(GetParam(), 400);
  for (const unsigned int limit : {150U, 600U, 2000U}) {
    const Hits greedyDual = simulated(accesses, strategies::kGreedyDual, limit);
    ASSERT_EQ(greedyDual, real(accesses, limit, std::make_shared<GreedyDualPruneStrategy>())) << limit;
    ASSERT_EQ(leastRecentlyUsed(accesses, limit), real(accesses, limit, std::make_shared<LRUPruneStrategy>())) << limit;
    EXPECT_GT(count(greedyDual), 0U) << limit;
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, SimulatedCaches, testing::Range(1U, 13U));

// All sets of at most so many items of one size that can be kept, after each access: the most hits of any order.
class BestOfAll {
 public:
  BestOfAll(const Accesses& accesses, unsigned items, unsigned room) : best_(std::size_t{1} << items, kImpossible) {
    best_[0] = 0;
    for (const Access& access : accesses) play(access, room);
  }
  int hits() const { return *std::max_element(best_.begin(), best_.end()); }

 private:
  static constexpr int kImpossible = -1000;

  static unsigned bitsOf(std::size_t set) { return set == 0 ? 0 : static_cast<unsigned>(set & 1U) + bitsOf(set >> 1U); }

  void play(const Access& access, unsigned room) {
    const std::size_t item = std::size_t{1} << access.key;
    std::vector<int> next(best_.size(), kImpossible);
    for (std::size_t set = 0; set < best_.size(); ++set) {
      const int hits = best_[set] + ((set & item) != 0 ? 1 : 0);
      for (std::size_t kept = 0; kept < best_.size(); ++kept) {
        if ((kept & ~(set | item)) == 0 && bitsOf(kept) <= room) next[kept] = std::max(next[kept], hits);
      }
    }
    best_ = next;
  }

  std::vector<int> best_;  // by set: the most hits with which it can be what is kept
};

std::uint64_t hitsWithForesight(const Accesses& accesses, std::int64_t limit) {
  Trace trace;
  for (const Access& access : accesses) {
    if (access.kind == AccessKind::Clear) {
      trace.appendClear(0);
    } else {
      trace.append(std::to_string(access.key), access);
    }
  }
  std::vector<Simulation> simulations = {{strategies::kForesight, limit, {}}};
  simulate(trace, simulations, 1, [](std::uint64_t, std::uint64_t) {});
  return simulations.front().found.hits;
}

TEST(ForesightCache, FindsTheMostOfItemsOfOneSize) {
  std::mt19937 random(5);
  for (int round = 0; round < 30; ++round) {
    Accesses accesses;
    for (int i = 0; i < 40; ++i) accesses.push_back(of(static_cast<std::uint32_t>(random() % 6), 10));
    EXPECT_EQ(hitsWithForesight(accesses, 29), BestOfAll(accesses, 6, 2).hits()) << round;
    EXPECT_EQ(hitsWithForesight(accesses, 30), BestOfAll(accesses, 6, 3).hits()) << round;
  }
}

TEST(ForesightCache, KeepsNothingForWhatIsWrittenRemovedOrClearedFirst) {
  const Access a = of(0, 10);
  const Access b = of(1, 10);
  EXPECT_EQ(hitsWithForesight({a, b, a, b}, 10), 1U);
  EXPECT_EQ(hitsWithForesight({a, b, of(0, 10, AccessKind::Remove), a, b}, 10), 1U);
  EXPECT_EQ(hitsWithForesight({a, b, of(0, 10, AccessKind::Store), b, a}, 10), 1U);
  EXPECT_EQ(hitsWithForesight({a, b, of(0, 0, AccessKind::Clear), a, b}, 20), 0U);
  EXPECT_EQ(hitsWithForesight({a, b, of(0, 0, AccessKind::Clear), a, b, b, a}, 20), 2U);
}

// By size it would keep the two small ones.
TEST(ForesightCache, MayFindLessThanAnotherOrderOfItemsOfDifferentSizes) {
  const Accesses accesses = {of(0, 1), of(1, 1), of(2, 10), of(2, 10), of(0, 1), of(1, 1)};
  EXPECT_EQ(hitsWithForesight(accesses, 10), 1U);
  EXPECT_EQ(count(simulated(accesses, strategies::kGreedyDual, 10)), 2U);
}

TEST(Simulate, GivesTheSameWhateverTheNumberOfThreads) {
  Trace trace;
  for (const Access& access : randomAccesses(3, 9000)) {
    if (access.kind != AccessKind::Clear) trace.append(std::to_string(access.key), access);
  }
  const auto play = [&](unsigned threads) {
    std::vector<Simulation> simulations;
    for (const std::int64_t limit : {100, 200, 400, 800, 1600}) {
      simulations.push_back({strategies::kGreedyDual, limit, {}});
      simulations.push_back({strategies::kForesight, limit, {}});
    }
    simulate(trace, simulations, threads, [](std::uint64_t done, std::uint64_t whole) { EXPECT_LE(done, whole); });
    std::vector<std::uint64_t> figures;
    for (const Simulation& each : simulations) {
      figures.insert(figures.end(), {each.found.hits, each.found.hitBytes});
      figures.insert(figures.end(), each.found.hitsByPart.begin(), each.found.hitsByPart.end());
      std::uint64_t sum = 0;
      for (const std::uint64_t hits : each.found.hitsByPart) sum += hits;
      EXPECT_EQ(sum, each.found.hits);
      EXPECT_GT(each.found.hits, 0U);
    }
    return figures;
  };
  const auto alone = play(1);
  EXPECT_EQ(play(3), alone);
  EXPECT_EQ(play(0), alone);
}

TEST(Simulate, AStrategyThatIsUnknownEndsAllThreads) {
  Trace trace;
  trace.append("key", of(0, 1));
  std::vector<Simulation> simulations = {{"none", 1, {}}, {strategies::kGreedyDual, 1, {}}, {"none", 1, {}}};
  EXPECT_THROW(simulate(trace, simulations, 2, [](std::uint64_t, std::uint64_t) {}), std::invalid_argument);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
