#pragma once

#include <cstdint>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// What a part of a storage, a store or something left over, has at one moment.
struct PartFigures {
  std::uint64_t items = 0;  // of what is left over: files
  std::uint64_t heldBytes = 0;
  std::uint64_t allocatedBytes = 0;
};

struct Moment {
  std::int64_t date = 0;                     // seconds since the Unix epoch
  std::string depth;                         // of what was inspected: "root", "area", "manager", "store" or "empty"
  std::map<std::string, PartFigures> parts;  // by path below what was inspected
};

struct Change {
  std::string path;
  std::optional<PartFigures> before;  // absent of what is new
  std::optional<PartFigures> after;   // absent of what has gone
};

// What has changed between two moments: that with the largest change on the disk first.
struct Growth {
  std::int64_t since = 0;
  std::int64_t until = 0;
  std::vector<Change> changes;
};

// From a document of `inspect --json`. Throws `InputError`, naming the file and the place, for another one.
Moment momentOf(const nlohmann::json& document, const std::string& file);

// Throws `InputError` when not the same kind of place was inspected.
Growth growthBetween(const Moment& before, const Moment& after);

nlohmann::ordered_json growthAsJson(const Growth& growth);
void printGrowth(const Growth& growth, Console& console);

}  // namespace velmora::mobile::xplat::cellar::tools
