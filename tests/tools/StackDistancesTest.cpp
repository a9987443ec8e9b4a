#include "tune/StackDistances.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <list>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "tools/RealCache.h"
#include "tune/Access.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using Trace = std::vector<Access>;
using Found = std::vector<bool>;  // by access

// The cache of one limit, played as it is described and in no clever way.
class PlainCache {
 public:
  explicit PlainCache(std::int64_t limit) : limit_(limit) {}

  bool access(const Access& access) {
    const bool found = takeOut(access.key);
    if (access.kind == AccessKind::Remove) return found;
    items_.push_front({access.key, access.size});
    total_ += access.size;
    while (total_ > limit_) {
      total_ -= items_.back().second;
      items_.pop_back();
    }
    return found;
  }

 private:
  bool takeOut(std::uint32_t key) {
    const auto item = std::find_if(items_.begin(), items_.end(), [&](const auto& i) { return i.first == key; });
    if (item == items_.end()) return false;
    total_ -= item->second;
    items_.erase(item);
    return true;
  }

  const std::int64_t limit_;
  std::int64_t total_ = 0;
  std::list<std::pair<std::uint32_t, std::int64_t>> items_;  // used last at the front
};

struct Habits {
  std::uint32_t keys = 40;
  std::int64_t leastSize = 0;
  std::int64_t mostSize = 100;
  bool sizesChange = false;
  bool removes = false;
};

Trace randomTrace(std::uint32_t seed, std::size_t length, const Habits& habits) {
  std::mt19937 random(seed);
  const auto below = [&](std::uint32_t bound) { return static_cast<std::uint32_t>(random() % bound); };
  const auto span = static_cast<std::uint32_t>(habits.mostSize - habits.leastSize + 1);
  std::vector<std::int64_t> sizes(habits.keys);
  for (std::int64_t& size : sizes) size = habits.leastSize + below(span);
  Trace trace(length);
  for (Access& access : trace) {
    access.key = std::min(below(habits.keys), below(habits.keys));  // some more often than others
    if (habits.sizesChange && below(4) == 0) sizes[access.key] = habits.leastSize + below(span);
    access.size = sizes[access.key];
    if (habits.removes && below(10) == 0) access.kind = AccessKind::Remove;
  }
  return trace;
}

std::vector<std::optional<std::int64_t>> leastLimits(const Trace& trace) {
  StackDistances distances;
  std::vector<std::optional<std::int64_t>> limits;
  for (const Access& access : trace) {
    if (access.kind == AccessKind::Remove) {
      distances.remove(access.key);
      limits.emplace_back();
    } else {
      limits.push_back(distances.use(access.key, access.size));
    }
  }
  return limits;
}

template <class Cache> Found play(const Trace& trace, Cache&& cache) {
  Found found;
  for (const Access& access : trace) found.push_back(cache.access(access) && access.kind != AccessKind::Remove);
  return found;
}

Found foundAt(std::int64_t limit, const std::vector<std::optional<std::int64_t>>& leastLimits) {
  Found found;
  for (const auto& least : leastLimits) found.push_back(least.has_value() && *least <= limit);
  return found;
}

// At each limit at which anything changes, right below it, and a few others.
void expectAgreementAtEveryLimit(const Trace& trace) {
  const auto least = leastLimits(trace);
  std::set<std::int64_t> limits = {0, 1, 1'000'000};
  for (const auto& limit : least) {
    if (limit) limits.insert({*limit, std::max<std::int64_t>(0, *limit - 1)});
  }
  for (const std::int64_t limit : limits) {
    ASSERT_EQ(foundAt(limit, least), play(trace, PlainCache(limit))) << "limit " << limit;
  }
}

std::optional<std::int64_t> at(std::int64_t limit) { return limit; }

TEST(StackDistances, AnItemIsFoundByALimitThatHoldsItAndAllThatWasUsedSince) {
  StackDistances distances;
  EXPECT_EQ(distances.use(0, 10), std::nullopt);
  EXPECT_EQ(distances.use(1, 20), std::nullopt);
  EXPECT_EQ(distances.use(2, 30), std::nullopt);
  EXPECT_EQ(distances.use(2, 30), at(30));
  EXPECT_EQ(distances.use(0, 10), at(60));
  EXPECT_EQ(distances.use(2, 30), at(40));
  EXPECT_EQ(distances.peak(), 60);
}

TEST(StackDistances, WhatWasGivenUpForAnItemThatIsSmallerByNowHasGone) {
  StackDistances distances;
  distances.use(0, 10);
  distances.use(1, 90);
  distances.use(1, 5);
  EXPECT_EQ(distances.use(0, 10), at(100));
  EXPECT_EQ(distances.use(0, 10), at(10));
}

TEST(StackDistances, AnItemThatGrowsIsFoundByItsOldSizeAndKeptByItsNewOne) {
  StackDistances distances;
  distances.use(0, 10);
  EXPECT_EQ(distances.use(0, 70), at(10));
  EXPECT_EQ(distances.use(0, 70), at(70));
  EXPECT_EQ(distances.peak(), 70);
}

TEST(StackDistances, AnItemLargerThanALimitEmptiesItsCache) {
  StackDistances distances;
  distances.use(0, 10);
  distances.use(1, 1000);
  distances.remove(1);
  EXPECT_EQ(distances.use(0, 10), at(1010));
}

TEST(StackDistances, ARemovedItemIsANewOneAndCountsForNothingAbove) {
  StackDistances distances;
  distances.use(0, 10);
  distances.use(1, 20);
  distances.remove(1);
  distances.remove(1);
  distances.remove(7);
  distances.use(2, 5);
  EXPECT_EQ(distances.use(1, 20), std::nullopt);
  EXPECT_EQ(distances.use(0, 10), at(35));
}

TEST(StackDistances, AnItemOfNoBytesIsFoundAtALimitOfNone) {
  StackDistances distances;
  distances.use(0, 0);
  EXPECT_EQ(distances.use(0, 0), at(0));
}

TEST(StackDistances, WhatIsClearedIsNewAndTheGreatestTotalStays) {
  StackDistances distances;
  distances.use(0, 10);
  distances.use(1, 20);
  distances.clear();
  EXPECT_EQ(distances.use(1, 5), std::nullopt);
  EXPECT_EQ(distances.use(1, 5), at(5));
  EXPECT_EQ(distances.peak(), 30);
}

TEST(StackDistances, ManyUsesOfFewItemsNeedNoMoreRoom) {
  StackDistances distances;
  distances.use(0, 3);
  for (int i = 0; i < 100'000; ++i) EXPECT_EQ(distances.use(1, 4).value_or(4), 4);
  EXPECT_EQ(distances.use(0, 3), at(7));
}

class RandomTraces : public testing::TestWithParam<std::uint32_t> {};

TEST_P(RandomTraces, AgreeWithAPlainCacheAtEveryLimit) {
  expectAgreementAtEveryLimit(randomTrace(GetParam(), 600, Habits()));
}

TEST_P(RandomTraces, AgreeWithAPlainCacheWhenSizesChange) {
  Habits habits;
  habits.sizesChange = true;
  expectAgreementAtEveryLimit(randomTrace(GetParam(), 600, habits));
}

TEST_P(RandomTraces, AgreeWithAPlainCacheWhenItemsAreRemoved) {
  Habits habits;
  habits.sizesChange = true;
  habits.removes = true;
  habits.keys = 150;
  expectAgreementAtEveryLimit(randomTrace(GetParam(), 600, habits));
}

TEST_P(RandomTraces, AgreeWithTheLibrarysOwnDiskCache) {
  Habits habits;
  habits.keys = 25;
  habits.leastSize = 1;
  habits.sizesChange = true;
  habits.removes = true;
  const Trace trace = randomTrace(GetParam(), 150, habits);
  const auto least = leastLimits(trace);
  for (const unsigned int limit : {60U, 200U, 500U, 900U}) {
    ASSERT_EQ(foundAt(limit, least), play(trace, RealCache(limit))) << "limit " << limit;
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, RandomTraces, testing::Values(1, 2, 3, 4));

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
