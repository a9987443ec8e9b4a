#pragma once

#include <nlohmann/json.hpp>

namespace velmora::mobile::xplat::cellar {

// A dynamic JSON value: null, boolean, 64-bit integer, double, string, array, or object with string keys.
using JsonValue = nlohmann::json;

}  // namespace velmora::mobile::xplat::cellar
