#include "host/testing/PowerCut.h"

#include <stdexcept>
#include <utility>
#include <vector>

#include "FileUtils.h"
#include "host/testing/powercut/DiskRecord.h"
#include "host/testing/powercut/RecordingFileUtils.h"
#include "host/testing/powercut/RecordingVfs.h"

namespace velmora::mobile::xplat::cellar::test {

namespace {

void throwUnlessUsable(const SharedDiskRecord& record, const std::string& directory) {
  if (record.contains(directory)) {
    throw std::invalid_argument("\"" + directory + "\" is inside the directory whose power is cut");
  }
  FileUtils disk;
  disk.createDirectory(directory, true);
  if (!disk.listDirectory(directory).empty() || !disk.listOtherEntries(directory).empty()) {
    throw std::invalid_argument("\"" + directory + "\" is not empty");
  }
}

// A link into the recorded directory leads into the other one, as it would if that were in the first one's place.
std::string moved(const std::string& target, const std::string& from, const std::string& to) {
  const bool isInside = target == from || target.compare(0, from.size() + 1, from + "/") == 0;
  return isInside ? to + target.substr(from.size()) : target;
}

}  // namespace

PowerCut::PowerCut(const std::string& directory)
    : record_(std::make_shared<SharedDiskRecord>(directory)),
      files_(std::make_shared<RecordingFileUtils>(record_)),
      databases_(std::make_unique<RecordedDatabases>(record_)) {}

PowerCut::~PowerCut() = default;

std::shared_ptr<FileUtils> PowerCut::files() const { return files_; }

void PowerCut::cutInto(const std::string& otherDirectory, std::uint32_t seed) const {
  throwUnlessUsable(*record_, otherDirectory);
  FileUtils disk;
  for (const Remains& remains : record_->afterPowerCut(seed)) {
    const std::string path = disk.combinePath(otherDirectory, remains.path);
    switch (remains.kind) {
      case Node::Kind::File:
        disk.createFile(path, remains.content);
        break;
      case Node::Kind::Directory:
        disk.createDirectory(path, false);
        break;
      case Node::Kind::Link:
        disk.createSymLink(path, moved(remains.target, record_->root(), otherDirectory));
        break;
    }
  }
}

void PowerCut::onOperation(std::function<void()> callback) { record_->setCallback(std::move(callback)); }

}  // namespace velmora::mobile::xplat::cellar::test
