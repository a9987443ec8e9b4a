#include <unistd.h>

#include <cstddef>
#include <map>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include <cellar/DiskCacheManifest.h>

#include "benchmarks/Benchmarks.h"
#include "lower_bounds/FileLowerBound.h"
#include "lower_bounds/ManifestLowerBound.h"
#include "support/Fill.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"
#include "support/Window.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kSize = Manifests::kItemSize;

// The first write after a start finds the database out of memory. It is a figure of its own; these go before the
// others.
constexpr std::size_t kFirstWrites = 20;

constexpr std::size_t kGoalItems = 10'000;

struct Taken {
  double first = 0;  // microseconds
  double each = 0;
};

const auto nothing = [] {};

// `finish` waits for the writes of a section.
template <class Write, class Finish = decltype(nothing)>
Taken timeWrites(std::size_t items, std::size_t writes, Write write, Finish finish = nothing) {
  Bytes value = valueOf(kSize);
  const auto timeOf = [&](std::size_t begin, std::size_t end) {
    const Stopwatch watch;
    for (std::size_t number = begin; number < end; ++number) {
      stamp(value, items + number);
      write(number, value);
    }
    finish();
    return watch.microseconds() / static_cast<double>(end - begin);
  };
  Taken taken;
  taken.first = timeOf(0, 1);
  timeOf(1, kFirstWrites);
  taken.each = timeOf(kFirstWrites, kFirstWrites + writes);
  return taken;
}

// Each write makes one of the first items go, so these have files.
Taken measureOurs(const Context& context, const Place& place, std::size_t items, std::size_t writes,
                  std::size_t outstanding) {
  const Scratch scratch(place);
  const std::string directory = scratch / "store";
  context.manifests.copyTo(directory, items);
  fillFiles(directory, kFirstWrites + writes);
  StoreOptions options;
  options.capacity = items;
  StoreUnderTest store(directory, options);
  settle(directory);
  Window window(outstanding);
  const Taken taken = timeWrites(
      items, writes,
      [&](std::size_t number, const Bytes& value) {
        auto future = store->store(keyOf(items + number), value);
        outstanding == 1 ? future.get() : window.add(std::move(future));
      },
      [&] { window.finish(); });
  if (store->getManifest()->count() != items) throw std::runtime_error("the store is not at its capacity");
  return taken;
}

Taken measureLowerBound(const Context& context, const Place& place, std::size_t items, std::size_t writes) {
  const Scratch scratch(place);
  context.manifests.copyTo(scratch.path(), items);
  fillFiles(scratch.path(), kFirstWrites + writes);
  ManifestLowerBound manifest(scratch.path());
  settle(scratch.path());
  return timeWrites(items, writes, [&](std::size_t number, const Bytes& value) {
    const std::string oldest = keyOf(number);
    manifest.remove(oldest);
    if (::unlink((scratch / oldest).c_str()) != 0) throw std::runtime_error("no file for " + oldest);
    const std::string key = keyOf(items + number);
    manifest.put(key, 0, dateOf(items + number));
    writeFile(scratch / key, value);
    manifest.put(key, kSize, dateOf(items + number));
  });
}

}  // namespace

void measureCapacity(const Context& context) {
  constexpr std::size_t few = 1'000;
  const std::size_t many = context.scaled<std::size_t>(1'000'000, 100'000);
  const std::size_t writes = context.scaled<std::size_t>(300, 100);
  const Place& place = context.places.front();
  Plot plot{"capacity", "A write to a full store", "items in the store", "microseconds"};
  Figures ofFew;
  Figures last;
  for (std::size_t items = few; items <= many; items *= 10) {
    std::map<std::string, std::vector<double>> firsts;
    const auto contestant = [&](const std::string& name, auto measure) -> Contestants::value_type {
      return {name, [&, name, measure] {
                const Taken taken = measure(context, place, items, writes);
                firsts[name].push_back(taken.first);
                return taken.each;
              }};
    };
    const auto oursWith = [](std::size_t outstanding) {
      return [outstanding](const Context& where, const Place& on, std::size_t count, std::size_t writeCount) {
        return measureOurs(where, on, count, writeCount, outstanding);
      };
    };
    last = interleaved(
        place,
        {contestant("ours", oursWith(1)), contestant("64", oursWith(64)), contestant("lower bound", measureLowerBound)},
        context.scaled(3, 1), writes * kSize);
    Figures outstanding = last;
    outstanding["ours"] = last.extract("64").mapped();
    outstanding.erase("64");
    if (items == few) ofFew = last;
    for (const auto& [name, figure] : last) plot.lines[name].emplace_back(static_cast<double>(items), figure);
    context.report.add(Row{countName(items) + " items", place.name, cpuName(false), "us a write", last, {}});
    context.report.add(Row{countName(items) + " items, 64 outstanding", place.name, cpuName(false), "us a write",
                           outstanding,
                           items == kGoalItems ? std::vector<Goal>{{"lower bound", 0.8}} : std::vector<Goal>{}});
    const Figures first = {{"ours", median(firsts["ours"])}, {"lower bound", median(firsts["lower bound"])}};
    context.report.add(
        Row{countName(items) + " items, the first after a start", place.name, cpuName(false), "us", first, {}});
  }
  const Figures growth = {{"ours", last["ours"] / ofFew["ours"]},
                          {"lower bound", last["lower bound"] / ofFew["lower bound"]}};
  const std::string name = "growth from " + countName(few) + " to " + countName(many) + " items";
  context.report.add(Row{name, place.name, cpuName(false), "times", growth, {{"", 1.15}}});
  context.report.add(plot);
}

}  // namespace velmora::mobile::xplat::cellar::bench
