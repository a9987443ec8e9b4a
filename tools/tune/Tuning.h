#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "tune/HitCurve.h"

namespace velmora::mobile::xplat::cellar::tools {

class Trace;

// A size limit and what a cache of it would have found.
struct TunedLimit {
  HitCurve::Point lru;
  std::optional<std::uint64_t> videoHits;  // in the order of the video strategy
  bool isPresent = false;
  bool isEnough = false;
};

// What follows from the accesses to one cache for its limit.
struct Tuning {
  std::uint64_t requests = 0;
  std::uint64_t requestedBytes = 0;
  std::uint64_t keys = 0;
  std::uint64_t keysOfUnknownSize = 0;
  std::int64_t assumedSize = 0;        // of those
  std::int64_t seconds = 0;            // from the first access to the last
  std::int64_t everything = 0;         // bytes; with this limit nothing is ever evicted
  double worth = 0;                    // the share of all requests that doubling a limit must turn into hits
  std::vector<TunedLimit> limits;      // ascending; the present one and the one that is enough are among them
  std::vector<HitCurve::Point> curve;  // finer, for a plot
};

// `present`: the current limit, 0 if it is not known. Limits are listed from one that finds next to nothing up to one
// that evicts nothing. `onAccess` is called after each access.
Tuning tune(const Trace& trace, std::int64_t present, double worth, const std::function<void()>& onAccess);

// The figures of a listed limit; null if it is not listed.
const TunedLimit* presentLimit(const Tuning& tuning);
const TunedLimit* enoughLimit(const Tuning& tuning);

// From 0 to 1; of nothing, 0.
double share(std::uint64_t part, std::uint64_t whole);

}  // namespace velmora::mobile::xplat::cellar::tools
