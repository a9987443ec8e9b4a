#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class LineReader;
class Trace;

// What the lines of the host kit's sink say of a store's accesses.
struct EventCounts {
  std::map<std::string, std::uint64_t> accessesOfStores;  // all stores that the lines name
  std::uint64_t hits = 0;                                 // of the store chosen, as they were reported
  std::uint64_t firstHits = 0;                            // those among them that are the first access to their key
  std::uint64_t damagedLines = 0;                         // passed over
};

// Appends the accesses to `store` (empty: to whichever) to the trace. A line that is no JSON, as a full disk leaves
// one, is counted and passed over; other events are no accesses. `onLine` is called after each line.
EventCounts readEvents(LineReader& lines, const std::string& store, Trace& trace, const std::function<void()>& onLine);

}  // namespace velmora::mobile::xplat::cellar::tools
