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
    DamagedValue,     // it is there, but its checksum differs
    UnreadableValue,  // so that nobody knows whether it is damaged
    FileWithoutRecord,
    SupersededFile,  // of a safe store: without a record, and its key has another value
    UnfinishedFile,  // of a safe store: its writer was killed
    DamagedManifest,
    MissingManifest,     // of a store with keys
    ForeignPart,         // of a manifest: a trigger, a view, a table
    UnfinishedManifest,  // a safe store was killed while it made it,
    InterruptedSalvage,  // or before it put it in place
    Quarantine,          // of a safe store: what it could not use
    DamagedAttributes,
    Unreadable  // `directory` is its path, whatever it is
  };

  Kind kind;
  std::string directory;       // of the store, or of the attributes
  std::string name;            // the key, or the file below the directory
  std::uint64_t recorded = 0;  // bytes
  std::uint64_t actual = 0;    // bytes
  bool hasFile = false;        // of a record
  bool isSafe = false;         // the store keeps checksums
  std::string detail = {};     // what the database, the parser or the system says
  std::string file =
      {};  // of a record without its file: another one with a value of the key; of a damaged value: its file
  std::uint64_t files = 0;  // in a quarantine
};

using Findings = std::vector<Finding>;

// What is wrong, for people: "record without file: 'sunrise.jpg' (4.0 KB recorded)".
std::string describe(const Finding& finding);

// Of its kind, for machines: "record_without_file".
const char* textOf(Finding::Kind kind);

}  // namespace velmora::mobile::xplat::cellar::tools
