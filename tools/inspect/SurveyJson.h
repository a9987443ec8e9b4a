#pragma once

#include <nlohmann/json.hpp>

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

// The survey as JSON, for machines and for the page. Keys do not change between releases; new ones may be added.
// Unknown values are null.
nlohmann::ordered_json surveyAsJson(const Survey& survey);

}  // namespace velmora::mobile::xplat::cellar::tools
