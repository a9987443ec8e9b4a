#include "verify/HostLocks.h"

#include <filesystem>
#include <system_error>

#include "InputError.h"
#include "LarderException.h"
#include "host/RootLock.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr int kLevels = 5;  // ROOT/_cellar_accounts/of_alice/caches/_store_alice/thumbs_v1

}  // namespace

HostLocks::HostLocks(const std::string& directory) {
  fs::path root = directory;
  for (int level = 0; level <= kLevels && root != root.root_path(); ++level, root = root.parent_path()) {
    std::error_code error;
    const auto type = fs::symlink_status(root / host::RootLock::fileName, error).type();
    if (type == fs::file_type::not_found) continue;
    try {
      locks_.push_back(std::make_unique<const host::RootLock>(root.string()));
    } catch (const FileUtilsIoException& locked) {
      throw InputError(std::string("cannot repair: ") + locked.description());
    }
  }
}

HostLocks::~HostLocks() = default;

}  // namespace velmora::mobile::xplat::cellar::tools
