#pragma once

#include <algorithm>
#include <cstdint>
#include <limits>

namespace velmora::mobile::xplat::cellar {

// A definition's seconds as a store takes them. Where `long` has 32 bits, more than it holds must not turn into a
// negative age, with which everything would be stale at once.
inline long staleAgeOf(std::uint32_t seconds) {
  return static_cast<long>(std::min<std::uint64_t>(seconds, std::numeric_limits<long>::max()));
}

}  // namespace velmora::mobile::xplat::cellar
