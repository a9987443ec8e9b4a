#include "manifest/AccessDates.h"

#include <glog/logging.h>

#include <cstddef>
#include <exception>
#include <iterator>

#include "ManifestPersistence.h"
#include "manifest/ManifestRecords.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::size_t kMostWaiting = 512;

}  // namespace

AccessDates::AccessDates(ManifestPersistence& persistence, const ManifestRecords& records,
                         std::recursive_mutex& itemsMutex, bool together)
    : persistence_(persistence), records_(records), itemsMutex_(itemsMutex), together_(together) {}

void AccessDates::clear(const ItemsLock& /*lock*/) {
  waiting_.clear();
  hasFailed_ = false;
}

bool AccessDates::isDue() const {
  if (hasFailed_ || waiting_.size() <= kMostWaiting) return false;
  const auto queued = queued_.lock();
  return queued == nullptr || queued->empty();
}

std::shared_ptr<AccessDates::Dates> AccessDates::takeDue(const ItemsLock& /*lock*/) {
  if (!isDue()) return nullptr;
  auto due = std::make_shared<Dates>();
  due->swap(waiting_);
  queued_ = due;
  return due;
}

void AccessDates::giveBack(const ItemsLock& /*lock*/, Dates& due) {
  waiting_.merge(due);
  due.clear();
}

void AccessDates::flush() {
  Dates dates;
  {
    const ItemsLock lock(itemsMutex_);
    dates.swap(waiting_);
  }
  write(dates);
}

void AccessDates::flush(Dates& due) {
  Dates dates;
  {
    const ItemsLock lock(itemsMutex_);
    dates.swap(due);
  }
  write(dates);
  {
    const ItemsLock lock(itemsMutex_);
    if (!isDue()) return;
    dates.swap(waiting_);
  }
  write(dates);
}

void AccessDates::write(Dates& dates) {
  try {
    if (together_) writeTogether(dates);
    for (; !dates.empty(); dates.erase(dates.begin())) {
      const auto& [key, date] = *dates.begin();
      if (isCurrent(key, date)) persistence_.updateLastAccessDate(key, date);
    }
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not write access dates: " << error.what();
  }
  const ItemsLock lock(itemsMutex_);
  hasFailed_ = !dates.empty();
  for (auto left = dates.begin(); left != dates.end();) {
    left = isCurrent(lock, left->first, left->second) ? std::next(left) : dates.erase(left);
  }
  waiting_.merge(dates);
}

// In one transaction, for which a synced store waits once. Where there are none, nothing is written, and the dates
// stay.
void AccessDates::writeTogether(Dates& dates) {
  Dates current;
  {
    const ItemsLock lock(itemsMutex_);
    for (const auto& [key, date] : dates) {
      if (isCurrent(lock, key, date)) current.emplace(key, date);
    }
  }
  const auto writeAll = [&] {
    for (const auto& [key, date] : current) persistence_.updateLastAccessDate(key, date);
  };
  if (current.empty() || persistence_.performTogether(writeAll)) dates.clear();
}

bool AccessDates::isCurrent(const std::string& key, std::int32_t date) const {
  return isCurrent(ItemsLock(itemsMutex_), key, date);
}

bool AccessDates::isCurrent(const ItemsLock& /*lock*/, const std::string& key, std::int32_t date) const {
  const ManifestRecord* const record = records_.find(key);
  return record != nullptr && record->lastAccessDate == date;
}

}  // namespace velmora::mobile::xplat::cellar
