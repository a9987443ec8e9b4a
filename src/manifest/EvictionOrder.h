#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "manifest/ManifestRecord.h"

namespace velmora::mobile::xplat::cellar {

// Which of many records has the earliest date, by whatever gives records their date, kept as they come, change and go,
// so that the next one to evict is found without a look at the others. Of the same date, whoever was put there first
// goes first.
//
// A heap of the dates that the records had when they were last put in their place. Use makes a record's date later, and
// happens far more often than eviction: that changes nothing here, until the record comes to the front and is put back
// to where it belongs by then.
class EvictionOrder {
 public:
  using Date = std::int32_t (*)(const ManifestRecord& record);
  using Place = std::uint32_t ManifestRecord::*;

  // `place` is where the records note their place in this order.
  EvictionOrder(Date dateOf, Place place) : dateOf_(dateOf), place_(place) {}

  // Null when there are no records.
  const ManifestRecord* first();

  // Room for so many records in all, or for one more. May throw `std::bad_alloc`.
  void reserve(std::size_t count) { heap_.reserve(count); }
  void reserveOneMore();

  // To be called after a record was added, for which there has to be room, or has changed, and before one is removed.
  void added(ManifestRecord& record);
  void changed(const ManifestRecord& record);
  void removed(const ManifestRecord& record);

  // The record's turn among those of its date; for one that was removed and has come back.
  std::uint32_t turnOf(const ManifestRecord& record) const { return heap_[record.*place_].turn; }
  void setTurn(const ManifestRecord& record, std::uint32_t turn);

  // To be called when other dates have become earlier as well.
  void allChanged();

  // For an order whose dates are given to it, and whose records themselves have one that is never later: a record is
  // added with its date, or put behind all others of another date; all get other dates, and keep their turns.
  void added(ManifestRecord& record, std::int32_t date);
  void moved(const ManifestRecord& record, std::int32_t date);
  std::size_t size() const { return heap_.size(); }
  std::int32_t givenDateOf(const ManifestRecord& record) const { return heap_[record.*place_].date; }
  template <class NewDate> void changeAll(NewDate newDate) {
    for (Entry& entry : heap_) entry.date = newDate(*entry.record, entry.date);
    rebuild();
  }
  // Gives turns by these dates, and the records to `forEach` in that order. All have to get other dates afterwards.
  void sortBy(Date dateOf);
  template <class Action> void forEach(Action action) const {
    for (const Entry& entry : heap_) action(*entry.record);
  }

  // Forgets all records.
  void clear() { std::vector<Entry>().swap(heap_); }

 private:
  struct Entry {
    std::int32_t date;
    std::uint32_t turn;  // among those of the same date
    ManifestRecord* record;
  };

  static bool isBefore(const Entry& a, const Entry& b);
  void rebuild();
  void put(std::size_t place, const Entry& entry);
  void moveUp(std::size_t place);
  void moveDown(std::size_t place);

  const Date dateOf_;
  const Place place_;
  std::vector<Entry> heap_;
  std::uint32_t nextSequence_ = 0;  // given out so far
};

}  // namespace velmora::mobile::xplat::cellar
