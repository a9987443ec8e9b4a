#include "verify/Repair.h"

#include <utility>

#include "Format.h"
#include "ManifestSnapshot.h"
#include "SQLiteManifestPersistence.h"
#include "storage/Layout.h"
#include "storage/Printable.h"
#include "storage/StoreFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

Repair::Repair(std::string root, Quarantine quarantine) : root_(std::move(root)), quarantine_(std::move(quarantine)) {}

Repair::~Repair() = default;

std::string Repair::fix(const Finding& finding) {
  switch (finding.kind) {
    case Finding::Kind::RecordWithoutFile:
    case Finding::Kind::InlineValueMissing:
      return removeRecord(finding);
    case Finding::Kind::InterruptedWrite:
      return finding.hasFile ? correctSize(finding) : removeRecord(finding);
    case Finding::Kind::SizeDiffers:
      return correctSize(finding);
    case Finding::Kind::DamagedManifest:
      return quarantineStore(finding);
    case Finding::Kind::FileWithoutRecord:
    case Finding::Kind::DamagedAttributes:
      break;
  }
  return quarantineFile(finding);
}

SQLiteManifestPersistence& Repair::manifestOf(const Finding& finding) {
  if (manifest_ == nullptr) {
    const std::string path = finding.directory + "/" + ManifestSnapshot::manifestName;
    manifest_ = std::make_unique<SQLiteManifestPersistence>(path, nullptr, nullptr);
  }
  return *manifest_;
}

std::string Repair::removeRecord(const Finding& finding) {
  manifestOf(finding).removeItem(finding.name);
  return "record removed";
}

std::string Repair::correctSize(const Finding& finding) {
  manifestOf(finding).setSize(finding.name, static_cast<std::uint32_t>(finding.actual));
  return "size recorded";
}

std::string Repair::quarantineFile(const Finding& finding) {
  const std::string now = quarantine_.take(finding.directory + "/" + finding.name);
  return "moved to " + printable(relativeTo(root_, now));
}

// It is no longer known which values its files contain: they are kept together with it.
std::string Repair::quarantineStore(const Finding& finding) {
  std::string manifest;
  std::uint64_t others = 0;
  for (const Entry& entry : listUntouched(finding.directory)) {
    if (isAttributesFile(entry)) continue;
    const std::string now = quarantine_.take(finding.directory + "/" + entry.name);
    if (entry.name == ManifestSnapshot::manifestName) manifest = now;
    if (!isManifestFile(entry.name)) ++others;
  }
  return "moved to " + printable(relativeTo(root_, manifest)) +
         (others == 0 ? "" : ", with " + formatCount(others, "file", "files") + " of values");
}

}  // namespace velmora::mobile::xplat::cellar::tools
