#pragma once

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// The survey as text.
void printSurvey(const Survey& survey, Console& console);

}  // namespace velmora::mobile::xplat::cellar::tools
