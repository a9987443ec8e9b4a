#include "tune/Advice.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <initializer_list>
#include <string>
#include <vector>

#include "tune/AdviceText.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr std::int64_t kMegabyte = std::int64_t{1} << 20;

// What a log of 10,000 requests could have given, every part of it the same.
class AdviceTest : public testing::Test {
 protected:
  AdviceTest() {
    tuning.requests = 10'000;
    tuning.requestsByPart.fill(1000);
    tuning.worth = 0.01;
    tuning.others = {"greedy_dual", "foresight"};
  }

  void limit(std::int64_t megabytes, std::uint64_t lru, std::uint64_t greedyDual) {
    TunedLimit limit;
    limit.lru = {megabytes * kMegabyte, lru, 0};
    limit.lruHitsByPart.fill(lru / kParts);
    Found found;
    found.hits = greedyDual;
    found.hitsByPart.fill(greedyDual / kParts);
    limit.strategies["greedy_dual"] = found;
    found.hits = 9900;
    limit.strategies["foresight"] = found;
    tuning.limits.push_back(limit);
  }
  void mark(std::size_t present, std::size_t enough) {
    tuning.limits[present].isPresent = true;
    tuning.limits[enough].isEnough = true;
  }

  Tuning tuning;
};

TEST_F(AdviceTest, AnotherStrategyIsAdvisedIfItFindsAsMuchMoreAsIsWorthAChange) {
  limit(1, 1000, 2000);
  limit(2, 5000, 5100);
  limit(4, 5010, 5110);
  mark(0, 1);
  EXPECT_EQ(adviceOn(tuning).strategy, "greedy_dual");
  EXPECT_EQ(adviceText(tuning),
            "2 MB with \"greedy_dual\" is enough, with 4,100 more hits (41.00 % of the requests, give or take 0.00 %) "
            "than now: from there on, doubling the limit always turns less than 1.00 % of the requests into hits.");
  tuning.limits[1].strategies["greedy_dual"].hits = 5099;
  EXPECT_EQ(adviceOn(tuning).strategy, "lru");
  EXPECT_THAT(adviceText(tuning), HasSubstr("2 MB is enough, with 4,000 more hits"));
}

TEST_F(AdviceTest, WithoutAPresentLimitAnotherStrategyIsComparedAtTheAdvisedOne) {
  limit(1, 1000, 2000);
  limit(2, 5000, 6000);
  tuning.limits[1].isEnough = true;
  EXPECT_THAT(adviceText(tuning), HasSubstr("2 MB with \"greedy_dual\" is enough, with 1,000 more hits (10.00 % of the "
                                            "requests, give or take 0.00 %) than \"lru\": from"));
}

TEST_F(AdviceTest, ThePresentStrategyIsKeptUnlessTheOtherIsWorthIt) {
  tuning.strategy = "greedy_dual";
  limit(1, 5099, 5000);
  limit(2, 5150, 5099);
  mark(0, 1);
  EXPECT_EQ(adviceOn(tuning).strategy, "greedy_dual");
  EXPECT_EQ(adviceOn(tuning).limit, &tuning.limits[0]);
  EXPECT_EQ(adviceOn(tuning).withinPresent, "");
  tuning.limits[0].lru.hits = 5100;
  EXPECT_EQ(adviceOn(tuning).withinPresent, "lru");
  EXPECT_EQ(adviceOn(tuning).strategy, "lru");
}

TEST_F(AdviceTest, SaysWhatAnotherStrategyWouldFindWithinThePresentLimit) {
  limit(1, 1000, 2000);
  limit(2, 5000, 5000);
  mark(0, 1);
  EXPECT_THAT(costText(tuning),
              HasSubstr(" than 2 MB would have. Within it, \"greedy_dual\" would have 1,000 more hits (10.00 % of the "
                        "requests, give or take 0.00 %)."));
}

TEST_F(AdviceTest, ForesightIsNeverAdvised) {
  limit(1, 1000, 1000);
  limit(2, 5000, 5000);
  mark(0, 1);
  EXPECT_EQ(adviceOn(tuning).strategy, "lru");
}

TEST_F(AdviceTest, AGainThatOnePartOfTheLogMakesIsNotCertain) {
  limit(1, 1000, 2000);
  mark(0, 0);
  tuning.limits[0].strategies["greedy_dual"].hitsByPart.fill(100);
  tuning.limits[0].strategies["greedy_dual"].hitsByPart[3] = 1000;  // of a difference of 900, with nine of none
  EXPECT_NEAR(marginOf(tuning, tuning.limits[0].strategies["greedy_dual"].hitsByPart, tuning.limits[0].lruHitsByPart),
              2.262 * 0.09, 1e-9);
  EXPECT_THAT(adviceText(tuning), HasSubstr("(10.00 % of the requests, give or take 20.36 %: not certain)"));
}

TEST_F(AdviceTest, APartWithoutRequestsSaysNothing) {
  limit(1, 5000, 5000);
  mark(0, 0);
  EXPECT_THAT(certaintyText(tuning), HasSubstr("50.00 % at 1 MB, give or take 0.00 %"));
  tuning.requestsByPart[9] = 0;
  EXPECT_TRUE(std::isinf(marginOf(tuning, tuning.limits[0].lruHitsByPart)));
  EXPECT_EQ(certaintyText(tuning), "");
}

TEST_F(AdviceTest, WhatFurtherSpaceWouldFindOfTheMissesIsSaidFromATenthOn) {
  limit(1, 1000, 1000);
  limit(2, 9100, 9100);
  limit(4, 9190, 9190);
  mark(0, 1);
  EXPECT_THAT(adviceText(tuning), HasSubstr("into hits. Of its 900 misses, 4 MB would find 10.00 %."));
  tuning.limits[2].lru.hits = 9189;
  EXPECT_THAT(adviceText(tuning), Not(HasSubstr("misses")));
}

TEST_F(AdviceTest, NothingIsCertainOfAShortLog) {
  limit(1, 1000, 2000);
  limit(2, 5000, 5000);
  mark(0, 1);
  tuning.requests = 999;
  tuning.limits[1].lru.hits = 900;
  EXPECT_TRUE(adviceOn(tuning).isTooShort);
  EXPECT_EQ(adviceText(tuning),
            "The log is too short for advice: it has 999 requests, 900 of them for items that were "
            "there before; at least 1,000 and 100 are needed.");
  EXPECT_THAT(costText(tuning), Not(HasSubstr("would")));
  EXPECT_EQ(certaintyText(tuning), "");
  tuning.requests = 1000;
  EXPECT_FALSE(adviceOn(tuning).isTooShort);
  tuning.limits[1].lru.hits = 99;
  EXPECT_TRUE(adviceOn(tuning).isTooShort);
}

TEST_F(AdviceTest, WhatIsWorthLessNeedsALongerLog) {
  limit(1, 5000, 5000);
  mark(0, 0);
  tuning.worth = 0.001;
  EXPECT_FALSE(adviceOn(tuning).isTooShort);
  tuning.worth = 0.0009;
  EXPECT_TRUE(adviceOn(tuning).isTooShort);
}

TEST_F(AdviceTest, AFewLimitsAreShownWhereSomethingChanges) {
  for (int i = 0; i < 40; ++i) limit(i + 1, i < 20 ? 10 : 10 + 200 * static_cast<std::uint64_t>(i - 20), 10);
  mark(3, 30);
  const auto shown = limitsToShow(tuning);
  ASSERT_EQ(shown.size(), kMostRows);
  for (const std::size_t wanted : {0U, 3U, 30U, 39U}) EXPECT_THAT(shown, testing::Contains(&tuning.limits[wanted]));
  int between = 0;
  for (std::size_t i = 1; i < shown.size(); ++i) {
    EXPECT_LT(shown[i - 1]->lru.limit, shown[i]->lru.limit);
    EXPECT_LE(shown[i]->lru.hits - shown[i - 1]->lru.hits, 800U);
    if (shown[i] > &tuning.limits[3] && shown[i] < &tuning.limits[20]) ++between;
  }
  EXPECT_EQ(between, 0);
}

TEST_F(AdviceTest, WhereNothingChangesOnlyTheEndsAndTheMarkedLimitsAreShown) {
  for (int i = 0; i < 20; ++i) limit(i + 1, 5000, 5000);
  mark(7, 0);
  EXPECT_THAT(limitsToShow(tuning), testing::ElementsAre(&tuning.limits[0], &tuning.limits[7], &tuning.limits[19]));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
