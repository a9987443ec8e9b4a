#pragma once

#include <string>

#include "check/ConfigurationDocument.h"
#include "check/Findings.h"
#include "check/Understood.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// What `cellar check` has found out.
struct CheckResult {
  std::string file;
  Understood understood;  // empty when there are faults
  Findings faults;
  Findings warnings;
};

void printCheck(const CheckResult& result, Console& console);
OrderedJson checkAsJson(const CheckResult& result);

}  // namespace velmora::mobile::xplat::cellar::tools
