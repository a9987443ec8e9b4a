#include <benchmark/benchmark.h>

#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include <cellar/AnalyticsEventReporter.h>

#include "benchmarks/Benchmarks.h"
#include "support/Samples.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

// A sink that reads the events and discards them.
class Sink : public XAnalytics {
 public:
  void logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                const std::string& time) override {
    benchmark::DoNotOptimize(eventName.size() + category.size() + payload.size() + time.size());
  }
};

void access(benchmark::State& state) {
  const AnalyticsEventReporter reporter(std::make_unique<Sink>());
  for ([[maybe_unused]] auto _ : state) {
    PersistentKeyValueStoreEventBuilder builder(PersistentKeyValueStoreEvent::Hit::Found, "thumbnails",
                                                "7f3a2b5c9d1e4f608a7b6c5d");
    reporter.reportEvent(builder.age(86'400).size(4'096).get());
  }
}

void manager(benchmark::State& state) {
  const AnalyticsEventReporter reporter(std::make_unique<Sink>());
  for ([[maybe_unused]] auto _ : state) {
    reporter.reportEvent(StoreManagerEvent(StoreManagerEvent::Type::Pruning, "thumbnails", 52'428'800, 41'943'040));
  }
}

// Takes the median of each benchmark's repetitions over.
class Collector : public benchmark::BenchmarkReporter {
 public:
  bool ReportContext(const Context& /*context*/) override { return true; }
  void ReportRuns(const std::vector<Run>& runs) override {
    std::vector<double> samples;
    for (const Run& run : runs) {
      if (run.run_type == Run::RT_Iteration) samples.push_back(run.GetAdjustedRealTime());
    }
    if (!samples.empty()) medians.emplace_back(runs.front().run_name.function_name, median(samples));
  }

  std::vector<std::pair<std::string, double>> medians;
};

}  // namespace

void measureEvents(const Context& context) {
  const double seconds = context.scaled(0.3, 0.05);
  for (const auto& [name, function] : {std::pair("access to a key", access), std::pair("manager's", manager)}) {
    benchmark::RegisterBenchmark(name, function)->Unit(benchmark::kMicrosecond)->MinTime(seconds)->Repetitions(5);
  }
  Collector collector;
  benchmark::RunSpecifiedBenchmarks(&collector);
  benchmark::ClearRegisteredBenchmarks();
  if (collector.medians.size() != 2) throw std::runtime_error("not every event was measured");
  for (const auto& [name, microseconds] : collector.medians) {
    context.report.add(Row{name, "memory", cpuName(false), "us", {{"ours", microseconds}}, {{"", 1.5}}});
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
