#include "check/ConfigurationDocument.h"

#include <cstddef>
#include <exception>
#include <set>
#include <utility>

#include "InputError.h"
#include "TextFile.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Collects the names that an object has twice, from the parser's events.
class RepeatedNames {
 public:
  void onEvent(OrderedJson::parse_event_t event, const OrderedJson& parsed) {
    switch (event) {
      case OrderedJson::parse_event_t::object_start:
      case OrderedJson::parse_event_t::array_start:
        open_.emplace_back();
        if (open_.size() > kTooDeep) throw InputError("is nested too deeply for a configuration");
        break;
      case OrderedJson::parse_event_t::object_end:
      case OrderedJson::parse_event_t::array_end:
        open_.pop_back();
        break;
      case OrderedJson::parse_event_t::key:
        if (open_.size() <= kDeepest) note(parsed.get_ref<const std::string&>());
        break;
      case OrderedJson::parse_event_t::value:
        break;
    }
  }

  std::vector<std::string> take() { return std::move(pointers_); }

 private:
  static constexpr std::size_t kDeepest = 4;    // document, manager, "stores", store
  static constexpr std::size_t kTooDeep = 200;  // values are copied and printed recursively

  struct Names {
    std::set<std::string> names;
    std::string latest;
  };

  void note(const std::string& name) {
    open_.back().latest = name;
    if (open_.back().names.insert(name).second) return;
    std::string pointer;
    for (const Names& names : open_) pointer = memberPointer(pointer, names.latest);
    pointers_.push_back(std::move(pointer));
  }

  std::vector<Names> open_;
  std::vector<std::string> pointers_;
};

}  // namespace

ConfigurationDocument readConfigurationDocument(const std::string& path) {
  const std::string text = readTextFile(path);
  try {
    return parseConfigurationDocument(text);
  } catch (const std::exception& error) {
    throw InputError(path + ": " + error.what());
  }
}

ConfigurationDocument parseConfigurationDocument(const std::string& text) {
  ConfigurationDocument document;
  document.text = text;
  RepeatedNames names;
  document.root =
      OrderedJson::parse(text, [&](int /*depth*/, OrderedJson::parse_event_t event, const OrderedJson& parsed) {
        names.onEvent(event, parsed);
        return true;
      });
  document.repeated = names.take();
  return document;
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

}  // namespace velmora::mobile::xplat::cellar::tools
