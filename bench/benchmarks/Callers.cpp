#include <algorithm>
#include <cstddef>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include <cellar/host/Await.h>

#include "benchmarks/Benchmarks.h"
#include "competitors/Competitor.h"
#include "support/Memory.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

// Each value is written several times, so that the space stays bounded.
constexpr std::size_t kKeys = 64;

constexpr std::size_t kPlottedSize = 4 << 10;
constexpr double kMedian = 0.5;
constexpr double kTail = 0.999;

struct Case {
  std::size_t size;
  std::size_t calls;  // in one turn
};

std::vector<Case> cases(const Context& context) {
  return {{4 << 10, context.scaled<std::size_t>(2000, 500)},
          {64 << 10, context.scaled<std::size_t>(1000, 200)},
          {1 << 20, context.scaled<std::size_t>(150, 40)}};
}

using Samples = std::vector<double>;

// What the calls of one contestant took, over all turns.
struct Taken {
  Samples puts;
  Samples gets;
};

class Contestant {
 public:
  Contestant() = default;
  virtual ~Contestant() = default;
  Contestant(const Contestant&) = delete;
  Contestant& operator=(const Contestant&) = delete;

  // One call each; microseconds until it returned. What it started has ended when these return.
  virtual double put(std::size_t number, const Bytes& value) = 0;
  virtual double get(std::size_t number, std::size_t size) = 0;
};

class OurCaller : public Contestant {
 public:
  explicit OurCaller(const Place& place) : scratch_(place), store_(scratch_ / "store") {}

  double put(std::size_t number, const Bytes& value) override {
    const std::string key = keyOf(number);
    const Stopwatch watch;
    Future<void> future = store_->store(key, value);
    const double taken = watch.microseconds();
    host::await(std::move(future));
    return taken;
  }

  double get(std::size_t number, std::size_t size) override {
    const std::string key = keyOf(number);
    const Stopwatch watch;
    auto future = store_->fetch(key);
    const double taken = watch.microseconds();
    const auto found = host::await(std::move(future));
    if (found == nullptr) throw std::runtime_error("item " + std::to_string(number) + " is missing");
    throwUnlessStamped(found->value.data(), found->value.size(), size, number);
    return taken;
  }

 private:
  const Scratch scratch_;
  StoreUnderTest store_;
};

class CompetitorCaller : public Contestant {
 public:
  CompetitorCaller(const Place& place, const OpenCompetitor& open)
      : scratch_(place), competitor_(open(scratch_.path())) {}

  double put(std::size_t number, const Bytes& value) override {
    const std::string key = keyOf(number);
    const Stopwatch watch;
    competitor_->put(key, value);
    return watch.microseconds();
  }

  double get(std::size_t number, std::size_t size) override {
    const std::string key = keyOf(number);
    const Stopwatch watch;
    const Bytes value = competitor_->get(key);
    const double taken = watch.microseconds();
    throwUnlessStamped(value.data(), value.size(), size, number);
    return taken;
  }

 private:
  const Scratch scratch_;
  const std::unique_ptr<Competitor> competitor_;
};

void takeTurn(Contestant& contestant, const Case& what, Taken& taken) {
  Bytes value = valueOf(what.size);
  for (std::size_t call = 0; call < what.calls; ++call) {
    stamp(value, call % kKeys);
    taken.puts.push_back(contestant.put(call % kKeys, value));
  }
  for (std::size_t call = 0; call < what.calls; ++call) {
    taken.gets.push_back(contestant.get(call * 7 % std::min(kKeys, what.calls), what.size));
  }
}

void report(const Context& context, const std::string& what, const Place& place, bool pinned,
            const std::map<std::string, Taken>& all, Samples Taken::*samples, double share,
            const std::vector<Goal>& goals) {
  Figures figures;
  for (const auto& [contestant, taken] : all) figures[contestant] = quantile(taken.*samples, share);
  const std::string name = share == kMedian ? ", median" : ", 99.9 %";
  context.report.add(Row{what + name, place.name, cpuName(pinned), "us", figures, goals});
}

// How many calls of a hundred, a thousand and so on took longer than what.
Plot distributionOf(const std::map<std::string, Taken>& all, const std::string& size) {
  Plot plot{"latency", "The caller's time for a store of " + size, "one call of so many takes longer", "microseconds",
            true};
  for (const auto& [contestant, taken] : all) {
    for (const double calls : {2, 5, 10, 20, 50, 100, 200, 500, 1000, 2000}) {
      plot.lines[contestant].emplace_back(calls, quantile(taken.puts, 1 - 1 / calls));
    }
  }
  return plot;
}

void measureCase(const Context& context, const Place& place, bool pinned, const Case& what) {
  const Pinned guard(pinned);
  std::vector<std::pair<std::string, std::unique_ptr<Contestant>>> contestants;
  contestants.emplace_back("ours", std::make_unique<OurCaller>(place));
  for (const auto& [name, open] : competitors()) {
    contestants.emplace_back(name, std::make_unique<CompetitorCaller>(place, open));
  }
  std::map<std::string, Taken> taken;
  for (int turn = 0; turn < context.scaled(7, 3); ++turn) {
    for (auto& [name, contestant] : contestants) {
      warmMemory(kKeys * what.size);
      warmFiles(place, kKeys * what.size);
      takeTurn(*contestant, what, taken[name]);
    }
  }
  const std::string size = sizeName(what.size);
  const std::vector<Goal> tailGoals = {{"LevelDB", 1}, {"SQLite", 1}};
  report(context, "store, " + size, place, pinned, taken, &Taken::puts, kMedian, {{"fastest competitor", 1}});
  report(context, "store, " + size, place, pinned, taken, &Taken::puts, kTail, tailGoals);
  report(context, "fetch, " + size, place, pinned, taken, &Taken::gets, kMedian, {});
  report(context, "fetch, " + size, place, pinned, taken, &Taken::gets, kTail, tailGoals);
  const bool isPlotted = what.size == kPlottedSize && !pinned && place.name == context.places.front().name;
  if (isPlotted) context.report.add(distributionOf(taken, size));
}

// What a store of 1 MiB asks for: the copy that the call makes, if there is no other.
void countCopies(const Context& context, const Place& place) {
  constexpr std::size_t size = 1 << 20;
  constexpr std::size_t stores = 20;
  const Scratch scratch(place);
  StoreUnderTest store(scratch / "store");
  Bytes value = valueOf(size);
  const CountedAllocations allocations;
  for (std::size_t number = 0; number < stores; ++number) {
    stamp(value, number);
    store->store(keyOf(number), value).get();
  }
  store.settle();
  const double copies = static_cast<double>(allocations.large()) / stores;
  store.verify(stores, size);
  context.report.add(Row{"copies of the bytes of a store", "memory", "", "copies", {{"ours", copies}}, {{"", 1}}});
}

}  // namespace

void measureCallers(const Context& context) {
  for (const Case& what : cases(context)) {
    for (const Place& place : context.places) {
      // The largest take the competitors too long for a second place.
      if (what.size >= 1U << 20U && place.name != context.places.front().name) continue;
      for (const bool pinned : context.pinnings(what.size)) measureCase(context, place, pinned, what);
    }
  }
  countCopies(context, context.places.back());
}

}  // namespace velmora::mobile::xplat::cellar::bench
