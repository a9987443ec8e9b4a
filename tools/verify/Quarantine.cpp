#include "verify/Quarantine.h"

#include <filesystem>
#include <utility>

#include "storage/Layout.h"
#include "verify/Beneath.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

// Where something below the base has its place in the quarantine.
struct Place {
  Place(const std::string& base, const std::string& path)
      : below(fs::path(path).lexically_relative(base)), quarantine(fs::path(kQuarantineName) / below.parent_path()) {}

  // Of its name there.
  std::string pathOf(const std::string& base, const std::string& name) const {
    return (base / quarantine / name).string();
  }

  fs::path below;
  fs::path quarantine;  // the directory
};

}  // namespace

Quarantine::Quarantine(std::string base) : base_(std::move(base)) {}

std::string Quarantine::take(const std::string& path) const {
  const Place place(base_, path);
  const Beneath source(base_, place.below.parent_path());
  const Beneath target(base_, place.quarantine, Beneath::IfMissing::Create);
  return place.pathOf(base_, source.moveTo(target, place.below.filename().string()));
}

std::string Quarantine::keep(const std::string& path, const std::vector<unsigned char>& bytes) const {
  const Place place(base_, path);
  const Beneath target(base_, place.quarantine, Beneath::IfMissing::Create);
  return place.pathOf(base_, target.create(place.below.filename().string(), bytes));
}

}  // namespace velmora::mobile::xplat::cellar::tools
