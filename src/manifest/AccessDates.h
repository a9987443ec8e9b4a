#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

namespace velmora::mobile::xplat::cellar {

class ManifestPersistence;
class ManifestRecords;

// The dates of use that wait to be written: until there are many, or until the timer comes. Those of items that have
// been used or set again meanwhile, or were removed, are not written.
class AccessDates {
 public:
  using Dates = std::unordered_map<std::string, std::int32_t>;
  using ItemsLock = std::lock_guard<std::recursive_mutex>;  // of the manifest's items

  // `itemsMutex` guards these dates and the records. With `together`, the dates of a flush are one transaction.
  AccessDates(ManifestPersistence& persistence, const ManifestRecords& records, std::recursive_mutex& itemsMutex,
              bool together);

  Dates& waiting(const ItemsLock& /*lock*/) { return waiting_; }
  void clear(const ItemsLock& lock);

  // The dates to be flushed on the executor now. Null when they are too few, another such flush is queued, or the last
  // one failed, after which they wait for the timer.
  std::shared_ptr<Dates> takeDue(const ItemsLock& lock);

  // When the flush of those dates cannot be queued. Of items that have been used again meanwhile, the later date stays.
  void giveBack(const ItemsLock& lock, Dates& due);

  // Without the items' mutex: writes all that wait, or the due ones and what has come together since they were taken.
  // What cannot be written is one error line and waits for the timer.
  void flush();
  void flush(Dates& due);

 private:
  bool isDue() const;
  bool isCurrent(const ItemsLock& lock, const std::string& key, std::int32_t date) const;
  bool isCurrent(const std::string& key, std::int32_t date) const;
  void write(Dates& dates);
  void writeTogether(Dates& dates);

  ManifestPersistence& persistence_;
  const ManifestRecords& records_;
  std::recursive_mutex& itemsMutex_;  // guards the records and the three below
  const bool together_;

  Dates waiting_;
  std::weak_ptr<Dates> queued_;  // those of the flush on the executor; empty once it runs
  bool hasFailed_ = false;
};

}  // namespace velmora::mobile::xplat::cellar
