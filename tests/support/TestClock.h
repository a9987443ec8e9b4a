#pragma once

#include <ctime>

namespace velmora::mobile::xplat::cellar::test {

// While it lives, `time` answers what the test says, in the whole process; afterwards, and in tests without one, the
// real time. One at a time. Thread-safe.
class TestClock {
 public:
  explicit TestClock(std::time_t now) { set(now); }
  TestClock(const TestClock&) = delete;
  TestClock& operator=(const TestClock&) = delete;
  ~TestClock();

  void set(std::time_t now);
  void advance(std::time_t seconds);
};

}  // namespace velmora::mobile::xplat::cellar::test
