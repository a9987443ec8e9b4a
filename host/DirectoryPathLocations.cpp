#include "host/DirectoryPathLocations.h"

#include <stdexcept>
#include <utility>

namespace velmora::mobile::xplat::cellar::host {

namespace {

std::string directoryName(Area area) {
  switch (area) {
    case Area::Caches:
      return "caches";
    case Area::Documents:
      return "documents";
    case Area::Shared:
      return "shared";
  }
  throw std::invalid_argument("Unknown area " + std::to_string(static_cast<int>(area)) + ".");
}

}  // namespace

DirectoryPathLocations::DirectoryPathLocations(std::string root) : root_(std::move(root)) {}

DirectoryPathLocations::~DirectoryPathLocations() = default;

std::string DirectoryPathLocations::pathForArea(Area area, const std::string& /*sessionKey*/) {
  const std::string name = directoryName(area);
  if (root_.empty() || root_.back() == '/') return root_ + name;
  return root_ + "/" + name;
}

}  // namespace velmora::mobile::xplat::cellar::host
