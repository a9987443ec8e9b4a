#pragma once

#include <string>

#include "check/ConfigurationDocument.h"
#include "check/Remarks.h"
#include "check/Understood.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// What `cellar check` has found out.
struct CheckResult {
  std::string file;
  Understood understood;  // empty when there are faults
  Remarks faults;
  Remarks warnings;
};

void printCheck(const CheckResult& result, Console& console);
OrderedJson checkAsJson(const CheckResult& result);

}  // namespace velmora::mobile::xplat::cellar::tools
