#include "host/Metrics.h"

#include <nlohmann/json.hpp>

namespace velmora::mobile::xplat::cellar::host {

namespace {

std::string asJson(const StoreMetrics& store);
std::string asJson(const ManagerMetrics& manager);

using Json = nlohmann::ordered_json;  // of which the analytics have the code already

// Writes an object member by member. Objects of the JSON library would be a multiple of the code.
class Writer {
 public:
  std::string text() const { return text_ + '}'; }

  void add(const char* name, const std::string& value) {
    addText(name, Json(value).dump(-1, ' ', false, Json::error_handler_t::replace));
  }
  void add(const char* name, bool value) { addText(name, value ? "true" : "false"); }
  void add(const char* name, std::int64_t value) { addText(name, std::to_string(value)); }
  void add(const char* name, std::uint64_t value) { addText(name, std::to_string(value)); }

  // A value that is JSON already.
  void addText(const char* name, const std::string& json) {
    if (text_.size() > 1) text_ += ',';
    text_ += '"';
    text_ += name;
    text_ += "\":";
    text_ += json;
  }

  template <class Value> void addIfKnown(const char* name, const std::optional<Value>& value) {
    if (value) add(name, *value);
  }

  template <class Element> void addArray(const char* name, const std::vector<Element>& elements) {
    std::string json = "[";
    for (const Element& element : elements) {
      if (json.size() > 1) json += ',';
      json += asJson(element);
    }
    addText(name, json + ']');
  }

 private:
  std::string text_ = "{";
};

std::string nameOf(StoreDefinition::Type type) {
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

std::string asJson(const PruneMetrics& prune) {
  Writer object;
  object.add("time", prune.time);
  object.add("from_bytes", prune.fromBytes);
  object.addIfKnown("to_bytes", prune.toBytes);
  return object.text();
}

std::string asJson(const StoreMetrics& store) {
  Writer object;
  object.add("identifier", store.identifier);
  object.add("name", store.name);
  object.add("type", nameOf(store.type));
  object.add("created", store.isCreated);
  object.addIfKnown("max_bytes", store.maxBytes);
  object.addIfKnown("survival_bytes", store.survivalBytes);
  object.addIfKnown("max_items", store.maxItems);
  if (store.staleAge) object.add("stale_age", std::uint64_t{*store.staleAge});
  object.addIfKnown("bytes", store.bytes);
  object.addIfKnown("items", store.items);
  object.addIfKnown("hits", store.hits);
  object.addIfKnown("misses", store.misses);
  object.addIfKnown("writes", store.writes);
  object.addIfKnown("evictions", store.evictions);
  if (store.lastPrune) object.addText("last_prune", asJson(*store.lastPrune));
  return object.text();
}

std::string asJson(const ManagerMetrics& manager) {
  Writer object;
  object.add("name", manager.name);
  object.add("session_scoped", manager.isSessionScoped);
  object.addIfKnown("session", manager.session);
  object.add("built", manager.isBuilt);
  object.add("max_bytes", manager.maxBytes);
  object.add("prune_interval", std::uint64_t{manager.pruneInterval});
  object.addIfKnown("bytes", manager.bytes);
  object.addArray("stores", manager.stores);
  return object.text();
}

std::string asJson(const QueueMetrics& queues) {
  Writer object;
  object.add("waiting", std::uint64_t{queues.waiting});
  object.add("running", std::uint64_t{queues.running});
  return object.text();
}

std::string asJson(const TrashMetrics& trash) {
  Writer object;
  object.add("entries", trash.entries);
  object.addIfKnown("bytes", trash.bytes);
  return object.text();
}

}  // namespace

std::string toJson(const HostMetrics& metrics) {
  Writer object;
  object.add("time", metrics.time);
  object.addArray("managers", metrics.managers);
  if (metrics.queues) object.addText("queues", asJson(*metrics.queues));
  if (metrics.trash) object.addText("trash", asJson(*metrics.trash));
  return object.text();
}

}  // namespace velmora::mobile::xplat::cellar::host
