#include "check/KeyWarnings.h"

#include <algorithm>
#include <cstdint>
#include <limits>
#include <locale>
#include <map>
#include <sstream>
#include <vector>

#include "Format.h"
#include "check/KnownKeys.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

bool contains(const std::vector<std::string>& keys, const std::string& key) {
  return std::find(keys.begin(), keys.end(), key) != keys.end();
}

// A size or duration as written: the number before it is truncated to 32 bits, and the text that the parser ignores.
struct Quantity {
  std::int64_t number = 0;
  std::string unit;
  std::string rest;
};

Quantity readQuantity(const std::string& text) {
  std::istringstream in(text);
  in.imbue(std::locale::classic());
  Quantity quantity;
  in >> quantity.number >> quantity.unit;
  std::getline(in >> std::ws, quantity.rest);
  return quantity;
}

std::int64_t factorOf(const std::string& unit) {
  static const std::map<std::string, std::int64_t> factors = {{"B", 1},        {"KB", 1 << 10},       {"MB", 1 << 20},
                                                              {"GB", 1 << 30}, {"minutes", 60},       {"hours", 3600},
                                                              {"days", 86400}, {"years", 365 * 86400}};
  const auto found = factors.find(unit);
  return found == factors.end() ? 1 : found->second;
}

enum class Measure { Size, Duration };

std::string inHumanUnits(std::uint32_t value, Measure measure) {
  return measure == Measure::Size ? formatSize(value) : formatDuration(value);
}

void warnOfQuantity(const std::string& pointer, const OrderedJson& object, const char* key, Measure measure,
                    Diagnostics& findings) {
  const auto member = object.find(key);
  if (member == object.end()) return;
  const std::string text = member->get<std::string>();
  const Quantity quantity = readQuantity(text);
  // The parser has taken the text, so the number has at most 32 bits and the product fits.
  const std::int64_t exact = quantity.number * factorOf(quantity.unit);
  const auto wrapped = static_cast<std::uint32_t>(exact);
  const std::string place = memberPointer(pointer, key);
  if (exact != static_cast<std::int64_t>(wrapped)) {
    findings.push_back(
        {"wrapped", place, "'" + text + "' does not fit into 32 bits and becomes " + inHumanUnits(wrapped, measure)});
  }
  if (!quantity.rest.empty()) {
    findings.push_back({"ignored_text", place, "'" + quantity.rest + "' after the unit is ignored"});
  }
}

void warnOfUnknownKey(const std::string& place, const std::string& key, const std::vector<std::string>& known,
                      const std::string& otherwise, Diagnostics& findings) {
  const std::string nearest = nearestKey(key, known);
  const std::string hint = nearest.empty() ? otherwise : "; did you mean '" + nearest + "'?";
  findings.push_back({"unknown_key", place, "unknown key" + hint});
}

std::vector<std::string> keysOfAnyStore() {
  std::vector<std::string> keys;
  for (const std::string& type : storeTypes()) {
    for (const std::string& key : keysOfStores(type)) {
      if (!contains(keys, key)) keys.push_back(key);
    }
  }
  return keys;
}

void warnOfStoreKey(const std::string& pointer, const std::string& type, const std::string& key,
                    Diagnostics& findings) {
  const std::vector<std::string>& known = keysOfStores(type);
  if (contains(known, key)) return;
  const std::string place = memberPointer(pointer, key);
  if (contains(keysOfAnyStore(), key)) {
    const bool isLimit = key == "max_size" && type == "disk_cache";
    findings.push_back(
        {"ignored_key", place,
         "stores of type " + type + " ignore this key" + (isLimit ? "; their limit is 'lru_size_limit'" : "")});
  } else {
    const bool isManagers = contains(keysOfManagers(), key);
    warnOfUnknownKey(place, key, known, isManagers ? "; it is one of managers" : "", findings);
  }
}

void warnOfVersion(const std::string& pointer, const OrderedJson& store, Diagnostics& findings) {
  const auto version = store.find("version");
  if (version == store.end()) return;
  const auto written = version->get<std::int64_t>();
  const auto wrapped = static_cast<std::uint32_t>(written);
  const bool isWhole = written == static_cast<std::int64_t>(wrapped) &&
                       !(version->is_number_unsigned() && version->get<std::uint64_t>() > wrapped);
  if (isWhole) return;
  findings.push_back({"wrapped", memberPointer(pointer, "version"),
                      version->dump() + " does not fit into 32 bits and becomes " + std::to_string(wrapped)});
}

void warnOfCapacity(const std::string& pointer, const OrderedJson& store, Diagnostics& findings) {
  const auto capacity = store.find("capacity");
  if (capacity == store.end()) return;
  const std::string place = memberPointer(pointer, "capacity");
  if (!capacity->is_number_integer()) {
    findings.push_back({"capacity", place, capacity->dump() + " is not an integer: the store has no capacity limit"});
  } else if (!capacity->is_number_unsigned() && capacity->get<std::int64_t>() < 0) {
    findings.push_back({"capacity", place, capacity->dump() + " is negative: the store has no capacity limit"});
  }
}

}  // namespace

void warnOfManagerKeys(const std::string& pointer, const OrderedJson& manager, Diagnostics& findings) {
  for (const auto& [key, value] : manager.items()) {
    if (contains(keysOfManagers(), key)) continue;
    const bool isStores = contains(keysOfAnyStore(), key);
    warnOfUnknownKey(memberPointer(pointer, key), key, keysOfManagers(), isStores ? "; it is one of stores" : "",
                     findings);
  }
  warnOfQuantity(pointer, manager, "max_size", Measure::Size, findings);
  warnOfQuantity(pointer, manager, "prune_interval", Measure::Duration, findings);
  const auto stores = manager.find("stores");
  if (stores != manager.end() && !stores->is_object()) {
    findings.push_back({"ignored_stores", memberPointer(pointer, "stores"), "is not an object: there are no stores"});
  }
}

void warnOfStoreKeys(const std::string& pointer, const OrderedJson& store, Diagnostics& findings) {
  const std::string type = store.at("type").get<std::string>();
  for (const auto& [key, value] : store.items()) warnOfStoreKey(pointer, type, key, findings);
  warnOfVersion(pointer, store, findings);
  if (type == "unmanaged") {
    warnOfQuantity(pointer, store, "max_size", Measure::Size, findings);
    return;
  }
  warnOfQuantity(pointer, store, "stale_age", Measure::Duration, findings);
  warnOfCapacity(pointer, store, findings);
  if (type != "disk_cache") return;
  warnOfQuantity(pointer, store, "lru_size_limit", Measure::Size, findings);
  warnOfQuantity(pointer, store, "survival_size", Measure::Size, findings);
}

}  // namespace velmora::mobile::xplat::cellar::tools
