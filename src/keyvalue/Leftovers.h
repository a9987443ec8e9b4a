#pragma once

#include <memory>
#include <string>
#include <unordered_set>
#include <vector>

#include "keyvalue/StoreContext.h"
#include "keyvalue/VersionedFiles.h"

namespace velmora::mobile::xplat::cellar {

class FileQueue;
class StoreManifest;
class ValueFiles;

// Removes, once a safe store is loaded, the files that no record names: of writes that were not completed and of values
// that were replaced or removed when the process was killed. Where the manifest has lost the record of a value instead,
// the value is kept.
class Leftovers {
 public:
  Leftovers(StoreContext& context, StoreManifest& manifest, FileQueue& fileQueue, ValueFiles& files,
            VersionedFiles& versions)
      : context_(context), manifest_(manifest), fileQueue_(fileQueue), files_(files), versions_(versions) {}

  // Called on the work queue.
  void remove();

 private:
  using Files = std::vector<VersionedFiles::Found>;

  void list();
  void removeAmong(const Files& files, std::vector<std::string> unfinished);
  std::unordered_set<std::string> namesInRecords();
  bool isManifestSound();
  Files withoutRecord(const std::unordered_set<std::string>& named, const Files& files,
                      std::vector<std::string>& superseded);
  bool hasItsFile(const DiskCacheItem& item) const;
  bool adopt(const VersionedFiles::Found& file);
  void deleteFiles(const std::vector<std::string>& names);

  StoreContext& context_;
  StoreManifest& manifest_;
  FileQueue& fileQueue_;
  ValueFiles& files_;
  VersionedFiles& versions_;
};

}  // namespace velmora::mobile::xplat::cellar
