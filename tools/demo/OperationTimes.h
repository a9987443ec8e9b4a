#pragma once

#include <chrono>
#include <cstddef>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// How long operations took.
class OperationTimes {
 public:
  void add(std::chrono::nanoseconds time);
  std::size_t count() const;

  // The time within which so many percent of them were over; 0 when there were none.
  std::chrono::nanoseconds percentile(unsigned int percent) const;

 private:
  std::vector<std::chrono::nanoseconds> times_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
