#include "Configuration.h"

#include <locale>
#include <sstream>
#include <stdexcept>
#include <utility>
#include <vector>

#include "JsonValue.h"
#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

namespace {

using std::string;

// A value of the document. Objects keep their members in document order and a name that is met twice twice, both of
// which the JSON library's own objects fold away; any other value is kept as the library reads it.
struct Node {
  string name;      // as a member of the object that holds it
  JsonValue value;  // an empty object or array for those
  std::vector<Node> members;

  // The member of that name, the last when there are several; null when there is none or this is not an object.
  const Node* find(const string& wanted) const {
    for (auto member = members.rbegin(); member != members.rend(); ++member) {
      if (member->name == wanted) return &*member;
    }
    return nullptr;
  }

  // Throws the JSON library's type error unless this is an object.
  void requireObject() const { value.get_ref<const JsonValue::object_t&>(); }
};

// Builds the nodes from the JSON library's parser events. What lies deeper than a store's own keys, or in an array, is
// of no interest and not kept, so that hostile nesting costs nothing.
class NodeBuilder : public nlohmann::json_sax<JsonValue> {
 public:
  bool null() override { return add(nullptr); }
  bool boolean(bool value) override { return add(value); }
  bool number_integer(number_integer_t value) override { return add(value); }
  bool number_unsigned(number_unsigned_t value) override { return add(value); }
  bool number_float(number_float_t value, const string_t& /*text*/) override { return add(value); }
  bool string(string_t& value) override { return add(std::move(value)); }
  bool binary(binary_t& /*value*/) override { return add(nullptr); }
  bool start_object(std::size_t /*size*/) override { return open(JsonValue::object()); }
  bool end_object() override { return close(); }
  bool start_array(std::size_t /*size*/) override { return open(JsonValue::array()); }
  bool end_array() override { return close(); }

  bool key(string_t& name) override {
    if (skipped_ == 0) name_ = std::move(name);
    return true;
  }

  bool parse_error(std::size_t /*position*/, const std::string& /*token*/,
                   const nlohmann::detail::exception& error) override {
    // The parser reports nothing but these; naming the class keeps it what the library's own reader throws.
    rethrowAs<JsonValue::parse_error>(error);
    rethrowAs<JsonValue::out_of_range>(error);
    return false;
  }

  Node take() { return std::move(root_); }

 private:
  static constexpr std::size_t kDeepest = 4;  // document, manager, "stores", store

  template <class Error> static void rethrowAs(const nlohmann::detail::exception& error) {
    if (const auto* known = dynamic_cast<const Error*>(&error)) throw Error(*known);
  }

  bool add(JsonValue value) {
    if (skipped_ == 0) place(std::move(value));
    return true;
  }

  bool open(JsonValue value) {
    const bool keepsMembers = skipped_ == 0 && value.is_object() && path_.size() < kDeepest;
    Node* node = skipped_ == 0 ? place(std::move(value)) : nullptr;
    if (keepsMembers) {
      path_.push_back(node);
    } else {
      ++skipped_;
    }
    return true;
  }

  bool close() {
    if (skipped_ > 0) {
      --skipped_;
    } else {
      path_.pop_back();
    }
    return true;
  }

  // Members are only ever appended to the object that is open last, so the pointers on the path stay good.
  Node* place(JsonValue value) {
    if (path_.empty()) {
      root_.value = std::move(value);
      return &root_;
    }
    std::vector<Node>& members = path_.back()->members;
    members.push_back({std::move(name_), std::move(value), {}});
    return &members.back();
  }

  Node root_;
  std::vector<Node*> path_;  // the open objects, outermost first
  std::size_t skipped_ = 0;  // open objects and arrays whose content is not kept
  std::string name_;
};

Node parseDocument(const string& json) {
  NodeBuilder builder;
  JsonValue::sax_parse(json, &builder);
  Node document = builder.take();
  document.requireObject();
  return document;
}

// Strict: a number is not a boolean, 1.5 and true are not integers.
template <class T> T as(const JsonValue& value) { return value.get<T>(); }
template <> std::int64_t as(const JsonValue& value) { return value.get_ref<const JsonValue::number_integer_t&>(); }

template <class T> T read(const Node& object, const char* key, T defaultValue) {
  const Node* member = object.find(key);
  return member == nullptr ? defaultValue : as<T>(member->value);
}

string readRequired(const Node& object, const char* key) {
  const Node* member = object.find(key);
  if (member == nullptr) return JsonValue::object().at(key);  // throws the JSON library's own missing-key error
  return as<string>(member->value);
}

struct Unit {
  const char* name;
  std::uint32_t factor;
};

template <std::size_t N>
std::uint32_t parseQuantity(const string& text, const Unit (&units)[N], const char* unitNames) {
  std::istringstream in(text);
  in.imbue(std::locale::classic());
  std::uint32_t number = 0;
  string unit;
  in >> number >> unit;
  for (const Unit& known : units) {
    if (unit == known.name) return number * known.factor;
  }
  throw std::invalid_argument("Invalid unit '" + unit + "', use " + unitNames + ".");
}

std::uint32_t parseSize(const string& text) {
  static constexpr Unit units[] = {{"B", 1U}, {"KB", 1U << 10U}, {"MB", 1U << 20U}, {"GB", 1U << 30U}};
  return parseQuantity(text, units, "B, KB, MB or GB");
}

std::uint32_t parseDuration(const string& text) {
  static constexpr Unit units[] = {{"minutes", 60U}, {"hours", 3600U}, {"days", 86400U}, {"years", 365U * 86400U}};
  return parseQuantity(text, units, "minutes, hours, days or years");
}

Area parseArea(const string& text) {
  if (text == "caches") return Area::Caches;
  if (text == "documents") return Area::Documents;
  if (text == "shared") return Area::Shared;
  throw std::invalid_argument("Invalid area '" + text + "', use caches, documents or shared.");
}

StoreDefinition::Type parseType(const string& text) {
  if (text == "unmanaged") return StoreDefinition::Type::Unmanaged;
  if (text == "pkvs") return StoreDefinition::Type::PKVS;
  if (text == "disk_cache") return StoreDefinition::Type::DiskCache;
  throw std::invalid_argument("Invalid type '" + text + "', use unmanaged, pkvs or disk_cache.");
}

ExtendedMetadataFactoryIdentifier parseMetadataFactory(const string& text) {
  if (text == "null") return ExtendedMetadataFactoryIdentifier::Null;
  if (text == "video_download") return ExtendedMetadataFactoryIdentifier::VideoDownload;
  throw std::invalid_argument("Invalid factory '" + text + "', use null or video_download.");
}

PruneStrategyIdentifier parsePruneStrategy(const string& text) {
  if (text == "null") return PruneStrategyIdentifier::Null;
  if (text == "lru") return PruneStrategyIdentifier::LRU;
  if (text == "video_download") return PruneStrategyIdentifier::VideoDownload;
  if (text == "greedy_dual") return PruneStrategyIdentifier::GreedyDual;
  throw std::invalid_argument("Invalid prune '" + text + "', use null, lru or video_download.");
}

Durability parseDurability(const string& text) {
  if (text == "relaxed") return Durability::Relaxed;
  if (text == "safe") return Durability::Safe;
  if (text == "synced") return Durability::Synced;
  throw std::invalid_argument("Invalid durability '" + text + "', use relaxed, safe or synced.");
}

// Anything but an integer counts as absent.
std::optional<std::int64_t> readCapacity(const Node& store) {
  const Node* member = store.find("capacity");
  if (member == nullptr || !member->value.is_number_integer()) return std::nullopt;
  return as<std::int64_t>(member->value);
}

const char* const kDefaultStaleAge = "50 years";

std::shared_ptr<const StoreDefinition> readStore(const string& managerName, const Node& store) {
  store.requireObject();
  const auto name = read<string>(store, "name", store.name);
  const StoreDefinition::Type type = parseType(readRequired(store, "type"));
  const auto localeSensitive = read<bool>(store, "locale_sensitive", false);
  const auto hasVersion = read<bool>(store, "has_version", false);
  const auto version = static_cast<std::uint32_t>(read<std::int64_t>(store, "version", 1));

  if (type == StoreDefinition::Type::Unmanaged) {
    const auto isCache = read<bool>(store, "is_cache", false);
    const std::uint32_t maxSize = parseSize(read<string>(store, "max_size", "0MB"));
    return std::make_shared<const UnmanagedStoreDefinition>(name, managerName, localeSensitive, hasVersion, version,
                                                            maxSize, isCache);
  }

  const auto inlineData = read<bool>(store, "inline_data", false);
  const std::uint32_t staleAge = parseDuration(read<string>(store, "stale_age", kDefaultStaleAge));
  if (type == StoreDefinition::Type::PKVS) {
    const auto durability = parseDurability(read<string>(store, "durability", "relaxed"));
    return std::make_shared<const PKVSDefinition>(name, managerName, localeSensitive, hasVersion, version,
                                                  readCapacity(store), inlineData, staleAge, durability);
  }

  const std::uint32_t lruSizeLimit = parseSize(read<string>(store, "lru_size_limit", "0MB"));
  const std::uint32_t survivalSize = parseSize(read<string>(store, "survival_size", "0MB"));
  const auto metadataFactory = parseMetadataFactory(read<string>(store, "metadata_factory", "null"));
  const auto pruneStrategy = parsePruneStrategy(read<string>(store, "prune_strategy", "null"));
  const auto durability = parseDurability(read<string>(store, "durability", "relaxed"));
  return std::make_shared<const DiskCacheDefinition>(name, managerName, localeSensitive, hasVersion, version,
                                                     readCapacity(store), staleAge, inlineData, lruSizeLimit,
                                                     survivalSize, metadataFactory, pruneStrategy, durability);
}

}  // namespace

StoreDefinition::StoreDefinition(Type type_, const string& name_, const string& managerName_, bool localeSensitive_,
                                 bool hasVersion_, unsigned int version_, unsigned int maxSize_, bool isCache_,
                                 bool isManaged_)
    : type(type_),
      name(name_),
      managerName(managerName_),
      localeSensitive(localeSensitive_),
      hasVersion(hasVersion_),
      version(version_),
      maxSize(maxSize_),
      isCache(isCache_),
      isManaged(isManaged_) {}

UnmanagedStoreDefinition::UnmanagedStoreDefinition(const string& name_, const string& managerName_,
                                                   bool localeSensitive_, bool hasVersion_, unsigned int version_,
                                                   unsigned int maxSize_, bool isCache_)
    : StoreDefinition(Type::Unmanaged, name_, managerName_, localeSensitive_, hasVersion_, version_, maxSize_, isCache_,
                      false) {}

PKVSDefinition::PKVSDefinition(const string& name_, const string& managerName_, bool localeSensitive_, bool hasVersion_,
                               unsigned int version_, std::optional<std::int64_t> capacity_, bool inlineData_,
                               std::uint32_t staleAge_, Durability durability_)
    : StoreDefinition(Type::PKVS, name_, managerName_, localeSensitive_, hasVersion_, version_, 0, false, true),
      capacity(capacity_),
      inlineData(inlineData_),
      staleAge(staleAge_),
      durability(durability_) {}

DiskCacheDefinition::DiskCacheDefinition(const string& name_, const string& managerName_, bool localeSensitive_,
                                         bool hasVersion_, unsigned int version_, std::optional<std::int64_t> capacity_,
                                         std::uint32_t staleAge_, bool inlineData_, std::uint32_t lruSizeLimit_,
                                         std::uint32_t survivalSize_,
                                         ExtendedMetadataFactoryIdentifier metadataFactory_,
                                         PruneStrategyIdentifier pruneStrategy_, Durability durability_)
    : StoreDefinition(Type::DiskCache, name_, managerName_, localeSensitive_, hasVersion_, version_, lruSizeLimit_,
                      true, true),
      capacity(capacity_),
      staleAge(staleAge_),
      inlineData(inlineData_),
      lruSizeLimit(lruSizeLimit_),
      survivalSize(survivalSize_),
      metadataFactory(metadataFactory_),
      pruneStrategy(pruneStrategy_),
      durability(durability_) {}

Configuration::Configuration(const string& json) {
  const Node document = parseDocument(json);
  for (const Node& manager : document.members) {
    const string& managerName = manager.name;
    if (managers_.count(managerName) > 0) throw ConfigurationException("Duplicate store manager definition.");
    manager.requireObject();
    StoreManagerDefinition definition{};
    definition.name = managerName;
    definition.area = parseArea(read<string>(manager, "area", "caches"));
    definition.maxSize = parseSize(read<string>(manager, "max_size", "20MB"));
    definition.pruneInterval = parseDuration(read<string>(manager, "prune_interval", "1 hours"));
    definition.sessionScoped = read<bool>(manager, "session_scoped", true);
    if (const Node* stores = manager.find("stores")) {
      for (const Node& store : stores->members) {
        const string& identifier = store.name;
        if (storeDefinitions_.count(identifier) > 0) throw ConfigurationException("Duplicate store definition.");
        const auto storeDefinition = readStore(managerName, store);
        definition.stores.emplace(identifier, storeDefinition);
        storeDefinitions_.emplace(identifier, storeDefinition);
      }
    }
    managers_.emplace(managerName, std::make_shared<const StoreManagerDefinition>(std::move(definition)));
  }
}

Configuration::Configuration(const std::unordered_map<string, std::shared_ptr<const StoreManagerDefinition>>& managers)
    : managers_(managers) {
  for (const auto& [name, manager] : managers_) {
    if (manager == nullptr) continue;
    for (const auto& [identifier, store] : manager->stores) storeDefinitions_[identifier] = store;
  }
}

std::shared_ptr<const StoreDefinition> Configuration::getStore(const string& identifier) const {
  const auto found = storeDefinitions_.find(identifier);
  if (found == storeDefinitions_.end()) throw ConfigurationException("Store '" + identifier + "' not found.");
  return found->second;
}

std::shared_ptr<const StoreManagerDefinition> Configuration::getManager(const string& name) const {
  const auto found = managers_.find(name);
  if (found == managers_.end()) throw ConfigurationException("Manager '" + name + "' not found.");
  return found->second;
}

}  // namespace velmora::mobile::xplat::cellar
