#pragma once

#include <cstdint>
#include <string>

#include "crash/Protocol.h"

namespace velmora::mobile::xplat::cellar::crash {

// What the parent wants of a worker.
struct Task {
  std::string root;
  std::uint64_t seed;
  std::uint32_t firstVersion;  // versions count on from it
  Ending ending;
  int pipe;     // for telling of the work
  int control;  // closed by the parent when it is time to end
};

// Works on the stores under the root and tells of it, until the process is killed or its time to end has come. Then it
// ends in the way that it is told to and leaves the process.
[[noreturn]] void work(const Task& task);

}  // namespace velmora::mobile::xplat::cellar::crash
