#pragma once

#include <cstdint>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// Whole seconds since the Unix epoch between which something happened: the library dates what it does itself, and its
// caller knows only when it called and when it got its answer.
struct DateRange {
  std::int64_t earliest = 0;
  std::int64_t latest = 0;

  bool includes(std::int64_t date) const;
  DateRange plus(std::int64_t seconds) const;
};

// Whether the dates can have been in this order, none earlier than the one before it.
bool canBeInOrder(const std::vector<DateRange>& dates);

// Whether none of `earlier` was certainly later than one of `later`.
bool canBeBefore(const std::vector<DateRange>& earlier, const std::vector<DateRange>& later);

}  // namespace velmora::mobile::xplat::cellar::tools
