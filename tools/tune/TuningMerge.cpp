#include "tune/TuningMerge.h"

#include <algorithm>

#include "InputError.h"
#include "tune/Advice.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::uint64_t kMost = std::uint64_t{1} << 62U;

// The smallest power of two, or one and a half times one, that is not smaller.
std::int64_t sharedLimitFrom(std::int64_t limit) {
  std::int64_t power = 1;
  while (power < limit) power *= 2;
  const bool isMiddle = power >= 4 && power / 4 * 3 >= limit;
  return isMiddle ? power / 4 * 3 : power;
}

HitCurve::Point pointOf(const TunedLimit& limit, const std::string& strategy) {
  if (strategy == strategies::kLeastRecentlyUsed) return limit.lru;
  const Found& found = limit.strategies.at(strategy);
  return {limit.lru.limit, found.hits, found.hitBytes};
}

std::vector<std::string> strategiesOf(const Tuning& tuning) {
  std::vector<std::string> strategies = tuning.others;
  strategies.emplace_back(strategies::kLeastRecentlyUsed);
  return strategies;
}

}  // namespace

void TuningMerge::add(const std::string& file, const DeviceTuning& device) {
  check(file, device);
  const Tuning& tuning = device.tuning;
  merged_.store = device.store;
  merged_.tuning.worth = tuning.worth;
  merged_.tuning.requests += tuning.requests;
  merged_.tuning.requestedBytes += tuning.requestedBytes;
  ++merged_.fleet.devices;
  if (tuning.sample.rate < 1) ++merged_.fleet.sampledDevices;
  addSteps(tuning);
  addEnough(tuning);
}

void TuningMerge::check(const std::string& file, const DeviceTuning& device) const {
  const Tuning& sum = merged_.tuning;
  if (device.tuning.requests > kMost - sum.requests || device.tuning.requestedBytes > kMost - sum.requestedBytes) {
    throw InputError(file + ": with the files before it, the figures add up to more than can be counted");
  }
  if (merged_.fleet.devices == 0) return;
  if (device.store != merged_.store) {
    throw InputError(file + ": /store: is '" + device.store + "', but '" + merged_.store + "' in the files before it");
  }
  if (device.tuning.worth != sum.worth) {
    throw InputError(file + ": /worth: is not that of the files before it; merge what was made with the same --worth");
  }
}

// Of limits that lead to the same shared one, the last is the nearest.
void TuningMerge::addSteps(const Tuning& tuning) {
  for (const std::string& strategy : strategiesOf(tuning)) {
    ++devicesOf_[strategy];
    HitCurve::Point before;
    for (const TunedLimit& limit : tuning.limits) {
      const HitCurve::Point point = pointOf(limit, strategy);
      Step& step = steps_[sharedLimitFrom(point.limit)][strategy];
      step.hits += static_cast<std::int64_t>(point.hits) - static_cast<std::int64_t>(before.hits);
      step.hitBytes += static_cast<std::int64_t>(point.hitBytes) - static_cast<std::int64_t>(before.hitBytes);
      before = point;
    }
  }
}

void TuningMerge::addEnough(const Tuning& tuning) {
  if (adviceOn(tuning).isTooShort) {
    ++merged_.fleet.shortDevices;
    return;
  }
  for (const std::string& strategy : strategiesOf(tuning)) {
    if (strategy == strategies::kForesight) continue;
    const TunedLimit* const enough = enoughWith(tuning, strategy);
    merged_.fleet.enough[strategy].push_back(enough == nullptr ? 0 : enough->lru.limit);
  }
}

bool TuningMerge::isComplete(const std::string& strategy) const {
  return devicesOf_.at(strategy) == merged_.fleet.devices;
}

TunedLimit TuningMerge::sumOf(std::int64_t limit, const Steps& sums) const {
  TunedLimit tuned;
  tuned.lru.limit = limit;
  for (const auto& [strategy, sum] : sums) {
    if (!isComplete(strategy)) continue;
    const auto hits = static_cast<std::uint64_t>(sum.hits);
    const auto hitBytes = static_cast<std::uint64_t>(sum.hitBytes);
    if (strategy == strategies::kLeastRecentlyUsed) {
      tuned.lru = {limit, hits, hitBytes};
    } else {
      tuned.strategies[strategy].hits = hits;
      tuned.strategies[strategy].hitBytes = hitBytes;
    }
  }
  return tuned;
}

void TuningMerge::sumUp(Tuning& tuning) const {
  Steps sums;
  for (const auto& [strategy, devices] : devicesOf_) sums[strategy] = {};
  for (const auto& [limit, steps] : steps_) {
    for (const auto& [strategy, step] : steps) {
      sums[strategy].hits += step.hits;
      sums[strategy].hitBytes += step.hitBytes;
    }
    tuning.limits.push_back(sumOf(limit, sums));
    tuning.curve.push_back(tuning.limits.back().lru);
  }
}

MergedTuning TuningMerge::result() const {
  MergedTuning merged = merged_;
  sumUp(merged.tuning);
  for (const auto& [strategy, devices] : devicesOf_) {
    if (!isComplete(strategy)) {
      merged.fleet.partialStrategies[strategy] = devices;
      merged.fleet.enough.erase(strategy);
    } else if (strategy != strategies::kLeastRecentlyUsed) {
      merged.tuning.others.push_back(strategy);
    }
  }
  std::stable_partition(merged.tuning.others.begin(), merged.tuning.others.end(),
                        [](const std::string& strategy) { return strategy != strategies::kForesight; });
  for (auto& [strategy, enough] : merged.fleet.enough) std::sort(enough.begin(), enough.end());
  const TunedLimit* const enough = enoughAmongListed(merged.tuning, strategies::kLeastRecentlyUsed);
  for (TunedLimit& limit : merged.tuning.limits) limit.isEnough = &limit == enough;
  return merged;
}

std::int64_t enoughFor(const std::vector<std::int64_t>& enough, unsigned percent) {
  return enough[(enough.size() * percent + 99) / 100 - 1];
}

}  // namespace velmora::mobile::xplat::cellar::tools
