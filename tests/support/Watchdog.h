#pragma once

#include <unistd.h>

namespace velmora::mobile::xplat::cellar::test {

// Ends the process by SIGALRM, which no test runner takes for success, unless it is gone after so many seconds. One at
// a time.
class Watchdog {
 public:
  explicit Watchdog(unsigned int seconds) { (void)::alarm(seconds); }
  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;
  ~Watchdog() { (void)::alarm(0); }
};

}  // namespace velmora::mobile::xplat::cellar::test
