#include "tune/TuneDocument.h"

#include <algorithm>
#include <cstdint>
#include <nlohmann/json.hpp>

#include "JsonPlace.h"
#include "tune/SimulatedCache.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::uint64_t kMost = std::uint64_t{1} << 62U;
constexpr double kLeastWorth = 1e-5;  // as on the command line

void checkFormat(const JsonPlace& root) {
  if (!root.has("format")) root.fail("is not a document of tune --json: it has no 'format'");
  if (root.at("format").count(0, kMost) != kTuneFormat) {
    root.at("format").fail("is not " + std::to_string(kTuneFormat) + ", the only version that is known");
  }
  if (root.has("devices")) root.fail("is merged already; merge the documents of the devices");
}

HitCurve::Point pointOf(const JsonPlace& figures, std::int64_t limit, const Tuning& tuning) {
  HitCurve::Point point;
  point.limit = limit;
  point.hits = figures.at("hits").count(0, tuning.requests);
  if (figures.has("hit_bytes")) point.hitBytes = figures.at("hit_bytes").count(0, tuning.requestedBytes);
  return point;
}

void readStrategies(const JsonPlace& row, const Tuning& tuning, TunedLimit& limit) {
  if (!row.has("strategies")) return;
  const JsonPlace strategies = row.at("strategies");
  for (const char* const name : {strategies::kGreedyDual, strategies::kVideoDownload, strategies::kForesight}) {
    if (!strategies.has(name)) continue;
    const HitCurve::Point point = pointOf(strategies.at(name), limit.lru.limit, tuning);
    limit.strategies[name].hits = point.hits;
    limit.strategies[name].hitBytes = point.hitBytes;
  }
  if (limit.strategies.size() != strategies.members()) strategies.fail("has a strategy that is not known");
}

// "lru" finds no less with more space, and every row has the same strategies.
void checkOrder(const JsonPlace& row, const TunedLimit& before, const TunedLimit& limit) {
  if (limit.lru.limit <= before.lru.limit) row.at("limit").fail("is not larger than the limit before it");
  if (limit.lru.hits < before.lru.hits) row.at("hits").fail("is less than at the limit before it");
  if (limit.lru.hitBytes < before.lru.hitBytes) row.at("hit_bytes").fail("is less than at the limit before it");
  const bool isSame =
      std::equal(before.strategies.begin(), before.strategies.end(), limit.strategies.begin(), limit.strategies.end(),
                 [](const auto& a, const auto& b) { return a.first == b.first; });
  if (!isSame) row.fail("has other strategies than the limit before it");
}

void readLimits(const JsonPlace& rows, Tuning& tuning) {
  if (rows.size() == 0) rows.fail("is empty");
  for (std::size_t i = 0; i < rows.size(); ++i) {
    const JsonPlace row = rows.at(i);
    TunedLimit limit;
    (void)row.at("hit_bytes");
    limit.lru = pointOf(row, static_cast<std::int64_t>(row.at("limit").count(1, kMost)), tuning);
    readStrategies(row, tuning, limit);
    if (!tuning.limits.empty()) checkOrder(row, tuning.limits.back(), limit);
    tuning.limits.push_back(std::move(limit));
  }
  for (const auto& [strategy, found] : tuning.limits.front().strategies) tuning.others.push_back(strategy);
}

void markEnough(const JsonPlace& root, Tuning& tuning) {
  if (!root.has("enough")) return;
  const JsonPlace place = root.at("enough").at("limit");
  const auto enough = static_cast<std::int64_t>(place.count(1, kMost));
  const auto found = std::find_if(tuning.limits.begin(), tuning.limits.end(),
                                  [&](const TunedLimit& limit) { return limit.lru.limit == enough; });
  if (found == tuning.limits.end()) place.fail("is not one of the limits");
  found->isEnough = true;
}

}  // namespace

DeviceTuning readTuneDocument(const std::string& file) {
  const nlohmann::json document = readJsonFile(file);
  const JsonPlace root(file, document);
  checkFormat(root);
  DeviceTuning device;
  device.store = root.at("store").text();
  Tuning& tuning = device.tuning;
  tuning.requests = root.at("requests").count(0, kMost);
  tuning.requestedBytes = root.at("requested_bytes").count(0, kMost);
  tuning.worth = root.at("worth").share(kLeastWorth);
  if (root.has("sample")) tuning.sample.rate = root.at("sample").at("rate").share();
  readLimits(root.at("limits"), tuning);
  markEnough(root, tuning);
  return device;
}

}  // namespace velmora::mobile::xplat::cellar::tools
