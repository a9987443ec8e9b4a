#include "host/limits/PromptPruning.h"

#include <glog/logging.h>

#include <algorithm>
#include <exception>
#include <utility>

#include "StoreDefinition.h"
#include "StoreManager.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr std::chrono::seconds kShortestDelay(1);
constexpr std::chrono::hours kLongestDelay(24 * 365 * 100);

std::int64_t nanosecondsOf(std::chrono::seconds delay) {
  const auto inRange = std::clamp<std::chrono::seconds>(delay, kShortestDelay, kLongestDelay);
  return std::chrono::nanoseconds(inRange).count();
}

bool exceedsByMoreThanATenth(std::uint64_t bytes, std::uint64_t limit) { return bytes * 10 > limit * 11; }

}  // namespace

void PromptPruning::begin(const std::shared_ptr<StoreManager>& manager, const StoreManagerDefinition& definition,
                          std::shared_ptr<AsyncExecutor> queue, std::chrono::seconds delay) {
  const auto pruning = std::make_shared<PromptPruning>(manager, definition, std::move(queue), delay);
  manager->setSizeListener(std::make_shared<const StoreManager::SizeListener>(
      [pruning](const std::string& identifier, std::uint32_t bytes) { pruning->noteSize(identifier, bytes); }));
  pruning->readSizes(*manager);
}

PromptPruning::PromptPruning(const std::shared_ptr<StoreManager>& manager, const StoreManagerDefinition& definition,
                             std::shared_ptr<AsyncExecutor> queue, std::chrono::seconds delay)
    : manager_(manager), queue_(std::move(queue)), delayNanoseconds_(nanosecondsOf(delay)), limit_(definition.maxSize) {
  for (const auto& [identifier, store] : definition.stores) {
    if (store == nullptr) continue;
    stores_[identifier] = {store->maxSize, store->type == StoreDefinition::Type::DiskCache};
  }
}

// What was reported before there was a listener. A size that the listener has been told of meanwhile is newer.
void PromptPruning::readSizes(StoreManager& manager) {
  for (auto& [identifier, store] : stores_) {
    const std::uint32_t bytes = manager.sizeOf(identifier);
    const Lock lock(mutex_);
    if (!store.isKnown) setSize(store, bytes, lock);
  }
}

void PromptPruning::noteSize(const std::string& identifier, std::uint32_t bytes) {
  const auto found = stores_.find(identifier);
  if (found == stores_.end()) return;
  const Lock lock(mutex_);
  setSize(found->second, bytes, lock);
}

void PromptPruning::setSize(StoreSize& store, std::uint32_t bytes, const Lock& lock) {
  store.isKnown = true;
  if (store.bytes == bytes) return;
  total_ = total_ - store.bytes + bytes;
  store.bytes = bytes;
  if (!isTimerRunning_ && isLimitExceeded(lock)) startTimer(lock);
}

// Only as far as a prune can help: it takes a disk cache back to its own limit.
bool PromptPruning::isLimitExceeded(const Lock& /*lock*/) const {
  const bool isTotalExceeded = exceedsByMoreThanATenth(total_, limit_);
  return std::any_of(stores_.begin(), stores_.end(), [isTotalExceeded](const auto& entry) {
    const StoreSize& store = entry.second;
    if (!store.isPrunable || store.bytes <= store.limit) return false;
    return isTotalExceeded || exceedsByMoreThanATenth(store.bytes, store.limit);
  });
}

void PromptPruning::startTimer(const Lock& /*lock*/) noexcept {
  try {
    const auto prune = [weakThis = weak_from_this()] {
      if (const auto self = weakThis.lock()) self->pruneIfStillExceeded();
    };
    timer_ = queue_->dispatchAfter(delayNanoseconds_, prune, nullptr);
    isTimerRunning_ = true;
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot prune promptly. " << error.what();
  } catch (...) {
    LOG(ERROR) << "Cannot prune promptly: unknown exception";
  }
}

void PromptPruning::pruneIfStillExceeded() {
  std::unique_ptr<AsyncTimer> fired;  // destroyed without the lock
  {
    const Lock lock(mutex_);
    fired.swap(timer_);
    isTimerRunning_ = false;
    if (!isLimitExceeded(lock)) return;
  }
  const auto manager = manager_.lock();
  if (manager == nullptr) return;
  try {
    manager->pruneNow();
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot prune promptly. " << error.what();
  } catch (...) {
    LOG(ERROR) << "Cannot prune promptly: unknown exception";
  }
}

}  // namespace velmora::mobile::xplat::cellar::host
