#pragma once

#include <chrono>

namespace velmora::mobile::xplat::cellar::tools {

// Runs from its construction.
class Stopwatch {
 public:
  std::chrono::nanoseconds elapsed() const { return std::chrono::steady_clock::now() - start_; }

 private:
  const std::chrono::steady_clock::time_point start_ = std::chrono::steady_clock::now();
};

}  // namespace velmora::mobile::xplat::cellar::tools
