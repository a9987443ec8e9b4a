#pragma once

#include <string>
#include <vector>

#include "harness/Scratch.h"

namespace velmora::mobile::xplat::cellar::fuzz {

// Runs `cellar tune` on the bytes with these options, and checks all forms of its report.
void checkTune(const Scratch& scratch, const std::string& bytes, const std::vector<std::string>& options);

}  // namespace velmora::mobile::xplat::cellar::fuzz
