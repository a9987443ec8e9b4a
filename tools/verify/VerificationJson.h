#pragma once

#include <nlohmann/json.hpp>

#include "verify/Verification.h"

namespace velmora::mobile::xplat::cellar::tools {

// What was found, and done, for machines. Keys do not change between releases; new ones may be added.
nlohmann::ordered_json verificationAsJson(const Layout& layout, const VerificationResult& result);

}  // namespace velmora::mobile::xplat::cellar::tools
