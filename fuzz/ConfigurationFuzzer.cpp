// The configuration document against a second reading of it: the same documents are accepted with the same definitions,
// and the same first fault is reported for the others.

#include <array>
#include <cstdint>
#include <exception>
#include <limits>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "Configuration.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

using Document = nlohmann::ordered_json;  // members stay in document order, which decides on the first fault

// Thrown by the second reading for a value of the wrong JSON type, or one that is missing.
struct WrongType {};

// --- The second reading ---

std::optional<std::uint32_t> leadingNumber(const std::string& text, std::size_t& position) {
  const auto skipSpace = [&] { position = std::min(text.find_first_not_of(" \t\n\v\f\r", position), text.size()); };
  skipSpace();
  bool negative = false;
  if (position < text.size() && (text[position] == '-' || text[position] == '+')) negative = text[position++] == '-';
  std::uint64_t number = 0;
  const std::size_t first = position;
  for (; position < text.size() && text[position] >= '0' && text[position] <= '9'; ++position) {
    number = std::min<std::uint64_t>(number * 10 + static_cast<std::uint64_t>(text[position] - '0'), 1ULL << 40U);
  }
  if (position == first || number > std::numeric_limits<std::uint32_t>::max()) return std::nullopt;
  skipSpace();
  return static_cast<std::uint32_t>(negative ? 0 - number : number);
}

struct Unit {
  const char* name;
  std::uint32_t factor;
};

std::uint32_t quantity(const std::string& text, const std::vector<Unit>& units, const char* names) {
  std::size_t position = 0;
  const auto number = leadingNumber(text, position);
  const std::size_t end = std::min(text.find_first_of(" \t\n\v\f\r", position), text.size());
  const std::string unit = number ? text.substr(position, end - position) : "";
  for (const Unit& known : units) {
    if (unit == known.name) return number.value() * known.factor;
  }
  throw std::invalid_argument("Invalid unit '" + unit + "', use " + names + ".");
}

std::uint32_t size(const std::string& text) {
  return quantity(text, {{"B", 1}, {"KB", 1024}, {"MB", 1048576}, {"GB", 1073741824}}, "B, KB, MB or GB");
}

std::uint32_t duration(const std::string& text) {
  return quantity(text, {{"minutes", 60}, {"hours", 3600}, {"days", 86400}, {"years", 31536000}},
                  "minutes, hours, days or years");
}

std::string stringAt(const Document& object, const char* key, const char* otherwise) {
  if (!object.contains(key)) return otherwise;
  if (!object.at(key).is_string()) throw WrongType();
  return object.at(key).get<std::string>();
}

bool booleanAt(const Document& object, const char* key, bool otherwise) {
  if (!object.contains(key)) return otherwise;
  if (!object.at(key).is_boolean()) throw WrongType();
  return object.at(key).get<bool>();
}

int choiceAt(const Document& object, const char* key, const char* otherwise, const std::vector<std::string>& words,
             const char* what, const char* names) {
  const std::string word = stringAt(object, key, otherwise);
  for (std::size_t i = 0; i < words.size(); ++i) {
    if (words[i] == word) return static_cast<int>(i);
  }
  throw std::invalid_argument(std::string("Invalid ") + what + " '" + word + "', use " + names + ".");
}

std::optional<std::int64_t> capacityOf(const Document& store) {
  if (!store.contains("capacity") || !store.at("capacity").is_number_integer()) return std::nullopt;
  return store.at("capacity").get<std::int64_t>();
}

void readUnmanaged(const Document& store, const StoreDefinition* actual) {
  const bool isCache = booleanAt(store, "is_cache", false);
  const std::uint32_t maxSize = size(stringAt(store, "max_size", "0MB"));
  if (actual == nullptr) return;
  check(dynamic_cast<const UnmanagedStoreDefinition*>(actual) != nullptr, "an unmanaged store is one");
  check(actual->isCache == isCache && actual->maxSize == maxSize && !actual->isManaged,
        "its values are the document's");
}

void readKeyValue(const Document& store, const StoreDefinition* actual) {
  const bool inlineData = booleanAt(store, "inline_data", false);
  const std::uint32_t staleAge = duration(stringAt(store, "stale_age", "50 years"));
  if (actual == nullptr) return;
  const auto* definition = dynamic_cast<const PKVSDefinition*>(actual);
  check(definition != nullptr, "a key-value store is one");
  check(definition->inlineData == inlineData && definition->staleAge == staleAge, "its values are the document's");
  check(definition->capacity == capacityOf(store), "its capacity is the document's");
  check(definition->maxSize == 0 && !definition->isCache && definition->isManaged, "what its type fixes is fixed");
}

void readDiskCache(const Document& store, const StoreDefinition* actual) {
  const bool inlineData = booleanAt(store, "inline_data", false);
  const std::uint32_t staleAge = duration(stringAt(store, "stale_age", "50 years"));
  const std::uint32_t limit = size(stringAt(store, "lru_size_limit", "0MB"));
  const std::uint32_t survival = size(stringAt(store, "survival_size", "0MB"));
  const int factory =
      choiceAt(store, "metadata_factory", "null", {"null", "video_download"}, "factory", "null or video_download");
  const int strategy = choiceAt(store, "prune_strategy", "null", {"lru", "null", "video_download", "greedy_dual"},
                                "prune", "null, lru or video_download");
  constexpr std::array<PruneStrategyIdentifier, 4> kStrategies = {
      PruneStrategyIdentifier::LRU, PruneStrategyIdentifier::Null, PruneStrategyIdentifier::VideoDownload,
      PruneStrategyIdentifier::GreedyDual};
  if (actual == nullptr) return;
  const auto* definition = dynamic_cast<const DiskCacheDefinition*>(actual);
  check(definition != nullptr, "a disk cache is one");
  check(definition->inlineData == inlineData && definition->staleAge == staleAge && definition->lruSizeLimit == limit &&
            definition->maxSize == limit && definition->survivalSize == survival &&
            static_cast<int>(definition->metadataFactory) == factory &&
            definition->pruneStrategy == kStrategies[static_cast<std::size_t>(strategy)],
        "its values are the document's");
  check(definition->capacity == capacityOf(store), "its capacity is the document's");
  check(definition->isCache && definition->isManaged, "what its type fixes is fixed");
}

void readStore(const std::string& manager, const std::string& identifier, const Document& store,
               const StoreDefinition* actual) {
  if (!store.is_object()) throw WrongType();
  const std::string name = store.contains("name") ? stringAt(store, "name", "") : identifier;
  if (!store.contains("type")) throw WrongType();
  const int type =
      choiceAt(store, "type", "", {"unmanaged", "pkvs", "disk_cache"}, "type", "unmanaged, pkvs or disk_cache");
  const bool localeSensitive = booleanAt(store, "locale_sensitive", false);
  const bool hasVersion = booleanAt(store, "has_version", false);
  if (store.contains("version") && !store.at("version").is_number_integer()) throw WrongType();
  const auto version =
      store.contains("version") ? static_cast<std::uint32_t>(store.at("version").get<std::int64_t>()) : 1U;
  if (actual != nullptr) {
    check(static_cast<int>(actual->type) == type, "a store is of its type", identifier);
    check(actual->name == name, "a store has its name", name);
    check(actual->managerName == manager, "a store knows its manager", manager);
    check(actual->localeSensitive == localeSensitive && actual->hasVersion == hasVersion && actual->version == version,
          "what names its directory is the document's", identifier);
  }
  if (type == 0) return readUnmanaged(store, actual);
  if (type == 1) return readKeyValue(store, actual);
  readDiskCache(store, actual);
}

const Document* storesOf(const Document& manager) {
  if (!manager.contains("stores") || !manager.at("stores").is_object()) return nullptr;
  return &manager.at("stores");
}

void readManager(const std::string& name, const Document& manager, const Configuration* configuration) {
  if (!manager.is_object()) throw WrongType();
  const int area =
      choiceAt(manager, "area", "caches", {"caches", "documents", "shared"}, "area", "caches, documents or shared");
  const std::uint32_t maxSize = size(stringAt(manager, "max_size", "20MB"));
  const std::uint32_t interval = duration(stringAt(manager, "prune_interval", "1 hours"));
  const bool sessionScoped = booleanAt(manager, "session_scoped", true);
  const auto actual = configuration == nullptr ? nullptr : configuration->getManager(name);
  const Document* stores = storesOf(manager);
  if (configuration != nullptr) {
    check(actual != nullptr && actual->name == name, "a manager has its name", name);
    check(static_cast<int>(actual->area) == area && actual->maxSize == maxSize && actual->pruneInterval == interval &&
              actual->sessionScoped == sessionScoped,
          "a manager's values are the document's", name);
    check(actual->stores.size() == (stores == nullptr ? 0 : stores->size()), "no store is lost or invented", name);
  }
  if (stores == nullptr) return;
  for (const auto& [identifier, store] : stores->items()) {
    const StoreDefinition* definition = nullptr;
    if (configuration != nullptr) {
      const auto found = actual->stores.find(identifier);
      check(found != actual->stores.end(), "a manager holds its stores", identifier);
      check(configuration->getStore(identifier) == found->second, "a store is one object", identifier);
      definition = found->second.get();
    }
    readStore(name, identifier, store, definition);
  }
}

// Checks the configuration against the document; only looks for the first fault when there is none.
void readDocument(const Document& document, const Configuration* configuration) {
  if (!document.is_object()) throw WrongType();
  for (const auto& [name, manager] : document.items()) readManager(name, manager, configuration);
}

// --- What the two say ---

// A fault as one line; "" for none.
template <class Action> std::string faultOf(Action action) {
  try {
    action();
  } catch (const WrongType&) {
    return "json";
  } catch (const std::invalid_argument& error) {
    return error.what();
  } catch (const ConfigurationException& error) {
    return error.description();
  } catch (const JsonValue::parse_error&) {
    return "text";
  } catch (const JsonValue::exception& error) {
    // A number too large for any type is met by the parser; every other one is a wrong or missing value.
    return error.id == 406 ? "text" : "json";
  }
  return "";
}

// Whether some object of the text has two members of one name, which the JSON library folds together.
bool hasDoubleNames(const std::string& text) {
  std::vector<std::set<std::string>> open;
  bool found = false;
  const Document::parser_callback_t look = [&](int, Document::parse_event_t event, Document& parsed) {
    if (event == Document::parse_event_t::object_start) open.emplace_back();
    if (event == Document::parse_event_t::object_end) open.pop_back();
    if (event == Document::parse_event_t::key) found = !open.back().insert(parsed.get<std::string>()).second || found;
    return true;
  };
  [[maybe_unused]] const Document whole = Document::parse(text, look);
  return found;
}

// Whether two managers have a store of one identifier, which is a fault wherever it is met.
bool hasDoubleStores(const Document& document) {
  std::set<std::string> identifiers;
  if (!document.is_object()) return false;
  for (const auto& [name, manager] : document.items()) {
    const Document* stores = manager.is_object() ? storesOf(manager) : nullptr;
    if (stores == nullptr) continue;
    for (const auto& [identifier, store] : stores->items()) {
      if (!identifiers.insert(identifier).second) return true;
    }
  }
  return false;
}

void checkUnknown(const Configuration& configuration, const Document& document) {
  const std::string unknown = "no such name";
  if (document.contains(unknown)) return;
  check(faultOf([&] { (void)configuration.getManager(unknown); }) == "Manager 'no such name' not found.",
        "an unknown manager is a fault");
}

void run(const std::string& text) {
  std::shared_ptr<Configuration> configuration;
  const std::string fault = faultOf([&] { configuration = std::make_shared<Configuration>(text); });
  check((fault == "text") == !Document::accept(text), "only text that is no JSON is refused as such", fault);
  if (fault == "text") return;

  const Document document = Document::parse(text);
  const bool doubles = hasDoubleNames(text) || hasDoubleStores(document);
  if (fault.empty()) {
    check(!hasDoubleStores(document), "a store that is defined twice is a fault");
    readDocument(document, configuration.get());
    checkUnknown(*configuration, document);
  } else if (!doubles) {
    const std::string expected = faultOf([&] { readDocument(document, nullptr); });
    check(fault == expected, "the first fault is reported", fault + " and not " + expected);
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using velmora::mobile::xplat::cellar::fuzz::run;
  run(std::string(data, data + size));
  return 0;
}
