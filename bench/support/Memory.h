#pragma once

#include <cstddef>

namespace velmora::mobile::xplat::cellar::bench {

// Touches so much memory and gives it back to the system. A virtual machine may have given unused memory back to its
// host, and whoever is first to touch it again would pay milliseconds for each MiB.
void warmMemory(std::size_t bytes);

// What operator new has given out in this process.
struct Allocations {
  std::size_t large;  // times that 256 KiB or more were asked for, since the start
  std::size_t bytes;  // in use now, what the allocator rounds up included
};
Allocations allocations();

}  // namespace velmora::mobile::xplat::cellar::bench
