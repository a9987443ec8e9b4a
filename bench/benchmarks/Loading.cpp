#include <cstddef>
#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>
#include <unordered_map>
#include <vector>

#include <cellar/DiskCacheManifest.h>
#include <cellar/host/ThreadQueueFactory.h>

#include "benchmarks/Benchmarks.h"
#include "lower_bounds/SQLite.h"
#include "support/Fill.h"
#include "support/Memory.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

struct Record {
  std::string filename;
  std::uint32_t size;
  bool hasInlineData;
  std::int32_t modificationDate;
  std::int32_t lastAccessDate;
};

void throwUnless(std::size_t expected, std::size_t found) {
  if (found != expected) throw std::runtime_error("not all records were loaded");
}

double measureLowerBound(const std::string& directory, std::size_t items) {
  const Stopwatch watch;
  Database database(directory + "/manifest_v1.sqlite");
  Statement all(database,
                "SELECT  key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  "
                "extended_manifest FROM LarderManifest;");
  std::unordered_map<std::string, Record> records;
  std::uint32_t total = 0;
  while (all.next()) {
    const auto size = static_cast<std::uint32_t>(all.number(2));
    total += size;
    records.emplace(all.text(0), Record{all.text(1), size, all.number(3) != 0, static_cast<std::int32_t>(all.number(4)),
                                        static_cast<std::int32_t>(all.number(5))});
  }
  const double result = watch.microseconds();
  throwUnless(items, records.size());
  throwUnless(items * Manifests::kItemSize, total);
  return result / static_cast<double>(items);
}

// Microseconds an item.
template <class WhenLoaded> double load(const std::string& directory, std::size_t items, WhenLoaded whenLoaded) {
  host::ThreadQueueFactory queues;
  const auto executor = queues.createWorkQueue();
  const Stopwatch watch;
  const auto manifest =
      DiskCacheManifest::createDiskCacheManifest(directory + "/manifest_v1.sqlite", executor, nullptr, nullptr);
  manifest->load();
  const double taken = watch.microseconds();
  whenLoaded();
  throwUnless(items, manifest->count());
  throwUnless(items * Manifests::kItemSize, manifest->size());
  return taken / static_cast<double>(items);
}

double measureOurs(const std::string& directory, std::size_t items) {
  return load(directory, items, [] {});
}

double measureMemory(const std::string& directory, std::size_t items) {
  std::ptrdiff_t bytes = 0;
  const CountedAllocations allocations;
  load(directory, items, [&] { bytes = allocations.bytes(); });
  return static_cast<double>(bytes) / static_cast<double>(items);
}

}  // namespace

void measureLoading(const Context& context) {
  const std::size_t few = context.scaled<std::size_t>(100'000, 10'000);
  const std::size_t many = few * 10;
  const Place& place = context.places.front();
  Plot plot{"load", "Loading a manifest: cost of an item", "items in the store", "microseconds"};
  Figures first;
  Figures last;
  for (std::size_t items = few / 10; items <= many; items *= 10) {
    const Scratch scratch(place);
    context.manifests.copyTo(scratch / "store", items);
    const double bytes = measureMemory(scratch / "store", items);
    last = interleaved(place,
                       {{"ours", [&] { return measureOurs(scratch / "store", items); }},
                        {"lower bound", [&] { return measureLowerBound(scratch / "store", items); }}},
                       context.scaled(5, 3), items * 300);
    if (items == few) first = last;
    for (const auto& [name, figure] : last) plot.lines[name].emplace_back(static_cast<double>(items), figure);
    const std::string name = countName(items) + " items";
    const std::vector<Goal> goals = items < few ? std::vector<Goal>() : std::vector<Goal>{{"lower bound", 1.3}};
    context.report.add(Row{name, place.name, cpuName(false), "us an item", last, goals});
    context.report.add(Row{name + ", memory", "memory", "", "bytes an item", {{"ours", bytes}}, {{"", 200}}});
  }
  const Figures growth = {{"ours", last["ours"] / first["ours"]},
                          {"lower bound", last["lower bound"] / first["lower bound"]}};
  const std::string name = "growth from " + countName(few) + " to " + countName(many) + " items";
  context.report.add(Row{name, place.name, cpuName(false), "times", growth, {{"lower bound", 1.1}}});
  context.report.add(plot);
}

}  // namespace velmora::mobile::xplat::cellar::bench
