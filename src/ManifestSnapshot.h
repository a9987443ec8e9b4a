#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Export.h"

namespace velmora::mobile::xplat::cellar {

class ExtendedMetadataFactory;
class FileUtils;

// What the manifest of a store's directory says, without opening the store: for tools that look at a directory, not for
// applications. The manifest is copied, with the write-ahead log beside it, and only the copy is ever opened: nothing
// in the store's directory is written, created, locked or checkpointed, no other file is read and no access date moves.
//
// A store may be running meanwhile. The snapshot then holds what had been committed at one moment; access dates that
// still wait in the store's memory are not in it. One thread at a time.
class CELLAR_EXPORT ManifestSnapshot {
 public:
  static const std::string manifestName;  // "manifest_v1.sqlite", in a store's directory

  struct CELLAR_EXPORT Record {
    DiskCacheItem item;                       // with the checksum that a safe store has given it
    std::optional<std::uint64_t> inlineSize;  // bytes of the value in the manifest; empty when there is none
  };

  // Takes the copy, into a directory of its own within `temporaryDirectory`, which must exist. The manifest stands in
  // memory while it is copied. Throws `FileUtilsIoException` for what cannot be read or written, and
  // `ManifestPersistenceException` (code 0) when the manifest of a running store never stood still.
  ManifestSnapshot(const std::string& storeDirectory, const std::string& temporaryDirectory,
                   std::shared_ptr<FileUtils> fileUtils);

  // Removes the copy. A failure is one error line in the log.
  ~ManifestSnapshot();
  ManifestSnapshot(const ManifestSnapshot&) = delete;
  ManifestSnapshot& operator=(const ManifestSnapshot&) = delete;

  // Every record, in no order. Without a metadata factory (null) metadata is left out. Throws
  // `ManifestPersistenceException` for what `integrityErrors` finds. Not an error: an empty file.
  std::vector<Record> records(std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory) const;

  // Whether the manifest has the column for checksums, which a safe or synced store adds and every store then keeps.
  // Throws as `records`.
  bool hasChecksums() const;

  // Calls `onValue` with each value that is in the manifest, in no order, on this thread. What it throws passes
  // through. Throws as `records`. Not an error: an empty file.
  void forEachInlineValue(
      const std::function<void(const std::string& key, const std::vector<unsigned char>& value)>& onValue) const;

  // What SQLite's integrity check, or opening the manifest as a store does, finds wrong with it, a line each; empty for
  // a sound one. Tables that somebody else has made are not checked: that may take any time and memory.
  std::vector<std::string> integrityErrors() const;

  // What somebody else has put into the database: "trigger 'name'", "view 'name'", "table 'name'". A store uses none of
  // it. Throws `ManifestPersistenceException` for a damaged manifest.
  std::vector<std::string> foreignParts() const;

 private:
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::string directory_;  // the snapshot's own
  const std::string path_;       // the copy
};

}  // namespace velmora::mobile::xplat::cellar
