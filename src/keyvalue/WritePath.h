#pragma once

#include <memory>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Future.h"
#include "PersistentKeyValueStore.h"

namespace velmora::mobile::xplat::cellar {

// How values get into a store: in place (InPlaceWrites), or each into a file of its own (ReplacingWrites).
class WritePath {
 public:
  using Metadata = std::shared_ptr<DiskCacheItem::ExtendedMetadata>;

  WritePath() = default;
  WritePath(const WritePath&) = delete;
  WritePath& operator=(const WritePath&) = delete;
  virtual ~WritePath() = default;

  virtual Future<void> store(const std::string& key, const std::vector<unsigned char>& value, Metadata metadata) = 0;
  virtual Future<void> store(const std::string& key, PersistentKeyValueStore::Writer writer, Metadata metadata) = 0;
};

}  // namespace velmora::mobile::xplat::cellar
