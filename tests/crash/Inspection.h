#pragma once

#include <array>
#include <cstddef>
#include <string>
#include <vector>

#include "crash/Ledger.h"

namespace velmora::mobile::xplat::cellar::crash {

// What the inspections after all kills have found.
struct Findings {
  std::array<std::size_t, kOutcomes> middle{};  // values caught in the middle, by outcome
  std::size_t intact = 0;                       // acknowledged values that were there, byte for byte
  std::size_t evicted = 0;                      // values that a limit had taken away
  std::size_t orphans = 0;                      // files without a record
  std::vector<std::string> faults;              // broken promises
};

// Starts the application again on a root whose process was killed, and holds every store to its promises. Afterwards
// the ledger says what is there now; what was found torn has been removed.
void inspect(const std::string& root, Ledger& ledger, Findings& findings);

}  // namespace velmora::mobile::xplat::cellar::crash
