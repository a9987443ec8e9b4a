#include "verify/Quarantine.h"

#include <filesystem>
#include <utility>

#include "FileUtils.h"
#include "storage/Layout.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

// The path itself, or the next one of its kind that is free: "sunrise.jpg.1".
fs::path freePath(const fs::path& wanted) {
  fs::path path = wanted;
  int number = 0;
  while (fs::exists(fs::symlink_status(path))) path = wanted.string() + "." + std::to_string(++number);
  return path;
}

}  // namespace

Quarantine::Quarantine(std::string base) : base_(std::move(base)) {}

std::string Quarantine::take(const std::string& path) const {
  std::string target = placeFor(path);
  fs::rename(path, target);
  return target;
}

std::string Quarantine::keep(const std::string& path, const std::vector<unsigned char>& bytes) const {
  std::string target = placeFor(path);
  FileUtils().createFile(target, bytes);
  return target;
}

std::string Quarantine::placeFor(const std::string& path) const {
  const fs::path wanted = fs::path(base_) / kQuarantineName / fs::path(path).lexically_relative(base_);
  fs::create_directories(wanted.parent_path());
  return freePath(wanted).string();
}

}  // namespace velmora::mobile::xplat::cellar::tools
