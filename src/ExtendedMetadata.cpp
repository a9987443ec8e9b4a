#include "ExtendedMetadata.h"

#include <charconv>
#include <optional>
#include <string_view>
#include <system_error>

#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::string_view whiteSpace = " \t\n\v\f\r";

std::string_view trimmed(std::string_view text) {
  const auto first = text.find_first_not_of(whiteSpace);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(whiteSpace) - first + 1);
}

// std::from_chars knows the minus sign alone.
std::string_view withoutPlusSign(std::string_view text) {
  const bool plusBeforeDigits = text.size() > 1 && text[0] == '+' && text[1] != '-';
  return plusBeforeDigits ? text.substr(1) : text;
}

std::optional<int> wholeDecimal(const std::string& text) {
  const std::string_view digits = withoutPlusSign(trimmed(text));
  const char* const end = digits.data() + digits.size();
  int value = 0;
  const auto [stop, error] = std::from_chars(digits.data(), end, value);
  if (error != std::errc() || stop != end) return std::nullopt;
  return value;
}

}  // namespace

void pushKeyValueIntoBinary(const std::string& key, const std::string& value, std::vector<unsigned char>& out) {
  out.push_back('{');
  out.insert(out.end(), key.begin(), key.end());
  out.push_back(':');
  out.insert(out.end(), value.begin(), value.end());
  out.push_back('}');
}

std::shared_ptr<DiskCacheItem::ExtendedMetadata> ExtendedMetadataFactory::getExtendedMetadata(
    std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata) const {
  return metadata != nullptr ? metadata : getExtendedMetadata();
}

const std::string VideoDownloadExtendedMetadata::extendedMetadataSerializationKey = "chunkSecond";
const std::string VideoDownloadExtendedMetadata::itemTypeKey = "itemType";

VideoDownloadExtendedMetadata::VideoDownloadExtendedMetadata()
    : VideoDownloadExtendedMetadata(DefaultChunkSecond, ItemType::VideoChunk) {}

VideoDownloadExtendedMetadata::VideoDownloadExtendedMetadata(int chunkSecond, ItemType itemType)
    : chunkSecond_(chunkSecond), itemType_(itemType) {}

std::vector<unsigned char> VideoDownloadExtendedMetadata::serialize() const {
  std::vector<unsigned char> bytes;
  pushKeyValueIntoBinary(extendedMetadataSerializationKey, std::to_string(chunkSecond_), bytes);
  pushKeyValueIntoBinary(itemTypeKey, std::to_string(static_cast<int>(itemType_)), bytes);
  return bytes;
}

void VideoDownloadExtendedMetadata::deserialize(const std::vector<unsigned char>& bytes) {
  const auto values = binaryToValueString<2>(bytes);
  chunkSecond_ = wholeDecimal(values[0]).value_or(DefaultChunkSecond);
  itemType_ = static_cast<ItemType>(wholeDecimal(values[1]).value_or(static_cast<int>(ItemType::Unreadable)));
}

int VideoDownloadExtendedMetadata::getExtendedMetadata() const { return chunkSecond_; }
VideoDownloadExtendedMetadata::ItemType VideoDownloadExtendedMetadata::getItemType() const { return itemType_; }

std::shared_ptr<DiskCacheItem::ExtendedMetadata> VideoDownloadExtendedMetadataFactory::getExtendedMetadata() const {
  return std::make_shared<VideoDownloadExtendedMetadata>();
}

std::shared_ptr<ExtendedMetadataFactory> ExtendedMetadataFactoryFactory(ExtendedMetadataFactoryIdentifier identifier) {
  if (identifier != ExtendedMetadataFactoryIdentifier::VideoDownload) return nullptr;
  return std::make_shared<VideoDownloadExtendedMetadataFactory>();
}

}  // namespace velmora::mobile::xplat::cellar
