#include "inspect/SurveyJson.h"

#include <optional>
#include <string>

#include "inspect/Totals.h"
#include "storage/FileSystemSize.h"
#include "storage/ReadableNames.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Json = nlohmann::ordered_json;

template <class T> Json orNull(const std::optional<T>& value) { return value ? Json(*value) : Json(); }

Json orNull(const std::string& text) { return text.empty() ? Json() : Json(text); }

Json asJson(const std::vector<Bucket>& buckets) {
  Json array = Json::array();
  for (const Bucket& bucket : buckets) {
    array.push_back({{"label", bucket.label}, {"items", bucket.items}, {"bytes", bucket.bytes}});
  }
  return array;
}

Json asJson(const std::vector<ItemFigures>& items) {
  Json array = Json::array();
  for (const ItemFigures& item : items) {
    array.push_back(
        {{"key", item.key}, {"bytes", item.bytes}, {"last_access", item.lastAccess}, {"inline", item.isInline}});
  }
  return array;
}

Json asJson(const StoreSurvey& store) {
  Json json;
  json["path"] = store.path;
  json["directory"] = store.name;
  json["identifier"] = orNull(store.identifier);
  json["kind"] = textOf(store.kind);
  json["leftover"] = store.leftover ? Json(textOf(*store.leftover)) : Json();
  json["damages"] = store.damages;
  json["items"] = store.items;
  json["recorded_bytes"] = orNull(store.recordedBytes);
  json["files"] = store.files;
  json["file_bytes"] = store.fileBytes;
  json["inline_bytes"] = store.inlineBytes;
  json["held_bytes"] = store.heldBytes();
  json["manifest_bytes"] = store.manifestBytes;
  json["allocated_bytes"] = store.allocatedBytes;
  json["limit_bytes"] = orNull(store.limitBytes);
  json["survival_bytes"] = orNull(store.survivalBytes);
  json["capacity"] = orNull(store.capacity);
  json["stale_age"] = orNull(store.staleAge);
  json["fill"] = orNull(fillOf(store));
  json["oldest_access"] = orNull(store.oldestAccess);
  json["newest_access"] = orNull(store.newestAccess);
  json["stale_items"] = orNull(store.staleItems);
  json["stale_bytes"] = orNull(store.staleBytes);
  json["items_to_prune"] = orNull(store.itemsToPrune);
  json["bytes_to_prune"] = orNull(store.bytesToPrune);
  json["next_to_go"] = asJson(store.nextToGo);
  for (std::size_t i = 0; i < store.nextToGo.size(); ++i) json["next_to_go"][i]["reason"] = store.nextToGo[i].reason;
  json["largest"] = asJson(store.largest);
  json["ages"] = asJson(store.ages);
  json["sizes"] = asJson(store.sizes);
  json["durability"] = orNull(store.durability);
  json["quarantined_files"] = store.quarantinedFiles;
  json["quarantined_bytes"] = store.quarantinedBytes;
  json["eviction_order"] = orNull(store.order);
  json["eviction_order_configured"] = store.isOrderConfigured;
  return json;
}

Json asJson(const ManagerSurvey& manager) {
  Json json;
  json["path"] = manager.path;
  json["directory"] = manager.directory;
  json["name"] = orNull(manager.name);
  json["area"] = manager.area;
  json["session"] = manager.session.empty() && manager.isSessionless ? Json() : Json(manager.session);
  json["limit_bytes"] = orNull(manager.limitBytes);
  json["counted_bytes"] = manager.countedBytes;
  json["fill"] = orNull(fillOf(manager));
  json["stores"] = Json::array();
  for (const StoreSurvey& store : manager.stores) json["stores"].push_back(asJson(store));
  const std::string decoded = decodedName(manager.session);
  json["session_name"] = decoded.empty() ? json["session"] : Json(decoded);
  json["unmanaged_bytes"] = manager.unmanagedBytes;
  return json;
}

Json asJson(const Leftover& leftover) {
  return {{"path", leftover.path},
          {"kind", textOf(leftover.kind)},
          {"files", leftover.files},
          {"bytes", leftover.bytes},
          {"allocated_bytes", leftover.allocatedBytes}};
}

Json asJson(const Totals& totals) {
  return {{"stores", totals.stores},
          {"items", totals.items},
          {"held_bytes", totals.heldBytes},
          {"manifest_bytes", totals.manifestBytes},
          {"allocated_bytes", totals.allocatedBytes},
          {"leftover_bytes", totals.leftoverBytes},
          {"leftover_allocated_bytes", totals.leftoverAllocatedBytes}};
}

}  // namespace

nlohmann::ordered_json surveyAsJson(const Survey& survey) {
  const Totals totals = totalsOf(survey);
  Json json;
  json["root"] = survey.root;
  json["depth"] = survey.depth;
  json["inspected_at"] = survey.inspectedAt;
  json["totals"] = asJson(totals);
  json["managers"] = Json::array();
  for (const ManagerSurvey& manager : survey.managers) json["managers"].push_back(asJson(manager));
  json["leftovers"] = Json::array();
  for (const Leftover& leftover : survey.leftovers) json["leftovers"].push_back(asJson(leftover));
  json["ages"] = asJson(totals.ages);
  json["sizes"] = asJson(totals.sizes);
  json["unreadable"] = Json::array();
  for (const Unreadable& part : survey.unreadable) {
    json["unreadable"].push_back({{"path", part.path}, {"reason", part.reason}});
  }
  json["file_system_bytes"] = orNull(survey.fileSystemBytes);
  json["discarded_at_start"] = survey.fileSystemBytes ? Json(isTooSmall(*survey.fileSystemBytes)) : Json();
  return json;
}

}  // namespace velmora::mobile::xplat::cellar::tools
