#include "tune/Tuning.h"

#include <algorithm>

#include "tune/Access.h"
#include "tune/StackDistances.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kMostOctaves = 16;       // listed
constexpr int kPointsOfAnOctave = 32;  // plotted

std::int64_t powerOfTwoFrom(std::int64_t bytes) {
  std::int64_t power = 1;
  while (power < bytes) power *= 2;
  return power;
}

// To whole units that a configuration can have, where that adds but little.
std::int64_t roundedUp(std::int64_t limit) {
  for (const std::int64_t unit : {std::int64_t{1} << 20, std::int64_t{1} << 10}) {
    if (limit >= 64 * unit) return (limit + unit - 1) / unit * unit;
  }
  return limit;
}

// Where listing begins: one doubling below the first limit that finds a hundredth of what can be found.
std::int64_t firstLimit(const HitCurve& curve, std::int64_t last) {
  std::int64_t first = last;
  const std::uint64_t most = curve.most().hits;
  for (int octave = 0; octave < kMostOctaves && first > 1; ++octave) {
    if (curve.at(first).hits * 100 <= most) break;
    first /= 2;
  }
  return first;
}

std::vector<std::int64_t> limitsToList(const HitCurve& curve, std::int64_t everything, std::int64_t present,
                                       std::int64_t enough) {
  const std::int64_t last = powerOfTwoFrom(everything);
  std::vector<std::int64_t> limits = {present, enough};
  if (2 * enough < last) limits.push_back(2 * enough);
  for (std::int64_t limit = firstLimit(curve, last); limit <= last; limit *= 2) {
    limits.push_back(limit);
    const bool hasMiddle = limit % 2 == 0 && limit < last;
    if (hasMiddle) limits.push_back(limit / 2 * 3);
  }
  std::sort(limits.begin(), limits.end());
  limits.erase(std::unique(limits.begin(), limits.end()), limits.end());
  limits.erase(limits.begin(), std::upper_bound(limits.begin(), limits.end(), 0));
  return limits;
}

std::vector<HitCurve::Point> pointsToPlot(const HitCurve& curve, std::int64_t first, std::int64_t last) {
  std::vector<HitCurve::Point> points;
  for (std::int64_t octave = first; octave <= last; octave *= 2) {
    std::int64_t latest = 0;
    for (int i = 0; i < kPointsOfAnOctave; ++i) {
      const std::int64_t limit = octave + octave * i / kPointsOfAnOctave;
      if (limit > latest && limit <= last) points.push_back(curve.at(limit));
      latest = limit;
    }
  }
  return points;
}

struct Simulated {
  HitCurve curve;
  std::vector<HitCurve> parts;
  std::int64_t everything = 0;
};

Simulated simulateLeastRecentlyUsed(const Trace& trace, std::int64_t present, const OnProgress& onProgress) {
  Simulated simulated{HitCurve(present), std::vector<HitCurve>(kParts, HitCurve(present))};
  StackDistances distances;
  std::uint64_t number = 0;
  trace.replay([&](const Access& access) {
    HitCurve& part = simulated.parts[partOf(number, trace.accesses())];
    if (access.kind == AccessKind::Clear) {
      distances.clear();
    } else if (access.kind == AccessKind::Remove) {
      distances.remove(access.key);
    } else {
      const auto least = distances.use(access.key, access.size);
      if (access.kind == AccessKind::Fetch) {
        simulated.curve.add(least, access.size);
        part.add(least, access.size);
      }
    }
    onProgress(++number, trace.accesses());
  });
  simulated.everything = distances.peak();
  return simulated;
}

TunedLimit tunedLimit(const Simulated& simulated, std::int64_t limit) {
  TunedLimit tuned;
  tuned.lru = simulated.curve.at(limit);
  for (std::size_t part = 0; part < kParts; ++part) tuned.lruHitsByPart[part] = simulated.parts[part].at(limit).hits;
  return tuned;
}

void simulateOthers(const Trace& trace, Tuning& tuning, unsigned threads, const OnProgress& onProgress) {
  std::vector<Simulation> simulations;
  for (const TunedLimit& limit : tuning.limits) {
    for (const std::string& strategy : tuning.others) simulations.push_back({strategy, limit.lru.limit, {}});
  }
  simulate(trace, simulations, threads, onProgress);
  auto simulation = simulations.cbegin();
  for (TunedLimit& limit : tuning.limits) {
    for (const std::string& strategy : tuning.others) limit.strategies[strategy] = (simulation++)->found;
  }
}

const TunedLimit* first(const Tuning& tuning, bool TunedLimit::*mark) {
  const auto found =
      std::find_if(tuning.limits.begin(), tuning.limits.end(), [&](const TunedLimit& limit) { return limit.*mark; });
  return found == tuning.limits.end() ? nullptr : &*found;
}

}  // namespace

Tuning tune(const Trace& trace, const TuneSettings& settings, const OnProgress& onProgress) {
  const Simulated simulated = simulateLeastRecentlyUsed(trace, settings.present, onProgress);
  const HitCurve& curve = simulated.curve;
  const std::int64_t enough = roundedUp(curve.enough(settings.worth).limit);
  Tuning tuning;
  tuning.requests = curve.requests();
  tuning.requestedBytes = curve.requestedBytes();
  tuning.keys = trace.keys();
  tuning.keysOfUnknownSize = trace.keysOfUnknownSize();
  tuning.assumedSize = trace.assumedSize();
  tuning.seconds = trace.seconds();
  tuning.everything = simulated.everything;
  for (std::size_t part = 0; part < kParts; ++part) tuning.requestsByPart[part] = simulated.parts[part].requests();
  tuning.worth = settings.worth;
  for (const std::int64_t limit : limitsToList(curve, simulated.everything, settings.present, enough)) {
    tuning.limits.push_back(tunedLimit(simulated, limit));
    tuning.limits.back().isPresent = limit == settings.present;
    tuning.limits.back().isEnough = limit == enough;
  }
  tuning.others = {strategies::kGreedyDual};
  if (trace.hasMetadata()) tuning.others.emplace_back(strategies::kVideoDownload);
  tuning.others.emplace_back(strategies::kForesight);
  const bool isKnown = std::find(tuning.others.begin(), tuning.others.end(), settings.strategy) != tuning.others.end();
  if (isKnown) tuning.strategy = settings.strategy;
  simulateOthers(trace, tuning, settings.threads, onProgress);
  const std::int64_t last = powerOfTwoFrom(simulated.everything);
  tuning.curve = pointsToPlot(curve, firstLimit(curve, last), last);
  return tuning;
}

std::uint64_t hitsOf(const TunedLimit& limit, const std::string& strategy) {
  return strategy == strategies::kLeastRecentlyUsed ? limit.lru.hits : limit.strategies.at(strategy).hits;
}

const TunedLimit* presentLimit(const Tuning& tuning) { return first(tuning, &TunedLimit::isPresent); }
const TunedLimit* enoughLimit(const Tuning& tuning) { return first(tuning, &TunedLimit::isEnough); }

double share(std::uint64_t part, std::uint64_t whole) {
  return whole == 0 ? 0 : static_cast<double>(part) / static_cast<double>(whole);
}

}  // namespace velmora::mobile::xplat::cellar::tools
