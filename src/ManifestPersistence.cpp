#include "ManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

ManifestPersistence::~ManifestPersistence() = default;

bool ManifestPersistence::performTogether(const std::function<void()>& /*operations*/) { return false; }

}  // namespace velmora::mobile::xplat::cellar
