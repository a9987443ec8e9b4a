#pragma once

// How metadata is kept as bytes: records "{" key ":" value "}" one after the other, with no separators, no escaping and
// no length prefixes. Values are read back by position, keys are for the human eye: the order of the records is part of
// the format, and keys and values must be free of "{", ":" and "}". A video chunk of second 12 is kept as
//
//   {chunkSecond:12}{itemType:0}

#include <array>
#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Export.h"

namespace velmora::mobile::xplat::cellar {

enum class ExtendedMetadataFactoryIdentifier : int;

// Appends one record to `out`.
CELLAR_EXPORT void pushKeyValueIntoBinary(const std::string& key, const std::string& value,
                                          std::vector<unsigned char>& out);

// The values of the first N records, empty where there are fewer. Never fails: damaged bytes give damaged or empty
// values.
template <std::size_t N> std::array<std::string, N> binaryToValueString(const std::vector<unsigned char>& in) {
  std::array<std::string, N> values;
  std::size_t count = 0;
  std::string current;
  bool inValue = false;
  for (const unsigned char byte : in) {
    if (byte == '{') {
      current.clear();
      inValue = false;
    } else if (byte == '}') {
      if (count < N) values[count++] = current;
    } else if (byte == ':') {
      inValue = true;
    } else if (inValue) {
      current.push_back(static_cast<char>(byte));
    }
  }
  return values;
}

// Makes the metadata objects of one store, so that the manifest can bring stored bytes back to life. Any thread may
// call. Objects are made with std::make_shared of their concrete type, which is what destroys them: no factory is ever
// deleted through a base. Add `using ExtendedMetadataFactory::getExtendedMetadata;` to a derived class, or the second
// operation is hidden.
class CELLAR_EXPORT ExtendedMetadataFactory {
 public:
  // A new object with default values; never empty.
  virtual std::shared_ptr<DiskCacheItem::ExtendedMetadata> getExtendedMetadata() const = 0;
  // `metadata` itself, or a new object with default values when it is empty.
  virtual std::shared_ptr<DiskCacheItem::ExtendedMetadata> getExtendedMetadata(
      std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata) const;

 protected:
  ExtendedMetadataFactory() = default;
  ExtendedMetadataFactory(const ExtendedMetadataFactory&) = default;
  ExtendedMetadataFactory& operator=(const ExtendedMetadataFactory&) = default;
  ~ExtendedMetadataFactory() = default;
};

// Which part of a video an item holds, for VideoDownloadPruneStrategy. An object of a derived class counts as video
// metadata there, by the second and type that it holds here; it is never deleted through this base either.
class CELLAR_EXPORT VideoDownloadExtendedMetadata : public DiskCacheItem::ExtendedMetadata {
 public:
  // Stored on disk as their numbers. The types 1, 2 and 3 always have high priority and need no names here; every
  // number outside 0 to 3 has low priority.
  enum class ItemType : int { VideoChunk = 0, Unreadable = 4 };

  static constexpr int DefaultChunkSecond = 1000000;  // so late that it never counts as an early chunk
  static const std::string extendedMetadataSerializationKey;
  static const std::string itemTypeKey;

  // DefaultChunkSecond and VideoChunk.
  VideoDownloadExtendedMetadata();
  VideoDownloadExtendedMetadata(int chunkSecond, ItemType itemType);

  std::vector<unsigned char> serialize() const override;
  // Not an error: a number that is missing, out of range or followed by anything but white space. The second is then
  // DefaultChunkSecond, the type Unreadable.
  void deserialize(const std::vector<unsigned char>& bytes) override;

  // The second of the video that this chunk belongs to.
  int getExtendedMetadata() const;
  ItemType getItemType() const;

 private:
  int chunkSecond_;
  ItemType itemType_;
};

class CELLAR_EXPORT VideoDownloadExtendedMetadataFactory : public ExtendedMetadataFactory {
 public:
  using ExtendedMetadataFactory::getExtendedMetadata;
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> getExtendedMetadata() const override;
};

// A new factory for VideoDownload; empty for every other number: the manifest then ignores stored metadata.
CELLAR_EXPORT std::shared_ptr<ExtendedMetadataFactory> ExtendedMetadataFactoryFactory(
    ExtendedMetadataFactoryIdentifier identifier);

}  // namespace velmora::mobile::xplat::cellar
