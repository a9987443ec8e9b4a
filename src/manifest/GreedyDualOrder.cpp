#include "manifest/GreedyDualOrder.h"

#include <algorithm>
#include <cmath>
#include <utility>

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr double kUnit = 65536;          // the worth of an item of the following size and of average use
constexpr double kUnitSize = 64 * 1024;  // bytes
constexpr std::uint32_t kMostOutcomes = 4096;
constexpr double kPrior = 16;  // outcomes of average use that each class starts with
constexpr double kMostWeight = 10;
constexpr std::int32_t kHighestLevel = 1 << 30;  // the highest worth, of one byte, is less than 2^28 above

}  // namespace

void GreedyDualOrder::added(ManifestRecord& record) { order_.added(record, level_ + worthOf(record.size)); }

void GreedyDualOrder::used(const ManifestRecord& record) {
  learn(record.size, &Outcomes::uses);
  order_.moved(record, level_ + worthOf(record.size));
}

void GreedyDualOrder::removed(const ManifestRecord& record) {
  if (&record == std::exchange(offered_, nullptr)) reached_ = std::max(reached_, priorityOf(record));
  order_.removed(record);
}

void GreedyDualOrder::begin() {
  offered_ = nullptr;
  reached_ = level_;
}

void GreedyDualOrder::evicted(const std::vector<DiskCacheItem>& items) {
  offered_ = nullptr;
  level_ = reached_;
  if (level_ >= kHighestLevel) lowerAll();
  for (const DiskCacheItem& item : items) learn(item.size, &Outcomes::evictions);
}

void GreedyDualOrder::restore(const ManifestRecord& record, std::int32_t priority, std::uint32_t turn) {
  order_.moved(record, priority);
  order_.setTurn(record, turn);
}

// The time between the oldest and the newest date of use stands for half the mean worth, by bytes. Over a whole life in
// the cache the level rises by about one mean worth; half of it loses the fewest hits after a start. Of a clock that
// was wrong for a while a few dates are far from all others: the first and the last of each 64 do not count.
void GreedyDualOrder::arrange() {
  order_.sortBy([](const ManifestRecord& record) { return record.lastAccessDate; });
  const std::size_t count = order_.size();
  const std::size_t apart = count < 3 ? 0 : std::max<std::size_t>(count / 64, 1);
  std::int64_t oldest = 0;
  std::int64_t newest = 0;
  double bytes = 0;
  double worth = 0;
  std::size_t index = 0;
  order_.forEach([&](const ManifestRecord& record) {
    if (index == apart) oldest = record.lastAccessDate;
    if (index == count - 1 - apart) newest = record.lastAccessDate;
    ++index;
    bytes += record.size;
    worth += static_cast<double>(worthOf(record.size)) * record.size;
  });
  const double rise = newest > oldest && bytes > 0 ? worth / bytes / 2 / static_cast<double>(newest - oldest) : 0;
  const auto levelAt = [&](std::int64_t date) {
    return static_cast<std::int32_t>(rise * static_cast<double>(std::clamp(date, oldest, newest) - oldest));
  };
  order_.changeAll([&](const ManifestRecord& record, std::int32_t /*former*/) {
    return levelAt(record.lastAccessDate) + worthOf(record.size);
  });
  level_ = levelAt(newest);
  begin();
}

void GreedyDualOrder::clear() {
  order_.clear();
  outcomes_ = {};
  total_ = {};
  level_ = 0;
  begin();
}

std::size_t GreedyDualOrder::classOf(std::uint32_t size) {
  std::size_t result = 0;
  while ((size >>= 1U) != 0) ++result;
  return result;
}

void GreedyDualOrder::learn(std::uint32_t size, std::uint32_t Outcomes::*outcome) {
  ++(outcomes_[classOf(size)].*outcome);
  ++(total_.*outcome);
  if (total_.uses + total_.evictions < kMostOutcomes) return;
  total_ = {};
  for (Outcomes& each : outcomes_) {
    total_.uses += each.uses /= 2;
    total_.evictions += each.evictions /= 2;
  }
}

// How much more often than the average the items of a class are used before they go.
double GreedyDualOrder::weightOf(const Outcomes& outcomes) const {
  if (total_.uses == 0) return 1;
  const double average = static_cast<double>(total_.uses) / (total_.uses + total_.evictions);
  const double weight = (outcomes.uses / average + kPrior) / (outcomes.uses + outcomes.evictions + kPrior);
  return std::clamp(weight, 1 / kMostWeight, kMostWeight);
}

std::int32_t GreedyDualOrder::worthOf(std::uint32_t size) const {
  const double worth = kUnit * weightOf(outcomes_[classOf(size)]) * std::sqrt(kUnitSize / std::max(size, 1U));
  return std::max(static_cast<std::int32_t>(std::lround(worth)), 1);
}

// Before priorities leave their range.
void GreedyDualOrder::lowerAll() {
  order_.changeAll([this](const ManifestRecord& /*record*/, std::int32_t priority) { return priority - level_; });
  level_ = 0;
}

}  // namespace velmora::mobile::xplat::cellar
