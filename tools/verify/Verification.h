#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "verify/StoreCheck.h"

namespace velmora::mobile::xplat::cellar::tools {

struct Layout;

struct VerificationResult {
  std::uint64_t stores = 0;
  std::uint64_t findings = 0;
  std::uint64_t repaired = 0;
};

using OnLine = std::function<void(const std::string& line)>;  // one finding, with what was done about it

// Checks every store in the layout, and repairs what it finds if `repair` is set. What cannot be read is a finding.
VerificationResult verify(const Layout& layout, bool repair, const OnFile& onFile, const OnLine& onLine);

}  // namespace velmora::mobile::xplat::cellar::tools
