#include "benchmarks/Benchmarks.h"

namespace velmora::mobile::xplat::cellar::bench {

const std::vector<Benchmark>& benchmarks() {
  static const std::vector<Benchmark> all = {
      {"store", "Storing: microseconds for each of many new values", measureStores},
      {"durability", "Durability: microseconds for each of many new values", measureDurability},
      {"fetch", "Fetching: microseconds for each of many values that are there", measureFetches},
      {"memory", "Finding a value in memory: microseconds for each", measureMemoryHits},
      {"caller", "The caller's time: microseconds until a call returns", measureCallers},
      {"prune", "Pruning: microseconds for each removed item", measurePrunes},
      {"capacity", "Writing to a store at its capacity: microseconds for each write", measureCapacity},
      {"load", "Loading a manifest: time and memory for each item", measureLoading},
      {"strategy", "The strategy greedy_dual (ours) beside lru: microseconds for each of values of 512 B to 16 KiB",
       measureStrategies},
      {"tree", "Measuring and freeing directories", measureTrees},
      {"event", "Reporting: microseconds for each analytics event", measureEvents},
      {"start", "Starting", measureStart},
      {"space", "Space on disk for each byte stored", measureSpace},
  };
  return all;
}

}  // namespace velmora::mobile::xplat::cellar::bench
