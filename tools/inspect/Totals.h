#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

// Of all stores, including those that are left over; the leftover figures count these again, with the trash and the
// like.
struct Totals {
  std::uint64_t stores = 0;
  std::uint64_t items = 0;
  std::uint64_t heldBytes = 0;
  std::uint64_t manifestBytes = 0;
  std::uint64_t allocatedBytes = 0;
  std::uint64_t leftoverBytes = 0;
  std::uint64_t leftoverAllocatedBytes = 0;
  std::vector<Bucket> ages;
  std::vector<Bucket> sizes;
};

Totals totalsOf(const Survey& survey);

// 1 for full; for a store with a capacity but no size limit, by its items. Empty without either.
std::optional<double> fillOf(const StoreSurvey& store);
std::optional<double> fillOf(const ManagerSurvey& manager);

}  // namespace velmora::mobile::xplat::cellar::tools
