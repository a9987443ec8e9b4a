#include "check/CheckReport.h"

#include <optional>
#include <vector>

#include "Configuration.h"
#include "Console.h"
#include "Format.h"
#include "Printable.h"
#include "storage/ConfiguredStores.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

const char* strategyName(PruneStrategyIdentifier strategy) {
  switch (strategy) {
    case PruneStrategyIdentifier::LRU:
      return "lru";
    case PruneStrategyIdentifier::VideoDownload:
      return "video_download";
    case PruneStrategyIdentifier::GreedyDual:
      return "greedy_dual";
    case PruneStrategyIdentifier::Null:
      break;
  }
  return "null";
}

const char* factoryName(ExtendedMetadataFactoryIdentifier factory) {
  return factory == ExtendedMetadataFactoryIdentifier::VideoDownload ? "video_download" : "null";
}

std::string textOf(const std::optional<std::int64_t>& capacity) {
  if (!capacity.has_value() || *capacity < 0) return "any number of items";
  return "at most " + formatCount(static_cast<std::uint64_t>(*capacity), "item", "items");
}

// What key-value stores and disk caches have in common.
template <class Definition> std::string rulesOfItems(const Definition& store) {
  return textOf(store.capacity) + ", stale after " + formatDuration(store.staleAge) + ", " +
         (store.inlineData ? "values in the manifest" : "a file for each value") + ", " +
         durabilityName(store.durability);
}

using Lines = std::vector<std::string>;

Lines rulesOf(const PKVSDefinition& store) { return {rulesOfItems(store)}; }

Lines rulesOf(const DiskCacheDefinition& store) {
  return {"pruned to " + formatSize(store.lruSizeLimit) + ", to " + formatSize(store.survivalSize) +
              " when space is short; strategy " + strategyName(store.pruneStrategy) + ", metadata " +
              factoryName(store.metadataFactory),
          rulesOfItems(store)};
}

Lines rulesOf(const StoreDefinition& store) {
  switch (store.type) {
    case StoreDefinition::Type::PKVS:
      return rulesOf(static_cast<const PKVSDefinition&>(store));
    case StoreDefinition::Type::DiskCache:
      return rulesOf(static_cast<const DiskCacheDefinition&>(store));
    case StoreDefinition::Type::Unmanaged:
      break;
  }
  if (!store.isCache) return {"no cache: never emptied"};
  return {"a cache, emptied when it is opened with more than " + formatSize(store.maxSize)};
}

// Stores that nothing keeps in a size, and that count for their manager's limit all the same.
std::vector<std::string> unboundedIn(const ResolvedManager& manager) {
  std::vector<std::string> identifiers;
  for (const ResolvedStore& store : manager.stores) {
    const bool isUnmanaged = store.definition->type == StoreDefinition::Type::Unmanaged;
    if (isUnmanaged && !store.definition->isCache) identifiers.push_back(store.identifier);
  }
  return identifiers;
}

std::string textOfUnbounded(const ResolvedManager& manager) {
  std::string names;
  for (const std::string& identifier : unboundedIn(manager)) names += (names.empty() ? "" : ", ") + identifier;
  if (names.empty()) return "";
  return "unmanaged, and no cache: " + names +
         "; what is in them counts for the limit, is never pruned and may exceed " + "it for ever";
}

void printManager(const ResolvedManager& manager, Console& console) {
  const StoreManagerDefinition& definition = *manager.definition;
  console.heading(printable(definition.name));
  const std::string interval = formatDuration(definition.pruneInterval);
  const std::string rounds =
      definition.pruneInterval == 0
          ? "never pruned: it may be exceeded for ever"
          : "pruned at most every " + interval + ": it may be exceeded for " + interval + " between two rounds";
  console.line(printable(manager.directory) + (definition.sessionScoped ? ", a session's" : ", of no session") +
               "; limit " + formatSize(definition.maxSize) + ", " + rounds);
  if (const std::string text = textOfUnbounded(manager); !text.empty()) console.line(text);
  if (manager.stores.empty()) console.line("no stores");
  for (const ResolvedStore& store : manager.stores) {
    console.line(printable(store.identifier + ": " + typeName(*store.definition) + " in " + store.directory));
    for (const std::string& rule : rulesOf(*store.definition)) console.line("    " + rule);
  }
}

std::size_t storesIn(const ResolvedConfiguration& resolved) {
  std::size_t count = 0;
  for (const ResolvedManager& manager : resolved) count += manager.stores.size();
  return count;
}

OrderedJson asJson(const Diagnostics& findings) {
  OrderedJson list = OrderedJson::array();
  for (const Diagnostic& finding : findings) {
    list.push_back({{"kind", finding.kind}, {"path", finding.pointer}, {"text", finding.text}});
  }
  return list;
}

OrderedJson asJson(const std::optional<std::int64_t>& capacity) {
  return capacity.has_value() ? OrderedJson(*capacity) : OrderedJson();
}

OrderedJson asJson(const ResolvedStore& store) {
  const StoreDefinition& definition = *store.definition;
  OrderedJson json = {{"identifier", store.identifier},
                      {"name", definition.name},
                      {"type", typeName(definition)},
                      {"directory", store.directory},
                      {"locale_sensitive", definition.localeSensitive},
                      {"has_version", definition.hasVersion},
                      {"version", definition.version}};
  if (definition.type == StoreDefinition::Type::Unmanaged) {
    json["is_cache"] = definition.isCache;
    json["max_size"] = definition.maxSize;
  } else if (definition.type == StoreDefinition::Type::PKVS) {
    const auto& values = static_cast<const PKVSDefinition&>(definition);
    json["inline_data"] = values.inlineData;
    json["stale_age"] = values.staleAge;
    json["capacity"] = asJson(values.capacity);
    json["durability"] = durabilityName(values.durability);
  } else {
    const auto& cache = static_cast<const DiskCacheDefinition&>(definition);
    json["inline_data"] = cache.inlineData;
    json["stale_age"] = cache.staleAge;
    json["lru_size_limit"] = cache.lruSizeLimit;
    json["survival_size"] = cache.survivalSize;
    json["metadata_factory"] = factoryName(cache.metadataFactory);
    json["prune_strategy"] = strategyName(cache.pruneStrategy);
    json["capacity"] = asJson(cache.capacity);
    json["durability"] = durabilityName(cache.durability);
  }
  return json;
}

OrderedJson asJson(const ResolvedManager& manager) {
  const StoreManagerDefinition& definition = *manager.definition;
  OrderedJson stores = OrderedJson::array();
  for (const ResolvedStore& store : manager.stores) stores.push_back(asJson(store));
  return {{"name", definition.name},
          {"area", areaName(definition)},
          {"directory", manager.directory},
          {"max_size", definition.maxSize},
          {"prune_interval", definition.pruneInterval},
          {"unbounded_stores", unboundedIn(manager)},
          {"session_scoped", definition.sessionScoped},
          {"stores", std::move(stores)}};
}

}  // namespace

void printWarnings(const CheckResult& result, Console& console) {
  for (const Diagnostic& warning : result.warnings) {
    console.bad(printable("warning: " + warning.pointer + (warning.pointer.empty() ? "" : ": ") + warning.text));
  }
}

void printCheck(const CheckResult& result, Console& console) {
  for (const ResolvedManager& manager : result.resolved) printManager(manager, console);
  console.raw("\n");
  printWarnings(result, console);
  const std::string counts = formatCount(result.resolved.size(), "manager", "managers") + ", " +
                             formatCount(storesIn(result.resolved), "store", "stores") + ", ";
  console.verdict(result.file + ": " + counts + formatCount(result.warnings.size(), "warning", "warnings"),
                  result.warnings.empty());
}

OrderedJson checkAsJson(const CheckResult& result) {
  OrderedJson managers = OrderedJson::array();
  for (const ResolvedManager& manager : result.resolved) managers.push_back(asJson(manager));
  return {{"file", result.file},
          {"managers", std::move(managers)},
          {"warnings", asJson(result.warnings)},
          {"errors", asJson(result.faults)}};
}

}  // namespace velmora::mobile::xplat::cellar::tools
