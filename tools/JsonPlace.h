#pragma once

#include <cstddef>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// A value in a document that this program has written before, and where it is. What is not as expected there throws
// `InputError`, which names the file and the place.
class JsonPlace {
 public:
  // Both must exist as long as the place and those that are made from it.
  JsonPlace(const std::string& file, const nlohmann::json& document) : JsonPlace(file, "", document) {}

  bool has(const std::string& name) const;  // which is not null

  JsonPlace at(const std::string& name) const;
  JsonPlace at(std::size_t index) const;

  std::size_t size() const;     // of an array
  std::size_t members() const;  // of an object
  std::string text() const;
  std::uint64_t count(std::uint64_t least, std::uint64_t most) const;
  double share(double least = 0) const;  // more than 0, at least `least`, at most 1

  [[noreturn]] void fail(const std::string& text) const;

 private:
  JsonPlace(const std::string& file, std::string pointer, const nlohmann::json& value)
      : file_(file), pointer_(std::move(pointer)), value_(value) {}

  const std::string& file_;
  const std::string pointer_;
  const nlohmann::json& value_;
};

// The document in a file. Throws `InputError`, naming the file and where it is not JSON.
nlohmann::json readJsonFile(const std::string& file);

}  // namespace velmora::mobile::xplat::cellar::tools
