#include "host/Expiring.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <stdexcept>

#include <cellar/Clock.h>

namespace velmora::mobile::xplat::cellar::host::detail {

namespace {

constexpr std::array<unsigned char, 3> kMagic = {0xce, 'E', 'x'};
constexpr unsigned char kVersion = 1;
constexpr std::size_t kDateBegin = kMagic.size() + 1;
constexpr std::size_t kDateBytes = 8;  // seconds since the Unix epoch, signed, the lowest byte first
constexpr std::size_t kHeaderBytes = kDateBegin + kDateBytes;

// Beyond what a date can hold: for ever. Without a time: before all dates, as the clock may be set back.
std::int64_t deadlineOf(std::chrono::seconds timeToLive) {
  using Limits = std::numeric_limits<std::int64_t>;
  const std::int64_t now = Clock::now();
  const std::int64_t seconds = timeToLive.count();
  if (seconds <= 0) return Limits::min();
  return now > Limits::max() - seconds ? Limits::max() : now + seconds;
}

}  // namespace

std::vector<unsigned char> withDeadline(const std::vector<unsigned char>& bytes, std::chrono::seconds timeToLive) {
  std::vector<unsigned char> result;
  result.reserve(kHeaderBytes + bytes.size());
  result.assign(kMagic.begin(), kMagic.end());
  result.push_back(kVersion);
  const auto date = static_cast<std::uint64_t>(deadlineOf(timeToLive));
  for (std::size_t i = 0; i < kDateBytes; ++i) result.push_back(static_cast<unsigned char>(date >> (8 * i)));
  result.insert(result.end(), bytes.begin(), bytes.end());
  return result;
}

bool takeDeadline(std::vector<unsigned char>& bytes) {
  if (bytes.size() < kHeaderBytes || !std::equal(kMagic.begin(), kMagic.end(), bytes.begin())) {
    throw std::invalid_argument("It does not have a time to live.");
  }
  if (bytes[kMagic.size()] != kVersion) {
    throw std::invalid_argument("Its time to live has the unknown format " + std::to_string(bytes[kMagic.size()]) +
                                ".");
  }
  std::uint64_t date = 0;
  for (std::size_t i = 0; i < kDateBytes; ++i) date |= static_cast<std::uint64_t>(bytes[kDateBegin + i]) << (8 * i);
  bytes.erase(bytes.begin(), bytes.begin() + kHeaderBytes);
  return Clock::now() < static_cast<std::int64_t>(date);
}

}  // namespace velmora::mobile::xplat::cellar::host::detail
