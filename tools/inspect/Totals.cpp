#include "inspect/Totals.h"

#include <cmath>
#include <cstddef>

#include "inspect/Buckets.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Four digits are enough, and the same on every machine.
std::optional<double> ratio(std::uint64_t part, std::optional<std::uint64_t> whole) {
  if (!whole || *whole == 0) return std::nullopt;
  constexpr double digits = 10000;
  return std::round(static_cast<double>(part) / static_cast<double>(*whole) * digits) / digits;
}

void add(const std::vector<Bucket>& buckets, std::vector<Bucket>& sums) {
  for (std::size_t i = 0; i < sums.size(); ++i) {
    sums[i].items += buckets[i].items;
    sums[i].bytes += buckets[i].bytes;
  }
}

void add(const StoreSurvey& store, Totals& totals) {
  ++totals.stores;
  totals.items += store.items;
  totals.heldBytes += store.heldBytes();
  totals.manifestBytes += store.manifestBytes;
  totals.allocatedBytes += store.allocatedBytes;
  add(store.ages, totals.ages);
  add(store.sizes, totals.sizes);
}

}  // namespace

Totals totalsOf(const Survey& survey) {
  Totals totals;
  totals.ages = ageBuckets();
  totals.sizes = sizeBuckets();
  for (const ManagerSurvey& manager : survey.managers) {
    for (const StoreSurvey& store : manager.stores) add(store, totals);
  }
  for (const Leftover& leftover : survey.leftovers) {
    totals.leftoverBytes += leftover.bytes;
    totals.leftoverAllocatedBytes += leftover.allocatedBytes;
  }
  return totals;
}

std::optional<double> fillOf(const StoreSurvey& store) {
  const bool isUnmanaged = store.kind == StoreKind::Unmanaged;
  if (store.limitBytes) {
    return ratio(isUnmanaged ? store.heldBytes() : store.recordedBytes.value_or(store.heldBytes()), store.limitBytes);
  }
  return ratio(store.items, store.capacity);
}

std::optional<double> fillOf(const ManagerSurvey& manager) { return ratio(manager.countedBytes, manager.limitBytes); }

}  // namespace velmora::mobile::xplat::cellar::tools
