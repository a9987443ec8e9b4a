#pragma once

#include <string>
#include <vector>

#include "support/Context.h"

namespace velmora::mobile::xplat::cellar::bench {

// Each measures one thing and adds its rows to the report.
void measureStores(const Context& context);
void measureDurability(const Context& context);
void measureFetches(const Context& context);
void measureMemoryHits(const Context& context);
void measureCallers(const Context& context);
void measurePrunes(const Context& context);
void measureCapacity(const Context& context);
void measureLoading(const Context& context);
void measureStrategies(const Context& context);
void measureTrees(const Context& context);
void measureEvents(const Context& context);
void measureStart(const Context& context);
void measureSpace(const Context& context);

struct Benchmark {
  std::string name;
  std::string title;
  void (*measure)(const Context& context);
};

const std::vector<Benchmark>& benchmarks();

}  // namespace velmora::mobile::xplat::cellar::bench
