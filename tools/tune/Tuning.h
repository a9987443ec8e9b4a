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

// What the accesses to one cache say of its limit.
struct Tuning {
  std::uint64_t requests = 0;
  std::uint64_t requestedBytes = 0;
  std::uint64_t keys = 0;
  std::uint64_t keysOfUnknownSize = 0;
  std::int64_t assumedSize = 0;        // of those
  std::int64_t seconds = 0;            // that the accesses took
  std::int64_t everything = 0;         // bytes; with this limit nothing is ever given up
  double worth = 0;                    // of all requests, what doubling a limit has to bring
  std::vector<TunedLimit> limits;      // ascending; the present one and the one that is enough are among them
  std::vector<HitCurve::Point> curve;  // finer, for a plot
};

// `present`: the limit of today, 0 when that is not known. Limits are listed from one that finds next to nothing up to
// one that gives up nothing. `onAccess` is called after each access.
Tuning tune(const Trace& trace, std::int64_t present, double worth, const std::function<void()>& onAccess);

// The figures of a limit among those listed; null when there is none such.
const TunedLimit* presentLimit(const Tuning& tuning);
const TunedLimit* enoughLimit(const Tuning& tuning);

// From 0 to 1; of nothing, 0.
double share(std::uint64_t part, std::uint64_t whole);

}  // namespace velmora::mobile::xplat::cellar::tools
