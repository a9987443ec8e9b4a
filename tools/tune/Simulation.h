#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

// The trace in parts of equal numbers of accesses: how far these differ says how sure a figure is.
constexpr std::size_t kParts = 10;
using ByPart = std::array<std::uint64_t, kParts>;
constexpr std::size_t partOf(std::uint64_t number, std::uint64_t accesses) {
  return static_cast<std::size_t>(number * kParts / accesses);
}

// The keys of a sample in groups; zeros without a sample.
using ByGroup = std::array<std::uint64_t, Trace::kGroups>;

// What a cache has found.
struct Found {
  std::uint64_t hits = 0;
  std::uint64_t hitBytes = 0;
  ByPart hitsByPart = {};
  ByGroup hitsByGroup = {};  // each by a cache that has only this group's keys
};

struct Simulation {
  std::string strategy;
  std::int64_t limit = 0;
  Found found = {};
};

// How many accesses have been simulated, and how many there are.
using OnProgress = std::function<void(std::uint64_t, std::uint64_t)>;

// Fills in what each has found; with a sample, what a cache of its share of the limit finds of the keys in it. Plays
// the trace once for each, so many at once as there are threads (0: as processors); memory is that of so many caches.
// `onProgress` is called from time to time, on the caller's thread.
void simulate(const Trace& trace, std::vector<Simulation>& simulations, unsigned threads, const OnProgress& onProgress);

}  // namespace velmora::mobile::xplat::cellar::tools
