#include "storage/TemporaryFolder.h"

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string makeFolder(const std::string& name) {
  std::error_code error;
  const std::filesystem::path parent = std::filesystem::temp_directory_path(error);
  std::string path = (parent / (name + "-XXXXXX")).string();
  if (error || mkdtemp(path.data()) == nullptr) {
    throw InputError("cannot create the temporary directory '" + path +
                     "': " + (error ? error.message() : std::generic_category().message(errno)));
  }
  return path;
}

}  // namespace

TemporaryFolder::TemporaryFolder(const std::string& name) : path_(makeFolder(name)) {}

TemporaryFolder::~TemporaryFolder() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

}  // namespace velmora::mobile::xplat::cellar::tools
