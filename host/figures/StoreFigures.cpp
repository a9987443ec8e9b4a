#include "host/figures/StoreFigures.h"

#include <exception>
#include <future>

#include "Clock.h"
#include "DiskCacheManifest.h"
#include "PersistentKeyValueStore.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

template <class Definition> void setItemLimits(StoreMetrics& metrics, const Definition& definition) {
  if (definition.capacity) metrics.maxItems = static_cast<std::uint64_t>(*definition.capacity);
  metrics.staleAge = definition.staleAge;
}

}  // namespace

StoreMetrics limitsOf(const std::string& identifier, const StoreDefinition& definition) {
  StoreMetrics metrics;
  metrics.identifier = identifier;
  metrics.name = definition.name;
  metrics.type = definition.type;
  if (definition.type != StoreDefinition::Type::PKVS) metrics.maxBytes = definition.maxSize;
  if (const auto* const cache = dynamic_cast<const DiskCacheDefinition*>(&definition)) {
    metrics.survivalBytes = cache->survivalSize;
    setItemLimits(metrics, *cache);
  } else if (const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(&definition)) {
    setItemLimits(metrics, *keyValue);
  }
  return metrics;
}

StoreFigures::StoreFigures(const std::string& identifier, const StoreDefinition& definition)
    : metrics_(limitsOf(identifier, definition)) {}

void StoreFigures::noteCreated(const std::shared_ptr<Store>& store) {
  const auto keyValueStore = std::dynamic_pointer_cast<PersistentKeyValueStore>(store);
  {
    const Lock lock(mutex_);
    metrics_.isCreated = true;
    store_ = keyValueStore;
  }
  if (keyValueStore == nullptr) return;
  // Without a key it looks nothing up, and counts as no access. Its end is behind the loading.
  keyValueStore->fetchFirst({}, nullptr).then(nullptr, [weakThis = weak_from_this()](auto& fetched) {
    try {
      fetched.get();
      if (const auto self = weakThis.lock()) self->noteLoaded();
    } catch (const std::exception&) {
      // Not loaded, or invalid by now.
    }
  });
}

void StoreFigures::noteLoaded() {
  const auto loaded = store();
  if (loaded == nullptr) return;
  const auto manifest = loaded->getManifest();
  if (manifest->isLoaded()) noteSize(manifest->size());
}

// Counts without the lock: the manifest's own may be held during an operation.
void StoreFigures::noteSize(std::uint64_t bytes) {
  std::optional<std::uint64_t> items;
  if (const auto reporting = store()) items = reporting->getManifest()->count();
  const Lock lock(mutex_);
  metrics_.bytes = bytes;
  if (items) metrics_.items = items;
  noteEndOfPrune(lock, bytes);
}

std::shared_ptr<PersistentKeyValueStore> StoreFigures::store() {
  const Lock lock(mutex_);
  return store_.lock();
}

void StoreFigures::noteMeasured(std::uint64_t bytes, std::optional<std::uint64_t> files) {
  const Lock lock(mutex_);
  if (!files && metrics_.bytes) return;
  metrics_.bytes = bytes;
  metrics_.items = files;
}

void StoreFigures::notePruning(std::uint64_t fromBytes) {
  const Lock lock(mutex_);
  metrics_.lastPrune = PruneMetrics{Clock::now(), fromBytes};
}

// A cache that was not above its normal limit is pruned because the device is short of space.
void StoreFigures::noteEndOfPrune(const Lock& /*lock*/, std::uint64_t bytes) {
  auto& prune = metrics_.lastPrune;
  if (!prune || prune->toBytes) return;
  const auto& target = prune->fromBytes > metrics_.maxBytes ? metrics_.maxBytes : metrics_.survivalBytes;
  if (bytes <= target) prune->toBytes = bytes;
}

void StoreFigures::release() {
  const Lock lock(mutex_);
  read();
  store_.reset();
}

StoreMetrics StoreFigures::read() {
  const Lock lock(mutex_);
  if (const auto store = store_.lock()) {
    const auto counts = store->operationCounts();
    metrics_.hits = counts.hits;
    metrics_.misses = counts.misses;
    metrics_.writes = counts.stores;
    metrics_.evictions = counts.evictions;
  }
  return metrics_;
}

}  // namespace velmora::mobile::xplat::cellar::host
