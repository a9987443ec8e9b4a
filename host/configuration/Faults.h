#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar::host {

// Why the library refuses a configuration, and where.
struct ConfigurationFault {
  std::string pointer;  // JSON pointer of the value; empty for the whole document
  std::size_t at;       // where that begins in the text, or a name that is used twice; in bytes
  std::string text;     // in the words of the library's parser, except where they do not say what is wrong
};

// All faults, in the order in which the library meets managers and stores. Empty if it accepts the document; never
// empty otherwise.
CELLAR_EXPORT std::vector<ConfigurationFault> faultsOf(const std::string& json);

// The JSON pointer of a member of what `pointer` points at.
CELLAR_EXPORT std::string memberPointer(const std::string& pointer, const std::string& name);

}  // namespace velmora::mobile::xplat::cellar::host
