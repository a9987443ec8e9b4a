#pragma once

#include <optional>
#include <string>

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

// "caches/_store_alice  media, 3.1 MB of 20.0 MB (16 %)"; printable
std::string titleOf(const ManagerSurvey& manager);

// "50.0 MB", "400 items", "-"
std::string limitText(const StoreSurvey& store);

// "16 %", "-"
std::string percentText(const std::optional<double>& ratio);

}  // namespace velmora::mobile::xplat::cellar::tools
