#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {

// What a log has to have at least for advice: so many requests, so many of them for items that were there before, and
// so many that doubling a limit has to turn into hits.
constexpr std::uint64_t kFewestRequests = 1000;
constexpr std::uint64_t kFewestRepeated = 100;
constexpr std::uint64_t kFewestOfWorth = 10;

struct Advice {
  bool isTooShort = false;  // then nothing below is certain
  std::uint64_t neededRequests = 0;
  std::uint64_t repeated = 0;           // requests that the largest limit finds
  std::string strategy;                 // the present one, unless another finds at least what is worth a change
  const TunedLimit* limit = nullptr;    // that is enough with it; null if nothing would have been found
  const TunedLimit* doubled = nullptr;  // the listed limit that is twice that or the next one; null if there is none

  // What finds most within the present limit, if that is worth a change; otherwise empty.
  std::string withinPresent;
};
Advice adviceOn(const Tuning& tuning);

// The least limit that is enough: that which is marked for "lru", and otherwise, by the same rule as
// `HitCurve::enough`, a listed one. Null if nothing would have been found.
const TunedLimit* enoughWith(const Tuning& tuning, const std::string& strategy);
const TunedLimit* enoughAmongListed(const Tuning& tuning, const std::string& strategy);

// Half of the interval that has 95 % of the means of ten parts, if these were independent of each other; for a share of
// the requests, or the difference of two. Infinite where a part has no requests.
double marginOf(const Tuning& tuning, const ByPart& hits, const ByPart& otherHits = {});

// What a sample of the keys adds to it; 0 without a sample. Half of the interval that has 95 % of the means of ten
// groups of keys, and the distance of that mean from the figure itself: a group is a sample of a tenth of the rate, so
// that this is what a smaller rate has changed already.
double samplingMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy);
double samplingMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy,
                      const TunedLimit& other, const std::string& otherStrategy);

// Of both kinds.
double wholeMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy);
double wholeMargin(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy, const TunedLimit& other,
                   const std::string& otherStrategy);

const ByPart& hitsByPart(const TunedLimit& limit, const std::string& strategy);
const ByGroup& hitsByGroup(const TunedLimit& limit, const std::string& strategy);

// At most `kMostRows` of the listed limits: both ends, those that are marked or advised, and those where the hits of a
// strategy change most. Ascending.
constexpr std::size_t kMostRows = 12;
std::vector<const TunedLimit*> limitsToShow(const Tuning& tuning);

}  // namespace velmora::mobile::xplat::cellar::tools
