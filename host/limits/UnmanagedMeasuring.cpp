#include "host/limits/UnmanagedMeasuring.h"

#include <glog/logging.h>

#include <algorithm>
#include <cerrno>
#include <exception>
#include <iterator>
#include <utility>

#include "AttributeStore.h"
#include "FileUtils.h"
#include "Incident.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "Store.h"
#include "StoreDefinition.h"
#include "StoreManagerImplCommon.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr std::chrono::hours kLongestRest(24 * 365 * 100);

// Keeps nothing, so that a calculator with it measures each directory anew, and leaves no file in it.
class NoAttributes final : public AttributeStore {
 public:
  using AttributeStore::AttributeStore;

  void set(const std::string& /*directory*/, const JsonValue& /*value*/) override {}
  JsonValue get(const std::string& /*directory*/) override { return JsonValue::object(); }
  void remove(const std::string& /*directory*/) override {}
};

std::chrono::nanoseconds restAfter(std::chrono::nanoseconds work) {
  if (work > std::chrono::nanoseconds(kLongestRest) / UnmanagedMeasuring::kRestPerWork) return kLongestRest;
  return work * UnmanagedMeasuring::kRestPerWork;
}

}  // namespace

UnmanagedMeasuring::UnmanagedMeasuring(std::chrono::seconds interval, Services services, Now now)
    : interval_(std::min<std::chrono::seconds>(interval, kLongestRest)),
      services_(std::move(services)),
      calculator_(std::make_unique<DiskSizeCalculator>(services_.files, std::make_shared<NoAttributes>(services_.files),
                                                       nullptr)),
      now_(now) {}

// Its manager holds it, and so does the pointer here.
bool UnmanagedMeasuring::Cache::isInUse() const {
  const auto present = store.lock();
  return present != nullptr && (wasRequested || present.use_count() > 2);
}

void UnmanagedMeasuring::noteRequest(const std::shared_ptr<Store>& requested) {
  const auto store = std::dynamic_pointer_cast<UnmanagedStore>(requested);
  if (store == nullptr || !store->definition->isCache || store->getMaxSize() == 0) return;
  const Lock lock(mutex_);
  Cache& cache = caches_[store->path];
  if (cache.store.lock() != store) {
    cache.store = store;
    cache.rest = std::max(cache.rest, interval_);
    cache.isOverLimit = false;
    forgetEnded(lock);
  }
  cache.wasRequested = true;
  if (!cache.isScheduled) startTimer(store->path, cache, lock);
}

void UnmanagedMeasuring::startTimer(const std::string& path, Cache& cache, const Lock& /*lock*/) noexcept {
  try {
    const auto measure = [weakThis = weak_from_this(), path] {
      if (const auto self = weakThis.lock()) self->measureDue(path);
    };
    cache.timer = services_.queue->dispatchAfter(cache.rest.count(), measure, nullptr);
    cache.isScheduled = true;
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot measure an unmanaged cache. " << error.what();
  } catch (...) {
    LOG(ERROR) << "Cannot measure an unmanaged cache: unknown exception";
  }
}

void UnmanagedMeasuring::forgetEnded(const Lock& /*lock*/) {
  for (auto cache = caches_.begin(); cache != caches_.end();) {
    cache = cache->second.store.expired() ? caches_.erase(cache) : std::next(cache);
  }
}

void UnmanagedMeasuring::measureDue(const std::string& path) {
  auto store = takeDue(path);
  if (store == nullptr) return;
  const auto definition = store->definition;
  const std::weak_ptr<UnmanagedStore> measured = store;
  store.reset();  // it would count as held
  const auto start = now_();
  const auto stats = measure(path);
  const auto duration = now_() - start;
  if (stats && isPresent(path, measured)) keep(path, *stats);
  if (noteMeasured(path, measured, duration, stats)) report(*definition, static_cast<std::uint64_t>(stats->size));
}

// Null when the cache's manager has ended.
std::shared_ptr<UnmanagedStore> UnmanagedMeasuring::takeDue(const std::string& path) {
  std::unique_ptr<AsyncTimer> fired;  // destroyed without the lock
  const Lock lock(mutex_);
  Cache& cache = caches_[path];
  fired.swap(cache.timer);
  cache.wasRequested = false;
  auto store = cache.store.lock();
  if (store == nullptr) caches_.erase(path);
  return store;
}

std::optional<DiskSizeCalculator::Stats> UnmanagedMeasuring::measure(const std::string& path) const {
  try {
    return calculator_->traverseDirectory(path, {}, {AttributeStore::fileName});
  } catch (const FileUtilsIoException& error) {
    if (error.code() == ENOENT) return std::nullopt;  // the directory was discarded meanwhile
    LOG(ERROR) << "Cannot measure an unmanaged cache. " << error.what();
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot measure an unmanaged cache. " << error.what();
  } catch (...) {
    LOG(ERROR) << "Cannot measure an unmanaged cache: unknown exception";
  }
  return std::nullopt;
}

// Not another session's, which may have the same path by now.
bool UnmanagedMeasuring::isPresent(const std::string& path, const std::weak_ptr<UnmanagedStore>& store) {
  const Lock lock(mutex_);
  const auto present = caches_[path].store.lock();
  return present != nullptr && present == store.lock();
}

void UnmanagedMeasuring::keep(const std::string& path, const DiskSizeCalculator::Stats& stats) const {
  try {
    if (services_.onMeasured) services_.onMeasured(path, stats);
    if (services_.sizes->fetchDirectorySize(path) == stats.size) return;
    const JsonValue attributes = services_.attributes->get(path);
    if (attributes.is_object() && attributes.contains(StoreManagerImplCommon::TrashOnStartupKey)) return;
    services_.sizes->setCachedStats(path, stats);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot keep the size of an unmanaged cache. " << error.what();
  } catch (...) {
    LOG(ERROR) << "Cannot keep the size of an unmanaged cache: unknown exception";
  }
}

// Starts the next timer if the cache is in use. Whether the cache has come to be over its limit.
bool UnmanagedMeasuring::noteMeasured(const std::string& path, const std::weak_ptr<UnmanagedStore>& store,
                                      std::chrono::nanoseconds duration,
                                      const std::optional<DiskSizeCalculator::Stats>& stats) {
  const Lock lock(mutex_);
  Cache& cache = caches_[path];
  cache.isScheduled = false;
  cache.rest = std::max(interval_, restAfter(duration));
  if (cache.isInUse()) startTimer(path, cache, lock);
  const auto present = cache.store.lock();
  if (!stats || present == nullptr || present != store.lock()) return false;  // another session's by now, perhaps
  const bool isOver = static_cast<std::uint64_t>(stats->size) > present->getMaxSize();
  return !std::exchange(cache.isOverLimit, isOver) && isOver;
}

void UnmanagedMeasuring::report(const StoreDefinition& definition, std::uint64_t bytes) const {
  const std::string description = "Unmanaged cache \"" + definition.name + "\" has " + std::to_string(bytes) +
                                  " bytes, more than its limit of " + std::to_string(definition.maxSize) + ".";
  LOG(ERROR) << description;
  if (services_.incidents == nullptr) return;
  services_.incidents->report({Incident::Kind::OverLimit, definition.name, "", description});
}

}  // namespace velmora::mobile::xplat::cellar::host
