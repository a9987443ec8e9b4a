#include "demo/OperationTimes.h"

#include <algorithm>

namespace velmora::mobile::xplat::cellar::tools {

void OperationTimes::add(std::chrono::nanoseconds time) { times_.push_back(time); }

std::size_t OperationTimes::count() const { return times_.size(); }

std::chrono::nanoseconds OperationTimes::percentile(unsigned int percent) const {
  if (times_.empty()) return std::chrono::nanoseconds::zero();
  std::vector<std::chrono::nanoseconds> times = times_;
  const std::size_t rank = std::max<std::size_t>(1, (times.size() * percent + 99) / 100);
  const auto position = times.begin() + static_cast<std::ptrdiff_t>(rank - 1);
  std::nth_element(times.begin(), position, times.end());
  return *position;
}

}  // namespace velmora::mobile::xplat::cellar::tools
