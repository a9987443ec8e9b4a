#include "tune/Tuning.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <numeric>
#include <sstream>
#include <string>
#include <vector>

#include "Console.h"
#include "tune/Trace.h"
#include "tune/TunePlot.h"
#include "tune/TuneReport.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr std::int64_t kMegabyte = 1024 * 1024;

class TuningTest : public testing::Test {
 protected:
  // Items of a megabyte, asked for in turn, round after round.
  void askInTurn(int items, int rounds) {
    for (int round = 0; round < rounds; ++round) {
      for (int item = 0; item < items; ++item) ask("item" + std::to_string(item), kMegabyte);
    }
  }

  void ask(const std::string& key, std::int64_t size) {
    Access access;
    access.size = size;
    access.date = date++;
    trace.append(key, access);
  }

  Tuning tuned(std::int64_t present = 0) const {
    TuneSettings settings;
    settings.present = present;
    return tune(trace, settings, [](std::uint64_t, std::uint64_t) {});
  }

  std::string printed(std::int64_t present = 0) const {
    std::ostringstream out;
    Console console(out, false, false);
    TuneReport report;
    report.source = "events";
    report.store = "thumbs";
    report.tuning = tuned(present);
    printTuning(report, console);
    return out.str();
  }

  Trace trace;
  std::int64_t date = 0;
};

TEST_F(TuningTest, ItemsAskedForInTurnAreFoundByALimitThatHoldsAllOrByNone) {
  askInTurn(10, 101);
  const Tuning tuning = tuned();
  EXPECT_EQ(tuning.requests, 1010U);
  EXPECT_EQ(tuning.keys, 10U);
  EXPECT_EQ(tuning.everything, 10 * kMegabyte);
  for (const TunedLimit& limit : tuning.limits) {
    EXPECT_EQ(limit.lru.hits, limit.lru.limit >= 10 * kMegabyte ? 1000U : 0U) << limit.lru.limit;
  }
  ASSERT_NE(enoughLimit(tuning), nullptr);
  EXPECT_EQ(enoughLimit(tuning)->lru.limit, 10 * kMegabyte);
  EXPECT_EQ(presentLimit(tuning), nullptr);
}

TEST_F(TuningTest, ThePresentLimitIsListedExactlyWhateverItIs) {
  askInTurn(10, 101);
  const Tuning tooSmall = tuned(10 * kMegabyte - 1);
  EXPECT_EQ(presentLimit(tooSmall)->lru.hits, 0U);
  const Tuning enough = tuned(10 * kMegabyte);
  EXPECT_EQ(presentLimit(enough)->lru.hits, 1000U);
  EXPECT_EQ(presentLimit(enough), enoughLimit(enough));
}

TEST_F(TuningTest, ListsLimitsFromNextToNothingToAllThereIs) {
  askInTurn(10, 101);
  const Tuning tuning = tuned();
  EXPECT_EQ(tuning.limits.front().lru.hits, 0U);
  EXPECT_EQ(tuning.limits.back().lru.limit, 16 * kMegabyte);
  EXPECT_EQ(tuning.limits.back().lru.hits, 1000U);
  for (std::size_t i = 1; i < tuning.limits.size(); ++i) {
    EXPECT_LT(tuning.limits[i - 1].lru.limit, tuning.limits[i].lru.limit);
  }
}

TEST_F(TuningTest, EnoughIsRoundedUpToAUnitThatAConfigurationCanHave) {
  for (int i = 0; i < 2; ++i) ask("odd", 70 * kMegabyte + 12345);
  for (int i = 0; i < 2; ++i) ask("odd", 70 * kMegabyte + 12345);
  EXPECT_EQ(enoughLimit(tuned())->lru.limit, 71 * kMegabyte);
}

TEST_F(TuningTest, AtTheEndOfASessionEveryCacheIsEmptied) {
  for (int session = 0; session < 50; ++session) {
    askInTurn(10, 3);
    trace.appendClear(date);
  }
  const Tuning tuning = tuned();
  EXPECT_EQ(tuning.requests, 1500U);
  EXPECT_EQ(tuning.limits.back().lru.hits, 1000U);
  for (const auto& [strategy, found] : tuning.limits.back().strategies) EXPECT_EQ(found.hits, 1000U) << strategy;
}

TEST_F(TuningTest, FiguresOfThePartsAddUpToThoseOfTheWhole) {
  askInTurn(10, 101);
  const Tuning tuning = tuned(5 * kMegabyte);
  const auto sum = [](const ByPart& parts) { return std::accumulate(parts.begin(), parts.end(), std::uint64_t{0}); };
  EXPECT_EQ(sum(tuning.requestsByPart), tuning.requests);
  for (const TunedLimit& limit : tuning.limits) {
    EXPECT_EQ(sum(limit.lruHitsByPart), limit.lru.hits);
    for (const auto& [strategy, found] : limit.strategies) EXPECT_EQ(sum(found.hitsByPart), found.hits) << strategy;
  }
}

TEST_F(TuningTest, APresentStrategyThatCannotBeSimulatedIsTakenForLeastRecentlyUsed) {
  askInTurn(10, 101);
  TuneSettings settings;
  settings.strategy = strategies::kVideoDownload;
  EXPECT_EQ(tune(trace, settings, [](std::uint64_t, std::uint64_t) {}).strategy, "lru");
  settings.strategy = strategies::kGreedyDual;
  EXPECT_EQ(tune(trace, settings, [](std::uint64_t, std::uint64_t) {}).strategy, "greedy_dual");
}

TEST_F(TuningTest, SaysWhatThePresentLimitCosts) {
  askInTurn(10, 101);
  EXPECT_THAT(
      printed(5 * kMegabyte),
      HasSubstr("\nThe present limit of 5 MB finds 0.00 %: 1,000 more misses (99.01 % of the requests) than 10 MB "
                "would have.\n"));
  EXPECT_THAT(printed(100 * kMegabyte),
              HasSubstr("\nThe present limit of 100 MB finds 99.01 %: 0 fewer misses (0.00 % of the requests) than 10 "
                        "MB, for 90.0 MB more space.\n"));
  EXPECT_THAT(printed(10 * kMegabyte), HasSubstr("\nThe present limit of 10 MB finds 99.01 %.\n"));
  EXPECT_THAT(printed(), Not(HasSubstr("present limit")));
}

TEST_F(TuningTest, SaysHowManyReportedHitsItCannotSee) {
  askInTurn(10, 101);
  TuneReport report;
  report.tuning = tuned();
  report.reportedHits = 1010;
  const auto print = [&] {
    std::ostringstream out;
    Console console(out, false, false);
    printTuning(report, console);
    return out.str();
  };
  EXPECT_THAT(print(), HasSubstr("reported 100.00 % hits\n  hit rates are estimates"));
  report.reportedFirstHits = 10;
  EXPECT_THAT(print(),
              HasSubstr("reported 100.00 % hits\n  10 of these were the first request of a key that was stored "
                        "before; they count as misses below\n"));
}

TEST_F(TuningTest, NamesTheRuleThatItsAdviceFollows) {
  askInTurn(10, 101);
  EXPECT_THAT(printed(), HasSubstr("10 MB is enough: from there on, doubling the limit always turns less than 1.00 % "
                                   "of the requests into hits."));
}

TEST_F(TuningTest, WithoutASecondRequestNoLimitHelps) {
  askInTurn(3, 1);
  EXPECT_EQ(enoughLimit(tuned()), nullptr);
  EXPECT_THAT(printed(), HasSubstr("No limit would have found anything"));
}

TEST_F(TuningTest, ItemsOfNoBytesAreFoundByAnyLimit) {
  for (int i = 0; i < 3; ++i) ask("empty", 0);
  const Tuning tuning = tuned();
  ASSERT_FALSE(tuning.limits.empty());
  EXPECT_EQ(tuning.limits.front().lru.hits, 2U);
}

TEST_F(TuningTest, ALimitBeyondTheLibrarysOwnIsMarked) {
  for (int i = 0; i < 1000; ++i) ask("film", std::int64_t{5} << 30);
  EXPECT_THAT(printed(), HasSubstr("(The library's own limits end below 4 GB.)"));
}

TEST_F(TuningTest, TheVideoStrategyIsPlayedWhereItemsCarryWhatItNeeds) {
  EXPECT_THAT(printed(), Not(HasSubstr("video_download")));
  askInTurn(4, 3);
  EXPECT_EQ(tuned().limits.back().strategies.count("video_download"), 0U);
  Access access;
  access.size = kMegabyte;
  access.itemType = 1;
  access.date = date;
  trace.append("item0", access);
  EXPECT_EQ(tuned().limits.back().strategies.at("video_download").hits, 9U);
  EXPECT_THAT(printed(), HasSubstr("video_download"));
}

TEST_F(TuningTest, TheReportForMachinesHasTheSameFigures) {
  askInTurn(10, 101);
  TuneReport report;
  report.source = "events";
  report.reportedHits = 42;
  report.tuning = tuned(5 * kMegabyte);
  const nlohmann::ordered_json json = tuningAsJson(report);
  EXPECT_EQ(json.at("requests"), 1010);
  EXPECT_EQ(json.at("reported_hits"), 42);
  EXPECT_EQ(json.at("enough").at("limit"), 10 * kMegabyte);
  EXPECT_EQ(json.at("enough").at("hits"), 1000);
  EXPECT_EQ(json.at("present").at("hits"), 0);
  EXPECT_EQ(json.at("limits").size(), report.tuning.limits.size());
}

TEST_F(TuningTest, TheReportForMachinesHasWhatEachStrategyFinds) {
  askInTurn(10, 101);
  TuneReport report;
  report.tuning = tuned(5 * kMegabyte);
  const nlohmann::ordered_json strategies = tuningAsJson(report).at("present").at("strategies");
  EXPECT_EQ(strategies.size(), 2U);
  EXPECT_EQ(strategies.at("greedy_dual").at("hits"), 0);  // of items of one size, as least recently used
  EXPECT_EQ(strategies.at("foresight").at("hits"), 500);  // the same five are kept
  EXPECT_EQ(strategies.at("foresight").at("hit_bytes"), 500 * kMegabyte);
}

TEST_F(TuningTest, ThePlotMarksBothLimitsAndEscapesTheStoresName) {
  askInTurn(10, 101);
  TuneReport report;
  report.store = "<a & b>";
  report.tuning = tuned(5 * kMegabyte);
  const std::string svg = tuningAsSvg(report);
  EXPECT_EQ(svg.rfind("<svg xmlns=", 0), 0U);
  EXPECT_THAT(svg, HasSubstr("&lt;a &amp; b&gt;"));
  EXPECT_THAT(svg, HasSubstr("present: 5 MB, 0.0 %"));
  EXPECT_THAT(svg, HasSubstr("enough: 10 MB, 99.0 %"));
  EXPECT_THAT(svg, Not(HasSubstr("nan")));
}

TEST_F(TuningTest, TheLargestSizesArePlottedAsFinelyAsOthers) {
  constexpr std::int64_t largest = std::int64_t{1} << 59;
  ask("a", largest);
  ask("a", largest);
  const Tuning tuning = tuned();
  EXPECT_TRUE(std::is_sorted(tuning.curve.begin(), tuning.curve.end(),
                             [](const auto& a, const auto& b) { return a.limit < b.limit; }));
  EXPECT_EQ(std::count_if(tuning.curve.begin(), tuning.curve.end(),
                          [&](const auto& point) { return point.limit > largest / 2 && point.limit < largest; }),
            31);
  EXPECT_EQ(tuning.curve.back().limit, largest);
}

TEST_F(TuningTest, EvenNothingCanBePlotted) {
  TuneReport report;
  report.tuning = tuned();
  EXPECT_THAT(tuningAsSvg(report), Not(HasSubstr("nan")));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
