#include "tune/KeySample.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <string>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

constexpr int kKeys = 100'000;

int countOf(const KeySample& sample, const std::string& prefix) {
  int count = 0;
  for (int i = 0; i < kKeys; ++i) count += sample.has(prefix + std::to_string(i)) ? 1 : 0;
  return count;
}

// Devices with different versions of the program have to agree.
TEST(KeySample, TheHashOfAKeyNeverChanges) {
  EXPECT_EQ(KeySample::hashOf(""), 723595804U);
  EXPECT_EQ(KeySample::hashOf("a"), 3999464523U);
  EXPECT_EQ(KeySample::hashOf("thumbs/42"), 2253680504U);
  EXPECT_EQ(KeySample::hashOf("\xff"), 56302960U);
}

TEST(KeySample, HasItsShareOfKeysThatDifferInANumberOnly) {
  for (const double rate : {0.5, 0.1, 0.01}) {
    for (const char* const prefix : {"", "item", "https://example.com/photos/"}) {
      const double expected = kKeys * rate;
      EXPECT_NEAR(countOf(KeySample(rate), prefix), expected, 4 * std::sqrt(expected)) << prefix;
    }
  }
}

TEST(KeySample, ASmallerSampleIsPartOfALargerOne) {
  for (int i = 0; i < kKeys; ++i) {
    const std::string key = std::to_string(i);
    EXPECT_LE(KeySample(0.01).has(key), KeySample(0.1).has(key)) << key;
  }
}

TEST(KeySample, OfRateOneHasEveryKey) { EXPECT_EQ(countOf(KeySample(1), "item"), kKeys); }

TEST(KeySample, ARateIsANumberOrPercent) {
  EXPECT_EQ(parseRate("1"), 1);
  EXPECT_EQ(parseRate("0.01"), 0.01);
  EXPECT_EQ(parseRate("1%"), 0.01);
  EXPECT_EQ(parseRate("100%"), 1);
  EXPECT_EQ(parseRate("0.5%"), 0.005);
}

TEST(KeySample, WhatIsNotARateIsRefused) {
  for (const char* const text :
       {"", "%", "0", "0%", "-0.1", "1.01", "101%", "nan", "inf", "1e-2", "0.1x", " 0.1", "10 %"}) {
    EXPECT_THROW((void)parseRate(text), InputError) << text;
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
