#include "demo/DateRange.h"

#include <algorithm>
#include <limits>

namespace velmora::mobile::xplat::cellar::tools {

bool DateRange::includes(std::int64_t date) const { return earliest <= date && date <= latest; }

DateRange DateRange::plus(std::int64_t seconds) const { return {earliest + seconds, latest + seconds}; }

bool canBeInOrder(const std::vector<DateRange>& dates) {
  std::int64_t reached = std::numeric_limits<std::int64_t>::min();
  for (const DateRange& date : dates) {
    reached = std::max(reached, date.earliest);
    if (date.latest < reached) return false;
  }
  return true;
}

bool canBeBefore(const std::vector<DateRange>& earlier, const std::vector<DateRange>& later) {
  std::int64_t reached = std::numeric_limits<std::int64_t>::min();
  for (const DateRange& date : earlier) reached = std::max(reached, date.earliest);
  return std::all_of(later.begin(), later.end(), [&](const DateRange& date) { return date.latest >= reached; });
}

}  // namespace velmora::mobile::xplat::cellar::tools
