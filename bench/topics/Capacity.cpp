#include <unistd.h>

#include <cstddef>
#include <stdexcept>
#include <string>

#include <cellar/DiskCacheManifest.h>

#include "floors/FileFloor.h"
#include "floors/ManifestFloor.h"
#include "support/Fill.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"
#include "topics/Topics.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kSize = Manifests::kItemSize;

// Each write makes one of the first items go, so these have files.
double measureOurs(const Context& context, const Place& place, std::size_t items, std::size_t writes) {
  const Scratch scratch(place);
  const std::string directory = scratch / "store";
  context.manifests.copyTo(directory, items);
  fillFiles(directory, writes);
  StoreOptions options;
  options.capacity = items;
  StoreUnderTest store(directory, options);
  Bytes value = valueOf(kSize);
  const Stopwatch watch;
  for (std::size_t number = items; number < items + writes; ++number) {
    stamp(value, number);
    store->store(keyOf(number), value).get();
  }
  const double result = watch.microseconds() / static_cast<double>(writes);
  if (store->getManifest()->count() != items) throw std::runtime_error("the store is not at its capacity");
  return result;
}

double measureFloor(const Context& context, const Place& place, std::size_t items, std::size_t writes) {
  const Scratch scratch(place);
  context.manifests.copyTo(scratch.path(), items);
  fillFiles(scratch.path(), writes);
  ManifestFloor manifest(scratch.path());
  Bytes value = valueOf(kSize);
  const Stopwatch watch;
  for (std::size_t number = 0; number < writes; ++number) {
    const std::string oldest = keyOf(number);
    manifest.remove(oldest);
    if (::unlink((scratch / oldest).c_str()) != 0) throw std::runtime_error("no file for " + oldest);
    const std::string key = keyOf(items + number);
    stamp(value, items + number);
    manifest.put(key, 0, dateOf(items + number));
    writeFile(scratch / key, value);
    manifest.put(key, kSize, dateOf(items + number));
  }
  return watch.microseconds() / static_cast<double>(writes);
}

}  // namespace

void measureCapacity(const Context& context) {
  constexpr std::size_t few = 1'000;
  const std::size_t many = context.scaled<std::size_t>(1'000'000, 100'000);
  const std::size_t writes = context.scaled<std::size_t>(300, 100);
  const Place& place = context.places.front();
  Plot plot{"capacity", "A write to a full store", "items in the store", "microseconds"};
  Figures first;
  Figures last;
  for (std::size_t items = few; items <= many; items *= 10) {
    last = interleaved({{"ours", [&] { return measureOurs(context, place, items, writes); }},
                        {"floor", [&] { return measureFloor(context, place, items, writes); }}},
                       context.scaled(3, 1), writes * kSize);
    if (items == few) first = last;
    for (const auto& [name, figure] : last) plot.lines[name].emplace_back(static_cast<double>(items), figure);
    context.report.add(Row{countName(items) + " items", place.name, cpuName(false), "us a write", last, {}});
  }
  const Figures growth = {{"ours", last["ours"] / first["ours"]}, {"floor", last["floor"] / first["floor"]}};
  const std::string name = "growth from " + countName(few) + " to " + countName(many) + " items";
  context.report.add(Row{name, place.name, cpuName(false), "times", growth, {{"", 1.15}}});
  context.report.add(plot);
}

}  // namespace velmora::mobile::xplat::cellar::bench
