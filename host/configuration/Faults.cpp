#include "host/configuration/Faults.h"

#include <algorithm>
#include <exception>
#include <map>
#include <string_view>
#include <utility>

#include "Configuration.h"
#include "JsonValue.h"
#include "host/configuration/Outline.h"
#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Faults = std::vector<ConfigurationFault>;

// The library's error for a document; empty if it accepts it.
std::string refusalOf(const std::string& json) {
  try {
    const Configuration configuration(json);
    return "";
  } catch (const std::exception& error) {
    return error.what();
  }
}

// Has the library read each value separately, in the smallest possible document.
class FaultFinder {
 public:
  explicit FaultFinder(const std::string& text) : text_(text) {}

  Faults find(const Outline& document) {
    if (!document.isObject) add("", document.begin, "is not an object of managers");
    ByName managers;
    for (const Outline& manager : document.members) {
      const std::string pointer = memberPointer("", manager.name);
      const bool isNew = managers.emplace(manager.name, &manager).second;
      if (!isNew) add(pointer, manager.nameAt, "is defined twice here");
      lookAtManager(pointer, manager);
    }
    return std::move(faults_);
  }

 private:
  using ByName = std::map<std::string, const Outline*>;

  void add(const std::string& pointer, std::size_t at, const std::string& refusal) {
    if (!refusal.empty()) faults_.push_back({pointer, at, refusal});
  }

  // Of several members of one name the last counts.
  static std::vector<const Outline*> membersThatCount(const Outline& object) {
    ByName last;
    for (const Outline& member : object.members) last[member.name] = &member;
    std::vector<const Outline*> members;
    for (const Outline& member : object.members) {
      if (last[member.name] == &member) members.push_back(&member);
    }
    return members;
  }

  std::string_view textOf(const Outline& member) const {
    return std::string_view(text_).substr(member.nameAt, member.end - member.nameAt);
  }

  void lookAtManager(const std::string& pointer, const Outline& manager) {
    if (!manager.isObject) return add(pointer, manager.begin, "a manager must be an object");
    for (const Outline* const member : membersThatCount(manager)) {
      if (member->name == "stores") continue;
      add(memberPointer(pointer, member->name), member->begin, refusalOf(joined({R"({"m":{)", textOf(*member), "}}"})));
    }
    const Outline* const stores = manager.find("stores");
    if (stores == nullptr) return;
    const std::string pointerOfStores = memberPointer(pointer, "stores");
    for (const Outline& store : stores->members) {
      const std::string pointerOfStore = memberPointer(pointerOfStores, store.name);
      const auto [owner, isNew] = owners_.emplace(store.name, &manager);
      if (!isNew) {
        add(pointerOfStore, store.nameAt,
            owner->second == &manager ? "is defined twice here" : "another manager has a store of this identifier");
      }
      lookAtStore(pointerOfStore, store);
    }
  }

  void lookAtStore(const std::string& pointer, const Outline& store) {
    if (!store.isObject) return add(pointer, store.begin, "a store must be an object");
    const auto lookAt = [&](const Outline& member, std::string_view otherMembers) {
      const std::string refusal = refusalOf(joined({R"({"m":{"stores":{"s":{)", otherMembers, textOf(member), "}}}}"}));
      add(memberPointer(pointer, member.name), member.begin, refusal);
      return refusal.empty();
    };
    if (const Outline* const name = store.find("name")) lookAt(*name, R"("type":"pkvs",)");
    const Outline* const type = store.find("type");
    if (type == nullptr) return add(pointer, store.begin, "has no 'type', use unmanaged, pkvs or disk_cache");
    if (!lookAt(*type, "")) return;
    for (const Outline* const member : membersThatCount(store)) {
      if (member->name != "name" && member->name != "type") lookAt(*member, joined({textOf(*type), ","}));
    }
  }

  const std::string& text_;
  ByName owners_;  // of the stores
  Faults faults_;
};

}  // namespace

std::vector<ConfigurationFault> faultsOf(const std::string& json) {
  std::string refusal;
  try {
    const Configuration configuration(json);
    return {};
  } catch (const JsonValue::parse_error& error) {
    return {{"", std::max<std::size_t>(error.byte, 1) - 1, error.what()}};
  } catch (const std::exception& error) {
    refusal = error.what();
  }
  const Outline document = outlineOf(json);
  Faults faults = FaultFinder(json).find(document);
  if (faults.empty()) faults.push_back({"", document.begin, refusal});
  return faults;
}

std::string memberPointer(const std::string& pointer, const std::string& name) {
  std::string escaped;
  for (const char character : name) {
    if (character == '~') {
      escaped += "~0";
    } else if (character == '/') {
      escaped += "~1";
    } else {
      escaped += character;
    }
  }
  return pointer + "/" + escaped;
}

}  // namespace velmora::mobile::xplat::cellar::host
