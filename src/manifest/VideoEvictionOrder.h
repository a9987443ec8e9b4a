#pragma once

#include <cstddef>
#include <cstdint>

#include "manifest/EvictionOrder.h"

namespace velmora::mobile::xplat::cellar {

// The order of eviction that the video strategy gives, kept like the one by access date. It is kept as dates, which
// takes metadata with every record, or with none: the strategy compares an item that has some with one that has none by
// their access dates, and the result is not an order to keep.
class VideoEvictionOrder {
 public:
  enum class Basis { AccessDate, Priority, Comparison };

  // What to go by for the present records and tunables.
  Basis basis(std::size_t recordCount) const;

  // The first to go by priority.
  const ManifestRecord* first();

  // As with EvictionOrder.
  void reserve(std::size_t count) { order_.reserve(count); }
  void reserveOneMore() { order_.reserveOneMore(); }
  void added(ManifestRecord& record);
  void changed(const ManifestRecord& record);
  void removed(const ManifestRecord& record);
  std::uint32_t turnOf(const ManifestRecord& record) const { return order_.turnOf(record); }
  void setTurn(const ManifestRecord& record, std::uint32_t turn) { order_.setTurn(record, turn); }
  void clear();

 private:
  EvictionOrder order_ = {dateOf, &ManifestRecord::priorityIndex};
  std::size_t recordsWithMetadata_ = 0;
  int priorityWeight_ = 0;  // the host's tunables as they were last seen
  int highPriorityVideoSecondCutoff_ = 0;
  bool isOutdated_ = false;  // they have changed since some record was put in its place

  void watchTunables();
  static std::int32_t dateOf(const ManifestRecord& record);
};

}  // namespace velmora::mobile::xplat::cellar
