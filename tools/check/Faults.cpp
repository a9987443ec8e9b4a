#include "check/Faults.h"

#include <algorithm>
#include <cstddef>
#include <exception>
#include <string>
#include <unordered_set>

#include "Configuration.h"
#include "check/KnownKeys.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kKind = "refused";

// "[json.exception.type_error.302] type must be string" has a first part that is of no use to a reader.
std::string withoutLibraryName(const std::string& text) {
  const std::size_t end = text.find("] ");
  return text.rfind("[json.exception.", 0) == 0 && end != std::string::npos ? text.substr(end + 2) : text;
}

// The library's error for a document; empty if it accepts it.
std::string refusalOf(const OrderedJson& document) {
  try {
    const Configuration configuration(document.dump(-1, ' ', false, OrderedJson::error_handler_t::replace));
    return "";
  } catch (const std::exception& error) {
    return withoutLibraryName(error.what());
  }
}

// Each value is parsed separately, in the smallest possible document.
class FaultFinder {
 public:
  Diagnostics find(const OrderedJson& root) {
    if (!root.is_object()) {
      add("", "is not an object of managers");
      return findings_;
    }
    for (const auto& [name, manager] : root.items()) lookAtManager(memberPointer("", name), manager);
    return findings_;
  }

 private:
  void add(const std::string& pointer, const std::string& refusal) {
    if (!refusal.empty()) findings_.push_back({kKind, pointer, refusal});
  }

  void lookAtManager(const std::string& pointer, const OrderedJson& manager) {
    if (!manager.is_object()) {
      add(pointer, "a manager must be an object");
      return;
    }
    for (const std::string& key : keysOfManagers()) {
      const auto member = manager.find(key);
      if (member == manager.end() || key == "stores") continue;
      add(memberPointer(pointer, key), refusalOf({{"m", {{key, *member}}}}));
    }
    const auto stores = manager.find("stores");
    if (stores == manager.end() || !stores->is_object()) return;
    for (const auto& [identifier, store] : stores->items()) {
      lookAtStore(memberPointer(memberPointer(pointer, "stores"), identifier), store);
    }
  }

  void lookAtStore(const std::string& pointer, const OrderedJson& store) {
    if (!store.is_object()) {
      add(pointer, "a store must be an object");
      return;
    }
    const auto type = store.find("type");
    if (type == store.end()) {
      add(pointer, "has no 'type', use unmanaged, pkvs or disk_cache");
      return;
    }
    const std::string refusal = refusalOf(around({{"type", *type}}));
    add(memberPointer(pointer, "type"), refusal);
    if (!refusal.empty()) return;
    for (const std::string& key : keysOfStores(type->get<std::string>())) {
      const auto member = store.find(key);
      if (member == store.end() || key == "type") continue;
      add(memberPointer(pointer, key), refusalOf(around({{"type", *type}, {key, *member}})));
    }
  }

  static OrderedJson around(const OrderedJson& store) { return {{"m", {{"stores", {{"s", store}}}}}}; }

  Diagnostics findings_;
};

// A manager's name, or a store's identifier, which must be unique.
bool namesADefinition(const std::string& pointer) {
  const auto depth = std::count(pointer.begin(), pointer.end(), '/');
  return depth == 1 || (depth == 3 && pointer.find("/stores/") != std::string::npos);
}

// Where an identifier is used a second time.
Diagnostics findRepeatedIdentifiers(const ConfigurationDocument& document) {
  Diagnostics findings;
  for (const std::string& pointer : document.repeated) {
    if (!namesADefinition(pointer)) continue;
    findings.push_back({kKind, pointer, "is defined twice here"});
  }
  std::unordered_set<std::string> seen;
  if (!document.root.is_object()) return findings;
  for (const auto& [name, manager] : document.root.items()) {
    const OrderedJson stores = manager.is_object() ? manager.value("stores", OrderedJson()) : OrderedJson();
    if (!stores.is_object()) continue;
    for (const auto& [identifier, store] : stores.items()) {
      const std::string pointer = memberPointer(memberPointer(memberPointer("", name), "stores"), identifier);
      if (!seen.insert(identifier).second) {
        findings.push_back({kKind, pointer, "another manager has a store of this identifier"});
      }
    }
  }
  return findings;
}

}  // namespace

Diagnostics findFaults(const ConfigurationDocument& document) {
  std::string refusal;
  try {
    const Configuration configuration(document.text);
    return {};
  } catch (const std::exception& error) {
    refusal = error.what();
  }
  Diagnostics findings = FaultFinder().find(document.root);
  const Diagnostics repeated = findRepeatedIdentifiers(document);
  findings.insert(findings.end(), repeated.begin(), repeated.end());
  if (findings.empty()) findings.push_back({kKind, "", refusal});
  return findings;
}

}  // namespace velmora::mobile::xplat::cellar::tools
