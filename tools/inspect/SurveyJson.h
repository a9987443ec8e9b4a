#pragma once

#include <nlohmann/json.hpp>

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

// The survey for machines, and for the page. Keys stay as they are from release to release; new ones may come. What is
// not known is null.
nlohmann::ordered_json surveyAsJson(const Survey& survey);

}  // namespace velmora::mobile::xplat::cellar::tools
