#include <algorithm>
#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "benchmarks/Benchmarks.h"
#include "competitors/Competitor.h"
#include "lower_bounds/FileLowerBound.h"
#include "lower_bounds/ManifestLowerBound.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/Storing.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kOutstanding = 64;

struct Case {
  Storing values;
  std::vector<Goal> outstandingGoals;
  std::vector<Goal> singleGoals;
};

std::vector<Case> cases(const Context& context) {
  return {
      {{200, context.scaled<std::size_t>(2000, 500), true}, {{"lower bound", 0.45}, {"SQLite", 1}}, {}},
      {{4 << 10, context.scaled<std::size_t>(2000, 500)}, {{"lower bound", 0.55}}, {{"lower bound", 1.5}}},
      {{64 << 10, context.scaled<std::size_t>(500, 150)}, {{"lower bound", 0.8}, {"LevelDB", 1}, {"SQLite", 1}}, {}},
      {{1 << 20, context.scaled<std::size_t>(60, 20)}, {{"LevelDB", 0.2}, {"SQLite", 0.2}}, {}},
  };
}

double average(const Stopwatch& watch, std::size_t count) { return watch.microseconds() / static_cast<double>(count); }

void throwUnlessStored(const Scratch& scratch, ManifestLowerBound& manifest, const Storing& what) {
  for (std::size_t number = 0; number < what.count; ++number) {
    const std::string key = keyOf(number);
    throwUnlessValue(what.inlineData ? manifest.value(key) : readFile(scratch / key, what.size), what.size, number);
  }
}

double measureLowerBound(const Place& place, bool pinned, const Storing& what) {
  const Scratch scratch(place);
  const Pinned guard(pinned);
  ManifestLowerBound manifest(scratch.path());
  Bytes value = valueOf(what.size);
  const Stopwatch watch;
  for (std::size_t number = 0; number < what.count; ++number) {
    stamp(value, number);
    const std::string key = keyOf(number);
    if (what.inlineData) {
      manifest.put(key, what.size, dateOf(number));
      manifest.putValue(key, value);
    } else {
      manifest.put(key, 0, dateOf(number));
      writeFile(scratch / key, value);
      manifest.put(key, what.size, dateOf(number));
    }
  }
  const double result = average(watch, what.count);
  throwUnlessStored(scratch, manifest, what);
  return result;
}

// The same with statements that are kept, in transactions of 32: what grouping can reach.
double measureGroupedLowerBound(const Place& place, bool pinned, const Storing& what) {
  const Scratch scratch(place);
  const Pinned guard(pinned);
  ManifestLowerBound manifest(scratch.path());
  Bytes value = valueOf(what.size);
  const Stopwatch watch;
  for (std::size_t first = 0; first < what.count; first += kWrittenTogether) {
    const auto forEach = [&](const std::function<void(std::size_t number, const std::string& key)>& write) {
      for (std::size_t number = first; number < std::min(first + kWrittenTogether, what.count); ++number) {
        write(number, keyOf(number));
      }
    };
    manifest.inTransaction([&] {
      forEach([&](std::size_t number, const std::string& key) {
        manifest.put(key, what.inlineData ? what.size : 0, dateOf(number));
        if (!what.inlineData) return;
        stamp(value, number);
        manifest.putValue(key, value);
      });
    });
    if (what.inlineData) continue;
    forEach([&](std::size_t number, const std::string& key) {
      stamp(value, number);
      writeFile(scratch / key, value);
    });
    manifest.inTransaction([&] {
      forEach([&](std::size_t number, const std::string& key) { manifest.put(key, what.size, dateOf(number)); });
    });
  }
  const double result = average(watch, what.count);
  throwUnlessStored(scratch, manifest, what);
  return result;
}

void measureCase(const Context& context, const Place& place, bool pinned, const Case& which) {
  const Storing& what = which.values;
  Contestants contestants = {
      {"64", [&] { return timeOfOurs(place, pinned, what, kOutstanding); }},
      {"1", [&] { return timeOfOurs(place, pinned, what, 1); }},
      {"lower bound", [&] { return measureLowerBound(place, pinned, what); }},
      {"in groups", [&] { return measureGroupedLowerBound(place, pinned, what); }},
  };
  for (const auto& [name, open] : competitors()) {
    contestants.emplace_back(name, [&, open = open] { return timeOfCompetitor(place, pinned, what, open); });
  }
  Figures figures = interleaved(place, contestants, context.scaled(5, 3), what.count * what.size);
  const Figure outstanding = figures.extract("64").mapped();
  const Figure single = figures.extract("1").mapped();
  const std::string name = nameOf(what);
  figures["ours"] = outstanding;
  context.report.add(
      Row{name + ", 64 outstanding", place.name, cpuName(pinned), "us", figures, which.outstandingGoals});
  figures["ours"] = single;
  context.report.add(Row{name + ", one at a time", place.name, cpuName(pinned), "us", figures, which.singleGoals});
}

}  // namespace

void measureStores(const Context& context) {
  for (const Case& which : cases(context)) {
    for (const Place& place : context.places) {
      for (const bool pinned : context.pinnings(which.values.size)) measureCase(context, place, pinned, which);
    }
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
