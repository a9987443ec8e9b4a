#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include <cellar/DiskCacheManifest.h>
#include <cellar/host/Await.h>
#include <cellar/host/testing/ManualClock.h>

#include "benchmarks/Benchmarks.h"
#include "support/Fill.h"
#include "support/Memory.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"
#include "support/Window.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

using Strategy = PruneStrategyIdentifier;

constexpr std::size_t kOutstanding = 64;
constexpr std::int64_t kStart = 1'700'000'000;

using SizeOf = std::size_t (*)(std::size_t number);

std::size_t mixedSize(std::size_t number) { return 512 + number * 7919 % (16 << 10); }
std::size_t equalSize(std::size_t /*number*/) { return 4 << 10; }

std::size_t sizeOfAll(std::size_t items, SizeOf sizeOf) {
  std::size_t bytes = 0;
  for (std::size_t number = 0; number < items; ++number) bytes += sizeOf(number);
  return bytes;
}

// A few are asked for often, most once in a while.
std::size_t itemAt(std::size_t step, std::size_t items) {
  const std::size_t any = step * 7919 % items;
  return any * any / items;
}

class Cache {
 public:
  Cache(const Place& place, Strategy strategy, std::size_t items, SizeOf sizeOf = mixedSize)
      : items_(items), sizeOf_(sizeOf), scratch_(place) {
    StoreOptions options;
    options.strategy = strategy;
    options.normalSize = static_cast<std::uint32_t>(sizeOfAll(items, sizeOf) / 2);
    store_ = std::make_unique<StoreUnderTest>(scratch_ / "store", options);
  }

  // Microseconds for each item.
  double fill() {
    const Stopwatch watch;
    Window window(kOutstanding);
    for (std::size_t number = 0; number < items_; ++number) {
      clock_.advance(1);
      Bytes value = valueOf(sizeOf_(number));
      stamp(value, number);
      window.add((*store_)->store(keyOf(number), value));
    }
    window.finish();
    return watch.microseconds() / static_cast<double>(items_);
  }

  // Microseconds for each fetch.
  double fetch(std::size_t fetches, std::size_t outstanding) {
    const Stopwatch watch;
    Window window(outstanding);
    for (std::size_t step = 0; step < fetches; ++step) {
      clock_.advance(1);
      const std::size_t number = itemAt(step, items_);
      window.add<Fetched>((*store_)->fetch(keyOf(number)),
                          [this, number](const Fetched& found) { check(number, found); });
    }
    window.finish();
    return watch.microseconds() / static_cast<double>(fetches);
  }

  // Microseconds for all, and how many items have gone.
  std::pair<double, std::size_t> prune() {
    const Stopwatch watch;
    store_->prune();
    const double taken = watch.microseconds();
    const std::size_t left = (*store_)->getManifest()->count();
    if (left == 0 || left >= items_) throw std::runtime_error("not half of the bytes were pruned");
    return {taken, items_ - left};
  }

 private:
  using Fetched = std::unique_ptr<DiskCache::FetchResult>;

  void check(std::size_t number, const Fetched& found) const {
    if (found == nullptr) throw std::runtime_error("item " + std::to_string(number) + " is missing");
    throwUnlessStamped(found->value.data(), found->value.size(), sizeOf_(number), number);
  }

  test::ManualClock clock_{kStart};  // goes on with each call, as nobody is as fast as this
  const std::size_t items_;
  const SizeOf sizeOf_;
  const Scratch scratch_;
  std::unique_ptr<StoreUnderTest> store_;
};

using Measure = std::function<double(Strategy)>;

Figures compared(const Place& place, int rounds, std::size_t bytes, const Measure& measure) {
  return interleaved(
      place, {{"ours", [&] { return measure(Strategy::GreedyDual); }}, {"lru", [&] { return measure(Strategy::LRU); }}},
      rounds, bytes);
}

void measureLoads(const Context& context, const Place& place) {
  const std::size_t items = context.scaled<std::size_t>(100'000, 10'000);
  const Scratch scratch(place);
  context.manifests.copyTo(scratch / "store", items);
  const auto load = [&](Strategy strategy, const std::function<double(const std::function<void()>&)>& figureOf) {
    StoreOptions options;
    options.strategy = strategy;
    std::unique_ptr<StoreUnderTest> store;
    const double figure = figureOf([&] { store = std::make_unique<StoreUnderTest>(scratch / "store", options); });
    if ((*store)->getManifest()->count() != items) throw std::runtime_error("not all records were loaded");
    return figure / static_cast<double>(items);
  };
  const Figures time = compared(place, context.scaled(9, 3), items * 300, [&](Strategy strategy) {
    return load(strategy, [](const auto& open) {
      const Stopwatch watch;
      open();
      return watch.microseconds();
    });
  });
  const auto memory = [&](Strategy strategy) {
    return load(strategy, [](const auto& open) {
      const CountedAllocations allocations;
      open();
      return static_cast<double>(allocations.bytes());
    });
  };
  const std::string name = "loading " + countName(items) + " items";
  context.report.add(Row{name, place.name, cpuName(false), "us an item", time, {}});
  const Figures bytes = {{"ours", memory(Strategy::GreedyDual)}, {"lru", memory(Strategy::LRU)}};
  context.report.add(Row{name + ", memory", "memory", "", "bytes an item", bytes, {}});
}

}  // namespace

void measureStrategies(const Context& context) {
  const Place& place = context.places.front();
  const std::size_t items = context.scaled<std::size_t>(2'000, 500);
  const std::size_t fetches = context.scaled<std::size_t>(4'000, 1'000);
  const int rounds = context.scaled(21, 3);  // enough to see a difference of a few hundredths
  const auto add = [&](const std::string& what, const Measure& measure) {
    const Figures figures = compared(place, rounds, sizeOfAll(items, mixedSize), measure);
    context.report.add(Row{what, place.name, cpuName(false), "us", figures, {{"lru", 1.05}}});
  };
  add("storing, 64 outstanding", [&](Strategy strategy) { return Cache(place, strategy, items).fill(); });
  for (const std::size_t outstanding : {kOutstanding, std::size_t{1}}) {
    const std::string name = outstanding == 1 ? "one at a time" : "64 outstanding";
    add("fetching, " + name, [&](Strategy strategy) {
      Cache cache(place, strategy, items);
      cache.fill();
      return cache.fetch(fetches, outstanding);
    });
  }
  // Of items of different sizes greedy_dual removes fewer and larger ones, so only the whole can be compared.
  const auto prune = [&](Strategy strategy, SizeOf sizeOf) {
    Cache cache(place, strategy, items, sizeOf);
    cache.fill();
    cache.fetch(fetches, kOutstanding);
    return cache.prune();
  };
  add("pruning half of the bytes, each item, all of 4 KiB", [&](Strategy strategy) {
    const auto [taken, gone] = prune(strategy, equalSize);
    return taken / static_cast<double>(gone);
  });
  add("pruning half of the bytes, as a whole", [&](Strategy strategy) { return prune(strategy, mixedSize).first; });
  measureLoads(context, place);
}

}  // namespace velmora::mobile::xplat::cellar::bench
