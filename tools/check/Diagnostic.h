#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// What is wrong with a configuration, and where.
struct Diagnostic {
  std::string kind;     // one word for machines
  std::string pointer;  // JSON pointer of the value, empty for the whole document
  std::string text;
};

using Diagnostics = std::vector<Diagnostic>;

}  // namespace velmora::mobile::xplat::cellar::tools
