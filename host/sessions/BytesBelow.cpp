#include "host/sessions/BytesBelow.h"

#include <cerrno>
#include <utility>
#include <vector>

#include "FileUtils.h"
#include "LarderException.h"

namespace velmora::mobile::xplat::cellar::host {

std::uint64_t bytesBelow(FileUtils& fileUtils, const std::string& directory) {
  std::uint64_t bytes = 0;
  std::vector<std::string> waiting = {directory};
  while (!waiting.empty()) {
    const std::string path = std::move(waiting.back());
    waiting.pop_back();
    if (fileUtils.isSymLink(path)) continue;
    try {
      for (const FileUtils::Info& entry : fileUtils.listDirectory(path)) {
        if (entry.type == FileUtils::Type::Directory) waiting.push_back(entry.path);
        bytes += static_cast<std::uint64_t>(entry.size);
      }
    } catch (const FileUtilsIoException& error) {
      if (error.code() != ENOENT) throw;
    }
  }
  return bytes;
}

}  // namespace velmora::mobile::xplat::cellar::host
