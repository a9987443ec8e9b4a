#include "ManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

ManifestPersistence::~ManifestPersistence() = default;

}  // namespace velmora::mobile::xplat::cellar
