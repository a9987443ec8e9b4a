#pragma once

#include <cstddef>

namespace velmora::mobile::xplat::cellar::bench {

// Touches that much memory and returns it to the system. A virtual machine may have returned unused memory to its host,
// and the first thread to touch it again would wait milliseconds for each MiB.
void warmMemory(std::size_t bytes);

// Lets this process keep what it frees, this much of it touched beforehand. The C library would give a value of 1 MiB
// back to the system with each free, and fetch it again page by page with the next; the allocators of phones keep it
// for a while.
void keepMemory(std::size_t bytes);

// Counts what operator new returns in this process while an object of this class exists. Not while time is taken: every
// thread counts at one place.
class CountedAllocations {
 public:
  CountedAllocations();
  ~CountedAllocations();
  CountedAllocations(const CountedAllocations&) = delete;
  CountedAllocations& operator=(const CountedAllocations&) = delete;

  std::size_t large() const;     // times that 256 KiB or more were asked for
  std::ptrdiff_t bytes() const;  // allocated and not freed, as rounded up by the allocator
};

}  // namespace velmora::mobile::xplat::cellar::bench
