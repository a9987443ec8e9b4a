#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "tune/HitCurve.h"
#include "tune/SimulatedCache.h"
#include "tune/Simulation.h"

namespace velmora::mobile::xplat::cellar::tools {

class Trace;

// A size limit and what a cache of it would have found.
struct TunedLimit {
  HitCurve::Point lru;
  ByPart lruHitsByPart = {};
  ByGroup lruHitsByGroup = {};
  std::map<std::string, Found> strategies;  // the other ones
  bool isPresent = false;
  bool isEnough = false;
};

// What the figures follow from where only a share of the keys was simulated.
struct SampleFigures {
  double rate = 1;
  std::uint64_t requests = 0;
  std::uint64_t keys = 0;
  ByGroup requestsByGroup = {};
};

// What follows from the accesses to one cache for its limit. From a sample, counts are estimates for the whole, but for
// `requests`, which were counted, and for the counts by part and by group, which are those of the sample.
struct Tuning {
  SampleFigures sample;
  std::uint64_t requests = 0;
  std::uint64_t requestedBytes = 0;
  std::uint64_t keys = 0;
  std::uint64_t keysOfUnknownSize = 0;
  std::int64_t assumedSize = 0;  // of those
  std::int64_t seconds = 0;      // from the first access to the last
  std::int64_t everything = 0;   // bytes; with this limit nothing is ever evicted
  ByPart requestsByPart = {};
  std::string strategy = strategies::kLeastRecentlyUsed;  // the present one
  std::vector<std::string> others;                        // simulated beside "lru"
  double worth = 0;                    // the share of all requests that doubling a limit must turn into hits
  std::vector<TunedLimit> limits;      // ascending; the present one and the one that is enough are among them
  std::vector<HitCurve::Point> curve;  // finer, for a plot
};

struct TuneSettings {
  std::int64_t present = 0;                               // the current limit; 0: not known
  std::string strategy = strategies::kLeastRecentlyUsed;  // the current one; "lru" is taken for one without figures
  double worth = 0.01;
  unsigned threads = 0;  // 0: as processors
};

// Limits are listed from one that finds next to nothing up to one that evicts nothing; among them are all powers of two
// in between, and one and a half times these.
Tuning tune(const Trace& trace, const TuneSettings& settings, const OnProgress& onProgress);

// The hits of a strategy, of which the limit has to have figures.
std::uint64_t hitsOf(const TunedLimit& limit, const std::string& strategy);

// The figures of a listed limit; null if it is not listed.
const TunedLimit* presentLimit(const Tuning& tuning);
const TunedLimit* enoughLimit(const Tuning& tuning);

// From 0 to 1; of nothing, 0.
double share(std::uint64_t part, std::uint64_t whole);

}  // namespace velmora::mobile::xplat::cellar::tools
