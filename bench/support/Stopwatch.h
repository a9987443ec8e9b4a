#pragma once

#include <chrono>

namespace velmora::mobile::xplat::cellar::bench {

// Microseconds since its construction.
class Stopwatch {
 public:
  double microseconds() const {
    return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start_).count();
  }

 private:
  const std::chrono::steady_clock::time_point start_ = std::chrono::steady_clock::now();
};

}  // namespace velmora::mobile::xplat::cellar::bench
