#pragma once

#include <cstddef>

#include <cellar/Durability.h>

#include "competitors/Competitor.h"
#include "support/Places.h"

namespace velmora::mobile::xplat::cellar::bench {

// Many new values, each stored once.
struct Storing {
  std::size_t size;  // bytes of each
  std::size_t count;
  bool inlineData = false;
  Durability durability = Durability::Relaxed;
};

// How many values a grouping competitor writes at once: as many as a group of ours has.
constexpr std::size_t kWrittenTogether = 32;

// "4 KiB", "200 B inline"
std::string nameOf(const Storing& what);

// Each measures once, in a directory of its own, and returns microseconds for each value. Throws unless every value is
// read back as it was stored.
double timeOfOurs(const Place& place, bool pinned, const Storing& what, std::size_t outstanding);
double timeOfCompetitor(const Place& place, bool pinned, const Storing& what, const OpenCompetitor& open);
double timeInGroups(const Place& place, bool pinned, const Storing& what, const OpenGroupingCompetitor& open);

}  // namespace velmora::mobile::xplat::cellar::bench
