#include "check/Faults.h"

#include <string>

#include "host/configuration/Faults.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kKind = "refused";

// "[json.exception.type_error.302] type must be string" has a first part that is of no use to a reader.
std::string withoutLibraryName(const std::string& text) {
  const std::size_t end = text.find("] ");
  return text.rfind("[json.exception.", 0) == 0 && end != std::string::npos ? text.substr(end + 2) : text;
}

}  // namespace

Diagnostics findFaults(const ConfigurationDocument& document) {
  Diagnostics findings;
  for (const host::ConfigurationFault& fault : host::faultsOf(document.text)) {
    findings.push_back({kKind, fault.pointer, withoutLibraryName(fault.text)});
  }
  return findings;
}

}  // namespace velmora::mobile::xplat::cellar::tools
