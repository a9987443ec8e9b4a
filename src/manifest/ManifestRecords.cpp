#include "manifest/ManifestRecords.h"

#include <typeinfo>
#include <utility>

#include "PruneStrategy.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// Yields records in the order of a comparator, one by one. A heap: taking the first few of many does not sort the rest,
// and with a comparator that is not a consistent order, which a host's may be, it still yields every record once. (The
// standard algorithms are undefined then.)
class ComparedRecords {
 public:
  template <class Map> ComparedRecords(const Map& records, std::shared_ptr<PruneStrategyBase> strategy)
      : before_(std::move(strategy)) {
    heap_.reserve(records.size());
    for (const auto& [key, record] : records) heap_.push_back(record.get());
    for (std::size_t i = heap_.size() / 2; i-- > 0;) siftDown(i);
  }

  const ManifestRecord* pop() {
    if (heap_.empty()) return nullptr;
    std::swap(heap_.front(), heap_.back());
    const ManifestRecord* const first = heap_.back();
    heap_.pop_back();
    siftDown(0);
    return first;
  }

 private:
  bool isBefore(const ManifestRecord* a, const ManifestRecord* b) {
    a->copyTo(first_);
    b->copyTo(second_);
    return before_(&first_, &second_);
  }

  void siftDown(std::size_t parent) {
    for (std::size_t child = 2 * parent + 1; child < heap_.size(); child = 2 * parent + 1) {
      if (child + 1 < heap_.size() && isBefore(heap_[child + 1], heap_[child])) ++child;
      if (!isBefore(heap_[child], heap_[parent])) return;
      std::swap(heap_[child], heap_[parent]);
      parent = child;
    }
  }

  const Comparator before_;
  std::vector<const ManifestRecord*> heap_;
  DiskCacheItem first_;  // what the comparator is shown; their strings keep their memory from one to the next
  DiskCacheItem second_;
};

std::int32_t accessDateOf(const ManifestRecord& record) { return record.lastAccessDate; }

// Exactly: a class that derives from one of ours may compare in its own way.
template <class Strategy> bool isExactly(const PruneStrategyBase* strategy) {
  return strategy != nullptr && typeid(*strategy) == typeid(Strategy);
}

}  // namespace

ManifestRecords::ManifestRecords(std::shared_ptr<PruneStrategyBase> strategy)
    : strategy_(std::move(strategy)),
      isVideoStrategy_(isExactly<VideoDownloadPruneStrategy>(strategy_.get())),
      isOwnStrategy_(strategy_ != nullptr && !isVideoStrategy_ && !isExactly<LRUPruneStrategy>(strategy_.get()) &&
                     !isExactly<GreedyDualPruneStrategy>(strategy_.get())),
      byAccessDate_(accessDateOf, &ManifestRecord::accessDateIndex),
      byGreedyDual_(isExactly<GreedyDualPruneStrategy>(strategy_.get()) ? std::make_unique<GreedyDualOrder>()
                                                                        : nullptr) {}

std::vector<std::string> ManifestRecords::keys() const {
  std::vector<std::string> keys;
  keys.reserve(records_.size());
  for (const auto& [key, record] : records_) keys.emplace_back(key);
  return keys;
}

const ManifestRecord* ManifestRecords::find(const std::string& key) const {
  const auto found = records_.find(key);
  return found == records_.end() ? nullptr : found->second.get();
}

const ManifestRecord* ManifestRecords::store(const DiskCacheItem& item) {
  byAccessDate_.reserveOneMore();
  if (isVideoStrategy_) byVideoPriority_.reserveOneMore();
  if (byGreedyDual_ != nullptr) byGreedyDual_->reserveOneMore();
  auto record = ManifestRecord::create(item);
  ManifestRecord& stored = *record;
  const auto old = records_.find(item.key);
  if (old == records_.end()) {
    records_.emplace(stored.key(), std::move(record));
  } else {
    leaveOrders(*old->second);
    auto place = records_.extract(old);
    place.key() = stored.key();  // the old one dies with its record
    place.mapped() = std::move(record);
    records_.insert(std::move(place));
  }
  totalSize_ += stored.size;
  byAccessDate_.added(stored);
  if (isVideoStrategy_) byVideoPriority_.added(stored);
  if (byGreedyDual_ != nullptr) byGreedyDual_->added(stored);
  return &stored;
}

void ManifestRecords::setLastAccessDate(const std::string& key, std::int32_t date) {
  ManifestRecord& record = *records_.at(key);
  record.lastAccessDate = date;
  byAccessDate_.changed(record);
  if (isVideoStrategy_) byVideoPriority_.changed(record);
  if (byGreedyDual_ != nullptr) byGreedyDual_->used(record);
}

void ManifestRecords::setHasInlineData(const std::string& key, bool hasInlineData) {
  records_.at(key)->hasInlineData = hasInlineData;
}

DiskCacheItem ManifestRecords::remove(const ManifestRecord& record) {
  DiskCacheItem item = record.item();
  leaveOrders(record);
  records_.erase(records_.find(record.key()));
  return item;
}

ManifestRecords::Copy ManifestRecords::copyOf(const ManifestRecord& record) const {
  const std::uint32_t turnByPriority = isVideoStrategy_           ? byVideoPriority_.turnOf(record)
                                       : byGreedyDual_ != nullptr ? byGreedyDual_->turnOf(record)
                                                                  : 0;
  return {record.item(), byAccessDate_.turnOf(record), turnByPriority,
          byGreedyDual_ != nullptr ? byGreedyDual_->priorityOf(record) : 0};
}

void ManifestRecords::restore(const Copy& copy) {
  const ManifestRecord& record = *store(copy.item);
  byAccessDate_.setTurn(record, copy.turnByAccessDate);
  if (isVideoStrategy_) byVideoPriority_.setTurn(record, copy.turnByPriority);
  if (byGreedyDual_ != nullptr) byGreedyDual_->restore(record, copy.priority, copy.turnByPriority);
}

void ManifestRecords::leaveOrders(const ManifestRecord& record) {
  totalSize_ -= record.size;
  byAccessDate_.removed(record);
  if (isVideoStrategy_) byVideoPriority_.removed(record);
  if (byGreedyDual_ != nullptr) byGreedyDual_->removed(record);
}

void ManifestRecords::clear() {
  byAccessDate_.clear();
  byVideoPriority_.clear();
  if (byGreedyDual_ != nullptr) byGreedyDual_->clear();
  records_.clear();
  totalSize_ = 0;
}

void ManifestRecords::reserve(std::size_t count) {
  records_.reserve(count);
  byAccessDate_.reserve(count);
  if (isVideoStrategy_) byVideoPriority_.reserve(count);
  if (byGreedyDual_ != nullptr) byGreedyDual_->reserve(count);
}

ManifestRecords::Next ManifestRecords::leastRecentlyUsed() {
  return [this] { return byAccessDate_.first(); };
}

void ManifestRecords::evicted(const std::vector<DiskCacheItem>& items) {
  if (byGreedyDual_ != nullptr) byGreedyDual_->evicted(items);
}

void ManifestRecords::loaded() {
  if (byGreedyDual_ != nullptr) byGreedyDual_->arrange();
}

ManifestRecords::Next ManifestRecords::byStrategy() {
  if (byGreedyDual_ != nullptr) {
    byGreedyDual_->begin();
    return [this] { return byGreedyDual_->first(); };
  }
  using Basis = VideoEvictionOrder::Basis;
  const Basis basis = isVideoStrategy_ ? byVideoPriority_.basis(records_.size())
                      : isOwnStrategy_ ? Basis::Comparison
                                       : Basis::AccessDate;
  if (basis == Basis::AccessDate) return leastRecentlyUsed();
  if (basis == Basis::Comparison) return byComparison();
  return [this] { return byVideoPriority_.first(); };
}

ManifestRecords::Next ManifestRecords::byComparison() const {
  return [records = std::make_shared<ComparedRecords>(records_, strategy_)] { return records->pop(); };
}

}  // namespace velmora::mobile::xplat::cellar
