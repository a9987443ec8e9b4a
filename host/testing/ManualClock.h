#pragma once

#include <cstdint>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar::test {

// While it lives, the library's dates are what the test says, in the whole process; afterwards, and in tests without
// one, they are the system's. One at a time. Thread-safe. It fires no timers: `ManualExecutor::fireTimer` does.
class CELLAR_EXPORT ManualClock {
 public:
  explicit ManualClock(std::int64_t now);  // seconds since the Unix epoch
  ManualClock(const ManualClock&) = delete;
  ManualClock& operator=(const ManualClock&) = delete;
  ~ManualClock();

  void set(std::int64_t now);
  void advance(std::int64_t seconds);
};

}  // namespace velmora::mobile::xplat::cellar::test
