#include "host/testing/powercut/RecordingFileUtils.h"

#include <unistd.h>

namespace velmora::mobile::xplat::cellar::test {

// Each operation looks first, to see what was done by other means. What one that fails has left behind is seen by the
// next look.

void RecordingFileUtils::writeFile(const std::string& path, const std::vector<unsigned char>& data) {
  record_->perform([&](DiskRecord& record) {
    (void)record.observeTarget(path);
    FileUtils::writeFile(path, data);
    record.replaced(path, data);
  });
}

void RecordingFileUtils::deleteFile(const std::string& path) {
  record_->perform([&](DiskRecord& record) {
    (void)record.observe(path);
    FileUtils::deleteFile(path);
    (void)record.observe(path);
  });
}

void RecordingFileUtils::rename(const std::string& from, const std::string& to) {
  record_->perform([&](DiskRecord& record) {
    (void)record.observe(from);
    (void)record.observe(to);
    FileUtils::rename(from, to);
    record.renamed(from, to);
  });
}

void RecordingFileUtils::createDirectory(const std::string& path, bool recursive) {
  if (recursive && !path.empty() && !pathExists(path)) createDirectory(parentPath(path), true);
  record_->perform([&](DiskRecord& record) {
    FileUtils::createDirectory(path, false);
    (void)record.observe(path);
  });
}

void RecordingFileUtils::createSymLink(const std::string& linkPath, const std::string& targetPath) {
  record_->perform([&](DiskRecord& record) {
    FileUtils::createSymLink(linkPath, targetPath);
    (void)record.observe(linkPath);
  });
}

void RecordingFileUtils::createFile(const std::string& path, const std::vector<unsigned char>& data) {
  record_->perform([&](DiskRecord& record) {
    (void)record.observe(path);
    FileUtils::createFile(path, data);
    record.replaced(path, data);
  });
}

void RecordingFileUtils::sync(const std::string& path) {
  record_->perform([&](DiskRecord& record) {
    if (::access(path.c_str(), R_OK) != 0) FileUtils::sync(path);  // throws what the system says to it
    record.synced(path);
  });
}

}  // namespace velmora::mobile::xplat::cellar::test
