#include "StopSignals.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <ctime>

namespace velmora::mobile::xplat::cellar::tools {

StopSignals::StopSignals() {
  (void)sigemptyset(&signals_);
  (void)sigaddset(&signals_, SIGINT);
  (void)sigaddset(&signals_, SIGTERM);
  (void)pthread_sigmask(SIG_BLOCK, &signals_, &before_);
}

StopSignals::~StopSignals() { (void)pthread_sigmask(SIG_SETMASK, &before_, nullptr); }

bool StopSignals::comeWithin(double seconds) const {
  using Clock = std::chrono::steady_clock;
  const auto end = Clock::now() + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
  for (;;) {
    const auto left = std::max(Clock::duration::zero(), end - Clock::now());
    const auto whole = std::chrono::duration_cast<std::chrono::seconds>(left);
    timespec wait{};
    wait.tv_sec = static_cast<std::time_t>(whole.count());
    wait.tv_nsec = static_cast<long>(std::chrono::nanoseconds(left - whole).count());
    if (sigtimedwait(&signals_, nullptr, &wait) > 0) return true;
    if (errno != EINTR) return false;
  }
}

void StopSignals::throwIfCome() const {
  const timespec now{};
  const int signal = sigtimedwait(&signals_, nullptr, &now);
  if (signal > 0) throw Interrupted{signal};
}

}  // namespace velmora::mobile::xplat::cellar::tools
