#pragma once

#include <string>

#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {

// The version of the document that `tune --json` writes. It changes with the meaning of a field.
constexpr int kTuneFormat = 1;

// What `tune --json` has written of one device.
struct DeviceTuning {
  std::string store;
  Tuning tuning;  // without what the document does not have: the parts, the groups and the curve
};

// Throws `InputError`, naming the file and the place, for what is not such a document, or not of this version, and for
// figures that cannot be.
DeviceTuning readTuneDocument(const std::string& file);

}  // namespace velmora::mobile::xplat::cellar::tools
