#include <unistd.h>

#include <cstddef>
#include <stdexcept>
#include <string>
#include <utility>

#include <cellar/DiskCacheManifest.h>

#include "benchmarks/Benchmarks.h"
#include "lower_bounds/ManifestLowerBound.h"
#include "support/Fill.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

using Removal = void (StoreUnderTest::*)();

struct Case {
  std::size_t items;
  std::size_t pruned;
  std::size_t files;  // of the first items; the others are records only, because a million files take minutes to make
  Removal remove = &StoreUnderTest::prune;
};

void throwUnlessPruned(const std::string& directory, std::size_t filesBefore, const Case& what) {
  std::size_t companions = 0;
  for (const char* name : {"/manifest_v1.sqlite", "/manifest_v1.sqlite-wal", "/manifest_v1.sqlite-shm"}) {
    if (::access((directory + name).c_str(), F_OK) == 0) ++companions;
  }
  if (figuresOf(directory).files - companions == filesBefore - what.pruned) return;
  throw std::runtime_error("not as many files were pruned as there should be");
}

double measureOurs(const Context& context, const Place& place, const Case& what) {
  const Scratch scratch(place);
  const std::string directory = scratch / "store";
  context.manifests.copyTo(directory, what.items);
  fillFiles(directory, what.files);
  StoreOptions options;
  options.normalSize = static_cast<std::uint32_t>((what.items - what.pruned) * Manifests::kItemSize);
  StoreUnderTest store(directory, options);
  settle(directory);
  const Stopwatch watch;
  (store.*what.remove)();
  const double result = watch.microseconds() / static_cast<double>(what.pruned);
  if (store->getManifest()->count() != what.items - what.pruned) throw std::runtime_error("not as many were pruned");
  throwUnlessPruned(directory, what.files, what);
  return result;
}

double measureLowerBound(const Context& context, const Place& place, const Case& what) {
  const Scratch scratch(place);
  context.manifests.copyTo(scratch.path(), what.items);
  fillFiles(scratch.path(), what.files);
  ManifestLowerBound manifest(scratch.path());
  settle(scratch.path());
  const Stopwatch watch;
  for (std::size_t number = 0; number < what.pruned; ++number) {
    const std::string key = keyOf(number);
    manifest.remove(key);
    if (::unlink((scratch / key).c_str()) != 0) throw std::runtime_error("no file for " + key);
  }
  const double result = watch.microseconds() / static_cast<double>(what.pruned);
  throwUnlessPruned(scratch.path(), what.files, what);
  return result;
}

Figures measureCase(const Context& context, const Place& place, const Case& what, int repetitions) {
  return interleaved(place,
                     {{"ours", [&] { return measureOurs(context, place, what); }},
                      {"lower bound", [&] { return measureLowerBound(context, place, what); }}},
                     repetitions, what.files * 4096);
}

void measureDown(const Context& context, const Place& place) {
  const std::size_t items = context.scaled<std::size_t>(15'000, 10'000);
  const Case what{items, items / 10 * 9, items};
  const Figures figures = measureCase(context, place, what, context.scaled(3, 1));
  const std::string name = countName(items) + " items down to " + countName(items / 10);
  context.report.add(Row{name, place.name, cpuName(false), "us an item", figures, {{"lower bound", 0.6}}});
}

void measureAll(const Context& context, const Place& place) {
  const std::size_t items = context.scaled<std::size_t>(15'000, 5'000);
  for (const auto& [name, remove] : {std::pair<std::string, Removal>("clearing ", &StoreUnderTest::clear),
                                     std::pair<std::string, Removal>("expiring ", &StoreUnderTest::expireAll)}) {
    const Figures figures = measureCase(context, place, {items, items, items, remove}, context.scaled(3, 1));
    context.report.add(Row{
        name + countName(items) + " items", place.name, cpuName(false), "us an item", figures, {{"lower bound", 0.6}}});
  }
}

void measureGrowth(const Context& context, const Place& place) {
  constexpr std::size_t few = 10'000;
  const std::size_t many = context.scaled<std::size_t>(1'000'000, 100'000);
  const std::size_t pruned = context.scaled<std::size_t>(2'000, 1'000);
  Plot plot{"prune", "Pruning: cost of an item", "items in the store", "microseconds"};
  Figures first;
  Figures last;
  for (std::size_t items = few; items <= many; items *= 10) {
    last = measureCase(context, place, {items, pruned, pruned}, context.scaled(3, 1));
    if (items == few) first = last;
    for (const auto& [name, figure] : last) plot.lines[name].emplace_back(static_cast<double>(items), figure);
    const std::string name = countName(pruned) + " of " + countName(items) + " items";
    context.report.add(Row{name, place.name, cpuName(false), "us an item", last, {}});
  }
  const Figures growth = {{"ours", last["ours"] / first["ours"]},
                          {"lower bound", last["lower bound"] / first["lower bound"]}};
  const std::string name = "growth from " + countName(few) + " to " + countName(many) + " items";
  context.report.add(Row{name, place.name, cpuName(false), "times", growth, {{"", 1.1}}});
  context.report.add(plot);
}

}  // namespace

void measurePrunes(const Context& context) {
  const Place& place = context.places.front();  // on another one it would take more than a minute
  measureDown(context, place);
  measureAll(context, place);
  measureGrowth(context, place);
}

}  // namespace velmora::mobile::xplat::cellar::bench
