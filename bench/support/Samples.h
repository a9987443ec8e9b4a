#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "support/Places.h"

namespace velmora::mobile::xplat::cellar::bench {

// The sample below which the share of all lies, 0.5 for the median. At least one sample.
double quantile(std::vector<double> samples, double share);
double median(std::vector<double> samples);

// Who takes part in a comparison, by name, and what measures it once.
using Contestants = std::vector<std::pair<std::string, std::function<double()>>>;

// What has been measured several times; a number on its own has no quartiles.
struct Figure {
  double median = 0;
  double lowerQuartile = 0;
  double upperQuartile = 0;

  Figure() = default;
  Figure(double value) : median(value), lowerQuartile(value), upperQuartile(value) {}
  explicit Figure(const std::vector<double>& samples)
      : median(bench::median(samples)),
        lowerQuartile(quantile(samples, 0.25)),
        upperQuartile(quantile(samples, 0.75)) {}
  operator double() const { return median; }
};
using Figures = std::map<std::string, Figure>;

// `repetitions` measurements of each contestant. They alternate, and each round begins with another one,
// so that other activity of the machine affects all of them. `bytes`: what a measurement writes to the place and reads;
// that much memory is warmed before.
Figures interleaved(const Place& place, const Contestants& contestants, int repetitions, std::size_t bytes);

}  // namespace velmora::mobile::xplat::cellar::bench
