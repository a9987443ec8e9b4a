#include <cstddef>
#include <memory>
#include <string>

#include "benchmarks/Benchmarks.h"
#include "competitors/Competitor.h"
#include "support/Fill.h"
#include "support/StoreUnderTest.h"
#include "support/Window.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kOutstanding = 64;

template <class Put> void putAll(std::size_t size, std::size_t count, Put put) {
  Bytes value = valueOf(size);
  for (std::size_t number = 0; number < count; ++number) {
    stamp(value, number);
    put(keyOf(number), value);
  }
}

// Bytes on disk for each stored byte, after the store or database was closed.
double spaceOf(const Scratch& scratch, std::size_t size, std::size_t count) {
  return static_cast<double>(figuresOf(scratch.path()).bytes) / static_cast<double>(size * count);
}

double ourSpace(const Place& place, std::size_t size, std::size_t count, bool inlineData) {
  const Scratch scratch(place);
  {
    StoreUnderTest store(scratch / "store", {inlineData});
    Window window(kOutstanding);
    putAll(size, count, [&](const std::string& key, const Bytes& value) { window.add(store->store(key, value)); });
    window.finish();
  }
  return spaceOf(scratch, size, count);
}

double competitorSpace(const Place& place, std::size_t size, std::size_t count, const OpenCompetitor& open) {
  const Scratch scratch(place);
  {
    const std::unique_ptr<Competitor> competitor = open(scratch.path());
    putAll(size, count, [&](const std::string& key, const Bytes& value) { competitor->put(key, value); });
  }
  return spaceOf(scratch, size, count);
}

}  // namespace

void measureSpace(const Context& context) {
  const Place& place = context.places.front();
  Plot plot{"space", "Space on disk for each byte stored", "bytes of a value", "bytes"};
  for (const std::size_t size : {200U, 1U << 10U, 4U << 10U, 16U << 10U, 64U << 10U}) {
    const std::size_t count = (context.scaled<std::size_t>(16, 4) << 20U) / size / (size < 4096 ? 8 : 1);
    Figures figures = {{"ours", ourSpace(place, size, count, false)}};
    const double inlined = ourSpace(place, size, count, true);
    for (const auto& [name, open] : competitors()) figures[name] = competitorSpace(place, size, count, open);
    context.report.add(Row{sizeName(size), place.name, "", "bytes a byte", figures, {}});
    context.report.add(Row{sizeName(size) + " inline", place.name, "", "bytes a byte", {{"ours", inlined}}, {}});
    figures["ours, inline"] = inlined;
    for (const auto& [name, figure] : figures) plot.lines[name].emplace_back(static_cast<double>(size), figure);
  }
  context.report.add(plot);
}

}  // namespace velmora::mobile::xplat::cellar::bench
