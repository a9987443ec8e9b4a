#include "support/OtherPrograms.h"

#include <sys/resource.h>
#include <unistd.h>

#include <fstream>
#include <string>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

double secondsOf(const timeval& time) {
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}

// Of all programs but this one, outside the kernel, and what this machine was kept from.
double secondsOfOthers() {
  std::ifstream file("/proc/stat");
  std::string name;
  double user = 0, nice = 0, system = 0, idle = 0, wait = 0, interrupts = 0, softInterrupts = 0, stolen = 0;
  file >> name >> user >> nice >> system >> idle >> wait >> interrupts >> softInterrupts >> stolen;
  rusage own{};
  (void)::getrusage(RUSAGE_SELF, &own);
  return (user + nice + stolen) / static_cast<double>(::sysconf(_SC_CLK_TCK)) - secondsOf(own.ru_utime);
}

}  // namespace

OtherPrograms::OtherPrograms() : begin_(std::chrono::steady_clock::now()), before_(secondsOfOthers()) {}

double OtherPrograms::share() const {
  const std::chrono::duration<double> elapsed = std::chrono::steady_clock::now() - begin_;
  return (secondsOfOthers() - before_) / elapsed.count();
}

}  // namespace velmora::mobile::xplat::cellar::bench
