#pragma once

#include <cstdint>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// The current time, from which the library takes all its dates: of items, of measurements, of prunes and of events. A
// test can replace it for the whole process (the testing kit has `ManualClock`).
class CELLAR_EXPORT Clock {
 public:
  using Source = std::int64_t (*)();

  // Seconds since the Unix epoch. Any thread.
  static std::int64_t now();

  // Asks `source` from now on; null: the system. Any thread.
  static void setSource(Source source);
};

}  // namespace velmora::mobile::xplat::cellar
