#include "manifest/EvictionOrder.h"

#include <algorithm>

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::size_t kChildren = 4;  // of each entry: half as deep as with two, and they lie side by side

std::size_t parentOf(std::size_t place) { return (place - 1) / kChildren; }

}  // namespace

const ManifestRecord* EvictionOrder::first() {
  while (!heap_.empty()) {
    Entry& front = heap_.front();
    const std::int32_t date = dateOf_(*front.record);
    if (date <= front.date) return front.record;
    front.date = date;
    front.turn = nextSequence_++;
    moveDown(0);
  }
  return nullptr;
}

// By a quarter of what there is: a cache of many items grows slowly.
void EvictionOrder::reserveOneMore() {
  if (heap_.size() == heap_.capacity()) heap_.reserve(heap_.size() + heap_.size() / 4 + kChildren);
}

void EvictionOrder::added(ManifestRecord& record) { added(record, dateOf_(record)); }

void EvictionOrder::added(ManifestRecord& record, std::int32_t date) {
  heap_.push_back({date, nextSequence_++, &record});
  moveUp(heap_.size() - 1);
}

// Earlier than before, which takes a clock that was set back: every later date can wait.
void EvictionOrder::changed(const ManifestRecord& record) {
  Entry& entry = heap_[record.*place_];
  const std::int32_t date = dateOf_(record);
  if (date >= entry.date) return;
  entry.date = date;
  entry.turn = nextSequence_++;
  moveUp(record.*place_);
}

void EvictionOrder::moved(const ManifestRecord& record, std::int32_t date) {
  const std::size_t place = record.*place_;
  heap_[place].date = date;
  heap_[place].turn = nextSequence_++;
  moveUp(place);
  moveDown(record.*place_);
}

void EvictionOrder::removed(const ManifestRecord& record) {
  const std::size_t place = record.*place_;
  const Entry last = heap_.back();
  heap_.pop_back();
  if (place == heap_.size()) return;
  put(place, last);
  moveUp(place);
  moveDown(last.record->*place_);
}

void EvictionOrder::setTurn(const ManifestRecord& record, std::uint32_t turn) {
  heap_[record.*place_].turn = turn;
  moveUp(record.*place_);
  moveDown(record.*place_);
}

void EvictionOrder::allChanged() {
  for (Entry& entry : heap_) entry.date = dateOf_(*entry.record);
  rebuild();
}

void EvictionOrder::sortBy(Date dateOf) {
  std::sort(heap_.begin(), heap_.end(), [dateOf](const Entry& a, const Entry& b) {
    const std::int32_t dateOfA = dateOf(*a.record);
    const std::int32_t dateOfB = dateOf(*b.record);
    return dateOfA != dateOfB ? dateOfA < dateOfB : isBefore(a, b);
  });
  nextSequence_ = 0;
  for (Entry& entry : heap_) {
    entry.record->*place_ = nextSequence_;
    entry.turn = nextSequence_++;
  }
}

void EvictionOrder::rebuild() {
  if (heap_.size() < 2) return;
  for (std::size_t place = parentOf(heap_.size() - 1) + 1; place-- > 0;) moveDown(place);
}

// Turns wrap around; what lies less than half of them ahead is later.
bool EvictionOrder::isBefore(const Entry& a, const Entry& b) {
  return a.date != b.date ? a.date < b.date : static_cast<std::int32_t>(a.turn - b.turn) < 0;
}

void EvictionOrder::put(std::size_t place, const Entry& entry) {
  heap_[place] = entry;
  entry.record->*place_ = static_cast<std::uint32_t>(place);
}

void EvictionOrder::moveUp(std::size_t place) {
  const Entry entry = heap_[place];
  while (place > 0 && isBefore(entry, heap_[parentOf(place)])) {
    put(place, heap_[parentOf(place)]);
    place = parentOf(place);
  }
  put(place, entry);
}

void EvictionOrder::moveDown(std::size_t place) {
  const Entry entry = heap_[place];
  while (kChildren * place + 1 < heap_.size()) {
    const auto children = heap_.begin() + static_cast<std::ptrdiff_t>(kChildren * place + 1);
    const auto end =
        heap_.begin() + static_cast<std::ptrdiff_t>(std::min(kChildren * place + kChildren + 1, heap_.size()));
    const auto earliest = std::min_element(children, end, isBefore);
    if (!isBefore(*earliest, entry)) break;
    const auto next = static_cast<std::size_t>(earliest - heap_.begin());
    put(place, *earliest);
    place = next;
  }
  put(place, entry);
}

}  // namespace velmora::mobile::xplat::cellar
