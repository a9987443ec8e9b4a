#include "EvictionOrder.h"

#include <algorithm>
#include <new>

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::size_t kChildren = 4;  // of each entry: half as deep as with two, and they lie side by side

std::size_t parentOf(std::size_t place) { return (place - 1) / kChildren; }

}  // namespace

const ManifestRecord* EvictionOrder::first(const ManifestRecordMap& records) {
  if (!isBuilt_) build(records);
  while (!heap_.empty()) {
    Entry& front = heap_.front();
    const std::int32_t date = dateOf_(*front.record);
    if (date <= front.date) return front.record;
    front.date = date;
    moveDown(0);
  }
  return nullptr;
}

void EvictionOrder::added(ManifestRecord& record) {
  if (!isBuilt_) return;
  try {
    heap_.push_back({dateOf_(record), &record});
  } catch (const std::bad_alloc&) {
    return clear();  // built again when it is needed
  }
  moveUp(heap_.size() - 1);
}

// Earlier than before, which takes a clock that was set back: every later date can wait.
void EvictionOrder::changed(const ManifestRecord& record) {
  if (!isBuilt_) return;
  Entry& entry = heap_[record.*place_];
  const std::int32_t date = dateOf_(record);
  if (date >= entry.date) return;
  entry.date = date;
  moveUp(record.*place_);
}

void EvictionOrder::removed(const ManifestRecord& record) {
  if (!isBuilt_) return;
  const std::size_t place = record.*place_;
  const Entry last = heap_.back();
  heap_.pop_back();
  if (place == heap_.size()) return;
  put(place, last);
  moveUp(place);
  moveDown(last.record->*place_);
}

void EvictionOrder::clear() {
  heap_ = {};
  isBuilt_ = false;
}

void EvictionOrder::put(std::size_t place, const Entry& entry) {
  heap_[place] = entry;
  entry.record->*place_ = static_cast<std::uint32_t>(place);
}

void EvictionOrder::build(const ManifestRecordMap& records) {
  heap_.reserve(records.size());
  for (const auto& [key, record] : records) {
    record.get()->*place_ = static_cast<std::uint32_t>(heap_.size());
    heap_.push_back({dateOf_(*record), record.get()});
  }
  isBuilt_ = true;
  if (heap_.size() < 2) return;
  for (std::size_t place = parentOf(heap_.size() - 1) + 1; place-- > 0;) moveDown(place);
}

void EvictionOrder::moveUp(std::size_t place) {
  const Entry entry = heap_[place];
  while (place > 0 && entry.date < heap_[parentOf(place)].date) {
    put(place, heap_[parentOf(place)]);
    place = parentOf(place);
  }
  put(place, entry);
}

void EvictionOrder::moveDown(std::size_t place) {
  const Entry entry = heap_[place];
  const auto isEarlier = [](const Entry& a, const Entry& b) { return a.date < b.date; };
  while (kChildren * place + 1 < heap_.size()) {
    const auto children = heap_.begin() + static_cast<std::ptrdiff_t>(kChildren * place + 1);
    const auto end =
        heap_.begin() + static_cast<std::ptrdiff_t>(std::min(kChildren * place + kChildren + 1, heap_.size()));
    const auto earliest = std::min_element(children, end, isEarlier);
    if (earliest->date >= entry.date) break;
    const auto next = static_cast<std::size_t>(earliest - heap_.begin());
    put(place, *earliest);
    place = next;
  }
  put(place, entry);
}

}  // namespace velmora::mobile::xplat::cellar
