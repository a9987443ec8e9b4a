#pragma once

#include <cstdint>

#include "ExtendedMetadata.h"

namespace velmora::mobile::xplat::cellar {

// The date by which the video strategy orders an item with this metadata, with its tunables as they are now.
std::int32_t videoPruneDate(std::int32_t lastAccessDate, const VideoDownloadExtendedMetadata& metadata);

}  // namespace velmora::mobile::xplat::cellar
