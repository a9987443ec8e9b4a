#pragma once

#include <cstdint>
#include <string>

#include "SQLiteStore.h"
#include "base/ManifestRow.h"

namespace velmora::mobile::xplat::cellar {

// A manifest that is made of rows, in a file that no store uses yet. It is complete, and on the medium, once `complete`
// has returned. Every operation throws `SQLiteStoreException` when the file cannot be written.
class NewManifest {
 public:
  // There must be no file at `path`.
  explicit NewManifest(const std::string& path);

  // Replaces the row of its key.
  void add(const ManifestRow& row);

  void complete();

 private:
  SQLiteStore store_;
};

}  // namespace velmora::mobile::xplat::cellar
