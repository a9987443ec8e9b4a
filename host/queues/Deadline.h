#pragma once

#include <algorithm>
#include <chrono>

namespace velmora::mobile::xplat::cellar::host {

// How long a thread looks out for what it waits for before it sleeps, as long as that is found to pay. To wake it takes
// some tens of microseconds, longer than most tasks, and whoever fetches one value after another waits for no longer.
constexpr std::chrono::microseconds kLongestLookout(100);

// A moment that far in the future; now for a delay of 0 or less, the clock's end for one beyond its range.
inline std::chrono::steady_clock::time_point deadlineAfter(std::chrono::nanoseconds delay) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point now = Clock::now();
  if (delay <= std::chrono::nanoseconds::zero()) return now;
  return delay < Clock::time_point::max() - now ? now + delay : Clock::time_point::max();
}

// How long to wait for it at once, so that no deadline leaves the range of a 32-bit `time_t`.
inline std::chrono::steady_clock::time_point cappedDeadline(std::chrono::steady_clock::time_point deadline) {
  return std::min(deadline, std::chrono::steady_clock::now() + std::chrono::hours(1));
}

}  // namespace velmora::mobile::xplat::cellar::host
