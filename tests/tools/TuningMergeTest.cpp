#include "tune/TuningMerge.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "Console.h"
#include "InputError.h"
#include "support/TemporaryDirectory.h"
#include "tune/Advice.h"
#include "tune/FleetText.h"
#include "tune/Trace.h"
#include "tune/TuneReport.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

constexpr std::int64_t kSize = 1000;

// A device that asks for so many items in turn, each again and again.
TuneReport deviceWith(int items, int rounds, double rate = 1, double worth = 0.01) {
  Trace trace{KeySample(rate)};
  for (int round = 0; round < rounds; ++round) {
    for (int item = 0; item < items; ++item) {
      Access access;
      access.size = kSize;
      trace.append(std::to_string(item), access);
    }
  }
  TuneSettings settings;
  settings.worth = worth;
  settings.threads = 1;
  TuneReport report;
  report.store = "thumbs";
  report.tuning = tune(trace, settings, [](std::uint64_t, std::uint64_t) {});
  return report;
}

class MergingTunings : public testing::Test {
 protected:
  std::string written(const nlohmann::json& document) {
    return directory_.write("device" + std::to_string(++files_) + ".json", document.dump());
  }
  std::string written(const TuneReport& report) { return written(tuningAsJson(report)); }

  // What is wrong with a document in which the value at a pointer is another.
  std::string errorWith(const char* pointer, const nlohmann::json& value) {
    nlohmann::json document = tuningAsJson(deviceWith(20, 100));
    document[nlohmann::json::json_pointer(pointer)] = value;
    return errorOf(document);
  }
  std::string errorOf(const nlohmann::json& document) {
    const std::string file = written(document);
    try {
      (void)readTuneDocument(file);
    } catch (const InputError& error) {
      const std::string text = error.what();
      EXPECT_EQ(text.substr(0, file.size() + 2), file + ": ");
      return text.substr(file.size() + 2);
    }
    return "no error";
  }

  MergedTuning mergedOf(const std::vector<std::string>& files) {
    TuningMerge merge;
    for (const std::string& file : files) merge.add(file, readTuneDocument(file));
    return merge.result();
  }

  static std::uint64_t hitsAt(const Tuning& tuning, std::int64_t limit, const std::string& strategy) {
    std::uint64_t hits = 0;
    for (const TunedLimit& each : tuning.limits) {
      if (each.lru.limit <= limit) hits = hitsOf(each, strategy);
    }
    return hits;
  }

  static nlohmann::json asJson(const MergedTuning& merged) {
    TuneReport report;
    report.store = merged.store;
    report.fleet = merged.fleet;
    report.tuning = merged.tuning;
    return tuningAsJson(report);
  }

  test::TemporaryDirectory directory_;
  int files_ = 0;
};

TEST_F(MergingTunings, OneDeviceHasItsOwnFiguresAtTheSharedLimits) {
  const TuneReport device = deviceWith(300, 20);
  const MergedTuning merged = mergedOf({written(device)});
  EXPECT_EQ(merged.tuning.requests, device.tuning.requests);
  EXPECT_EQ(merged.tuning.requestedBytes, device.tuning.requestedBytes);
  EXPECT_EQ(merged.tuning.others, device.tuning.others);
  int compared = 0;
  for (const TunedLimit& limit : device.tuning.limits) {
    const auto found = std::find_if(merged.tuning.limits.begin(), merged.tuning.limits.end(),
                                    [&](const TunedLimit& each) { return each.lru.limit == limit.lru.limit; });
    if (found == merged.tuning.limits.end()) continue;  // of this device alone
    ++compared;
    EXPECT_EQ(found->lru.hits, limit.lru.hits) << limit.lru.limit;
    EXPECT_EQ(found->lru.hitBytes, limit.lru.hitBytes) << limit.lru.limit;
    for (const auto& [strategy, figures] : limit.strategies) {
      EXPECT_EQ(found->strategies.at(strategy).hits, figures.hits) << strategy << limit.lru.limit;
      EXPECT_EQ(found->strategies.at(strategy).hitBytes, figures.hitBytes) << strategy << limit.lru.limit;
    }
  }
  EXPECT_GE(compared, 3);
}

TEST_F(MergingTunings, DevicesHaveTheWeightOfTheirRequests) {
  const TuneReport small = deviceWith(20, 100);  // 2,000 requests, all but 20 found with 20,000 bytes
  const TuneReport large = deviceWith(300, 20);  // 6,000 requests, all but 300 found with 300,000 bytes
  const MergedTuning merged = mergedOf({written(small), written(large)});
  EXPECT_EQ(merged.fleet.devices, 2U);
  EXPECT_EQ(merged.tuning.requests, 8000U);
  EXPECT_EQ(hitsAt(merged.tuning, 32768, "lru"), 1980U);
  EXPECT_EQ(hitsAt(merged.tuning, 524288, "lru"), 1980U + 5700U);
  EXPECT_EQ(merged.tuning.limits.back().lru.hits, 1980U + 5700U);
}

TEST_F(MergingTunings, TheOrderOfTheDevicesDoesNotMatter) {
  std::vector<std::string> files = {written(deviceWith(20, 100)), written(deviceWith(300, 20)),
                                    written(deviceWith(90, 50)), written(deviceWith(3, 2))};
  const nlohmann::json expected = asJson(mergedOf(files));
  std::sort(files.begin(), files.end());
  while (std::next_permutation(files.begin(), files.end())) ASSERT_EQ(asJson(mergedOf(files)), expected);
}

TEST_F(MergingTunings, PercentilesAreOfTheDevicesThatHaveEnoughRequests) {
  std::vector<std::string> files(19, written(deviceWith(20, 100)));
  files.push_back(written(deviceWith(300, 20)));
  files.push_back(written(deviceWith(3, 2)));
  const MergedTuning merged = mergedOf(files);
  EXPECT_EQ(merged.fleet.shortDevices, 1U);
  const std::vector<std::int64_t>& enough = merged.fleet.enough.at("lru");
  EXPECT_EQ(enough.size(), 20U);
  EXPECT_EQ(enoughFor(enough, 95), 20'000);
  EXPECT_GE(enoughFor(enough, 96), 300'000);
  EXPECT_EQ(merged.fleet.enough.count("foresight"), 0U);
  const std::string text = testing::PrintToString(fleetTexts(merged.fleet, merged.tuning));
  EXPECT_THAT(text, HasSubstr("1 device has too few requests"));
  EXPECT_THAT(text, HasSubstr("20000 B on 95 %, 293 KB on 99 %"));
}

TEST_F(MergingTunings, AShareOfTheDevicesIsRoundedUpToOneOfThem) {
  const std::vector<std::int64_t> two = {1, 2};
  EXPECT_EQ(enoughFor(two, 50), 1);
  EXPECT_EQ(enoughFor(two, 51), 2);
  EXPECT_EQ(enoughFor(two, 100), 2);
  EXPECT_EQ(enoughFor({7}, 1), 7);
}

TEST_F(MergingTunings, DevicesThatNeverAskAgainNeedNoSpace) {
  const MergedTuning merged = mergedOf({written(deviceWith(2000, 1))});
  EXPECT_EQ(merged.fleet.shortDevices, 1U);
  EXPECT_EQ(merged.tuning.limits.back().lru.hits, 0U);
  EXPECT_EQ(enoughLimit(merged.tuning), nullptr);
}

TEST_F(MergingTunings, SampledDevicesAreCounted) {
  const MergedTuning merged = mergedOf({written(deviceWith(300, 20)), written(deviceWith(5000, 3, 0.5))});
  EXPECT_EQ(merged.fleet.sampledDevices, 1U);
  EXPECT_EQ(merged.tuning.requests, 6000U + 15'000U);
}

TEST_F(MergingTunings, AStrategyThatOneDeviceDoesNotHaveIsLeftOut) {
  nlohmann::json document = tuningAsJson(deviceWith(20, 100));
  for (nlohmann::json& limit : document["limits"]) limit["strategies"].erase("greedy_dual");
  const MergedTuning merged = mergedOf({written(document), written(deviceWith(300, 20))});
  EXPECT_THAT(merged.tuning.others, ElementsAre("foresight"));
  EXPECT_EQ(merged.fleet.partialStrategies.at("greedy_dual"), 1U);
  EXPECT_EQ(merged.fleet.enough.count("greedy_dual"), 0U);
  EXPECT_THAT(testing::PrintToString(fleetTexts(merged.fleet, merged.tuning)),
              HasSubstr("greedy_dual\\\" is left out"));
}

TEST_F(MergingTunings, TheReportIsOfAllDevices) {
  const MergedTuning merged = mergedOf({written(deviceWith(20, 100)), written(deviceWith(300, 20))});
  const nlohmann::json json = asJson(merged);
  EXPECT_EQ(json.at("devices"), 2);
  EXPECT_EQ(json.at("enough_for_percent").at("lru").at("50"), 20'000);
  EXPECT_EQ(json.at("limits").size(), merged.tuning.limits.size());
}

TEST_F(MergingTunings, OtherDocumentsAreRefused) {
  EXPECT_EQ(errorOf(nlohmann::json::object()), "is not a document of tune --json: it has no 'format'");
  EXPECT_EQ(errorOf(nlohmann::json::array()), "is not an object");
  EXPECT_EQ(errorWith("/format", 2), "/format: is not 1, the only version that is known");
  EXPECT_EQ(errorOf(asJson(mergedOf({written(deviceWith(20, 100))}))),
            "is merged already; merge the documents of the devices");
  EXPECT_EQ(errorWith("/limits", nlohmann::json::array()), "/limits: is empty");
  EXPECT_EQ(errorWith("/limits/0/hits", 2001), "/limits/0/hits: is not a whole number from 0 to 2000");
  EXPECT_EQ(errorWith("/limits/0/limit", 0), "/limits/0/limit: is not a whole number from 1 to 4611686018427387904");
  EXPECT_EQ(errorWith("/limits/1/limit", 1), "/limits/1/limit: is not larger than the limit before it");
  EXPECT_EQ(errorWith("/limits/0/strategies/sieve", {}), "/limits/0/strategies: has a strategy that is not known");
  EXPECT_EQ(errorWith("/limits/1/strategies", nullptr), "/limits/1: has other strategies than the limit before it");
  EXPECT_EQ(errorWith("/worth", 0), "/worth: is not a share from 1e-05 to 1");
  EXPECT_EQ(errorWith("/worth", 1e-300), "/worth: is not a share from 1e-05 to 1");
  EXPECT_EQ(errorWith("/worth", 1e-5), "no error");
  EXPECT_EQ(errorWith("/enough/limit", 3), "/enough/limit: is not one of the limits");
  EXPECT_EQ(errorWith("/store", 3), "/store: is not a text");
}

TEST_F(MergingTunings, WhatIsNotOfTheSameKindIsNotAddedUp) {
  const auto errorAfter = [&](const TuneReport& second) {
    try {
      (void)mergedOf({written(deviceWith(20, 100)), written(second)});
    } catch (const InputError& error) {
      return std::string(error.what());
    }
    return std::string("no error");
  };
  TuneReport other = deviceWith(20, 100);
  other.store = "videos";
  EXPECT_THAT(errorAfter(other), HasSubstr("device2.json: /store: is 'videos', but 'thumbs' in the files before it"));
  EXPECT_THAT(errorAfter(deviceWith(20, 100, 1, 0.02)),
              HasSubstr("device4.json: /worth: is not that of the files before it"));
}

TEST_F(MergingTunings, FiguresThatCannotBeCountedAreRefused) {
  nlohmann::json document = tuningAsJson(deviceWith(20, 100));
  document["requested_bytes"] = std::uint64_t{1} << 62U;
  const std::string file = written(document);
  EXPECT_THROW((void)mergedOf({file, file}), InputError);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
