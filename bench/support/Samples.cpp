#include "support/Samples.h"

#include <algorithm>

#include "support/Memory.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kLeastWarm = 4U << 20U;
constexpr std::size_t kMostWarm = 256U << 20U;

}  // namespace

double quantile(std::vector<double> samples, double share) {
  const double position = share * static_cast<double>(samples.size());
  const auto index = std::min(static_cast<std::size_t>(position), samples.size() - 1);
  std::nth_element(samples.begin(), samples.begin() + static_cast<std::ptrdiff_t>(index), samples.end());
  return samples[index];
}

double median(std::vector<double> samples) { return quantile(std::move(samples), 0.5); }

Figures interleaved(const Place& place, const Contestants& contestants, int repetitions, std::size_t bytes) {
  std::map<std::string, std::vector<double>> samples;
  for (int round = 0; round < repetitions; ++round) {
    for (std::size_t turn = 0; turn < contestants.size(); ++turn) {
      const auto& [name, measure] = contestants[(turn + static_cast<std::size_t>(round)) % contestants.size()];
      const std::size_t warm = std::min(kLeastWarm + 2 * bytes, kMostWarm);
      warmMemory(warm);
      warmFiles(place, warm);
      samples[name].push_back(measure());
    }
  }
  Figures figures;
  for (const auto& [name, values] : samples) figures[name] = Figure(values);
  return figures;
}

}  // namespace velmora::mobile::xplat::cellar::bench
