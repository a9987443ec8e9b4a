#pragma once

#include <sys/types.h>

#include <array>
#include <cstddef>
#include <set>
#include <string>
#include <vector>

#include "crash/Ledger.h"

namespace velmora::mobile::xplat::cellar::crash {

// What the inspections after all kills or closings have found.
struct Findings {
  std::array<std::size_t, kOutcomes> middle{};  // values caught in the middle, by outcome
  std::size_t intact = 0;                       // acknowledged values that were there, byte for byte
  std::size_t evicted = 0;                      // values that a limit had taken away
  std::set<std::string> orphans;                // files without a record, of the latest root
  std::size_t hostsRefused = 0;                 // because another process had the root
  std::size_t sessionsEnded = 0;
  std::vector<std::string> faults;  // broken promises
};

// Starts the application again on a root whose process has ended, and holds every store to its promises. Afterwards the
// ledger says what is there now; what was found torn has been removed.
void inspect(const std::string& root, Ending ending, Ledger& ledger, Findings& findings);

// A second application on a root whose process is at work must be refused, by an error that names both.
void intrude(const std::string& root, pid_t owner, Findings& findings);

// Ends the session in an application that has not opened it. Afterwards it has no values.
void endSession(const std::string& root, Ledger& ledger, Findings& findings);

}  // namespace velmora::mobile::xplat::cellar::crash
