#include "check/ConfigurationDocument.h"

#include <cstddef>
#include <exception>
#include <iterator>
#include <unordered_map>
#include <utility>

#include "InputError.h"
#include "TextFile.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Builds a document from the parser's events. The library's own reader looks through all members of an object for each
// one that it adds.
class DocumentBuilder : public nlohmann::json_sax<OrderedJson> {
 public:
  explicit DocumentBuilder(ConfigurationDocument& document) : document_(document) {}

  bool null() override { return add(nullptr); }
  bool boolean(bool value) override { return add(value); }
  bool number_integer(number_integer_t value) override { return add(value); }
  bool number_unsigned(number_unsigned_t value) override { return add(value); }
  bool number_float(number_float_t value, const string_t& /*text*/) override { return add(value); }
  bool string(string_t& value) override { return add(std::move(value)); }
  bool binary(binary_t& /*value*/) override { return add(nullptr); }
  bool start_object(std::size_t /*size*/) override { return open(OrderedJson::object()); }
  bool end_object() override { return close(); }
  bool start_array(std::size_t /*size*/) override { return open(OrderedJson::array()); }
  bool end_array() override { return close(); }

  bool key(string_t& name) override {
    Open& object = open_.back();
    auto& members = object.value->get_ref<OrderedJson::object_t&>();
    const auto [place, isNew] = object.places.emplace(name, members.size());
    object.next = place->second;
    object.latest = name;
    if (isNew) {
      members.emplace_back(std::move(name), nullptr);
    } else if (open_.size() <= kDeepest) {
      noteRepeated();
    }
    return true;
  }

  bool parse_error(std::size_t /*position*/, const std::string& /*token*/,
                   const nlohmann::detail::exception& error) override {
    // The parser reports nothing but these.
    rethrowAs<OrderedJson::parse_error>(error);
    rethrowAs<OrderedJson::out_of_range>(error);
    return false;
  }

 private:
  static constexpr std::size_t kDeepest = 4;    // document, manager, "stores", store
  static constexpr std::size_t kTooDeep = 200;  // values are copied and printed recursively

  struct Open {
    OrderedJson* value;
    std::unordered_map<std::string, std::size_t> places;  // of its members
    std::size_t next = 0;                                 // where the next value belongs
    std::string latest;
  };

  template <class Error> static void rethrowAs(const nlohmann::detail::exception& error) {
    if (const auto* known = dynamic_cast<const Error*>(&error)) throw Error(*known);
  }

  bool add(OrderedJson value) {
    place(std::move(value));
    return true;
  }

  bool open(OrderedJson value) {
    open_.push_back({place(std::move(value)), {}, 0, {}});
    if (open_.size() > kTooDeep) throw InputError("is nested too deeply for a configuration");
    return true;
  }

  bool close() {
    open_.pop_back();
    return true;
  }

  // Only what is open last grows, so that the pointers to what is open stay good.
  OrderedJson* place(OrderedJson value) {
    OrderedJson* target = &document_.root;
    if (!open_.empty()) {
      OrderedJson& parent = *open_.back().value;
      if (parent.is_array()) parent.push_back(nullptr);
      target = parent.is_array() ? &parent.back() : memberAt(parent, open_.back().next);
    }
    *target = std::move(value);
    return target;
  }

  static OrderedJson* memberAt(OrderedJson& object, std::size_t place) {
    return &std::next(object.get_ref<OrderedJson::object_t&>().begin(), static_cast<std::ptrdiff_t>(place))->second;
  }

  void noteRepeated() {
    std::string pointer;
    for (const Open& object : open_) pointer = memberPointer(pointer, object.latest);
    document_.repeated.push_back(std::move(pointer));
  }

  ConfigurationDocument& document_;
  std::vector<Open> open_;
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
  DocumentBuilder builder(document);
  OrderedJson::sax_parse(text, &builder);
  return document;
}

}  // namespace velmora::mobile::xplat::cellar::tools
