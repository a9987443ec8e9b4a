#include "ManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

ManifestPersistence::~ManifestPersistence() = default;

void ManifestPersistence::storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData) {
  setItem(item);
  if (inlineData != nullptr) setInlineData(item.key, *inlineData);
}

bool ManifestPersistence::hasMoved() const { return false; }

bool ManifestPersistence::isSound() const { return true; }

void ManifestPersistence::release() {}

void ManifestPersistence::suspend() {}

void ManifestPersistence::resume() {}

bool ManifestPersistence::performTogether(const std::function<void()>& /*operations*/) { return false; }

}  // namespace velmora::mobile::xplat::cellar
