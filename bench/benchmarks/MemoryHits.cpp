#include <cstddef>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include <cellar/host/Await.h>
#include <cellar/host/MemoryTier.h>

#include "benchmarks/Benchmarks.h"
#include "competitors/Competitor.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

struct Case {
  std::size_t size;
  std::size_t items;
  std::vector<Goal> goals;
};

std::vector<Case> cases() {
  return {
      {200, 500, {}},
      {4 << 10, 500, {{"fastest competitor", 1}}},
      {64 << 10, 100, {{"fastest competitor", 1}}},
      {1 << 20, 16, {{"fastest competitor", 1}}},
  };
}

// Visits all items in an order that is not the one in which they were stored.
template <class Operation> double average(const Context& context, const Case& what, Operation operation) {
  const std::size_t count = context.scaled<std::size_t>(20'000, 4000) / (what.size < 1 << 20 ? 1 : 100);
  const Stopwatch watch;
  for (std::size_t step = 0; step < count; ++step) operation(step * 7 % what.items);
  return watch.microseconds() / static_cast<double>(count);
}

template <class Put> void fill(const Case& what, Put put) {
  Bytes value = valueOf(what.size);
  for (std::size_t number = 0; number < what.items; ++number) {
    stamp(value, number);
    put(keyOf(number), value);
  }
}

void check(const Case& what, const host::MemoryTier::Value& value, std::size_t number) {
  if (value == nullptr) throw std::runtime_error("item " + std::to_string(number) + " is missing");
  throwUnlessStamped(value->data(), value->size(), what.size, number);
}

// A tier that has all values in memory.
class OurHits {
 public:
  OurHits(const Context& context, const Place& place, bool pinned, const Case& what)
      : context_(context),
        what_(what),
        scratch_(place),
        pinned_(pinned),
        store_(scratch_ / "store"),
        tier_(std::static_pointer_cast<PersistentKeyValueStore>(store_->shared_from_this()), kRoomy) {
    fill(what, [this](const std::string& key, const Bytes& value) { host::await(tier_.store(key, value)); });
    store_.verify(what.items, what.size);
  }

  double find() {
    return average(context_, what_, [this](std::size_t number) { check(what_, tier_.find(keyOf(number)), number); });
  }

  double fetch() {
    return average(context_, what_,
                   [this](std::size_t number) { check(what_, host::await(tier_.fetch(keyOf(number))), number); });
  }

 private:
  static constexpr std::size_t kRoomy = std::size_t{64} << 20U;

  const Context& context_;
  const Case& what_;
  const Scratch scratch_;
  const Pinned pinned_;
  StoreUnderTest store_;
  host::MemoryTier tier_;
};

class CompetitorHits {
 public:
  CompetitorHits(const Context& context, const Place& place, const Case& what, const OpenCompetitor& open)
      : context_(context), what_(what), scratch_(place), competitor_(open(scratch_.path())) {
    fill(what, [this](const std::string& key, const Bytes& value) { competitor_->put(key, value); });
  }

  double measure() const {
    return average(context_, what_, [this](std::size_t number) {
      const Bytes value = competitor_->get(keyOf(number));
      throwUnlessStamped(value.data(), value.size(), what_.size, number);
    });
  }

 private:
  const Context& context_;
  const Case& what_;
  const Scratch scratch_;
  const std::unique_ptr<Competitor> competitor_;
};

void measureCase(const Context& context, const Place& place, bool pinned, const Case& what) {
  OurHits ours(context, place, pinned, what);
  Contestants contestants = {{"find", [&] { return ours.find(); }}, {"fetch", [&] { return ours.fetch(); }}};
  for (const auto& [name, open] : competitors()) {
    const auto competitor = std::make_shared<CompetitorHits>(context, place, what, open);
    contestants.emplace_back(name, [competitor] { return competitor->measure(); });
  }
  Figures figures = interleaved(place, contestants, context.scaled(5, 3), what.size * what.items);
  const Figure found = figures.extract("find").mapped();
  const Figure fetched = figures.extract("fetch").mapped();
  figures["ours"] = found;
  context.report.add(Row{sizeName(what.size) + ", find", place.name, cpuName(pinned), "us", figures, what.goals});
  figures["ours"] = fetched;
  context.report.add(Row{sizeName(what.size) + ", fetch and await",
                         place.name,
                         cpuName(pinned),
                         "us",
                         figures,
                         {{"fastest competitor", kNoLimit}}});
}

}  // namespace

void measureMemoryHits(const Context& context) {
  const Place& place = context.places.front();  // a hit reads nothing from it
  for (const Case& what : cases()) {
    for (const bool pinned : context.pinnings(what.size)) measureCase(context, place, pinned, what);
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
