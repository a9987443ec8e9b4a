#include "manifest/ManifestRecord.h"

#include <cstddef>
#include <cstring>
#include <new>
#include <stdexcept>

namespace velmora::mobile::xplat::cellar {

void ManifestRecord::Deleter::operator()(ManifestRecord* record) const {
  record->~ManifestRecord();
  ::operator delete(record);
}

ManifestRecord::Owner ManifestRecord::create(const DiskCacheItem& item) {
  if (item.key.size() > kLongestKey) throw std::length_error("The key is too long.");
  const auto keyLength = static_cast<std::uint32_t>(item.key.size());
  const std::size_t behind = keyLength + (item.checksum ? sizeof(*item.checksum) : 0);
  Owner record(new (::operator new(sizeof(ManifestRecord) + behind))
                   ManifestRecord(keyLength, item.checksum.has_value()));
  item.key.copy(record->bytes(), keyLength);
  if (item.checksum) std::memcpy(record->bytes() + keyLength, &*item.checksum, sizeof(*item.checksum));
  if (item.filename != item.key) record->filename_ = std::make_unique<const std::string>(item.filename);
  record->size = item.size;
  record->hasInlineData = item.hasInlineData;
  record->modificationDate = item.modificationDate;
  record->lastAccessDate = item.lastAccessDate;
  record->extendedMetadata = item.extendedMetadata;
  return record;
}

DiskCacheItem ManifestRecord::item() const {
  DiskCacheItem item;
  copyTo(item);
  return item;
}

void ManifestRecord::copyTo(DiskCacheItem& item) const {
  item.key = key();
  item.filename = filename_ == nullptr ? item.key : *filename_;
  item.size = size;
  item.hasInlineData = hasInlineData;
  item.modificationDate = modificationDate;
  item.lastAccessDate = lastAccessDate;
  item.extendedMetadata = extendedMetadata;
  item.checksum = checksum();
}

std::optional<std::uint32_t> ManifestRecord::checksum() const {
  if (!hasChecksum_) return std::nullopt;
  std::uint32_t checksum = 0;
  std::memcpy(&checksum, bytes() + keyLength_, sizeof(checksum));
  return checksum;
}

}  // namespace velmora::mobile::xplat::cellar
