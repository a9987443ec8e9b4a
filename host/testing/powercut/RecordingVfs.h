#pragma once

#include <memory>

#include <cellar/host/testing/powercut/DiskRecord.h>

namespace velmora::mobile::xplat::cellar::test {

// While one of these lives, SQLite's default file layer records what is done in its tree. The layer is one for the
// process; it is there from the first of these to the last. Syncing waits for no disk.
class RecordedDatabases {
 public:
  // Throws std::runtime_error if SQLite does not take the layer.
  explicit RecordedDatabases(std::shared_ptr<SharedDiskRecord> record);
  RecordedDatabases(const RecordedDatabases&) = delete;
  RecordedDatabases& operator=(const RecordedDatabases&) = delete;
  ~RecordedDatabases();

 private:
  const std::shared_ptr<SharedDiskRecord> record_;
};

}  // namespace velmora::mobile::xplat::cellar::test
