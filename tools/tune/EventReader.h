#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class LineReader;
class Trace;

// The accesses to a store in the lines of the host kit's sink.
struct EventCounts {
  std::map<std::string, std::uint64_t> accessesOfStores;  // all stores that the lines name
  std::uint64_t hits = 0;                                 // reported for the chosen store
  std::uint64_t firstHits = 0;                            // those that are the first access to their key
  std::uint64_t damagedLines = 0;                         // not JSON, or of a size that no item has: ignored
};

// Appends the accesses to `store` (empty: to any store) to the trace. A line that is not JSON, for example after a full
// disk, is counted and ignored; other events are not accesses. `onLine` is called after each line.
EventCounts readEvents(LineReader& lines, const std::string& store, Trace& trace, const std::function<void()>& onLine);

}  // namespace velmora::mobile::xplat::cellar::tools
