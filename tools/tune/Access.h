#pragma once

#include <cstdint>

namespace velmora::mobile::xplat::cellar::tools {

enum class AccessKind : std::uint8_t {
  Fetch,   // counts; one that misses is followed by storing the item
  Store,   // a use that is not a request
  Remove,  // the item is removed
  Clear,   // all items are removed; without a key
};

// One use of an item of a cache.
struct Access {
  static constexpr std::int64_t kUnknownSize = -1;
  static constexpr std::int32_t kNoMetadata = -1;

  static constexpr std::uint32_t kNoKey = 0xffffffff;

  std::uint32_t key = 0;  // numbered from 0
  AccessKind kind = AccessKind::Fetch;
  std::int32_t itemType = kNoMetadata;  // of a video download
  std::int32_t chunkSecond = 0;
  std::int64_t date = 0;  // seconds
  std::int64_t size = kUnknownSize;
};

}  // namespace velmora::mobile::xplat::cellar::tools
