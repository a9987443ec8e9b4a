#include "tune/HitCurve.h"

#include <algorithm>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::int64_t kFirst = 2048;  // up to here every limit is kept
constexpr std::int64_t kHalf = kFirst / 2;

}  // namespace

HitCurve::HitCurve(std::int64_t exactLimit) : exactLimit_(exactLimit) { exact_.limit = exactLimit; }

void HitCurve::addHit(std::int64_t leastLimit, std::int64_t size) {
  const auto bytes = static_cast<std::uint64_t>(size);
  ++requests_;
  requestedBytes_ += bytes;
  sums_.clear();
  const std::size_t index = indexOf(leastLimit);
  if (index >= steps_.size()) steps_.resize(index + 1);
  ++steps_[index].hits;
  steps_[index].hitBytes += bytes;
  if (leastLimit > exactLimit_) return;
  ++exact_.hits;
  exact_.hitBytes += bytes;
}

void HitCurve::addMiss(std::int64_t size) {
  ++requests_;
  requestedBytes_ += static_cast<std::uint64_t>(size);
}

HitCurve::Point HitCurve::at(std::int64_t limit) const {
  if (limit == exactLimit_) return exact_;
  Point point;
  point.limit = limit;
  if (limit < 0 || steps_.empty()) return point;
  sumUp();
  std::size_t index = indexOf(limit);
  if (limitOf(index) > limit) --index;
  const Point& sum = sums_[std::min(index, sums_.size() - 1)];
  point.hits = sum.hits;
  point.hitBytes = sum.hitBytes;
  return point;
}

HitCurve::Point HitCurve::most() const {
  if (steps_.empty()) return {};
  sumUp();
  return sums_.back();
}

HitCurve::Point HitCurve::enough(double worth) const {
  const std::uint64_t most = this->most().hits;
  if (most == 0) return {};
  const double least = worth * static_cast<double>(requests_);
  std::size_t index = sums_.size() - 1;
  while (index > 0) {
    const std::size_t doubled = indexOf(2 * limitOf(index - 1));
    const std::uint64_t then = doubled < sums_.size() ? sums_[doubled].hits : most;
    if (static_cast<double>(then - sums_[index - 1].hits) >= least) break;
    --index;
  }
  return sums_[index];
}

// Limits of eleven digits are digits times a power of two. Numbered by magnitude, then by digits.
std::size_t HitCurve::indexOf(std::int64_t limit) {
  if (limit <= kFirst) return static_cast<std::size_t>(limit);
  int power = 0;
  while (((limit - 1) >> power) >= kFirst) ++power;
  const std::int64_t digits = ((limit - 1) >> power) + 1;
  return static_cast<std::size_t>(kFirst + (power - 1) * kHalf + (digits - kHalf));
}

std::int64_t HitCurve::limitOf(std::size_t index) {
  const auto number = static_cast<std::int64_t>(index);
  if (number <= kFirst) return number;
  const std::int64_t power = (number - kFirst - 1) / kHalf + 1;
  const std::int64_t digits = (number - kFirst - 1) % kHalf + 1 + kHalf;
  return digits << power;
}

void HitCurve::sumUp() const {
  if (!sums_.empty()) return;
  sums_ = steps_;
  for (std::size_t index = 0; index < sums_.size(); ++index) {
    sums_[index].limit = limitOf(index);
    if (index == 0) continue;
    sums_[index].hits += sums_[index - 1].hits;
    sums_[index].hitBytes += sums_[index - 1].hitBytes;
  }
}

}  // namespace velmora::mobile::xplat::cellar::tools
