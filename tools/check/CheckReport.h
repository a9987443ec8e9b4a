#pragma once

#include <string>

#include "check/ConfigurationDocument.h"
#include "check/Diagnostic.h"
#include "check/ResolvedConfiguration.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// What `cellar check` has found out.
struct CheckResult {
  std::string file;
  ResolvedConfiguration resolved;  // empty when there are faults
  Diagnostics faults;
  Diagnostics warnings;
};

void printWarnings(const CheckResult& result, Console& console);
void printCheck(const CheckResult& result, Console& console);
OrderedJson checkAsJson(const CheckResult& result);

}  // namespace velmora::mobile::xplat::cellar::tools
