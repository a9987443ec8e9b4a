#include "support/Storing.h"

#include <algorithm>
#include <memory>

#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"
#include "support/Window.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

double average(const Stopwatch& watch, std::size_t count) { return watch.microseconds() / static_cast<double>(count); }

void throwUnlessStored(Competitor& competitor, const Storing& what) {
  for (std::size_t number = 0; number < what.count; ++number) {
    throwUnlessValue(competitor.get(keyOf(number)), what.size, number);
  }
}

}  // namespace

std::string nameOf(const Storing& what) { return sizeName(what.size) + (what.inlineData ? " inline" : ""); }

double timeOfOurs(const Place& place, bool pinned, const Storing& what, std::size_t outstanding) {
  const Scratch scratch(place);
  const Pinned guard(pinned);
  StoreOptions options;
  options.inlineData = what.inlineData;
  options.durability = what.durability;
  StoreUnderTest store(scratch / "store", options);
  Bytes value = valueOf(what.size);
  const Stopwatch watch;
  Window window(outstanding);
  for (std::size_t number = 0; number < what.count; ++number) {
    stamp(value, number);
    if (outstanding == 1) {
      store->store(keyOf(number), value).get();
    } else {
      window.add(store->store(keyOf(number), value));
    }
  }
  window.finish();
  const double result = average(watch, what.count);
  store.verify(what.count, what.size);
  return result;
}

double timeOfCompetitor(const Place& place, bool pinned, const Storing& what, const OpenCompetitor& open) {
  const Scratch scratch(place);
  const Pinned guard(pinned);
  const std::unique_ptr<Competitor> competitor = open(scratch.path());
  Bytes value = valueOf(what.size);
  const Stopwatch watch;
  for (std::size_t number = 0; number < what.count; ++number) {
    stamp(value, number);
    competitor->put(keyOf(number), value);
  }
  const double result = average(watch, what.count);
  throwUnlessStored(*competitor, what);
  return result;
}

double timeInGroups(const Place& place, bool pinned, const Storing& what, const OpenGroupingCompetitor& open) {
  const Scratch scratch(place);
  const Pinned guard(pinned);
  const std::unique_ptr<GroupingCompetitor> competitor = open(scratch.path());
  const Bytes value = valueOf(what.size);
  const Stopwatch watch;
  for (std::size_t first = 0; first < what.count; first += kWrittenTogether) {
    Entries entries;
    for (std::size_t number = first; number < std::min(first + kWrittenTogether, what.count); ++number) {
      entries.emplace_back(keyOf(number), value);
      stamp(entries.back().second, number);
    }
    competitor->putTogether(entries);
  }
  const double result = average(watch, what.count);
  throwUnlessStored(*competitor, what);
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::bench
