#pragma once

#include <optional>
#include <vector>

#include "DiskCacheItem.h"

namespace velmora::mobile::xplat::cellar {

// A row of a manifest, its metadata as bytes that nobody has interpreted. That of the item is empty.
struct ManifestRow {
  DiskCacheItem item;
  std::optional<std::vector<unsigned char>> inlineData;
  std::optional<std::vector<unsigned char>> metadata;
};

}  // namespace velmora::mobile::xplat::cellar
