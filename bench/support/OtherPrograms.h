#pragma once

#include <chrono>

namespace velmora::mobile::xplat::cellar::bench {

// How much of the processors' time others take meanwhile: other programs, and other machines on the same hardware. What
// the system does for this program counts for it.
class OtherPrograms {
 public:
  OtherPrograms();

  // Since the construction, of one processor: 0.5 is half of one.
  double share() const;

 private:
  const std::chrono::steady_clock::time_point begin_;
  const double before_;  // seconds
};

}  // namespace velmora::mobile::xplat::cellar::bench
