#pragma once

#include <cstddef>
#include <cstdint>
#include <unordered_map>
#include <vector>

#include "ManifestRecord.h"

namespace velmora::mobile::xplat::cellar {

using ManifestRecordMap = std::unordered_map<std::string_view, ManifestRecord::Owner>;

// Which of many records has the earliest date, by whatever gives records their date, kept as they come, change and go,
// so that the next one to evict is found without a look at the others.
//
// A heap of the dates that the records had when they were last put in their place. Use makes a record's date later, and
// happens far more often than eviction: that changes nothing here, until the record comes to the front and is put back
// to where it belongs by then. Nothing is kept before the first question.
class EvictionOrder {
 public:
  using Date = std::int32_t (*)(const ManifestRecord& record);
  using Place = std::uint32_t ManifestRecord::*;

  // `place` is where the records note their place in this order.
  EvictionOrder(Date dateOf, Place place) : dateOf_(dateOf), place_(place) {}

  // Null when there are no records. `records` are all those that have been added and not removed.
  const ManifestRecord* first(const ManifestRecordMap& records);

  // To be called after a record was added or has changed, and before one is removed.
  void added(ManifestRecord& record);
  void changed(const ManifestRecord& record);
  void removed(const ManifestRecord& record);

  // Forgets all records.
  void clear();

 private:
  struct Entry {
    std::int32_t date;
    ManifestRecord* record;
  };

  void put(std::size_t place, const Entry& entry);
  void build(const ManifestRecordMap& records);
  void moveUp(std::size_t place);
  void moveDown(std::size_t place);

  const Date dateOf_;
  const Place place_;
  std::vector<Entry> heap_;
  bool isBuilt_ = false;
};

}  // namespace velmora::mobile::xplat::cellar
