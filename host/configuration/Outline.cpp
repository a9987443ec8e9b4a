#include "host/configuration/Outline.h"

#include <algorithm>
#include <nlohmann/json.hpp>

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr int kDeepest = 4;  // document, manager, "stores", store

// Goes through the text once. Whatever that is, it reads nothing behind its end and comes to an end.
class Scanner {
 public:
  explicit Scanner(const std::string& text) : text_(text) {
    if (text_.compare(0, 3, "\xef\xbb\xbf") == 0) at_ = 3;
  }

  void readValue(Outline& value, int depth) {
    skipBlanks();
    value.begin = at_;
    value.isObject = next() == '{';
    if (value.isObject && depth <= kDeepest) {
      readMembers(value, depth);
    } else {
      skipValue();
    }
    value.end = at_;
  }

 private:
  char next() const { return at_ < text_.size() ? text_[at_] : '\0'; }

  void skipBlanks() { at_ = std::min(text_.find_first_not_of(" \t\r\n", at_), text_.size()); }

  void readMembers(Outline& object, int depth) {
    do {
      ++at_;  // the brace, or a comma
      skipBlanks();
      if (next() != '"') break;
      Outline& member = object.members.emplace_back();
      member.nameAt = at_;
      skipString();
      member.name = decoded(text_.substr(member.nameAt, at_ - member.nameAt));
      skipBlanks();
      if (next() != ':') return;
      ++at_;
      readValue(member, depth + 1);
      skipBlanks();
    } while (next() == ',');
    if (next() == '}') ++at_;
  }

  // A string with its quotes, without what they escape.
  static std::string decoded(const std::string& quoted) {
    const auto value = nlohmann::ordered_json::parse(quoted, nullptr, false);
    return value.is_string() ? value.get<std::string>() : quoted;
  }

  void skipString() {
    for (++at_; at_ < text_.size() && text_[at_] != '"'; ++at_) {
      if (text_[at_] == '\\') ++at_;
    }
    at_ = std::min(at_ + 1, text_.size());
  }

  // Without recursion, however deep it is.
  void skipValue() {
    std::size_t open = 0;
    do {
      if (next() == '"') {
        skipString();
        continue;
      }
      if (next() == '{' || next() == '[') ++open;
      if (next() == '}' || next() == ']') {
        if (open == 0) return;
        --open;
      } else if (open == 0) {
        at_ = std::min(text_.find_first_of(",]} \t\r\n", at_), text_.size());
        return;
      }
      ++at_;
    } while (open > 0 && at_ < text_.size());
  }

  const std::string& text_;
  std::size_t at_ = 0;
};

}  // namespace

const Outline* Outline::find(const std::string& member) const {
  for (auto candidate = members.rbegin(); candidate != members.rend(); ++candidate) {
    if (candidate->name == member) return &*candidate;
  }
  return nullptr;
}

Outline outlineOf(const std::string& json) {
  Outline document;
  Scanner(json).readValue(document, 1);
  return document;
}

}  // namespace velmora::mobile::xplat::cellar::host
