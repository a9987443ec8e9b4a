#include "verify/Verification.h"

#include <exception>
#include <filesystem>
#include <memory>
#include <utility>

#include "LarderException.h"
#include "Printable.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "storage/ReadableNames.h"
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
  Verifier(const Layout& layout, const ConfiguredStores& configured, bool repair, const OnFile& onFile,
           const OnLine& onLine)
      : layout_(layout), configured_(configured), repair_(repair), onFile_(onFile), onLine_(onLine) {}

  VerificationResult run() {
    for (const Unreadable& part : layout_.unreadable) settle({findingOf(part)}, Quarantine(layout_.root));
    for (const ManagerPlace& manager : layout_.managers) {
      const Quarantine quarantine = quarantineFor(layout_, manager);
      for (const StorePlace& store : manager.stores) {
        ++result_.stores;
        settle(checkStore(store, configured(manager, store), temporary_.path(), onFile_), quarantine);
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
      SettledFinding settled{finding, relativeTo(layout_.root, finding.directory), "", false};
      std::string line = printable(settled.path + sessionNote(settled.path)) + ": " + describe(finding);
      if (repair_) {
        const std::uint64_t before = result_.repaired;
        settled.outcome = fix(repair, finding);
        settled.isRepaired = result_.repaired > before;
        line += "; " + settled.outcome;
      }
      onLine_(line);
      result_.all.push_back(std::move(settled));
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

  Configured configured(const ManagerPlace& manager, const StorePlace& store) const {
    const auto definition = configured_.find(manager, store.name).definition;
    if (definition == nullptr) return {};
    return {definition->type != StoreDefinition::Type::Unmanaged, durabilityOf(*definition) != Durability::Relaxed};
  }

  const Layout& layout_;
  const ConfiguredStores& configured_;
  const bool repair_;
  const OnFile& onFile_;
  const OnLine& onLine_;
  const TemporaryFolder temporary_;
  VerificationResult result_;
};

}  // namespace

VerificationResult verify(const Layout& layout, bool repair, const OnFile& onFile, const OnLine& onLine) {
  return verify(layout, ConfiguredStores(), repair, onFile, onLine);
}

VerificationResult verify(const Layout& layout, const ConfiguredStores& configured, bool repair, const OnFile& onFile,
                          const OnLine& onLine) {
  std::unique_ptr<const HostLocks> locks;
  if (repair) locks = std::make_unique<const HostLocks>(layout.root);
  VerificationResult result = Verifier(layout, configured, repair, onFile, onLine).run();
  result.isLocked = locks != nullptr && locks->areThere();
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::tools
