#include "support/TestClock.h"

#include <atomic>

namespace velmora::mobile::xplat::cellar::test {

namespace {

constexpr std::time_t kReal = -1;
std::atomic<std::time_t> chosen{kReal};

}  // namespace

TestClock::~TestClock() { chosen = kReal; }

void TestClock::set(std::time_t now) { chosen = now; }

void TestClock::advance(std::time_t seconds) { chosen += seconds; }

}  // namespace velmora::mobile::xplat::cellar::test

// Takes the place of the C library's: a definition in the program comes before those of the libraries that it loads.
extern "C" __attribute__((visibility("default"))) std::time_t time(std::time_t* out) noexcept {
  using velmora::mobile::xplat::cellar::test::chosen;
  using velmora::mobile::xplat::cellar::test::kReal;
  std::time_t now = chosen;
  if (now == kReal) {
    std::timespec real{};
    (void)::clock_gettime(CLOCK_REALTIME, &real);
    now = real.tv_sec;
  }
  if (out != nullptr) *out = now;
  return now;
}
