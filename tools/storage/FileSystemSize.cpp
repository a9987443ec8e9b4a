#include "storage/FileSystemSize.h"

#include "FileUtils.h"
#include "Format.h"
#include "InputError.h"
#include "LarderException.h"
#include "StoreManagerImpl.h"

namespace velmora::mobile::xplat::cellar::tools {

std::int64_t fileSystemSize(const std::string& directory, FileUtils& fileUtils) {
  try {
    return fileUtils.getDiskSpace(directory).total;
  } catch (const LarderException& error) {
    throw InputError(error.description());
  }
}

bool isTooSmall(std::int64_t fileSystemBytes) {
  return fileSystemBytes < StoreManagerImpl::kCleanseMinimumFreeSizeTrash;
}

std::string tooSmallText(std::int64_t fileSystemBytes) {
  return "the whole file system has " + formatSize(static_cast<std::uint64_t>(fileSystemBytes)) + ", less than " +
         formatSize(static_cast<std::uint64_t>(StoreManagerImpl::kCleanseMinimumFreeSizeTrash)) +
         ": at every start, managers discard all that is stored there, documents too";
}

}  // namespace velmora::mobile::xplat::cellar::tools
