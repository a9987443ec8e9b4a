#include "host/testing/ManualClock.h"

#include <atomic>

#include <cellar/Clock.h>

namespace velmora::mobile::xplat::cellar::test {

namespace {

std::atomic<std::int64_t> chosen{0};

}  // namespace

ManualClock::ManualClock(std::int64_t now) {
  set(now);
  Clock::setSource([] { return chosen.load(); });
}

ManualClock::~ManualClock() { Clock::setSource(nullptr); }

void ManualClock::set(std::int64_t now) { chosen = now; }

void ManualClock::advance(std::int64_t seconds) { chosen += seconds; }

}  // namespace velmora::mobile::xplat::cellar::test
