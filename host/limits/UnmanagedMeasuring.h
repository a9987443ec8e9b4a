#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include <cellar/DiskSizeCalculator.h>
#include <cellar/executor/AsyncExecutor.h>

namespace velmora::mobile::xplat::cellar {

class AttributeStore;
class FileUtils;
class IncidentReporter;
class Store;
class StoreDefinition;
class UnmanagedStore;

namespace host {

// Measures unmanaged caches again while they are in use, and reports an `OverLimit` incident for one that has more than
// its limit: once, until it is measured within its limit. A cache is in use if it was requested since it was last
// measured, and as long as somebody holds it besides its manager; it is measured once more after that. Otherwise no
// timer runs, and never for stores that are no caches or have no limit.
//
// The size is kept with the directory when it has changed, for the next time that the cache is opened, but not in place
// of the mark for trashing at start-up, if that is not set in the same moment. All directories of the cache are walked
// each time. Measurements run on the queue, one at a time; before the next one of a cache passes at least a hundred
// times what the last one has taken. Any thread may call.
class UnmanagedMeasuring : public std::enable_shared_from_this<UnmanagedMeasuring> {
 public:
  using Now = std::chrono::steady_clock::time_point (*)();

  static constexpr int kRestPerWork = 100;  // times the duration of the last measurement

  struct Services {
    std::shared_ptr<AsyncExecutor> queue;
    std::shared_ptr<FileUtils> files;
    std::shared_ptr<AttributeStore> attributes;
    std::shared_ptr<DiskSizeCalculator> sizes;          // keeps the sizes
    std::shared_ptr<const IncidentReporter> incidents;  // null: incidents are only logged
    std::function<void(const std::string& path, const DiskSizeCalculator::Stats& stats)> onMeasured{};  // may be empty
  };

  UnmanagedMeasuring(std::chrono::seconds interval, Services services, Now now = std::chrono::steady_clock::now);

  // A store of any type has been requested. Does not wait for a measurement. What the queue throws is one error line in
  // the log, and the next request tries again.
  void noteRequest(const std::shared_ptr<Store>& store);

 private:
  using Lock = std::lock_guard<std::mutex>;

  struct Cache {
    std::weak_ptr<UnmanagedStore> store{};
    std::chrono::nanoseconds rest{};  // before the next measurement
    bool wasRequested = false;        // since the last one began
    bool isOverLimit = false;         // as the last one found
    bool isScheduled = false;         // the timer runs, or the cache is being measured
    std::unique_ptr<AsyncTimer> timer{};

    bool isInUse() const;
  };

  void startTimer(const std::string& path, Cache& cache, const Lock& lock) noexcept;
  void forgetEnded(const Lock& lock);
  void measureDue(const std::string& path);
  std::shared_ptr<UnmanagedStore> takeDue(const std::string& path);
  std::optional<DiskSizeCalculator::Stats> measure(const std::string& path) const;
  void keep(const std::string& path, const DiskSizeCalculator::Stats& stats) const;
  bool isPresent(const std::string& path, const std::weak_ptr<UnmanagedStore>& store);
  bool noteMeasured(const std::string& path, const std::weak_ptr<UnmanagedStore>& store,
                    std::chrono::nanoseconds duration, const std::optional<DiskSizeCalculator::Stats>& stats);
  void report(const StoreDefinition& definition, std::uint64_t bytes) const;

  const std::chrono::nanoseconds interval_;
  const Services services_;
  const std::unique_ptr<DiskSizeCalculator> calculator_;
  const Now now_;

  std::mutex mutex_;                     // guards the caches
  std::map<std::string, Cache> caches_;  // by path
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
