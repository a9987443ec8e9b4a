#include "Clock.h"
#include "DiskCacheManifest.h"

// What a manifest of the host's own need not do.
namespace velmora::mobile::xplat::cellar {

DiskCacheManifestInterface::~DiskCacheManifestInterface() = default;

std::optional<ReplacedItem> DiskCacheManifestInterface::replaceItem(const DiskCacheItem& item,
                                                                    bool /*withInlineData*/) {
  setItem(item);
  return std::nullopt;
}

bool DiskCacheManifestInterface::changeTogether(const std::function<void()>& /*changes*/) { return false; }

void DiskCacheManifestInterface::storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData) {
  setItem(item);
  if (inlineData != nullptr) setInlineData(item.key, *inlineData);
}

void DiskCacheManifestInterface::changeTogetherOrThrow(const std::function<void()>& changes) { changes(); }

std::int64_t DiskCacheManifestInterface::currentDate() { return Clock::now(); }

bool DiskCacheManifestInterface::hasMoved() { return false; }

bool DiskCacheManifestInterface::isSound() { return true; }

void DiskCacheManifestInterface::release() {}

void DiskCacheManifestInterface::suspend() {}

void DiskCacheManifestInterface::resume() {}

void DiskCacheManifestInterface::reload() { load(); }

}  // namespace velmora::mobile::xplat::cellar
