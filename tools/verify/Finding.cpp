#include "verify/Finding.h"

#include "Format.h"
#include "Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string bytes(std::uint64_t count) { return formatCount(count, "byte", "bytes"); }

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
      return "file without record: " + name + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::SupersededFile:
      return "superseded file: " + name + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::UnfinishedFile:
      return "unfinished file: " + name + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::UnfinishedManifest:
      return "unfinished manifest: " + name + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::InterruptedSalvage:
      return "interrupted salvage: " + name + " is not in its place yet";
    case Finding::Kind::Quarantine:
      return "quarantine: " + name + " has " + formatCount(finding.files, "file", "files") + " (" +
             bytes(finding.actual) + ")";
    case Finding::Kind::DamagedManifest:
      return "damaged manifest: " + printable(finding.detail);
    case Finding::Kind::Unreadable:
      return "cannot be read: " + printable(finding.detail);
    case Finding::Kind::DamagedAttributes:
      break;
  }
  return "damaged attributes: " + name + " is not JSON";
}

}  // namespace velmora::mobile::xplat::cellar::tools
