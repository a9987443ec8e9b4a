#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::host {

// Where the parts of a configuration stand in its text: the document, or a member of an object. Offsets in bytes.
struct Outline {
  std::string name{};      // of a member
  std::size_t nameAt = 0;  // its first quote
  std::size_t begin = 0;   // of the value
  std::size_t end = 0;
  bool isObject = false;
  std::vector<Outline>
      members{};  // in the order of the text, those of one name included; none below a store's own keys

  // The last member of that name, which is the one that counts; null if there is none.
  const Outline* find(const std::string& member) const;
};

// The outline of a text that is JSON. Of any other text it has what could be told.
Outline outlineOf(const std::string& json);

}  // namespace velmora::mobile::xplat::cellar::host
