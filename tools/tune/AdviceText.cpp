#include "tune/AdviceText.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <limits>

#include "Format.h"
#include "tune/Advice.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string wholeBytes(const TunedLimit& limit) { return formatWholeSize(static_cast<std::uint64_t>(limit.lru.limit)); }

std::string quoted(const std::string& strategy) { return '"' + strategy + '"'; }

// Strategies are named where one is not the one that a cache has unless it is told.
std::string nameOf(const TunedLimit& limit, const std::string& strategy, bool withStrategy) {
  return wholeBytes(limit) + (withStrategy ? " with " + quoted(strategy) : "");
}

bool isNamed(const std::string& strategy) { return strategy != strategies::kLeastRecentlyUsed; }

// What the first finds and the second does not.
std::string gain(const Tuning& tuning, const TunedLimit& limit, const std::string& strategy, const TunedLimit& other,
                 const std::string& otherStrategy) {
  const std::uint64_t more = hitsOf(limit, strategy) - hitsOf(other, otherStrategy);
  const double part = share(more, tuning.requests);
  std::string text = formatCount(more, "more hit", "more hits") + " (" + percent(part) + " of the requests";
  const double margin = wholeMargin(tuning, limit, strategy, other, otherStrategy);
  if (std::isfinite(margin)) text += ", give or take " + percent(margin) + (margin >= part ? ": not certain" : "");
  return text + ")";
}

std::string shortText(const Tuning& tuning, const Advice& advice) {
  const bool isWhole = tuning.sample.rate == 1;
  const double repeated = std::round(static_cast<double>(advice.repeated) * tuning.sample.rate);
  return std::string(isWhole ? "The log is too short" : "The sample is too small") + " for advice: it has " +
         formatCount(isWhole ? tuning.requests : tuning.sample.requests, "request", "requests") + ", " +
         formatCount(static_cast<std::uint64_t>(repeated)) + " of them for items that were there before; at least " +
         formatCount(advice.neededRequests) + " and " + formatCount(kFewestRepeated) + " are needed.";
}

// What is found from the limit on that is enough, although it is little of all requests.
std::string doublingText(const Tuning& tuning, const Advice& advice) {
  if (advice.doubled == nullptr) return "";
  const std::uint64_t hits = hitsOf(*advice.limit, advice.strategy);
  const std::uint64_t then = hitsOf(*advice.doubled, advice.strategy);
  const std::uint64_t misses = tuning.requests - hits;
  if (then <= hits || (then - hits) * 10 < misses) return "";
  return " Of its " + formatCount(misses, "miss", "misses") + ", " + wholeBytes(*advice.doubled) + " would find " +
         percent(share(then - hits, misses)) + ".";
}

}  // namespace

std::string percent(double part) {
  std::array<char, 32> text{};
  (void)std::snprintf(text.data(), text.size(), "%.2f %%", part * 100);
  return text.data();
}

// With the rule that it follows from.
std::string adviceText(const Tuning& tuning) {
  const Advice advice = adviceOn(tuning);
  if (advice.limit == nullptr && advice.repeated == 0) {
    return "No limit would have found anything: no item is requested twice.";
  }
  if (advice.isTooShort || advice.limit == nullptr) return shortText(tuning, advice);
  const bool isChange = advice.strategy != tuning.strategy;
  std::string text = nameOf(*advice.limit, advice.strategy, isChange || isNamed(advice.strategy)) + " is enough";
  const TunedLimit* const present = presentLimit(tuning);
  const TunedLimit& before = present == nullptr ? *advice.limit : *present;
  if (hitsOf(*advice.limit, advice.strategy) > hitsOf(before, tuning.strategy)) {
    text += ", with " + gain(tuning, *advice.limit, advice.strategy, before, tuning.strategy) + " than " +
            (present == nullptr ? quoted(tuning.strategy) : "now");
  }
  const bool fits = advice.limit->lru.limit <= std::numeric_limits<std::uint32_t>::max();
  return text + ": from there on, doubling the limit always turns less than " + percent(tuning.worth) +
         " of the requests into hits." + doublingText(tuning, advice) +
         (fits ? "" : " (The library's own limits end below 4 GB.)");
}

std::string costText(const Tuning& tuning) {
  const TunedLimit* const present = presentLimit(tuning);
  if (present == nullptr) return "";
  const Advice advice = adviceOn(tuning);
  const bool named = isNamed(tuning.strategy) || isNamed(advice.strategy);
  const std::uint64_t hits = hitsOf(*present, tuning.strategy);
  std::string text = "The present limit of " + nameOf(*present, tuning.strategy, named) + " finds " +
                     percent(share(hits, tuning.requests));
  if (advice.isTooShort || advice.limit == nullptr) return text + ".";
  if (advice.limit != present || advice.strategy != tuning.strategy) {
    const std::uint64_t then = hitsOf(*advice.limit, advice.strategy);
    const std::uint64_t count = then > hits ? then - hits : hits - then;
    const bool isMore = then > hits || (then == hits && advice.limit->lru.limit > present->lru.limit);
    text += ": " + formatCount(count) + (isMore ? " more " : " fewer ") + (count == 1 ? "miss" : "misses") + " (" +
            percent(share(count, tuning.requests)) + " of the requests) than " +
            nameOf(*advice.limit, advice.strategy, named) + (isMore ? " would have" : "");
    const std::int64_t space = present->lru.limit - advice.limit->lru.limit;
    if (!isMore && space > 0) text += ", for " + formatSize(static_cast<std::uint64_t>(space)) + " more space";
  }
  text += ".";
  if (advice.withinPresent.empty()) return text;
  return text + " Within it, " + quoted(advice.withinPresent) + " would have " +
         gain(tuning, *present, advice.withinPresent, *present, tuning.strategy) + ".";
}

std::string certaintyText(const Tuning& tuning) {
  const Advice advice = adviceOn(tuning);
  if (advice.isTooShort || advice.limit == nullptr) return "";
  const double margin = wholeMargin(tuning, *advice.limit, advice.strategy);
  if (!std::isfinite(margin)) return "";
  return "hit rates are estimates: " + percent(share(hitsOf(*advice.limit, advice.strategy), tuning.requests)) +
         " at " + nameOf(*advice.limit, advice.strategy, isNamed(advice.strategy)) + ", give or take " +
         percent(margin) + " (95 %, from ten equal parts of the log" +
         (tuning.sample.rate == 1 ? ")" : ", and ten groups of the sampled keys)");
}

std::string sampleText(const Tuning& tuning) {
  if (tuning.sample.rate == 1) return "";
  std::string margins;
  const auto add = [&](const std::string& strategy) {
    double greatest = 0;
    for (const TunedLimit& limit : tuning.limits) {
      greatest = std::max(greatest, samplingMargin(tuning, limit, strategy));
    }
    margins += (margins.empty() ? "" : ", ") + percent(greatest) + " for " + strategy;
  };
  add(strategies::kLeastRecentlyUsed);
  for (const std::string& strategy : tuning.others) add(strategy);
  return "a sample: " + formatCount(tuning.sample.requests, "request", "requests") + " of " +
         formatCount(tuning.sample.keys, "key", "keys") + "; hit rates of the whole log may differ by up to " +
         margins + " (95 %, from ten groups of keys)";
}

}  // namespace velmora::mobile::xplat::cellar::tools
