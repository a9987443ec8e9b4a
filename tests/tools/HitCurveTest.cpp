#include "tune/HitCurve.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <random>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {
namespace {

constexpr std::int64_t kMegabyte = 1024 * 1024;

HitCurve curveOf(const std::vector<std::int64_t>& leastLimits, int misses = 0, std::int64_t exactLimit = 0) {
  HitCurve curve(exactLimit);
  for (const std::int64_t limit : leastLimits) curve.addHit(limit, 10);
  for (int i = 0; i < misses; ++i) curve.addMiss(10);
  return curve;
}

TEST(HitCurve, CountsARequestFromItsLeastLimitOn) {
  const HitCurve curve = curveOf({100, 100, 3000}, 1);
  EXPECT_EQ(curve.requests(), 4U);
  EXPECT_EQ(curve.requestedBytes(), 40U);
  EXPECT_EQ(curve.at(99).hits, 0U);
  EXPECT_EQ(curve.at(100).hits, 2U);
  EXPECT_EQ(curve.at(100).hitBytes, 20U);
  EXPECT_EQ(curve.at(2998).hits, 2U);
  EXPECT_EQ(curve.at(3000).hits, 3U);
  EXPECT_EQ(curve.most().hits, 3U);
}

TEST(HitCurve, IsExactAtEveryLimitOfElevenBinaryDigits) {
  std::mt19937_64 random(7);
  std::vector<std::int64_t> leastLimits;
  for (int i = 0; i < 3000; ++i) leastLimits.push_back(static_cast<std::int64_t>(random() >> (4 + random() % 58)));
  const HitCurve curve = curveOf(leastLimits);
  for (std::int64_t digits = 1024; digits <= 2048; digits += 61) {
    for (int power = 0; power < 49; ++power) {
      const std::int64_t limit = digits << power;
      std::uint64_t hits = 0;
      for (const std::int64_t least : leastLimits) hits += least <= limit ? 1 : 0;
      ASSERT_EQ(curve.at(limit).hits, hits) << limit;
    }
  }
}

TEST(HitCurve, IsExactAtTheOneOtherLimitThatItWasMadeFor) {
  const std::int64_t odd = 100 * kMegabyte + 1;
  const HitCurve curve = curveOf({odd - 1, odd, odd + 1}, 0, odd);
  EXPECT_EQ(curve.at(odd).hits, 2U);
}

TEST(HitCurve, HasNothingAtALimitOfNoneButWhatHasNoBytes) {
  HitCurve curve;
  curve.addHit(0, 0);
  curve.addHit(1, 1);
  EXPECT_EQ(curve.at(0).hits, 1U);
  EXPECT_EQ(curve.at(1).hits, 2U);
}

TEST(HitCurve, OfMissesOnlyHasNoLimitThatIsEnough) {
  const HitCurve curve = curveOf({}, 5);
  EXPECT_EQ(curve.enough(0.01).limit, 0);
  EXPECT_EQ(curve.at(1000).hits, 0U);
}

// One of the hundred requests lies beyond the doubling of the other 99's limit.
TEST(HitCurve, EnoughIsTheLeastLimitWithoutAWorthwhileDoublingAbove) {
  std::vector<std::int64_t> leastLimits(99, 100 * kMegabyte);
  leastLimits.push_back(400 * kMegabyte);
  const HitCurve curve = curveOf(leastLimits);
  EXPECT_EQ(curve.enough(0.011).limit, 100 * kMegabyte);
  EXPECT_EQ(curve.enough(0.009).limit, 400 * kMegabyte);
}

TEST(HitCurve, APlateauInTheMiddleIsNotTheEnd) {
  std::vector<std::int64_t> leastLimits(50, kMegabyte);
  leastLimits.insert(leastLimits.end(), 50, 1000 * kMegabyte);
  EXPECT_EQ(curveOf(leastLimits).enough(0.01).limit, 1000 * kMegabyte);
}

TEST(HitCurve, ManySmallStepsAreWeighedByWhatADoublingBringsAltogether) {
  std::vector<std::int64_t> leastLimits;
  for (int i = 1; i <= 1024; ++i) leastLimits.push_back(i);
  // From 512 on a doubling brings half of all; from 1024 on nothing more comes.
  EXPECT_EQ(curveOf(leastLimits).enough(0.01).limit, 1024 - 10);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
