#include "DiskCacheItem.h"

#include <utility>

namespace velmora::mobile::xplat::cellar {

DiskCacheItem::DiskCacheItem() = default;

DiskCacheItem::DiskCacheItem(const std::string& key_, const std::string& filename_, std::uint32_t size_,
                             bool hasInlineData_, std::int32_t modificationDate_, std::int32_t lastAccessDate_,
                             std::shared_ptr<ExtendedMetadata> extendedMetadata_)
    : key(key_),
      filename(filename_),
      size(size_),
      hasInlineData(hasInlineData_),
      modificationDate(modificationDate_),
      lastAccessDate(lastAccessDate_),
      extendedMetadata(std::move(extendedMetadata_)) {}

}  // namespace velmora::mobile::xplat::cellar
