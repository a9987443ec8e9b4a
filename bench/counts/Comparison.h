#pragma once

#include <iosfwd>
#include <string>

#include <nlohmann/json.hpp>

namespace velmora::mobile::xplat::cellar::bench {

// Counts without a clock:
//
//   { "environment": { "compiler": "12.2.0", ... },
//     "scenarios": { "1,000 stores": { "instructions": 123, "system calls": { "openat": 1000, ... } } } }
//
// Either count is missing where it could not be taken.
using Counts = nlohmann::ordered_json;

// What counts depend on beside the code: they can be compared only where this is the same.
Counts environmentOfThisProgram();

// Reads lines of "SCENARIO<tab>instructions<tab>NUMBER" and "SCENARIO<tab>NAME OF A SYSTEM CALL<tab>NUMBER". Throws
// `std::runtime_error` for any other.
Counts parseMeasured(std::istream& lines);

// Tells how the counts have moved, in a table. False when instructions have by more than 3 % or system calls at all.
bool compare(const Counts& baseline, const Counts& measured, std::ostream& out);

}  // namespace velmora::mobile::xplat::cellar::bench
