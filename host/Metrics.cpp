#include "host/Metrics.h"

#include <nlohmann/json.hpp>

namespace velmora::mobile::xplat::cellar::host {

namespace {

// Keeps the members in their order.
using OrderedJson = nlohmann::ordered_json;

template <class Value> void addIfKnown(OrderedJson& object, const char* name, const std::optional<Value>& value) {
  if (value) object[name] = *value;
}

const char* nameOf(StoreDefinition::Type type) {
  switch (type) {
    case StoreDefinition::Type::Unmanaged:
      return "unmanaged";
    case StoreDefinition::Type::PKVS:
      return "pkvs";
    case StoreDefinition::Type::DiskCache:
      return "disk_cache";
  }
  return "";
}

OrderedJson asJson(const PruneMetrics& prune) {
  OrderedJson object{{"time", prune.time}, {"from_bytes", prune.fromBytes}};
  addIfKnown(object, "to_bytes", prune.toBytes);
  return object;
}

OrderedJson asJson(const StoreMetrics& store) {
  OrderedJson object{{"identifier", store.identifier},
                     {"name", store.name},
                     {"type", nameOf(store.type)},
                     {"created", store.isCreated}};
  addIfKnown(object, "max_bytes", store.maxBytes);
  addIfKnown(object, "survival_bytes", store.survivalBytes);
  addIfKnown(object, "max_items", store.maxItems);
  addIfKnown(object, "stale_age", store.staleAge);
  addIfKnown(object, "bytes", store.bytes);
  addIfKnown(object, "items", store.items);
  addIfKnown(object, "hits", store.hits);
  addIfKnown(object, "misses", store.misses);
  addIfKnown(object, "writes", store.writes);
  addIfKnown(object, "evictions", store.evictions);
  if (store.lastPrune) object["last_prune"] = asJson(*store.lastPrune);
  return object;
}

OrderedJson asJson(const ManagerMetrics& manager) {
  OrderedJson object{{"name", manager.name}, {"session_scoped", manager.isSessionScoped}};
  addIfKnown(object, "session", manager.session);
  object["built"] = manager.isBuilt;
  object["max_bytes"] = manager.maxBytes;
  object["prune_interval"] = manager.pruneInterval;
  addIfKnown(object, "bytes", manager.bytes);
  OrderedJson& stores = object["stores"] = OrderedJson::array();
  for (const StoreMetrics& store : manager.stores) stores.push_back(asJson(store));
  return object;
}

}  // namespace

std::string toJson(const HostMetrics& metrics) {
  OrderedJson object{{"time", metrics.time}};
  OrderedJson& managers = object["managers"] = OrderedJson::array();
  for (const ManagerMetrics& manager : metrics.managers) managers.push_back(asJson(manager));
  if (metrics.queues) object["queues"] = {{"waiting", metrics.queues->waiting}, {"running", metrics.queues->running}};
  if (metrics.trash) {
    OrderedJson& trash = object["trash"] = {{"entries", metrics.trash->entries}};
    addIfKnown(trash, "bytes", metrics.trash->bytes);
  }
  return object.dump(-1, ' ', false, OrderedJson::error_handler_t::replace);
}

}  // namespace velmora::mobile::xplat::cellar::host
