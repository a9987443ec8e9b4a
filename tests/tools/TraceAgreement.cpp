// Plays a table of accesses through the library's own disk cache, pruned after each store, and through the simulations
// of `cellar tune`, and compares what they find request by request:
//
//     cellar_trace_agreement trace.csv KEY-COLUMN SIZE-COLUMN LIMIT...

#include <cstdint>
#include <cstdlib>
#include <exception>
#include <iostream>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>

#include "PruneStrategy.h"
#include "tools/RealCache.h"
#include "tune/CsvReader.h"
#include "tune/LineReader.h"
#include "tune/SimulatedCache.h"
#include "tune/StackDistances.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Returns the number of requests of which the two say something else.
template <class Simulated> std::uint64_t compare(const std::string& strategy, const Trace& trace, unsigned int limit,
                                                 std::shared_ptr<PruneStrategyBase> real, Simulated simulated) {
  RealCache cache(limit, std::move(real));
  std::uint64_t hits = 0;
  std::uint64_t different = 0;
  trace.replay([&](const Access& access) {
    const bool isHit = cache.access(access);
    if (simulated(access) != isHit) ++different;
    if (isHit) ++hits;
  });
  std::cout << strategy << ", limit " << limit << ": " << hits << " hits of " << trace.accesses() << " requests, "
            << different << " differ" << std::endl;
  return different;
}

std::uint64_t compareAt(const Trace& trace, unsigned int limit) {
  StackDistances distances;
  const auto greedyDual = simulatedCache(strategies::kGreedyDual, limit);
  return compare("lru", trace, limit, std::make_shared<LRUPruneStrategy>(),
                 [&](const Access& access) {
                   const auto least = distances.use(access.key, access.size);
                   return least && *least <= limit;
                 }) +
         compare("greedy_dual", trace, limit, std::make_shared<GreedyDualPruneStrategy>(),
                 [&](const Access& access) { return greedyDual->access(access, SimulatedCache::kNever); });
}

}  // namespace

static int run(int count, char** arguments) {
  if (count < 5) throw std::invalid_argument("usage: cellar_trace_agreement trace.csv KEY-COLUMN SIZE-COLUMN LIMIT...");
  LineReader lines(arguments[1]);
  CsvColumns columns;
  columns.key = arguments[2];
  columns.size = arguments[3];
  Trace trace;
  readCsv(lines, columns, trace, [] {});
  std::uint64_t different = 0;
  for (int i = 4; i < count; ++i) different += compareAt(trace, static_cast<unsigned int>(std::stoul(arguments[i])));
  return different == 0 ? EXIT_SUCCESS : EXIT_FAILURE;
}

}  // namespace velmora::mobile::xplat::cellar::tools

int main(int count, char** arguments) {
  try {
    return velmora::mobile::xplat::cellar::tools::run(count, arguments);
  } catch (const std::exception& error) {
    std::cerr << error.what() << std::endl;
    return EXIT_FAILURE;
  }
}
