#include "tune/Tuning.h"

#include <algorithm>
#include <optional>

#include "tune/Access.h"
#include "tune/SampleScale.h"
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
      const std::int64_t step =
          octave < kPointsOfAnOctave ? octave * i / kPointsOfAnOctave : octave / kPointsOfAnOctave * i;
      const std::int64_t limit = octave + step;
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

// Of limits of the whole.
class ScaledDistances {
 public:
  explicit ScaledDistances(double rate) : scale_(rate, 0, 0, 0) {}

  // The least limit at which the item is found; empty also for an access that is not a use.
  std::optional<std::int64_t> access(const Access& access) {
    if (access.kind == AccessKind::Clear) {
      distances_.clear();
    } else if (access.kind == AccessKind::Remove) {
      distances_.remove(access.key);
    } else if (const auto least = distances_.use(access.key, access.size)) {
      return scale_.limit(*least);
    }
    return std::nullopt;
  }
  std::int64_t peak() const { return scale_.limit(distances_.peak()); }

 private:
  const SampleScale scale_;
  StackDistances distances_;
};

Simulated simulateLeastRecentlyUsed(const Trace& trace, std::int64_t present, const OnProgress& onProgress) {
  Simulated simulated{HitCurve(present), std::vector<HitCurve>(kParts, HitCurve(present))};
  ScaledDistances distances(trace.sample().rate());
  std::uint64_t number = 0;
  trace.replay([&](const Access& access) {
    HitCurve& part = simulated.parts[partOf(number, trace.accesses())];
    const auto least = distances.access(access);
    if (access.kind == AccessKind::Fetch) {
      simulated.curve.add(least, access.size);
      part.add(least, access.size);
    }
    onProgress(++number, trace.accesses());
  });
  simulated.everything = distances.peak();
  return simulated;
}

// Each group of keys as if there were no others.
void simulateGroups(const Trace& trace, Tuning& tuning) {
  std::vector<ScaledDistances> distances(Trace::kGroups, ScaledDistances(trace.sample().rate() / Trace::kGroups));
  trace.replay([&](Access access) {
    if (access.kind == AccessKind::Clear) {
      for (ScaledDistances& each : distances) (void)each.access(access);
      return;
    }
    const Trace::GroupedKey key = trace.groupedKey(access.key);
    access.key = key.number;
    const auto least = distances[key.group].access(access);
    if (access.kind != AccessKind::Fetch) return;
    ++tuning.sample.requestsByGroup[key.group];
    for (auto limit = tuning.limits.rbegin(); least && limit != tuning.limits.rend() && limit->lru.limit >= *least;
         ++limit) {
      ++limit->lruHitsByGroup[key.group];
    }
  });
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

void scale(HitCurve::Point& point, const SampleScale& sample) {
  point.hits = sample.hits(point.hits);
  point.hitBytes = sample.hitBytes(point.hitBytes);
}

// From the figures of the sample to those of the whole.
void scale(Tuning& tuning, const SampleScale& sample) {
  for (TunedLimit& limit : tuning.limits) {
    scale(limit.lru, sample);
    for (auto& [strategy, found] : limit.strategies) {
      found.hits = sample.hits(found.hits);
      found.hitBytes = sample.hitBytes(found.hitBytes);
    }
  }
  for (HitCurve::Point& point : tuning.curve) scale(point, sample);
  tuning.requestedBytes = sample.requestedBytes();
  tuning.keys = sample.count(tuning.keys);
  tuning.keysOfUnknownSize = sample.count(tuning.keysOfUnknownSize);
}

// The tables of the curves are gone again when the other strategies need memory.
Tuning tuneLeastRecentlyUsed(const Trace& trace, const TuneSettings& settings, const OnProgress& onProgress) {
  const Simulated simulated = simulateLeastRecentlyUsed(trace, settings.present, onProgress);
  const HitCurve& curve = simulated.curve;
  const std::int64_t enough = roundedUp(curve.enough(settings.worth).limit);
  Tuning tuning;
  tuning.sample.rate = trace.sample().rate();
  tuning.sample.requests = curve.requests();
  tuning.sample.keys = trace.keys();
  tuning.requests = trace.requests();
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
  const std::int64_t last = powerOfTwoFrom(simulated.everything);
  tuning.curve = pointsToPlot(curve, firstLimit(curve, last), last);
  return tuning;
}

const TunedLimit* first(const Tuning& tuning, bool TunedLimit::*mark) {
  const auto found =
      std::find_if(tuning.limits.begin(), tuning.limits.end(), [&](const TunedLimit& limit) { return limit.*mark; });
  return found == tuning.limits.end() ? nullptr : &*found;
}

}  // namespace

Tuning tune(const Trace& trace, const TuneSettings& settings, const OnProgress& onProgress) {
  Tuning tuning = tuneLeastRecentlyUsed(trace, settings, onProgress);
  if (!trace.sample().isWhole()) simulateGroups(trace, tuning);
  tuning.others = {strategies::kGreedyDual};
  if (trace.hasMetadata()) tuning.others.emplace_back(strategies::kVideoDownload);
  tuning.others.emplace_back(strategies::kForesight);
  const bool isKnown = std::find(tuning.others.begin(), tuning.others.end(), settings.strategy) != tuning.others.end();
  if (isKnown) tuning.strategy = settings.strategy;
  simulateOthers(trace, tuning, settings.threads, onProgress);
  scale(tuning, SampleScale(tuning.sample.rate, tuning.requests, tuning.sample.requests, tuning.requestedBytes));
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
