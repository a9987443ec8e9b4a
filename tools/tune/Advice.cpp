#include "tune/Advice.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstddef>
#include <functional>
#include <iterator>
#include <limits>
#include <set>
#include <tuple>

#include "tune/SampleScale.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Of Student's distribution with nine degrees of freedom.
constexpr double kQuantile = 2.262;

using Ten = std::array<double, 10>;
constexpr double kTen = 10;
static_assert(kParts == std::tuple_size_v<Ten> && Trace::kGroups == kParts);

double meanOf(const Ten& rates) {
  double mean = 0;
  for (const double rate : rates) mean += rate / kTen;
  return mean;
}

// Half of the interval that has 95 % of their means.
double marginOfMean(const Ten& rates) {
  const double mean = meanOf(rates);
  double squares = 0;
  for (const double rate : rates) squares += (rate - mean) * (rate - mean);
  return kQuantile * std::sqrt(squares / (kTen - 1) / kTen);
}

// Each group is a sample of its own.
Ten ratesByGroup(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy) {
  const ByGroup& hits = hitsByGroup(limit, strategy);
  Ten rates = {};
  for (std::size_t group = 0; group < rates.size(); ++group) {
    const double rate = tuning.sample.rate / Trace::kGroups;
    rates[group] = SampleScale(rate, tuning.requests, tuning.sample.requestsByGroup[group], 0).hitRate(hits[group]);
  }
  return rates;
}

// What is not in the sample is what is not certain.
double marginOfSample(const Tuning& tuning, const Ten& rates, double rate) {
  return std::sqrt(1 - tuning.sample.rate) * marginOfMean(rates) + std::abs(meanOf(rates) - rate);
}

std::uint64_t distance(std::uint64_t a, std::uint64_t b) { return a > b ? a - b : b - a; }

bool isWorthIt(const Tuning& tuning, std::uint64_t hits, std::uint64_t fewerHits) {
  return hits > fewerHits &&
         static_cast<double>(hits - fewerHits) >= tuning.worth * static_cast<double>(tuning.requests);
}

// The first listed limit that is at least twice as large, or else the last one.
std::size_t indexOfDoubled(const Tuning& tuning, std::size_t index) {
  const std::int64_t twice = 2 * tuning.limits[index].lru.limit;
  while (index + 1 < tuning.limits.size() && tuning.limits[index].lru.limit < twice) ++index;
  return index;
}

// What finds most at the limit, if that is worth changing the present strategy for.
std::string bestStrategy(const Tuning& tuning, const TunedLimit& limit) {
  std::string best = tuning.strategy;
  std::vector<std::string> candidates = tuning.others;
  candidates.emplace_back(strategies::kLeastRecentlyUsed);
  for (const std::string& candidate : candidates) {
    const bool isPossible = candidate != strategies::kForesight && hitsOf(limit, candidate) > hitsOf(limit, best);
    if (isPossible && isWorthIt(tuning, hitsOf(limit, candidate), hitsOf(limit, tuning.strategy))) best = candidate;
  }
  return best;
}

// The greatest change of what one of the strategies finds.
std::uint64_t changeBetween(const Tuning& tuning, const TunedLimit& a, const TunedLimit& b) {
  std::uint64_t change = distance(a.lru.hits, b.lru.hits);
  for (const std::string& strategy : tuning.others) {
    change = std::max(change, distance(hitsOf(a, strategy), hitsOf(b, strategy)));
  }
  return change;
}

// Between two limits that are shown: the one that leaves the least change on its greater side.
struct Step {
  std::uint64_t change = 0;
  std::size_t index = 0;
};
Step stepBetween(const Tuning& tuning, std::size_t first, std::size_t last) {
  Step step;
  std::uint64_t least = std::numeric_limits<std::uint64_t>::max();
  for (std::size_t i = first + 1; i < last; ++i) {
    const std::uint64_t greater = std::max(changeBetween(tuning, tuning.limits[first], tuning.limits[i]),
                                           changeBetween(tuning, tuning.limits[i], tuning.limits[last]));
    if (greater >= least) continue;
    least = greater;
    step.index = i;
  }
  if (step.index != 0) step.change = changeBetween(tuning, tuning.limits[first], tuning.limits[last]);
  return step;
}

Step greatestStep(const Tuning& tuning, const std::set<std::size_t>& shown) {
  Step greatest;
  for (auto first = shown.begin(), last = std::next(first); last != shown.end(); ++first, ++last) {
    const Step step = stepBetween(tuning, *first, *last);
    if (step.change > greatest.change) greatest = step;
  }
  return greatest;
}

}  // namespace

const TunedLimit* enoughAmongListed(const Tuning& tuning, const std::string& strategy) {
  if (tuning.limits.empty()) return nullptr;
  std::size_t index = tuning.limits.size() - 1;
  for (; index > 0; --index) {
    const TunedLimit& doubled = tuning.limits[indexOfDoubled(tuning, index - 1)];
    if (isWorthIt(tuning, hitsOf(doubled, strategy), hitsOf(tuning.limits[index - 1], strategy))) break;
  }
  return hitsOf(tuning.limits[index], strategy) == 0 ? nullptr : &tuning.limits[index];
}

const TunedLimit* enoughWith(const Tuning& tuning, const std::string& strategy) {
  return strategy == strategies::kLeastRecentlyUsed ? enoughLimit(tuning) : enoughAmongListed(tuning, strategy);
}

Advice adviceOn(const Tuning& tuning) {
  Advice advice;
  const double ofWorth = std::ceil(static_cast<double>(kFewestOfWorth) / tuning.worth);
  advice.neededRequests = std::max(kFewestRequests, static_cast<std::uint64_t>(ofWorth));
  advice.repeated = tuning.limits.empty() ? 0 : tuning.limits.back().lru.hits;
  const auto simulated = [&](std::uint64_t count) { return static_cast<double>(count) * tuning.sample.rate; };
  advice.isTooShort = simulated(tuning.requests) < static_cast<double>(advice.neededRequests) ||
                      simulated(advice.repeated) < static_cast<double>(kFewestRepeated);
  advice.strategy = tuning.strategy;
  const TunedLimit* const enough = enoughWith(tuning, tuning.strategy);
  if (const TunedLimit* const present = presentLimit(tuning)) {
    const std::string best = bestStrategy(tuning, *present);
    if (best != tuning.strategy) advice.withinPresent = best;
  }
  if (enough == nullptr) return advice;
  advice.strategy = bestStrategy(tuning, *enough);
  advice.limit = enoughWith(tuning, advice.strategy);
  const std::size_t index = static_cast<std::size_t>(advice.limit - tuning.limits.data());
  const TunedLimit* const doubled = &tuning.limits[indexOfDoubled(tuning, index)];
  if (doubled != advice.limit) advice.doubled = doubled;
  return advice;
}

double marginOf(const Tuning& tuning, const ByPart& hits, const ByPart& otherHits) {
  Ten rates = {};
  for (std::size_t part = 0; part < rates.size(); ++part) {
    if (tuning.requestsByPart[part] == 0) return std::numeric_limits<double>::infinity();
    const double difference = static_cast<double>(hits[part]) - static_cast<double>(otherHits[part]);
    rates[part] = difference / static_cast<double>(tuning.requestsByPart[part]);
  }
  return marginOfMean(rates);
}

double samplingMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy) {
  if (tuning.sample.rate == 1) return 0;
  return marginOfSample(tuning, ratesByGroup(tuning, limit, strategy), share(hitsOf(limit, strategy), tuning.requests));
}

double samplingMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy,
                      const TunedLimit& other, const std::string& otherStrategy) {
  if (tuning.sample.rate == 1) return 0;
  Ten rates = ratesByGroup(tuning, limit, strategy);
  const Ten others = ratesByGroup(tuning, other, otherStrategy);
  std::transform(rates.begin(), rates.end(), others.begin(), rates.begin(), std::minus<>());
  const double rate = share(hitsOf(limit, strategy), tuning.requests);
  return marginOfSample(tuning, rates, rate - share(hitsOf(other, otherStrategy), tuning.requests));
}

double wholeMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy) {
  return std::hypot(marginOf(tuning, hitsByPart(limit, strategy)), samplingMargin(tuning, limit, strategy));
}

double wholeMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy, const TunedLimit& other,
                   const std::string& otherStrategy) {
  return std::hypot(marginOf(tuning, hitsByPart(limit, strategy), hitsByPart(other, otherStrategy)),
                    samplingMargin(tuning, limit, strategy, other, otherStrategy));
}

const ByPart& hitsByPart(const TunedLimit& limit, const std::string& strategy) {
  return strategy == strategies::kLeastRecentlyUsed ? limit.lruHitsByPart : limit.strategies.at(strategy).hitsByPart;
}

const ByGroup& hitsByGroup(const TunedLimit& limit, const std::string& strategy) {
  return strategy == strategies::kLeastRecentlyUsed ? limit.lruHitsByGroup : limit.strategies.at(strategy).hitsByGroup;
}

std::vector<const TunedLimit*> limitsToShow(const Tuning& tuning) {
  if (tuning.limits.empty()) return {};
  std::set<std::size_t> shown = {0, tuning.limits.size() - 1};
  const Advice advice = adviceOn(tuning);
  for (const TunedLimit* const limit : {presentLimit(tuning), enoughLimit(tuning), advice.limit}) {
    if (limit != nullptr) shown.insert(static_cast<std::size_t>(limit - tuning.limits.data()));
  }
  while (shown.size() < kMostRows) {
    const Step step = greatestStep(tuning, shown);
    if (step.change == 0) break;
    shown.insert(step.index);
  }
  std::vector<const TunedLimit*> limits;
  limits.reserve(shown.size());
  for (const std::size_t index : shown) limits.push_back(&tuning.limits[index]);
  return limits;
}

}  // namespace velmora::mobile::xplat::cellar::tools
