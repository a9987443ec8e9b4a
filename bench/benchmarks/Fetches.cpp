#include <cstddef>
#include <memory>
#include <stdexcept>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include <cellar/host/Await.h>

#include "benchmarks/Benchmarks.h"
#include "competitors/Competitor.h"
#include "lower_bounds/FileLowerBound.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"
#include "support/Window.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kOutstanding = 64;

struct Case {
  std::size_t size;
  std::size_t items;
  std::size_t fetches;
  std::string note;
  std::vector<Goal> outstandingGoals;
  std::vector<Goal> singleGoals;
};

std::vector<Case> cases(const Context& context) {
  const auto fetches = context.scaled<std::size_t>(4000, 1000);
  // A store keeps up to 512 access dates in memory. With more items than that in use they are written again and again.
  return {
      {4 << 10, 500, fetches, "", {{"lower bound", 1.3}}, {{"lower bound", 4}}},
      {4 << 10, 5000, fetches, " of 5,000", {{"lower bound", 1.3}}, {{"lower bound", 4}}},
      {200, 500, fetches, "", {}, {}},
      {64 << 10, 100, fetches / 2, "", {}, {}},
      {1 << 20, 16, fetches / 20, "", {}, {}},
  };
}

// Visits all items in an order that is not the one in which they were stored.
std::size_t itemAt(const Case& what, std::size_t step) { return step * 7 % what.items; }

template <class Operation> double average(const Case& what, Operation operation) {
  const Stopwatch watch;
  for (std::size_t step = 0; step < what.fetches; ++step) operation(itemAt(what, step));
  return watch.microseconds() / static_cast<double>(what.fetches);
}

template <class Put> void fill(const Case& what, Put put) {
  Bytes value = valueOf(what.size);
  for (std::size_t number = 0; number < what.items; ++number) {
    stamp(value, number);
    put(keyOf(number), value);
  }
}

// One store, filled once, and what each way of fetching from it takes.
class OurFetches {
 public:
  OurFetches(const Place& place, bool pinned, const Case& what)
      : what_(what), scratch_(place), pinned_(pinned), store_(scratch_ / "store") {
    fill(what, [this](const std::string& key, const Bytes& value) { store_->store(key, value).get(); });
    store_.verify(what.items, what.size);
  }

  double singly() {
    return average(what_, [this](std::size_t number) { check(number, store_->fetch(keyOf(number))); });
  }

  double outstanding() {
    const Stopwatch watch;
    Window window(kOutstanding);
    for (std::size_t step = 0; step < what_.fetches; ++step) {
      const std::size_t number = itemAt(what_, step);
      window.add<Fetched>(store_->fetch(keyOf(number)), [this, number](const Fetched& found) { check(number, found); });
    }
    window.finish();
    return watch.microseconds() / static_cast<double>(what_.fetches);
  }

 private:
  using Fetched = std::unique_ptr<DiskCache::FetchResult>;

  void check(std::size_t number, Future<Fetched> future) { check(number, host::await(std::move(future))); }

  void check(std::size_t number, const Fetched& found) const {
    if (found == nullptr) throw std::runtime_error("item " + std::to_string(number) + " is missing");
    throwUnlessStamped(found->value.data(), found->value.size(), what_.size, number);
  }

  const Case& what_;
  const Scratch scratch_;
  const Pinned pinned_;
  StoreUnderTest store_;
};

class LowerBoundFetches {
 public:
  LowerBoundFetches(const Place& place, const Case& what) : what_(what), scratch_(place) {
    fill(what, [this](const std::string& key, const Bytes& value) {
      writeFile(scratch_ / key, value);
      sizes_[key] = value.size();
    });
  }

  double measure() const {
    return average(what_, [this](std::size_t number) {
      const std::string key = keyOf(number);
      const auto found = sizes_.find(key);
      const Bytes value = readFile(scratch_ / key, found->second);
      throwUnlessStamped(value.data(), value.size(), what_.size, number);
    });
  }

 private:
  const Case& what_;
  const Scratch scratch_;
  std::unordered_map<std::string, std::size_t> sizes_;
};

class CompetitorFetches {
 public:
  CompetitorFetches(const Place& place, const Case& what, const OpenCompetitor& open)
      : what_(what), scratch_(place), competitor_(open(scratch_.path())) {
    fill(what, [this](const std::string& key, const Bytes& value) { competitor_->put(key, value); });
  }

  double measure() const {
    return average(what_, [this](std::size_t number) {
      const Bytes value = competitor_->get(keyOf(number));
      throwUnlessStamped(value.data(), value.size(), what_.size, number);
    });
  }

 private:
  const Case& what_;
  const Scratch scratch_;
  const std::unique_ptr<Competitor> competitor_;
};

void measureCase(const Context& context, const Place& place, bool pinned, const Case& what) {
  OurFetches ours(place, pinned, what);
  const LowerBoundFetches lowerBound(place, what);
  Contestants contestants = {{"64", [&] { return ours.outstanding(); }},
                             {"1", [&] { return ours.singly(); }},
                             {"lower bound", [&] { return lowerBound.measure(); }}};
  for (const auto& [name, open] : competitors()) {
    contestants.emplace_back(
        name, [competitor = std::make_shared<CompetitorFetches>(place, what, open)] { return competitor->measure(); });
  }
  Figures figures = interleaved(place, contestants, context.scaled(5, 3), what.size * kOutstanding);
  const Figure outstanding = figures.extract("64").mapped();
  const Figure single = figures.extract("1").mapped();
  figures["ours"] = outstanding;
  const std::string name = sizeName(what.size) + what.note;
  context.report.add(Row{name + ", 64 outstanding", place.name, cpuName(pinned), "us", figures, what.outstandingGoals});
  figures["ours"] = single;
  context.report.add(Row{name + ", one at a time", place.name, cpuName(pinned), "us", figures, what.singleGoals});
}

}  // namespace

void measureFetches(const Context& context) {
  for (const Case& what : cases(context)) {
    for (const Place& place : context.places) {
      for (const bool pinned : context.pinnings(what.size)) measureCase(context, place, pinned, what);
    }
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
