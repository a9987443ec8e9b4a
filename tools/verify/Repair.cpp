#include "verify/Repair.h"

#include <sys/types.h>

#include <filesystem>
#include <stdexcept>
#include <utility>

#include "EncodedFileName.h"
#include "Format.h"
#include "ManifestSnapshot.h"
#include "Printable.h"
#include "SQLiteManifestPersistence.h"
#include "storage/Layout.h"
#include "storage/SafeFiles.h"
#include "storage/StoreFiles.h"
#include "verify/Beneath.h"

namespace velmora::mobile::xplat::cellar::tools {

Repair::Repair(std::string root, Quarantine quarantine) : root_(std::move(root)), quarantine_(std::move(quarantine)) {}

Repair::~Repair() = default;

std::string Repair::fix(const Finding& finding) {
  if (finding.kind != Finding::Kind::Unreadable) requireUnused(finding.directory);
  switch (finding.kind) {
    case Finding::Kind::RecordWithoutFile:
      return finding.file.empty() ? removeRecord(finding) : nameFile(finding);
    case Finding::Kind::InlineValueMissing:
      return removeRecord(finding);
    case Finding::Kind::InterruptedWrite:
      return finding.hasFile ? correctSize(finding) : removeRecord(finding);
    case Finding::Kind::SizeDiffers:
      return correctSize(finding);
    case Finding::Kind::DamagedValue:
      return quarantineValue(finding);
    case Finding::Kind::SupersededFile:
    case Finding::Kind::UnfinishedFile:
    case Finding::Kind::UnfinishedManifest:
      return removeFile(finding);
    case Finding::Kind::DamagedManifest:
      if (finding.isSafe) throw std::runtime_error("the store salvages it at its next start, if it is safe or synced");
      return quarantineStore(finding);
    case Finding::Kind::MissingManifest:
      throw std::runtime_error("a safe store adopts its values when it is opened, another one begins empty");
    case Finding::Kind::ForeignPart:
      throw std::runtime_error("whoever put it there may need it");
    case Finding::Kind::InterruptedSalvage:
      throw std::runtime_error("the store puts it in its place at its next start");
    case Finding::Kind::UnreadableValue:
    case Finding::Kind::Unreadable:
      throw std::runtime_error("it may be readable later");
    case Finding::Kind::Quarantine:
      throw std::runtime_error("look at what is in it, and remove it yourself");
    case Finding::Kind::FileWithoutRecord:
    case Finding::Kind::DamagedAttributes:
      break;
  }
  return quarantineFile(finding);
}

// The program's own connection would be taken for that of an application, which is why it is looked for before.
void Repair::requireUnused(const std::string& directory) const {
  if (manifest_ != nullptr) return;
  const Beneath store(root_, relativeTo(root_, directory));
  const pid_t user = store.userOfDatabase(ManifestSnapshot::manifestName);
  if (user != 0) throw std::runtime_error("process " + std::to_string(user) + " has the store open");
}

SQLiteManifestPersistence& Repair::manifestOf(const Finding& finding) {
  if (manifest_ == nullptr) {
    const Beneath store(root_, relativeTo(root_, finding.directory));
    for (const std::string& name : manifestFiles()) store.requireOwn(name);
    const std::string path = finding.directory + "/" + ManifestSnapshot::manifestName;
    const Durability durability = finding.isSafe ? Durability::Safe : Durability::Relaxed;
    manifest_ = std::make_unique<SQLiteManifestPersistence>(path, nullptr, nullptr, durability);
  }
  return *manifest_;
}

std::string Repair::removeRecord(const Finding& finding) {
  manifestOf(finding).removeItem(finding.name);
  return "record removed";
}

// As a safe store does itself when it starts.
std::string Repair::nameFile(const Finding& finding) {
  const auto name = parseSafeFileName(finding.file);
  const auto item = manifestOf(finding).getItem(finding.name);
  if (!name || item == nullptr) throw std::runtime_error("the record has changed meanwhile");
  item->filename = finding.file;
  item->size = static_cast<std::uint32_t>(finding.actual);
  item->checksum = name->checksum;
  manifestOf(finding).storeItem(*item, nullptr);
  return "file recorded";
}

// The checksum of the record remains true: a value that does not have it is never given a size.
std::string Repair::correctSize(const Finding& finding) {
  manifestOf(finding).setSize(finding.name, static_cast<std::uint32_t>(finding.actual));
  return "size recorded";
}

std::string Repair::quarantineFile(const Finding& finding) {
  const std::string now = quarantine_.take(finding.directory + "/" + finding.name);
  return "moved to " + printable(relativeTo(root_, now));
}

// Of a write that was never acknowledged, or of a value that another one has replaced.
std::string Repair::removeFile(const Finding& finding) const {
  const std::filesystem::path path = std::filesystem::path(finding.directory) / finding.name;
  Beneath(root_, relativeTo(root_, path.parent_path().string())).remove(path.filename().string());
  return "file removed";
}

// What is left of it, and then its record.
std::string Repair::quarantineValue(const Finding& finding) {
  std::string now;
  if (finding.hasFile) {
    if (finding.file.rfind("..", 0) == 0) throw std::runtime_error("its file is outside of the store's directory");
    now = quarantine_.take(finding.directory + "/" + finding.file);
  } else {
    now = quarantine_.keep(finding.directory + "/" + encodeFileName(finding.name),
                           manifestOf(finding).getInlineData(finding.name));
  }
  return "moved to " + printable(relativeTo(root_, now)) + ", " + removeRecord(finding);
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
