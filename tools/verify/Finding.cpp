#include "verify/Finding.h"

#include "Format.h"
#include "storage/Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string bytes(std::uint64_t count) { return formatCount(count, "byte", "bytes"); }

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
      return "record without file: " + name + " (" + bytes(finding.recorded) + " recorded)";
    case Finding::Kind::InterruptedWrite:
      return describeInterrupted(finding, name);
    case Finding::Kind::SizeDiffers:
      return "size differs: " + name + " has " + bytes(finding.actual) + ", recorded are " +
             formatCount(finding.recorded);
    case Finding::Kind::InlineValueMissing:
      return "inline value missing: " + name + " (" + bytes(finding.recorded) + " recorded)";
    case Finding::Kind::FileWithoutRecord:
      return "file without record: " + name + " (" + bytes(finding.actual) + ")";
    case Finding::Kind::DamagedManifest:
      return "damaged manifest: " + printable(finding.detail);
    case Finding::Kind::DamagedAttributes:
      break;
  }
  return "damaged attributes: " + name + " is not JSON";
}

}  // namespace velmora::mobile::xplat::cellar::tools
