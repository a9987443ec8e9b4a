#include "verify/Verification.h"

#include <exception>
#include <filesystem>
#include <memory>

#include "LarderException.h"
#include "Printable.h"
#include "storage/Layout.h"
#include "storage/TemporaryFolder.h"
#include "verify/HostLocks.h"
#include "verify/Quarantine.h"
#include "verify/Repair.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Beside the managers' directories, or beside the directory of a store that is verified alone.
Quarantine quarantineFor(const Layout& layout, const ManagerPlace& manager) {
  const bool standsByItself = layout.kind == Layout::Kind::Store && manager.name.empty();
  return Quarantine(standsByItself ? manager.path : std::filesystem::path(manager.path).parent_path().string());
}

std::string reasonOf(const std::exception& error) {
  if (const auto* own = dynamic_cast<const LarderException*>(&error)) return own->description();
  return error.what();
}

class Verifier {
 public:
  Verifier(const Layout& layout, bool repair, const OnFile& onFile, const OnLine& onLine)
      : layout_(layout), repair_(repair), onFile_(onFile), onLine_(onLine) {}

  VerificationResult run() {
    for (const Unreadable& part : layout_.unreadable) settle({findingOf(part)}, Quarantine(layout_.root));
    for (const ManagerPlace& manager : layout_.managers) {
      const Quarantine quarantine = quarantineFor(layout_, manager);
      for (const StorePlace& store : manager.stores) {
        ++result_.stores;
        settle(checkStore(store, temporary_.path(), onFile_), quarantine);
        settle(checkAttributes(store.path), quarantine);
      }
    }
    return result_;
  }

 private:
  void settle(const Findings& findings, const Quarantine& quarantine) {
    Repair repair(layout_.root, quarantine);
    for (const Finding& finding : findings) {
      ++result_.findings;
      std::string line = printable(relativeTo(layout_.root, finding.directory)) + ": " + describe(finding);
      if (repair_) line += "; " + fix(repair, finding);
      onLine_(line);
    }
  }

  std::string fix(Repair& repair, const Finding& finding) {
    try {
      std::string done = repair.fix(finding);
      ++result_.repaired;
      return done;
    } catch (const std::exception& error) {
      return "NOT REPAIRED: " + printable(reasonOf(error));
    }
  }

  const Layout& layout_;
  const bool repair_;
  const OnFile& onFile_;
  const OnLine& onLine_;
  const TemporaryFolder temporary_;
  VerificationResult result_;
};

}  // namespace

VerificationResult verify(const Layout& layout, bool repair, const OnFile& onFile, const OnLine& onLine) {
  std::unique_ptr<const HostLocks> locks;
  if (repair) locks = std::make_unique<const HostLocks>(layout.root);
  VerificationResult result = Verifier(layout, repair, onFile, onLine).run();
  result.isLocked = locks != nullptr && locks->areThere();
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::tools
