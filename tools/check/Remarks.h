#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// What is wrong with a configuration, and where.
struct Remark {
  std::string kind;     // one word for machines
  std::string pointer;  // JSON pointer of the value, empty for the whole document
  std::string text;
};

using Remarks = std::vector<Remark>;

}  // namespace velmora::mobile::xplat::cellar::tools
