#pragma once

#include <memory>
#include <string>

#include "verify/Finding.h"
#include "verify/Quarantine.h"

namespace velmora::mobile::xplat::cellar {
class SQLiteManifestPersistence;
}

namespace velmora::mobile::xplat::cellar::tools {

// Mends the findings of one store, or of the attributes of one tree, without losing a value. The store must not be in
// use: nothing is mended while another process has its manifest open. Nothing is created, renamed, removed or written
// through a link.
class Repair {
 public:
  // `root` is what paths are named below.
  Repair(std::string root, Quarantine quarantine);
  ~Repair();
  Repair(const Repair&) = delete;
  Repair& operator=(const Repair&) = delete;

  // Mends it; what was done. Throws what went wrong: the finding then remains.
  std::string fix(const Finding& finding);

 private:
  void requireUnused(const std::string& directory) const;
  SQLiteManifestPersistence& manifestOf(const Finding& finding);
  std::string removeRecord(const Finding& finding);
  std::string nameFile(const Finding& finding);
  std::string correctSize(const Finding& finding);
  std::string removeFile(const Finding& finding) const;
  std::string quarantineFile(const Finding& finding);
  std::string quarantineValue(const Finding& finding);
  std::string quarantineStore(const Finding& finding);

  const std::string root_;
  const Quarantine quarantine_;
  std::unique_ptr<SQLiteManifestPersistence> manifest_;  // once a record is to be changed
};

}  // namespace velmora::mobile::xplat::cellar::tools
