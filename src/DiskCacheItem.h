#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// The record of one stored item: what the manifest knows of it without touching its file. A plain value without locks
// of its own; a copy shares the extended metadata with its original.
struct CELLAR_EXPORT DiskCacheItem {
  // What a host attaches to an item beyond the fields below. The manifest keeps it as bytes that only its own type
  // understands, and a prune strategy may read it. Objects are made with std::make_shared of their concrete type, which
  // is what destroys them: none is ever deleted through a base.
  class CELLAR_EXPORT ExtendedMetadata {
   public:
    // The bytes to keep. Called under the manifest's lock: it must not call the store again.
    virtual std::vector<unsigned char> serialize() const = 0;
    // Takes over what `bytes` say. They may be empty, damaged or written by an older program: that is not an error, the
    // object then falls back to values of its choice. Called under the manifest's lock like `serialize`.
    virtual void deserialize(const std::vector<unsigned char>& bytes) = 0;

   protected:
    ExtendedMetadata() = default;
    ExtendedMetadata(const ExtendedMetadata&) = default;
    ExtendedMetadata& operator=(const ExtendedMetadata&) = default;
    ~ExtendedMetadata() = default;
  };

  // No key, no file, all numbers 0, not inline, no metadata.
  DiskCacheItem();
  DiskCacheItem(const std::string& key, const std::string& filename, std::uint32_t size, bool hasInlineData,
                std::int32_t modificationDate, std::int32_t lastAccessDate,
                std::shared_ptr<ExtendedMetadata> extendedMetadata);

  std::string key;
  std::string filename;                                // within the store's directory
  std::uint32_t size = 0;                              // bytes
  bool hasInlineData = false;                          // the value lies in the manifest instead of a file
  std::int32_t modificationDate = 0;                   // seconds since the Unix epoch
  std::int32_t lastAccessDate = 0;                     // seconds since the Unix epoch
  std::shared_ptr<ExtendedMetadata> extendedMetadata;  // may be empty; not to be changed once a store has the item

  // Of key and value, for an item that a safe store has written.
  std::optional<std::uint32_t> checksum;
};

}  // namespace velmora::mobile::xplat::cellar
