#include "inspect/StoreFigures.h"

#include <algorithm>
#include <exception>
#include <filesystem>
#include <memory>
#include <utility>

#include "AttributeStore.h"
#include "DiskSizeCalculator.h"
#include "ExtendedMetadata.h"
#include "JsonValue.h"
#include "ManifestSnapshot.h"
#include "inspect/Buckets.h"
#include "inspect/OrderOfEviction.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "storage/StoreFiles.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

using Records = std::vector<ManifestSnapshot::Record>;

void noteDate(StoreSurvey& store, std::int64_t date) {
  store.oldestAccess = std::min(store.oldestAccess.value_or(date), date);
  store.newestAccess = std::max(store.newestAccess.value_or(date), date);
}

void noteItem(StoreSurvey& store, const ItemFigures& item, const StoreContext& context) {
  ++store.items;
  noteDate(store, item.lastAccess);
  addTo(store.ages[ageBucketOf(context.now - item.lastAccess)], item.bytes);
  addTo(store.sizes[sizeBucketOf(item.bytes)], item.bytes);
  if (context.hashesKeys) store.keyHashes.push_back(std::hash<std::string>()(item.key));
}

// The first few of the items, in an order.
template <class Before>
std::vector<ItemFigures> firstOf(std::vector<ItemFigures> items, std::size_t count, Before before) {
  count = std::min(count, items.size());
  const auto end = items.begin() + static_cast<std::ptrdiff_t>(count);
  std::partial_sort(items.begin(), end, items.end(), before);
  items.erase(end, items.end());
  return items;
}

std::vector<ItemFigures> largestOf(const std::vector<ItemFigures>& items, std::size_t count) {
  return firstOf(items, count, [](const ItemFigures& a, const ItemFigures& b) {
    return std::pair(b.bytes, std::cref(a.key).get()) < std::pair(a.bytes, std::cref(b.key).get());
  });
}

// --- Files ---

// Everything in the directory; the files of values in `values`.
void measureFiles(const StorePlace& place, const StoreContext& context, StoreSurvey& store,
                  std::vector<ItemFigures>& values) {
  store.allocatedBytes = allocatedBy(place.path);
  const auto onEntry = [&](const std::string& path, const Entry& entry) {
    store.allocatedBytes += entry.allocated;
    if (entry.type != Entry::Type::File) return;
    context.onFile(entry.size);
    if (isAttributesFile(entry)) return;
    const bool isInterim = path == newManifestName() || path == salvagedManifestName();
    if (place.hasManifest && (isManifestFile(path) || isInterim)) {
      store.manifestBytes += entry.size;
    } else if (place.hasManifest && isInStoreQuarantine(path)) {
      ++store.quarantinedFiles;
      store.quarantinedBytes += entry.size;
    } else {
      ++store.files;
      store.fileBytes += entry.size;
      values.push_back({path, entry.size, entry.modified, false, ""});
    }
  };
  walkTree(place.path, onEntry, context.onUnreadable);
}

bool exists(const std::string& path) {
  std::error_code ignored;
  return fs::exists(fs::symlink_status(path, ignored));
}

// The stored result of the last measurement of the directory.
std::optional<std::uint64_t> keptSize(const std::string& path) {
  const std::string file = path + "/" + AttributeStore::fileName;
  if (!exists(file)) return std::nullopt;
  const auto bytes = UntouchedFiles(kLargestAttributes).readFile(file);
  const JsonValue document = JsonValue::parse(bytes.begin(), bytes.end(), nullptr, false);
  if (!document.is_object()) return std::nullopt;
  const auto size = document.find(DiskSizeCalculator::ATTR_SIZE);
  if (size == document.end() || !size->is_number_integer() || size->get<std::int64_t>() < 0) return std::nullopt;
  return static_cast<std::uint64_t>(size->get<std::int64_t>());
}

void useFiles(const std::vector<ItemFigures>& values, const StoreContext& context, StoreSurvey& store) {
  for (const ItemFigures& value : values) noteItem(store, value, context);
  store.largest = largestOf(values, context.top);
}

// --- Records ---

ItemFigures figuresOf(const DiskCacheItem& item) {
  return {item.key, item.size, item.lastAccessDate, item.hasInlineData, ""};
}

void countPrune(const std::vector<EvictedItem>& order, std::uint64_t limit, StoreSurvey& store) {
  std::uint64_t left = store.recordedBytes.value_or(0);
  std::uint64_t items = 0;
  for (auto next = order.begin(); left > limit && next != order.end(); ++next, ++items) left -= next->item.size;
  store.itemsToPrune = items;
  store.bytesToPrune = *store.recordedBytes - left;
}

void notePruneOrder(const Records& records, const DiskCacheDefinition* cache, std::size_t top, StoreSurvey& store) {
  const auto strategy = cache != nullptr ? cache->pruneStrategy : PruneStrategyIdentifier::LRU;
  const auto order = orderOfEviction(records, strategy);
  store.order = nameOfOrder(strategy);
  store.isOrderConfigured = store.kind != StoreKind::Keyed;
  for (std::size_t i = 0; i < std::min(top, order.size()); ++i) {
    store.nextToGo.push_back(figuresOf(order[i].item));
    store.nextToGo.back().reason = order[i].reason;
  }
  if (cache != nullptr) countPrune(order, cache->lruSizeLimit, store);
}

void countStale(const Records& records, std::int64_t now, StoreSurvey& store) {
  if (!store.staleAge) return;
  const std::int64_t cutoff = now - static_cast<std::int64_t>(*store.staleAge);
  store.staleItems = 0;
  store.staleBytes = 0;
  for (const auto& record : records) {
    if (record.item.lastAccessDate >= cutoff) continue;
    ++*store.staleItems;
    *store.staleBytes += record.item.size;
  }
}

void useRecords(const Records& records, const DiskCacheDefinition* cache, const StoreContext& context,
                StoreSurvey& store) {
  store.recordedBytes = 0;
  std::vector<ItemFigures> items;
  items.reserve(records.size());
  for (const auto& record : records) {
    items.push_back(figuresOf(record.item));
    noteItem(store, items.back(), context);
    *store.recordedBytes += record.item.size;
    store.inlineBytes += record.inlineSize.value_or(0);
  }
  store.largest = largestOf(items, context.top);
  countStale(records, context.now, store);
  notePruneOrder(records, cache, context.top, store);
}

// --- The definition ---

void useDefinition(const StoreDefinition& definition, StoreSurvey& store) {
  if (const auto* cache = dynamic_cast<const DiskCacheDefinition*>(&definition)) {
    store.kind = StoreKind::DiskCache;
    store.limitBytes = cache->lruSizeLimit;
    store.survivalBytes = cache->survivalSize;
    store.staleAge = cache->staleAge;
    store.durability = durabilityName(cache->durability);
    if (cache->capacity) store.capacity = static_cast<std::uint64_t>(*cache->capacity);
  } else if (const auto* keyValue = dynamic_cast<const PKVSDefinition*>(&definition)) {
    store.kind = StoreKind::KeyValue;
    store.staleAge = keyValue->staleAge;
    store.durability = durabilityName(keyValue->durability);
    if (keyValue->capacity) store.capacity = static_cast<std::uint64_t>(*keyValue->capacity);
  } else if (definition.maxSize > 0) {
    store.limitBytes = definition.maxSize;
  }
}

// The manifest, or the attributes: whatever the store itself has written down.
void useKept(const StorePlace& place, const ConfiguredStore& configured, const std::vector<ItemFigures>& values,
             const StoreContext& context, StoreSurvey& store) {
  if (!place.hasManifest) {
    const std::string strangeness = strangenessOf(place.path + "/" + ManifestSnapshot::manifestName);
    if (!strangeness.empty()) {
      context.onUnreadable({place.path + "/" + ManifestSnapshot::manifestName, strangeness});
      store.isUnread = true;
    }
    store.recordedBytes = keptSize(place.path);
    useFiles(values, context, store);
    return;
  }
  const ManifestSnapshot snapshot(place.path, context.temporaryDirectory, std::make_shared<UntouchedFiles>());
  store.damages = snapshot.integrityErrors();
  if (!store.damages.empty()) {
    useFiles(values, context, store);
    return;
  }
  if (store.durability.empty() && snapshot.hasChecksums()) store.durability = "checksums";
  const auto* const cache = dynamic_cast<const DiskCacheDefinition*>(configured.definition.get());
  const auto metadata = cache != nullptr ? ExtendedMetadataFactoryFactory(cache->metadataFactory) : nullptr;
  useRecords(snapshot.records(metadata), cache, context, store);
}

}  // namespace

StoreSurvey surveyStore(const StorePlace& place, const ConfiguredStore& configured, const StoreContext& context) {
  StoreSurvey store;
  store.path = relativeTo(context.root, place.path);
  store.name = place.name;
  store.identifier = configured.identifier;
  store.kind = place.hasManifest ? StoreKind::Keyed : StoreKind::Unmanaged;
  store.ages = ageBuckets();
  store.sizes = sizeBuckets();
  if (configured.definition != nullptr) useDefinition(*configured.definition, store);

  std::vector<ItemFigures> values;
  measureFiles(place, context, store, values);
  try {
    useKept(place, configured, values, context, store);
  } catch (const std::exception& error) {
    context.onUnreadable(unreadableBy(error, place.path));
    store.isUnread = true;
    useFiles(values, context, store);
  }
  std::sort(store.keyHashes.begin(), store.keyHashes.end());
  return store;
}

void measureTree(const std::string& path, Leftover& leftover, const StoreContext& context) {
  leftover.allocatedBytes = allocatedBy(path);
  const auto onEntry = [&](const std::string&, const Entry& entry) {
    leftover.allocatedBytes += entry.allocated;
    if (entry.type != Entry::Type::File) return;
    context.onFile(entry.size);
    ++leftover.files;
    leftover.bytes += entry.size;
  };
  walkTree(path, onEntry, context.onUnreadable);
}

}  // namespace velmora::mobile::xplat::cellar::tools
