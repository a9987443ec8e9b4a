#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "verify/Finding.h"
#include "verify/StoreCheck.h"

namespace velmora::mobile::xplat::cellar::tools {

class ConfiguredStores;
struct Layout;

struct SettledFinding {
  Finding finding;
  std::string path;     // below the root
  std::string outcome;  // of the repair, or empty
  bool isRepaired = false;
};

struct VerificationResult {
  std::uint64_t stores = 0;
  std::uint64_t findings = 0;
  std::uint64_t repaired = 0;
  std::vector<SettledFinding> all;
  bool isLocked = false;  // while repairing: the hosts' locks were there, and held
};

using OnLine = std::function<void(const std::string& line)>;  // one finding, with what was done about it

// Checks every store in the layout, and repairs what it finds if `repair` is set. What cannot be read is a finding.
// Repairs only under the locks of the host: throws `InputError`, with the owner's process id, when one is held. A root
// without a lock file is repaired without a lock.
VerificationResult verify(const Layout& layout, bool repair, const OnFile& onFile, const OnLine& onLine);

// The same, knowing which stores are to have a manifest.
VerificationResult verify(const Layout& layout, const ConfiguredStores& configured, bool repair, const OnFile& onFile,
                          const OnLine& onLine);

}  // namespace velmora::mobile::xplat::cellar::tools
