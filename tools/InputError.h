#pragma once

#include <stdexcept>

namespace velmora::mobile::xplat::cellar::tools {

// The user's input is not valid. The text is one line for the user.
class InputError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

}  // namespace velmora::mobile::xplat::cellar::tools
