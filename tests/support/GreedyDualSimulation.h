#pragma once

#include <algorithm>
#include <array>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::test {

// The strategy in its plainest form: looks at every item for each eviction, and its numbers never need to be lowered.
class GreedyDualSimulation {
 public:
  bool contains(const std::string& key) const { return items_.count(key) != 0; }
  std::size_t evictions() const { return evictions_; }
  std::int64_t level() const { return level_; }
  std::vector<std::string> keys() const {
    std::vector<std::string> keys;
    for (const auto& item : items_) keys.push_back(item.first);
    return keys;
  }

  bool use(const std::string& key, std::int64_t date) {
    const auto found = items_.find(key);
    if (found == items_.end()) return false;
    learn(found->second.size, 0);
    place(found->second, date);
    return true;
  }
  void store(const std::string& key, std::uint32_t size, std::int64_t date) {
    Item& item = items_[key];
    item.size = size;
    place(item, date);
  }
  void remove(const std::string& key) { items_.erase(key); }
  void clear() { items_.clear(); }

  std::vector<std::string> prune(std::uint64_t limit) {
    std::vector<std::string> evicted;
    for (std::uint64_t total = totalSize(); total > limit;) {
      const auto lowest = std::min_element(items_.begin(), items_.end(), [](const auto& a, const auto& b) {
        const Item& x = a.second;
        const Item& y = b.second;
        return x.priority != y.priority ? x.priority < y.priority : x.turn < y.turn;
      });
      level_ = std::max(level_, lowest->second.priority);
      learn(lowest->second.size, 1);
      total -= lowest->second.size;
      evicted.push_back(lowest->first);
      items_.erase(lowest);
    }
    evictions_ += evicted.size();
    return evicted;
  }

  // What is left after a restart: sizes and dates of use.
  void restart() {
    outcomes_ = {};
    level_ = 0;
    if (items_.empty()) return;
    std::vector<std::int64_t> dates;
    double worth = 0;
    double bytes = 0;
    for (const auto& [key, item] : items_) {
      dates.push_back(item.date);
      worth += static_cast<double>(worthOf(item.size)) * item.size;
      bytes += item.size;
    }
    std::sort(dates.begin(), dates.end());
    const std::size_t apart = dates.size() < 3 ? 0 : std::max<std::size_t>(dates.size() / 64, 1);
    const std::int64_t oldest = dates[apart];
    const std::int64_t newest = dates[dates.size() - 1 - apart];
    const double rise = newest == oldest || bytes == 0 ? 0 : worth / bytes / 2 / static_cast<double>(newest - oldest);
    const auto levelAt = [&](std::int64_t date) {
      return static_cast<std::int64_t>(rise * static_cast<double>(std::min(std::max(date, oldest), newest) - oldest));
    };
    for (auto& [key, item] : items_) item.priority = levelAt(item.date) + worthOf(item.size);
    level_ = levelAt(newest);
  }

 private:
  struct Item {
    std::uint32_t size = 0;
    std::int64_t date = 0;
    std::int64_t priority = 0;
    std::uint64_t turn = 0;
  };

  std::uint64_t totalSize() const {
    std::uint64_t total = 0;
    for (const auto& item : items_) total += item.second.size;
    return total;
  }
  void place(Item& item, std::int64_t date) {
    item.date = date;
    item.priority = level_ + worthOf(item.size);
    item.turn = ++turns_;
  }
  static int classOf(std::uint32_t size) { return static_cast<int>(std::floor(std::log2(std::max(size, 1U)))); }
  std::array<double, 2> sum() const {
    std::array<double, 2> sum = {};
    for (const auto& [key, counts] : outcomes_) sum = {sum[0] + counts[0], sum[1] + counts[1]};
    return sum;
  }
  void learn(std::uint32_t size, std::size_t outcome) {
    ++outcomes_[classOf(size)].at(outcome);
    if (sum()[0] + sum()[1] < 4096) return;
    for (auto& [key, counts] : outcomes_) counts = {counts[0] / 2, counts[1] / 2};
  }
  std::int64_t worthOf(std::uint32_t size) const {
    const auto all = sum();
    double weight = 1;
    if (all[0] > 0) {
      const auto found = outcomes_.find(classOf(size));
      const std::array<int, 2> own = found == outcomes_.end() ? std::array<int, 2>{} : found->second;
      weight = (own[0] / (all[0] / (all[0] + all[1])) + 16) / (own[0] + own[1] + 16.0);
    }
    return std::lround(65536 * std::min(10.0, std::max(0.1, weight)) * std::sqrt(65536.0 / std::max(size, 1U)));
  }

  std::map<std::string, Item> items_;
  std::map<int, std::array<int, 2>> outcomes_;  // uses and evictions of the sizes from 2^n on
  std::int64_t level_ = 0;
  std::uint64_t turns_ = 0;
  std::size_t evictions_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::test
