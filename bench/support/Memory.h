#pragma once

#include <cstddef>

namespace velmora::mobile::xplat::cellar::bench {

// Touches so much memory and gives it back to the system. A virtual machine may have given unused memory back to its
// host, and whoever is first to touch it again would pay milliseconds for each MiB.
void warmMemory(std::size_t bytes);

// Lets this process keep what it frees, this much of it touched beforehand. The C library would give a value of 1 MiB
// back to the system with each free, and fetch it again page by page with the next; the allocators of phones keep it
// for a while.
void keepMemory(std::size_t bytes);

// What operator new gives out in this process while there is one of these. Not while time is taken: every thread counts
// at one place.
class CountedAllocations {
 public:
  CountedAllocations();
  ~CountedAllocations();
  CountedAllocations(const CountedAllocations&) = delete;
  CountedAllocations& operator=(const CountedAllocations&) = delete;

  std::size_t large() const;     // times that 256 KiB or more were asked for
  std::ptrdiff_t bytes() const;  // given out and not given back, what the allocator rounds up included
};

}  // namespace velmora::mobile::xplat::cellar::bench
