#pragma once

#include <string>

#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {

// "12.34 %"
std::string percent(double part);

// Which strategy and which limit, by which rule, and what that brings; or that the log is too short for advice.
std::string adviceText(const Tuning& tuning);

// What the present limit costs, and what another strategy would bring within it; empty without one.
std::string costText(const Tuning& tuning);

// How sure the hit rates are; empty where that cannot be told.
std::string certaintyText(const Tuning& tuning);

// From what the figures are estimated, and how far they may differ from those of the whole log; empty without a sample.
std::string sampleText(const Tuning& tuning);

}  // namespace velmora::mobile::xplat::cellar::tools
