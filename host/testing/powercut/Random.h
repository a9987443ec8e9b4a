#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <random>

namespace velmora::mobile::xplat::cellar::test {

// The chances of a power cut. The same numbers for the same seed with every compiler and library, which the standard
// library's distributions do not promise.
class Random {
 public:
  // How much of what was not synced comes through, in eighths.
  using Luck = std::size_t;
  static constexpr Luck kNothing = 0;

  explicit Random(std::uint32_t seed) : engine_(seed) {}

  // From 0 to below `limit`, which is not 0.
  std::size_t below(std::size_t limit) { return engine_() % limit; }

  // The extremes are drawn as often as what lies between: they are what independent draws hardly ever give.
  Luck luck() {
    constexpr std::array<Luck, 5> all = {kNothing, 1, 4, 7, 8};
    return all.at(below(all.size()));
  }

  bool succeeds(Luck luck) { return below(8) < luck; }

 private:
  std::mt19937 engine_;
};

}  // namespace velmora::mobile::xplat::cellar::test
