#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include <cellar/executor/AsyncExecutor.h>

namespace velmora::mobile::xplat::cellar {

class StoreManager;
struct StoreManagerDefinition;

namespace host {

// Has one manager prune soon after a limit was exceeded by more than a tenth: that of a disk cache, or the manager's
// own, as far as pruning helps. A timer runs from then on; when it is due and the limit is still exceeded, the manager
// prunes. No timer runs while the limits are kept, nor while nothing is written: if a prune did not help, the next
// change of a size starts the timer again.
//
// Any thread may call. It belongs to the manager, which it does not keep alive.
class PromptPruning : public std::enable_shared_from_this<PromptPruning> {
 public:
  // From now on, as long as there is a handle on the manager. `delay` is the time from the excess to the prune, and so
  // the least time between two prunes. Throws nothing: what the queue throws is one error line in the log, and the next
  // change of a size tries again.
  static void begin(const std::shared_ptr<StoreManager>& manager, const StoreManagerDefinition& definition,
                    std::shared_ptr<AsyncExecutor> queue, std::chrono::seconds delay);

  PromptPruning(const std::shared_ptr<StoreManager>& manager, const StoreManagerDefinition& definition,
                std::shared_ptr<AsyncExecutor> queue, std::chrono::seconds delay);

 private:
  using Lock = std::lock_guard<std::mutex>;

  struct StoreSize {
    std::uint64_t limit = 0;
    bool isPrunable = false;
    bool isKnown = false;
    std::uint64_t bytes = 0;
  };

  void readSizes(StoreManager& manager);
  void noteSize(const std::string& identifier, std::uint32_t bytes);
  void setSize(StoreSize& store, std::uint32_t bytes, const Lock& lock);
  bool isLimitExceeded(const Lock& lock) const;
  void startTimer(const Lock& lock) noexcept;
  void pruneIfStillExceeded();

  const std::weak_ptr<StoreManager> manager_;
  const std::shared_ptr<AsyncExecutor> queue_;
  const std::int64_t delayNanoseconds_;
  const std::uint64_t limit_;  // the manager's

  std::mutex mutex_;                                   // guards the rest
  std::unordered_map<std::string, StoreSize> stores_;  // by identifier; the map itself does not change
  std::uint64_t total_ = 0;
  bool isTimerRunning_ = false;
  std::unique_ptr<AsyncTimer> timer_;
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
