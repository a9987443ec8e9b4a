#include <algorithm>
#include <chrono>
#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "Console.h"
#include "DiskSizeCalculator.h"
#include "Format.h"
#include "Stopwatch.h"
#include "demo/DemoContext.h"
#include "demo/DemoFilling.h"
#include "demo/DemoSteps.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kCovers = "covers";

// All that there is, and for the covers more than they may keep.
constexpr Filling kEverything{SourceFiles::kMostFiles, 125};

// A first measurement that was shorter says nothing about how much quicker the second one is.
constexpr std::chrono::milliseconds kWorthComparing(100);

struct Measurement {
  std::vector<DiskSizeCalculator::Stats> stats;  // in the order of the stores
  TreeSize total;
  std::chrono::nanoseconds time;
};

TreeSize figuresOf(const DiskSizeCalculator::Stats& stats) {
  return {static_cast<std::uint64_t>(stats.fileCount), static_cast<std::uint64_t>(stats.size)};
}

Measurement measure(DemoContext& context) {
  Measurement measurement{{}, {}, {}};
  const Stopwatch watch;
  for (const auto& store : context.unmanagedStores()) {
    const auto directory = context.app().expectedDirectory(*store);
    measurement.stats.push_back(context.app().host().sizes()->calculateDirectorySize(directory));
    measurement.total += figuresOf(measurement.stats.back());
  }
  measurement.time = watch.elapsed();
  return measurement;
}

void checkFigures(DemoContext& context, const Measurement& measurement, bool isKept) {
  const auto stores = context.unmanagedStores();
  for (std::size_t i = 0; i < stores.size(); ++i) {
    const TreeSize measured = figuresOf(measurement.stats[i]);
    const TreeSize walked = sizeOfTree(context.app().expectedDirectory(*stores[i]));
    context.checks.equal("measured files of " + stores[i]->name, walked.files, measured.files);
    context.checks.equal("measured bytes of " + stores[i]->name, walked.bytes, measured.bytes);
    context.checks.equal("origin of the figures of " + stores[i]->name, isKept ? "kept" : "fresh",
                         measurement.stats[i].valid ? "kept" : "fresh");
  }
}

std::string timesAsQuick(std::chrono::nanoseconds first, std::chrono::nanoseconds second) {
  return formatCount(static_cast<std::uint64_t>(first / std::max(second, std::chrono::nanoseconds(1))));
}

// The directories of the stores, a line for each manager.
void printDirectories(DemoContext& context) {
  std::map<std::string, std::string> names;
  for (const auto& store : context.stores()) {
    const std::string manager = context.app().expectedManagerDirectory(*store);
    names[below(context.root, manager) + "/"] += "  " + below(manager, context.app().expectedDirectory(*store));
  }
  for (const auto& [manager, stores] : names) context.console.line(manager + stores);
}

}  // namespace

void firstStart(DemoContext& context) {
  context.startTimed("100", "alice");
  for (const auto& store : context.stores()) {
    const auto manager = context.app().managerOf(*store);
    const std::string directory = context.app().expectedDirectory(*store);
    const std::string temporary = context.app().expectedManagerDirectory(*store) + "/tmp";
    context.checks.equal("directory of " + store->name, directory, manager->getStore<Store>(store->name)->path);
    context.checks.isTrue(store->name + " has its directory", exists(directory));
    context.checks.equal("temporary directory for " + store->name, temporary, manager->getTemporaryDirectory());
    context.checks.isTrue("the temporary directory for " + store->name + " is there", exists(temporary));
  }
  printDirectories(context);
  context.checkContents();
}

void fillStores(DemoContext& context) {
  const Stopwatch watch;
  const TreeSize written = fillEmptyStores(context, kEverything);
  context.console.line(formatFiles(written) + " written in " + formatTime(watch.elapsed()));
  for (const auto& store : context.unmanagedStores()) {
    context.console.line(store->name + ": " + formatFiles(context.contents[store->name]));
  }
  context.checkContents();
}

void measureStores(DemoContext& context) {
  const std::uint64_t listingsBefore = context.app().files().listings();
  const Measurement measurement = measure(context);
  context.measuringTime = measurement.time;
  context.console.line(formatFiles(measurement.total) + " in " +
                       formatCount(context.app().files().listings() - listingsBefore, "directory", "directories") +
                       ", in " + formatTime(measurement.time));
  context.console.line("a walk that knows nothing of the library counts the same, store by store");
  checkFigures(context, measurement, false);
}

void measureStoresAgain(DemoContext& context) {
  const std::uint64_t listingsBefore = context.app().files().listings();
  const Measurement measurement = measure(context);
  context.console.line("the same " + formatFiles(measurement.total) + ", in " + formatTime(measurement.time) +
                       ", from what is kept with each directory");
  context.console.line(timesAsQuick(context.measuringTime, measurement.time) + " times as quick, no directory listed");
  checkFigures(context, measurement, true);
  context.checks.equal("directories listed", 0, context.app().files().listings() - listingsBefore);
  if (context.measuringTime < kWorthComparing) return;
  context.checks.isTrue("the second measurement is quicker", measurement.time < context.measuringTime);
}

void evictOversizedCache(DemoContext& context) {
  const TreeSize before = context.contents[kCovers];
  const std::uint64_t limit = context.app().unmanagedStore(kCovers)->getMaxSize();
  const std::size_t evictionsBefore = context.storeEvents("eviction").size();
  context.checks.isTrue("covers are over their limit", before.bytes > limit);
  context.restartTimed();
  context.contents[kCovers] = {};
  context.console.line("covers held " + formatSize(before.bytes) + " and may keep " + formatSize(limit) +
                       ": they begin empty, the other stores are as they were");
  context.checkContents();

  const std::vector<JsonValue> evictions = context.storeEvents("eviction");
  context.checks.equal("evictions reported", evictionsBefore + 1, evictions.size());
  if (evictions.empty()) return;
  context.checks.equal("store reported", kCovers, evictions.back().at("store_name").get<std::string>());
  context.checks.equal("size reported", before.bytes, evictions.back().at("current_size").get<std::uint64_t>());
  context.checks.equal("limit reported", limit, evictions.back().at("max_size").get<std::uint64_t>());
  context.checkTrashVanishes();
}

}  // namespace velmora::mobile::xplat::cellar::tools
