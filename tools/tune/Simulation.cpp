#include "tune/Simulation.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <thread>

#include "tune/NextFetches.h"
#include "tune/SampleScale.h"
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

// Calls `visit` with each access, its number, and the next fetch for a strategy that asks for it.
void play(Work& work, const std::string& strategy,
          const std::function<void(const Access&, std::uint64_t, std::uint64_t)>& visit) {
  std::unique_ptr<NextFetches::Reader> fetches;
  if (strategy == strategies::kForesight) fetches = std::make_unique<NextFetches::Reader>(*work.fetches);
  std::uint64_t number = 0;
  work.trace.replay([&](const Access& access) {
    visit(access, number, fetches == nullptr ? SimulatedCache::kNever : fetches->next());
    if (++number % kAccessesOfAStep == 0) work.done += kAccessesOfAStep;
  });
  work.done += number % kAccessesOfAStep;
}

Found findOf(Work& work, const Simulation& simulation) {
  const std::int64_t limit = sampledLimit(simulation.limit, work.trace.sample().rate());
  const auto cache = simulatedCache(simulation.strategy, limit);
  Found found;
  play(work, simulation.strategy, [&](const Access& access, std::uint64_t number, std::uint64_t nextFetch) {
    if (!cache->access(access, nextFetch) || access.kind != AccessKind::Fetch) return;
    ++found.hits;
    found.hitBytes += static_cast<std::uint64_t>(access.size);
    ++found.hitsByPart[partOf(number, work.trace.accesses())];
  });
  return found;
}

ByGroup findByGroup(Work& work, const Simulation& simulation) {
  const std::int64_t limit = sampledLimit(simulation.limit, work.trace.sample().rate() / Trace::kGroups);
  std::vector<std::unique_ptr<SimulatedCache>> caches(Trace::kGroups);
  for (auto& cache : caches) cache = simulatedCache(simulation.strategy, limit);
  ByGroup hits = {};
  play(work, simulation.strategy, [&](Access access, std::uint64_t, std::uint64_t nextFetch) {
    if (access.kind == AccessKind::Clear) {
      for (auto& cache : caches) (void)cache->access(access, nextFetch);
      return;
    }
    const Trace::GroupedKey key = work.trace.groupedKey(access.key);
    access.key = key.number;
    if (caches[key.group]->access(access, nextFetch) && access.kind == AccessKind::Fetch) ++hits[key.group];
  });
  return hits;
}

void run(Work& work, Simulation& simulation) {
  simulation.found = findOf(work, simulation);
  if (!work.trace.sample().isWhole()) simulation.found.hitsByGroup = findByGroup(work, simulation);
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
  const std::uint64_t whole = simulations.size() * trace.accesses() * (trace.sample().isWhole() ? 1 : 2);
  for (std::future<void>& each : runs) {
    while (each.wait_for(kBetweenSteps) != std::future_status::ready) onProgress(work.done, whole);
  }
  for (std::future<void>& each : runs) each.get();
}

}  // namespace velmora::mobile::xplat::cellar::tools
