#include "tune/SampleScale.h"

#include <algorithm>
#include <cmath>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr double kMost = 4e18;  // less than 63 bits

}  // namespace

std::int64_t sampledLimit(std::int64_t limit, double rate) {
  return rate == 1 ? limit : static_cast<std::int64_t>(static_cast<double>(limit) * rate);
}

SampleScale::SampleScale(double rate, std::uint64_t requests, std::uint64_t sampled, std::uint64_t sampledBytes)
    : rate_(rate),
      requests_(requests),
      sampledBytes_(sampledBytes),
      expected_(static_cast<double>(requests) * rate),
      missing_(expected_ - static_cast<double>(sampled)),
      meanSize_(sampled == 0 ? 0 : static_cast<double>(sampledBytes) / static_cast<double>(sampled)) {}

std::int64_t SampleScale::limit(std::int64_t sampled) const {
  if (isWhole()) return sampled;
  return static_cast<std::int64_t>(std::ceil(std::min(kMost, static_cast<double>(sampled) / rate_)));
}

std::uint64_t SampleScale::count(std::uint64_t sampled) const {
  if (isWhole()) return sampled;
  return static_cast<std::uint64_t>(std::round(std::min(kMost, static_cast<double>(sampled) / rate_)));
}

std::uint64_t SampleScale::hits(std::uint64_t sampled) const {
  if (isWhole()) return sampled;
  return static_cast<std::uint64_t>(std::round(hitRate(sampled) * static_cast<double>(requests_)));
}

std::uint64_t SampleScale::hitBytes(std::uint64_t sampled) const {
  if (isWhole()) return sampled;
  const double bytes = std::max(0.0, static_cast<double>(sampled) + missing_ * meanSize_);
  return std::min(requestedBytes(), static_cast<std::uint64_t>(std::round(std::min(kMost, bytes / rate_))));
}

std::uint64_t SampleScale::requestedBytes() const {
  if (isWhole()) return sampledBytes_;
  return static_cast<std::uint64_t>(std::round(std::min(kMost, static_cast<double>(requests_) * meanSize_)));
}

double SampleScale::hitRate(std::uint64_t sampledHits) const {
  if (expected_ == 0) return 0;
  return std::clamp((static_cast<double>(sampledHits) + missing_) / expected_, 0.0, 1.0);
}

}  // namespace velmora::mobile::xplat::cellar::tools
