#include "tune/Simulation.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <thread>

#include "tune/NextFetches.h"
#include "tune/SimulatedCache.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::uint64_t kAccessesOfAStep = 4096;
constexpr std::chrono::milliseconds kBetweenSteps(2);

// What the threads share.
struct Work {
  const Trace& trace;
  const std::unique_ptr<const NextFetches> fetches;  // null where nothing needs them
  std::vector<Simulation>& simulations;
  std::atomic<std::size_t> next = 0;
  std::atomic<std::uint64_t> done = 0;
};

void run(Work& work, Simulation& simulation) {
  const auto cache = simulatedCache(simulation.strategy, simulation.limit);
  std::unique_ptr<NextFetches::Reader> fetches;
  if (simulation.strategy == strategies::kForesight) {
    fetches = std::make_unique<NextFetches::Reader>(*work.fetches);
  }
  std::uint64_t number = 0;
  Found found;
  work.trace.replay([&](const Access& access) {
    const std::uint64_t fetch = fetches == nullptr ? SimulatedCache::kNever : fetches->next();
    if (cache->access(access, fetch) && access.kind == AccessKind::Fetch) {
      ++found.hits;
      found.hitBytes += static_cast<std::uint64_t>(access.size);
      ++found.hitsByPart[partOf(number, work.trace.accesses())];
    }
    if (++number % kAccessesOfAStep == 0) work.done += kAccessesOfAStep;
  });
  work.done += number % kAccessesOfAStep;
  simulation.found = found;
}

// After a failure the others take nothing more.
void runAll(Work& work) {
  for (std::size_t i = work.next++; i < work.simulations.size(); i = work.next++) {
    try {
      run(work, work.simulations[i]);
    } catch (...) {
      work.next = work.simulations.size();
      throw;
    }
  }
}

bool needsFetches(const std::vector<Simulation>& simulations) {
  return std::any_of(simulations.begin(), simulations.end(),
                     [](const Simulation& simulation) { return simulation.strategy == strategies::kForesight; });
}

}  // namespace

void simulate(const Trace& trace, std::vector<Simulation>& simulations, unsigned threads,
              const OnProgress& onProgress) {
  if (threads == 0) threads = std::max(1U, std::thread::hardware_concurrency());
  Work work{trace, needsFetches(simulations) ? std::make_unique<const NextFetches>(trace) : nullptr, simulations};
  std::vector<std::future<void>> runs;
  for (std::size_t i = 0; i < std::min<std::size_t>(threads, simulations.size()); ++i) {
    runs.push_back(std::async(std::launch::async, [&work] { runAll(work); }));
  }
  const std::uint64_t whole = simulations.size() * trace.accesses();
  for (std::future<void>& each : runs) {
    while (each.wait_for(kBetweenSteps) != std::future_status::ready) onProgress(work.done, whole);
  }
  for (std::future<void>& each : runs) each.get();
}

}  // namespace velmora::mobile::xplat::cellar::tools
