#include "verify/Finding.h"

#include "Format.h"
#include "Printable.h"
#include "storage/ReadableNames.h"
#include "storage/SafeFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string bytes(std::uint64_t count) { return formatCount(count, "byte", "bytes"); }

// " of the key 'letter one'" for the file of a safe store whose name has it encoded.
std::string keyNote(const Finding& finding) {
  const auto file = finding.isSafe ? parseSafeFileName(finding.name) : std::nullopt;
  if (!file || !file->key || finding.name.rfind(*file->key + ".", 0) == 0) return "";
  return " of the key '" + printable(*file->key) + "'";
}

std::string describeRecordWithoutFile(const Finding& finding, const std::string& name) {
  const std::string text = "record without file: " + name + " (" + bytes(finding.recorded) + " recorded)";
  return finding.file.empty() ? text : text + ", but '" + printable(finding.file) + "' has a value of the key";
}

std::string describeInterrupted(const Finding& finding, const std::string& name) {
  const std::string text = "interrupted write: " + name;
  return finding.hasFile ? text + " has a file of " + bytes(finding.actual) + ", and a provisional record"
                         : text + " has a provisional record, and no file";
}

}  // namespace

std::string describe(const Finding& finding) {
  const std::string name = "'" + printable(finding.name) + "'";
  switch (finding.kind) {
    case Finding::Kind::RecordWithoutFile:
      return describeRecordWithoutFile(finding, name);
    case Finding::Kind::InterruptedWrite:
      return describeInterrupted(finding, name);
    case Finding::Kind::SizeDiffers:
      return "size differs: " + name + " has " + bytes(finding.actual) + ", recorded are " +
             formatCount(finding.recorded);
    case Finding::Kind::InlineValueMissing:
      return "inline value missing: " + name + " (" + bytes(finding.recorded) + " recorded)";
    case Finding::Kind::DamagedValue:
      return "damaged value: " + name + " (" + bytes(finding.actual) + ") does not have its checksum";
    case Finding::Kind::UnreadableValue:
      return "unreadable value: " + name + ": " + printable(finding.detail);
    case Finding::Kind::FileWithoutRecord:
      return "file without record: " + name + keyNote(finding) + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::SupersededFile:
      return "superseded file: " + name + keyNote(finding) + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::UnfinishedFile:
      return "unfinished file: " + name + keyNote(finding) + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::UnfinishedManifest:
      return "unfinished manifest: " + name + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::InterruptedSalvage:
      return "interrupted salvage: " + name + " is not in its place yet";
    case Finding::Kind::Quarantine:
      return "quarantine: " + name + " has " + formatCount(finding.files, "file", "files") + " (" +
             bytes(finding.actual) + ")";
    case Finding::Kind::DamagedManifest:
      return "damaged manifest: " + printable(finding.detail);
    case Finding::Kind::MissingManifest:
      return "missing manifest: there is no " + name + ", but " + printable(finding.detail);
    case Finding::Kind::ForeignPart:
      return "foreign part: the manifest has the " + printable(finding.detail) + ", which no store uses";
    case Finding::Kind::Unreadable:
      return "cannot be read: " + printable(finding.detail);
    case Finding::Kind::DamagedAttributes:
      break;
  }
  return "damaged attributes: " + name + " is not JSON";
}

const char* textOf(Finding::Kind kind) {
  switch (kind) {
    case Finding::Kind::RecordWithoutFile:
      return "record_without_file";
    case Finding::Kind::InterruptedWrite:
      return "interrupted_write";
    case Finding::Kind::SizeDiffers:
      return "size_differs";
    case Finding::Kind::InlineValueMissing:
      return "inline_value_missing";
    case Finding::Kind::DamagedValue:
      return "damaged_value";
    case Finding::Kind::UnreadableValue:
      return "unreadable_value";
    case Finding::Kind::FileWithoutRecord:
      return "file_without_record";
    case Finding::Kind::SupersededFile:
      return "superseded_file";
    case Finding::Kind::UnfinishedFile:
      return "unfinished_file";
    case Finding::Kind::DamagedManifest:
      return "damaged_manifest";
    case Finding::Kind::MissingManifest:
      return "missing_manifest";
    case Finding::Kind::ForeignPart:
      return "foreign_part";
    case Finding::Kind::UnfinishedManifest:
      return "unfinished_manifest";
    case Finding::Kind::InterruptedSalvage:
      return "interrupted_salvage";
    case Finding::Kind::Quarantine:
      return "quarantine";
    case Finding::Kind::DamagedAttributes:
      return "damaged_attributes";
    case Finding::Kind::Unreadable:
      break;
  }
  return "unreadable";
}

}  // namespace velmora::mobile::xplat::cellar::tools
