#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <vector>

#include "manifest/EvictionOrder.h"

namespace velmora::mobile::xplat::cellar {

// The order of eviction of `GreedyDualPruneStrategy`. An item's priority is the level when it was last stored or used
// plus its worth; the lowest goes first and lifts the level to its own. Of the same priority, the least recently used
// goes first.
class GreedyDualOrder {
 public:
  // As with EvictionOrder.
  void reserve(std::size_t count) { order_.reserve(count); }
  void reserveOneMore() { order_.reserveOneMore(); }
  void added(ManifestRecord& record);
  void removed(const ManifestRecord& record);
  std::int32_t priorityOf(const ManifestRecord& record) const { return order_.givenDateOf(record); }
  std::uint32_t turnOf(const ManifestRecord& record) const { return order_.turnOf(record); }

  // To be called after a record was found.
  void used(const ManifestRecord& record);

  // To be called before a prune.
  void begin();

  // The lowest, to be removed before the next is asked for. Null when there are no records.
  const ManifestRecord* first() { return offered_ = order_.first(); }

  // To be called after a prune that has come about and has left room for items: learns from what it has evicted.
  void evicted(const std::vector<DiskCacheItem>& items);

  // For a record that was removed and has come back.
  void restore(const ManifestRecord& record, std::int32_t priority, std::uint32_t turn);

  // Gives all records the priorities that their dates of use suggest, as when they have been read after a start.
  void arrange();

  // Forgets all records, and what was learnt.
  void clear();

 private:
  // Of items of one size class: how often one was used, and how often one was evicted. Halved from time to time.
  struct Outcomes {
    std::uint32_t uses = 0;
    std::uint32_t evictions = 0;
  };

  static std::int32_t never(const ManifestRecord& /*record*/) { return std::numeric_limits<std::int32_t>::min(); }
  static std::size_t classOf(std::uint32_t size);
  void learn(std::uint32_t size, std::uint32_t Outcomes::*outcome);
  double weightOf(const Outcomes& outcomes) const;
  std::int32_t worthOf(std::uint32_t size) const;
  void lowerAll();

  EvictionOrder order_ = {never, &ManifestRecord::priorityIndex};  // with priorities as dates
  std::array<Outcomes, 32> outcomes_ = {};
  Outcomes total_;
  std::int32_t level_ = 0;
  const ManifestRecord* offered_ = nullptr;  // the last that `first` gave
  std::int32_t reached_ = 0;                 // the level that the present prune has reached
};

}  // namespace velmora::mobile::xplat::cellar
