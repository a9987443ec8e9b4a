#include "manifest/ManifestRecord.h"

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
  Owner record(new (::operator new(sizeof(ManifestRecord) + keyLength)) ManifestRecord(keyLength));
  item.key.copy(reinterpret_cast<char*>(record.get() + 1), keyLength);
  if (item.filename != item.key) record->filename_ = std::make_unique<const std::string>(item.filename);
  record->size = item.size;
  record->hasInlineData = item.hasInlineData;
  record->modificationDate = item.modificationDate;
  record->lastAccessDate = item.lastAccessDate;
  record->extendedMetadata = item.extendedMetadata;
  record->hasChecksum = item.checksum.has_value();
  record->checksum = item.checksum.value_or(0);
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
  item.checksum = hasChecksum ? std::make_optional(checksum) : std::nullopt;
}

}  // namespace velmora::mobile::xplat::cellar
