#pragma once

#include <stdexcept>

namespace velmora::mobile::xplat::cellar::tools {

// What the user gave cannot be worked with. The text is one line for them.
class InputError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

}  // namespace velmora::mobile::xplat::cellar::tools
