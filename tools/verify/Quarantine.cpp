#include "verify/Quarantine.h"

#include <filesystem>
#include <utility>

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
  const fs::path wanted = fs::path(base_) / kQuarantineName / fs::path(path).lexically_relative(base_);
  fs::create_directories(wanted.parent_path());
  const fs::path target = freePath(wanted);
  fs::rename(path, target);
  return target.string();
}

}  // namespace velmora::mobile::xplat::cellar::tools
