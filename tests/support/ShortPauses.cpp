#include "support/ShortPauses.h"

#include <atomic>
#include <cerrno>
#include <ctime>

namespace velmora::mobile::xplat::cellar::test {

namespace {

std::atomic<bool> areShort{false};

}  // namespace

ShortPauses::ShortPauses() { areShort = true; }

ShortPauses::~ShortPauses() { areShort = false; }

}  // namespace velmora::mobile::xplat::cellar::test

// Takes the place of the C library's: a definition in the program comes before those of the libraries that it loads.
extern "C" __attribute__((visibility("default"))) int nanosleep(const std::timespec* wanted, std::timespec* left) {
  if (velmora::mobile::xplat::cellar::test::areShort) return 0;
  const int error = ::clock_nanosleep(CLOCK_REALTIME, 0, wanted, left);
  if (error == 0) return 0;
  errno = error;
  return -1;
}
