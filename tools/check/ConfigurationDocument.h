#pragma once

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "host/configuration/Faults.h"

namespace velmora::mobile::xplat::cellar::tools {

// Keeps members in the order of the document.
using OrderedJson = nlohmann::ordered_json;

// A configuration as written, including the keys that the library ignores.
struct ConfigurationDocument {
  std::string text;
  OrderedJson root;                   // of duplicate names, the last
  std::vector<std::string> repeated;  // JSON pointers of those names
};

// Reads the file. Throws `InputError`, naming it, when it cannot be read, is not JSON or is nested too deeply.
ConfigurationDocument readConfigurationDocument(const std::string& path);

// The same from a text. Throws the JSON library's parse errors, and `InputError` for the nesting.
ConfigurationDocument parseConfigurationDocument(const std::string& text);

using host::memberPointer;

}  // namespace velmora::mobile::xplat::cellar::tools
