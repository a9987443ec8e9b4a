#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "Console.h"
#include "tune/Advice.h"
#include "tune/AdviceText.h"
#include "tune/SampleScale.h"
#include "tune/Trace.h"
#include "tune/TuneReport.h"
#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr std::uint32_t kSeeds = 3;

struct Request {
  std::string key;
  Access access;
};

// Many keys, of which some are much more popular than others, with sizes of two magnitudes; some are stored, removed,
// or all discarded.
std::vector<Request> randomRequests(std::uint32_t seed, int count, int keys) {
  std::mt19937 random(seed);
  std::uniform_real_distribution<double> uniform(0, 1);
  std::vector<Request> requests;
  requests.reserve(static_cast<std::size_t>(count));
  for (int i = 0; i < count; ++i) {
    const int key = static_cast<int>(std::pow(uniform(random), 2) * keys);
    Request request;
    request.key = std::to_string(seed) + "/" + std::to_string(key);
    request.access.size = 1000 + (key * 7919) % 100'000;
    request.access.date = i;
    const double kind = uniform(random);
    if (kind < 0.02) request.access.kind = AccessKind::Store;
    if (kind > 0.99) request.access.kind = AccessKind::Remove;
    requests.push_back(request);
  }
  return requests;
}

void play(const std::vector<Request>& requests, Trace& trace) {
  for (const Request& request : requests) trace.append(request.key, request.access);
}

Tuning tuned(const Trace& trace) {
  return tune(trace, {}, [](std::uint64_t, std::uint64_t) {});
}

Tuning tunedAt(double rate, const std::vector<Request>& requests) {
  Trace trace{KeySample(rate)};
  play(requests, trace);
  return tuned(trace);
}

const TunedLimit* find(const Tuning& tuning, std::int64_t limit) {
  const auto found = std::find_if(tuning.limits.begin(), tuning.limits.end(),
                                  [&](const TunedLimit& each) { return each.lru.limit == limit; });
  return found == tuning.limits.end() ? nullptr : &*found;
}

TuneReport reportOf(const Tuning& tuning) {
  TuneReport report;
  report.source = "events";
  report.tuning = tuning;
  return report;
}

TEST(SampledTuning, ASampleOfRateOneIsTheWhole) {
  for (std::uint32_t seed = 1; seed <= kSeeds; ++seed) {
    const std::vector<Request> requests = randomRequests(seed, 3000, 500);
    Trace whole;
    play(requests, whole);
    EXPECT_EQ(tuningAsJson(reportOf(tunedAt(1, requests))), tuningAsJson(reportOf(tuned(whole)))) << seed;
  }
}

TEST(SampledTuning, ATenthOfTheKeysGivesEveryStrategysFiguresWithinTheStatedError) {
  int compared = 0;
  int outside = 0;
  for (std::uint32_t seed = 1; seed <= kSeeds; ++seed) {
    const std::vector<Request> requests = randomRequests(seed, 30'000, 10'000);
    const Tuning whole = tunedAt(1, requests);
    const Tuning sample = tunedAt(0.1, requests);
    EXPECT_EQ(sample.requests, whole.requests);
    EXPECT_NEAR(static_cast<double>(sample.keys), static_cast<double>(whole.keys),
                0.1 * static_cast<double>(whole.keys));
    for (const TunedLimit& limit : sample.limits) {
      const TunedLimit* const exact = find(whole, limit.lru.limit);
      if (exact == nullptr) continue;
      for (const char* const strategy : {"lru", "greedy_dual", "foresight"}) {
        const double error =
            std::abs(share(hitsOf(limit, strategy), sample.requests) - share(hitsOf(*exact, strategy), whole.requests));
        const double margin = samplingMargin(sample, limit, strategy);
        EXPECT_LT(margin, 0.2) << seed << ' ' << strategy << ' ' << limit.lru.limit;
        ++compared;
        if (error > margin) ++outside;
      }
    }
  }
  EXPECT_GT(compared, 100);
  EXPECT_LE(outside, compared / 20);
}

TEST(SampledTuning, MemoryIsNeededForTheKeysOfTheSampleOnly) {
  Trace trace{KeySample(0.01)};
  Access access;
  access.size = 1;
  for (int i = 0; i < 100'000; ++i) trace.append("item" + std::to_string(i), access);
  EXPECT_EQ(trace.requests(), 100'000U);
  EXPECT_NEAR(static_cast<double>(trace.keys()), 1000, 130);
  EXPECT_EQ(trace.accesses(), trace.keys());
  trace.mayBeEmpty("item0");
  for (int i = 0; i < 1000; ++i) trace.mayBeEmpty("other" + std::to_string(i));
  EXPECT_LT(trace.keys(), 1200U);
}

TEST(SampledTuning, TheGroupsOfASampleNumberTheirKeysWithoutGaps) {
  Trace trace{KeySample(0.5)};
  play(randomRequests(1, 5000, 1000), trace);
  std::vector<std::vector<bool>> seen(Trace::kGroups);
  for (std::uint32_t key = 0; key < trace.keys(); ++key) {
    const Trace::GroupedKey grouped = trace.groupedKey(key);
    ASSERT_EQ(grouped.number, seen.at(grouped.group).size());
    seen.at(grouped.group).push_back(true);
  }
  for (const auto& group : seen) EXPECT_GT(group.size(), trace.keys() / 20);
}

TEST(SampledTuning, TheEndOfASessionEmptiesTheCachesOfASampleToo) {
  Trace trace{KeySample(0.5)};
  for (std::uint32_t session = 0; session < 5; ++session) {
    for (int round = 0; round < 3; ++round) {
      for (int item = 0; item < 1000; ++item) {
        Access access;
        access.size = 1000;
        trace.append(std::to_string(item), access);
      }
    }
    trace.appendClear(session);
  }
  const Tuning tuning = tuned(trace);
  const double expected = 2.0 / 3;
  for (const char* const strategy : {"lru", "greedy_dual", "foresight"}) {
    EXPECT_NEAR(share(hitsOf(tuning.limits.back(), strategy), tuning.requests), expected, 0.05) << strategy;
  }
}

// All requests of a key are in the sample or none: what is missing are those of a few keys that are found anyway.
TEST(SampleScale, RequestsThatTheSampleLacksOrHasTooManyOfAreTakenForHits) {
  const SampleScale lacking(0.1, 1000, 90, 900);
  EXPECT_EQ(lacking.hits(40), 500U);
  EXPECT_EQ(lacking.hitBytes(400), 5000U);
  EXPECT_EQ(lacking.requestedBytes(), 10'000U);
  const SampleScale tooMany(0.1, 1000, 120, 1200);
  EXPECT_EQ(tooMany.hits(40), 200U);
  EXPECT_EQ(tooMany.hits(10), 0U);
  EXPECT_EQ(tooMany.hits(120), 1000U);
  EXPECT_EQ(tooMany.hitBytes(1200), 10'000U);
}

TEST(SampleScale, DistancesAndLimitsAreScaledByTheRate) {
  const SampleScale scale(0.1, 1000, 100, 1000);
  EXPECT_EQ(scale.limit(1), 10);
  EXPECT_EQ(scale.count(7), 70U);
  EXPECT_EQ(sampledLimit(1005, 0.1), 100);
  EXPECT_EQ(sampledLimit(1005, 1), 1005);
  EXPECT_EQ(SampleScale(1, 5, 5, 50).limit(7), 7);
}

TEST(SampleScale, OfNothingThereIsNothing) {
  const SampleScale scale(0.1, 0, 0, 0);
  EXPECT_EQ(scale.hits(0), 0U);
  EXPECT_EQ(scale.hitBytes(0), 0U);
}

TEST(SampledTuning, AReportSaysThatItIsEstimatedAndHowFarItMayBeOff) {
  const std::vector<Request> requests = randomRequests(1, 30'000, 10'000);
  const Tuning whole = tunedAt(1, requests);
  EXPECT_EQ(sampleText(whole), "");
  EXPECT_FALSE(tuningAsJson(reportOf(whole)).contains("sample"));
  const Tuning sample = tunedAt(0.1, requests);
  std::ostringstream out;
  Console console(out, false, false);
  printTuning(reportOf(sample), console);
  EXPECT_THAT(out.str(), HasSubstr("  a sample: "));
  EXPECT_THAT(out.str(), HasSubstr("and ten groups of the sampled keys)"));
  const auto json = tuningAsJson(reportOf(sample));
  EXPECT_EQ(json.at("sample").at("rate"), 0.1);
  EXPECT_GT(json.at("limits").at(5).at("sampling_margin"), 0);
}

TEST(SampledTuning, ASmallSampleOfALongLogGivesNoAdvice) {
  const std::vector<Request> requests = randomRequests(1, 20'000, 2000);
  const Tuning whole = tunedAt(1, requests);
  EXPECT_FALSE(adviceOn(whole).isTooShort);
  EXPECT_THAT(adviceText(whole), Not(HasSubstr("too small")));
  const Tuning sample = tunedAt(0.01, requests);
  EXPECT_TRUE(adviceOn(sample).isTooShort);
  EXPECT_THAT(adviceText(sample), HasSubstr("The sample is too small for advice: it has "));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
