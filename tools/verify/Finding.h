#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// One inconsistency in a store.
struct Finding {
  enum class Kind {
    RecordWithoutFile,
    InterruptedWrite,  // a provisional record, with or without a file
    SizeDiffers,
    InlineValueMissing,
    FileWithoutRecord,
    DamagedManifest,
    DamagedAttributes
  };

  Kind kind;
  std::string directory;       // of the store, or of the attributes
  std::string name;            // the key, or the file below the directory
  std::uint64_t recorded = 0;  // bytes
  std::uint64_t actual = 0;    // bytes
  bool hasFile = false;        // of a record
  std::string detail = {};     // what the database or the parser says
};

using Findings = std::vector<Finding>;

// What is wrong, for people: "record without file: 'sunrise.jpg' (4.0 KB recorded)".
std::string describe(const Finding& finding);

}  // namespace velmora::mobile::xplat::cellar::tools
