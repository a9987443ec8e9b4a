#include "JsonPlace.h"

#include <algorithm>

#include "InputError.h"
#include "TextFile.h"

namespace velmora::mobile::xplat::cellar::tools {

bool JsonPlace::has(const std::string& name) const {
  if (!value_.is_object()) fail("is not an object");
  const auto found = value_.find(name);
  return found != value_.end() && !found->is_null();
}

JsonPlace JsonPlace::at(const std::string& name) const {
  if (!value_.is_object()) fail("is not an object");
  const auto found = value_.find(name);
  if (found == value_.end()) fail("has no '" + name + "'");
  return {file_, pointer_ + "/" + name, *found};
}

JsonPlace JsonPlace::at(std::size_t index) const {
  return {file_, pointer_ + "/" + std::to_string(index), value_[index]};
}

std::size_t JsonPlace::size() const {
  if (!value_.is_array()) fail("is not an array");
  return value_.size();
}

std::size_t JsonPlace::members() const {
  if (!value_.is_object()) fail("is not an object");
  return value_.size();
}

std::string JsonPlace::text() const {
  if (!value_.is_string()) fail("is not a text");
  return value_.get<std::string>();
}

std::uint64_t JsonPlace::count(std::uint64_t least, std::uint64_t most) const {
  if (!value_.is_number_integer() || value_ < least || value_ > most) {
    fail("is not a whole number from " + std::to_string(least) + " to " + std::to_string(most));
  }
  return value_.get<std::uint64_t>();
}

double JsonPlace::share(double least) const {
  const double share = value_.is_number() ? value_.get<double>() : 0;
  if (share > 0 && share >= least && share <= 1) return share;
  fail(least > 0 ? "is not a share from " + nlohmann::json(least).dump() + " to 1"
                 : "is not a share of more than 0 and at most 1");
}

void JsonPlace::fail(const std::string& text) const {
  throw InputError(file_ + ": " + (pointer_.empty() ? "" : pointer_ + ": ") + text);
}

nlohmann::json readJsonFile(const std::string& file) {
  const std::string text = readTextFile(file);
  if (text.empty()) throw InputError(file + ": is empty");
  try {
    return nlohmann::json::parse(text);
  } catch (const nlohmann::json::exception& error) {
    const std::string what = error.what();
    throw InputError(file + ": " + what.substr(std::min(what.size(), what.find("] ") + 2)));
  }
}

}  // namespace velmora::mobile::xplat::cellar::tools
