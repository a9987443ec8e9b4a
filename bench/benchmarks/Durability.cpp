#include <cellar/Durability.h>

#include <cstddef>
#include <cstdint>
#include <iostream>
#include <string>
#include <utility>
#include <vector>

#include <base/Checksum.h>

#include "benchmarks/Benchmarks.h"
#include "competitors/Competitor.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/Storing.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kOutstanding = 64;
constexpr const char* kRelaxed = "relaxed";
constexpr const char* kSafeStore = "safe store";

// Short measurements, but many: the two differ by less than what a disturbed one is off by.
int roundsOfSafe(const Context& context) { return context.scaled(7, 3); }

int rounds(const Context& context) { return context.scaled(5, 3); }

Storing with(Durability durability, Storing what) {
  what.durability = durability;
  return what;
}

std::string outstandingName(std::size_t outstanding) {
  return outstanding == 1 ? "one at a time" : std::to_string(outstanding) + " outstanding";
}

// What a safe store costs over a relaxed one.

void measureSafe(const Context& context, const Place& place, bool pinned, const Storing& what) {
  for (const std::size_t outstanding : {kOutstanding, std::size_t{1}}) {
    const auto timeOf = [&](Durability durability) {
      return [&, durability] { return timeOfOurs(place, pinned, with(durability, what), outstanding); };
    };
    const Contestants contestants = {{"ours", timeOf(Durability::Safe)}, {kRelaxed, timeOf(Durability::Relaxed)}};
    context.report.add(Row{"safe, " + nameOf(what) + ", " + outstandingName(outstanding),
                           place.name,
                           cpuName(pinned),
                           "us",
                           interleaved(place, contestants, roundsOfSafe(context), what.count * what.size),
                           {{kRelaxed, 1}}});
  }
}

void measureSafe(const Context& context) {
  const std::vector<Storing> cases = {{200, context.scaled<std::size_t>(2000, 500), true},
                                      {4 << 10, context.scaled<std::size_t>(1000, 500)},
                                      {64 << 10, context.scaled<std::size_t>(150, 80)}};
  for (const Storing& what : cases) {
    for (const Place& place : context.places) {
      for (const bool pinned : context.pinnings(what.size)) measureSafe(context, place, pinned, what);
    }
  }
}

// What the checksum costs of that.

double timeOfChecksum(std::size_t size) {
  const std::size_t count = (std::size_t{16} << 20U) / size;
  const std::string key = keyOf(0);
  Bytes value = valueOf(size);
  volatile std::uint32_t result = 0;
  const Stopwatch watch;
  for (std::size_t number = 0; number < count; ++number) {
    stamp(value, number);
    result = Checksum::of(key, value);
  }
  const double taken = watch.microseconds() / static_cast<double>(count);
  (void)result;
  return taken;
}

void measureChecksum(const Context& context, const Storing& what, std::vector<Goal> goals) {
  const Place& place = context.places.front();
  const Contestants contestants = {
      {"ours", [&] { return timeOfChecksum(what.size); }},
      {kSafeStore, [&] { return timeOfOurs(place, false, with(Durability::Safe, what), kOutstanding); }}};
  goals.push_back({kSafeStore, 0.1});
  context.report.add(Row{"checksum of " + sizeName(what.size), place.name, cpuName(false), "us",
                         interleaved(place, contestants, rounds(context), what.count * what.size), goals});
}

// A synced store, beside databases that sync each write, or each group of them.

Contestants syncedContestants(const Place& place, const Storing& what) {
  Contestants contestants = {
      {"64", [&place, &what] { return timeOfOurs(place, false, what, kOutstanding); }},
      {"1", [&place, &what] { return timeOfOurs(place, false, what, 1); }},
  };
  for (const auto& [name, open] : syncedCompetitors()) {
    contestants.emplace_back(name, [&, open = open] { return timeOfCompetitor(place, false, what, open); });
    contestants.emplace_back(inGroups(name), [&, open = open] { return timeInGroups(place, false, what, open); });
  }
  return contestants;
}

void measureSynced(const Context& context, const Place& place, const Storing& what) {
  Figures figures = interleaved(place, syncedContestants(place, what), rounds(context), what.count * what.size);
  const Figure outstanding = figures.extract("64").mapped();
  const Figure single = figures.extract("1").mapped();
  const std::string name = "synced, " + nameOf(what) + ", ";
  std::vector<Goal> outstandingGoals;
  std::vector<Goal> singleGoals;
  for (const auto& [competitor, open] : syncedCompetitors()) {
    outstandingGoals.push_back({competitor, 1});
    outstandingGoals.push_back({inGroups(competitor), kNoLimit});
    singleGoals.push_back({competitor, kNoLimit});
  }
  figures["ours"] = outstanding;
  context.report.add(
      Row{name + outstandingName(kOutstanding), place.name, cpuName(false), "us", figures, outstandingGoals});
  figures["ours"] = single;
  context.report.add(Row{name + outstandingName(1), place.name, cpuName(false), "us", figures, singleGoals});
}

void measureSynced(const Context& context) {
  if (!context.disk) {
    std::cerr << "No disk was named: synced stores are not measured, a sync costs next to nothing in memory\n";
    return;
  }
  const auto synced = [&](std::size_t size, bool inlineData) {
    return Storing{size, context.scaled<std::size_t>(128, 64), inlineData, Durability::Synced};
  };
  const std::vector<Storing> cases = {synced(200, true), synced(4 << 10, true), synced(4 << 10, false)};
  for (const Storing& what : cases) measureSynced(context, *context.disk, what);
}

}  // namespace

void measureDurability(const Context& context) {
  measureSafe(context);
  measureChecksum(context, {4 << 10, context.scaled<std::size_t>(2000, 500)}, {{"", 1}});
  measureChecksum(context, {1 << 20, context.scaled<std::size_t>(30, 20)}, {});
  measureSynced(context);
}

}  // namespace velmora::mobile::xplat::cellar::bench
