#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "DiskCacheItem.h"

namespace velmora::mobile::xplat::cellar {

// An item's record as the manifest keeps it, of which a cache may have a million: in one piece of memory, with the
// bytes of the key, and the checksum if it has one, behind the object, and without the file's name where that is the
// key, as it nearly always is.
class ManifestRecord {
 public:
  // Gives the memory back without the size of the class, so that the key's bytes go with it.
  struct Deleter {
    void operator()(ManifestRecord* record) const;
  };
  using Owner = std::unique_ptr<ManifestRecord, Deleter>;

  static constexpr std::uint32_t kLongestKey = (1U << 30U) - 1;  // bytes

  // Throws `std::length_error` for a key that is longer.
  static Owner create(const DiskCacheItem& item);
  ManifestRecord(const ManifestRecord&) = delete;
  ManifestRecord& operator=(const ManifestRecord&) = delete;

  std::string_view key() const { return {bytes(), keyLength_}; }

  DiskCacheItem item() const;
  void copyTo(DiskCacheItem& item) const;  // into the memory of its strings

  std::uint32_t size = 0;
  std::int32_t modificationDate = 0;
  std::int32_t lastAccessDate = 0;
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;

  std::uint32_t accessDateIndex = 0;  // kept by the two orders of eviction
  std::uint32_t priorityIndex = 0;

 private:
  const std::uint32_t keyLength_ : 30;

 public:
  bool hasInlineData : 1;  // beside the length, where they take no room of their own

 private:
  const bool hasChecksum_ : 1;

  ManifestRecord(std::uint32_t keyLength, bool hasChecksum) noexcept
      : keyLength_(keyLength & kLongestKey), hasInlineData(false), hasChecksum_(hasChecksum) {}
  ~ManifestRecord() = default;

  // The key, and behind it the checksum.
  char* bytes() { return reinterpret_cast<char*>(this + 1); }
  const char* bytes() const { return reinterpret_cast<const char*>(this + 1); }
  std::optional<std::uint32_t> checksum() const;

  std::unique_ptr<const std::string> filename_;  // null: the same as the key
};

}  // namespace velmora::mobile::xplat::cellar
