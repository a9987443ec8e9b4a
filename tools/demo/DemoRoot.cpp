#include "demo/DemoRoot.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr const char* kMarker = ".cellar-demo";

[[noreturn]] void refuse(const fs::path& root, const std::string& reason) {
  throw InputError("cannot use '" + root.string() + "' as the root: " + reason);
}

std::string makeTemporaryDirectory() {
  std::string path = (fs::temp_directory_path() / "cellar-demo-XXXXXX").string();
  if (mkdtemp(path.data()) == nullptr) refuse(path, std::generic_category().message(errno));
  return path;
}

std::string makeDirectory(const std::string& path) {
  std::error_code error;
  fs::create_directories(path, error);
  if (error) refuse(path, error.message());
  if (!fs::exists(fs::path(path) / kMarker) && !fs::is_empty(path, error)) {
    refuse(path, error ? error.message() : "it is not empty, and no earlier demo made it");
  }
  return fs::canonical(path).string();
}

}  // namespace

DemoRoot::DemoRoot(const std::string& path)
    : isTemporary_(path.empty()), path_(isTemporary_ ? makeTemporaryDirectory() : makeDirectory(path)) {
  lock();
  clear();
}

DemoRoot::~DemoRoot() {
  std::error_code ignored;
  if (isTemporary_) fs::remove_all(path_, ignored);
  if (lock_ >= 0) close(lock_);
}

const std::string& DemoRoot::path() const { return path_; }

bool DemoRoot::isTemporary() const { return isTemporary_; }

void DemoRoot::requireOutside(const std::string& root, const std::string& directory) {
  if (root.empty()) return;
  std::error_code error;
  const fs::path outer = fs::weakly_canonical(root, error);
  const fs::path inner = fs::weakly_canonical(directory, error);
  if (error) return;  // whatever is wrong with them shows when they are used
  const bool isInside = std::mismatch(outer.begin(), outer.end(), inner.begin(), inner.end()).first == outer.end();
  if (isInside) refuse(root, "DIRECTORY '" + directory + "' lies in it and would be cleared");
}

void DemoRoot::lock() {
  const std::string marker = (fs::path(path_) / kMarker).string();
  lock_ = open(marker.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (lock_ < 0) refuse(path_, std::generic_category().message(errno));
  if (flock(lock_, LOCK_EX | LOCK_NB) != 0) {
    close(lock_);
    refuse(path_, "another demo is running there");
  }
}

void DemoRoot::clear() const {
  try {
    for (const fs::directory_entry& entry : fs::directory_iterator(path_)) {
      if (entry.path().filename() != kMarker) fs::remove_all(entry.path());
    }
  } catch (const fs::filesystem_error& error) {
    close(lock_);
    refuse(path_, error.code().message());
  }
}

}  // namespace velmora::mobile::xplat::cellar::tools
