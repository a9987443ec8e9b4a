#pragma once

#include <array>
#include <string>
#include <vector>

#include "tune/Fleet.h"
#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {

// For how many percent of the devices it is said which limit is enough.
constexpr std::array<unsigned, 4> kShownPercentiles = {50, 90, 95, 99};

// How many devices there are, and for how many of them which limit is enough with each strategy.
std::vector<std::string> fleetTexts(const Fleet& fleet, const Tuning& tuning);

}  // namespace velmora::mobile::xplat::cellar::tools
