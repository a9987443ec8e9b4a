#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "DiskCacheItem.h"

namespace velmora::mobile::xplat::cellar {

// An item's record as the manifest keeps it, of which a cache may have a million: in one piece of memory, with the
// bytes of the key behind the object, and without the file's name where that is the key, as it nearly always is.
class ManifestRecord {
 public:
  // Gives the memory back without the size of the class, so that the key's bytes go with it.
  struct Deleter {
    void operator()(ManifestRecord* record) const;
  };
  using Owner = std::unique_ptr<ManifestRecord, Deleter>;

  static Owner create(const DiskCacheItem& item);
  ManifestRecord(const ManifestRecord&) = delete;
  ManifestRecord& operator=(const ManifestRecord&) = delete;

  std::string_view key() const { return {reinterpret_cast<const char*>(this + 1), keyLength_}; }

  DiskCacheItem item() const;
  void copyTo(DiskCacheItem& item) const;  // into the memory of its strings

  std::uint32_t size = 0;
  std::int32_t modificationDate = 0;
  std::int32_t lastAccessDate = 0;
  bool hasInlineData = false;
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;

  std::uint32_t placeByAccessDate = 0;  // kept by the two orders of eviction
  std::uint32_t placeByPriority = 0;

 private:
  explicit ManifestRecord(std::uint32_t keyLength) noexcept : keyLength_(keyLength) {}
  ~ManifestRecord() = default;

  const std::uint32_t keyLength_;
  std::unique_ptr<const std::string> filename_;  // null: the same as the key
};

}  // namespace velmora::mobile::xplat::cellar
