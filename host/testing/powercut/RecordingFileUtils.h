#pragma once

#include <memory>
#include <string>
#include <vector>

#include <cellar/FileUtils.h>
#include <cellar/host/testing/powercut/DiskRecord.h>

namespace velmora::mobile::xplat::cellar::test {

// The real file system, with what is done in one tree recorded. Syncing waits for no disk. Thread-safe.
class RecordingFileUtils final : public FileUtils {
 public:
  explicit RecordingFileUtils(std::shared_ptr<SharedDiskRecord> record) : record_(std::move(record)) {}

  void writeFile(const std::string& path, const std::vector<unsigned char>& data) override;
  void deleteFile(const std::string& path) override;
  void rename(const std::string& from, const std::string& to) override;
  void createDirectory(const std::string& path, bool recursive) override;
  void createSymLink(const std::string& linkPath, const std::string& targetPath) override;
  void createFile(const std::string& path, const std::vector<unsigned char>& data) override;
  void sync(const std::string& path) override;

 private:
  const std::shared_ptr<SharedDiskRecord> record_;
};

}  // namespace velmora::mobile::xplat::cellar::test
