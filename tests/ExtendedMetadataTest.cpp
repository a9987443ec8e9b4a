#include "ExtendedMetadata.h"

#include <gtest/gtest.h>

#include <array>
#include <cstddef>
#include <limits>
#include <memory>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "Configuration.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using ItemType = VideoDownloadExtendedMetadata::ItemType;

std::vector<unsigned char> bytes(const std::string& text) { return {text.begin(), text.end()}; }

std::string text(const std::vector<unsigned char>& bytes) { return {bytes.begin(), bytes.end()}; }

template <std::size_t N> std::array<std::string, N> valuesIn(const std::string& record) {
  return binaryToValueString<N>(bytes(record));
}

// What an object reads from `record`, as "second/type".
std::string readFrom(const std::string& record) {
  VideoDownloadExtendedMetadata metadata(77, static_cast<ItemType>(3));
  metadata.deserialize(bytes(record));
  return std::to_string(metadata.getExtendedMetadata()) + "/" +
         std::to_string(static_cast<int>(metadata.getItemType()));
}

TEST(PushKeyValueIntoBinary, AppendsARecordToWhatIsThere) {
  std::vector<unsigned char> out = bytes("before");
  pushKeyValueIntoBinary("key", "value", out);
  pushKeyValueIntoBinary("", "", out);
  EXPECT_EQ(text(out), "before{key:value}{:}");
}

TEST(PushKeyValueIntoBinary, EscapesNothing) {
  std::vector<unsigned char> out;
  pushKeyValueIntoBinary("{a}", std::string("b:\0\xff", 4), out);
  EXPECT_EQ(text(out), std::string("{{a}:b:\0\xff}", 10));
}

TEST(BinaryToValueString, GivesTheValuesInTheOrderOfTheirRecords) {
  EXPECT_EQ(valuesIn<2>("{a:1}{b:22}"), (std::array<std::string, 2>{"1", "22"}));
}

TEST(BinaryToValueString, LeavesWhatIsMissingEmpty) {
  EXPECT_EQ(valuesIn<2>(""), (std::array<std::string, 2>{"", ""}));
  EXPECT_EQ(valuesIn<3>("{a:1}"), (std::array<std::string, 3>{"1", "", ""}));
  EXPECT_EQ(valuesIn<1>("{a:1"), (std::array<std::string, 1>{""}));
}

TEST(BinaryToValueString, IgnoresRecordsBeyondTheLastWanted) {
  EXPECT_EQ(valuesIn<1>("{a:1}{b:2}{c:3}"), (std::array<std::string, 1>{"1"}));
}

TEST(BinaryToValueString, DropsEveryColon) {
  EXPECT_EQ(valuesIn<1>("{a:1:2::3}"), (std::array<std::string, 1>{"123"}));
}

TEST(BinaryToValueString, ReadsNothingWithoutAColon) {
  EXPECT_EQ(valuesIn<1>("{abc}"), (std::array<std::string, 1>{""}));
  EXPECT_EQ(valuesIn<1>("abc}"), (std::array<std::string, 1>{""}));
}

TEST(BinaryToValueString, StartsAgainAtEachOpeningBrace) {
  EXPECT_EQ(valuesIn<2>("{a:1{b:2}"), (std::array<std::string, 2>{"2", ""}));
}

TEST(BinaryToValueString, GoesOnWithTheValueAfterAClosingBrace) {
  EXPECT_EQ(valuesIn<3>("{a:1}2}:3}"), (std::array<std::string, 3>{"1", "12", "123"}));
}

TEST(BinaryToValueString, NeedsNoOpeningBrace) { EXPECT_EQ(valuesIn<1>("a:1}"), (std::array<std::string, 1>{"1"})); }

TEST(BinaryToValueString, KeepsEveryOtherByte) {
  const std::string value("\0 \xff\n", 4);
  EXPECT_EQ(valuesIn<1>("{k\xfe:" + value + "}"), (std::array<std::string, 1>{value}));
}

TEST(VideoDownloadExtendedMetadata, IsAPlainChunkOfALateSecondByDefault) {
  const VideoDownloadExtendedMetadata metadata;
  EXPECT_EQ(metadata.getExtendedMetadata(), 1000000);
  EXPECT_EQ(metadata.getItemType(), static_cast<ItemType>(0));
  EXPECT_EQ(VideoDownloadExtendedMetadata::DefaultChunkSecond, 1000000);
}

TEST(VideoDownloadExtendedMetadata, TakesSecondAndType) {
  const VideoDownloadExtendedMetadata metadata(12, static_cast<ItemType>(3));
  EXPECT_EQ(metadata.getExtendedMetadata(), 12);
  EXPECT_EQ(metadata.getItemType(), static_cast<ItemType>(3));
}

TEST(VideoDownloadExtendedMetadata, NamesItsKeys) {
  EXPECT_EQ(VideoDownloadExtendedMetadata::extendedMetadataSerializationKey, "chunkSecond");
  EXPECT_EQ(VideoDownloadExtendedMetadata::itemTypeKey, "itemType");
}

// The bytes are on disk in every manifest: they may not change.
TEST(VideoDownloadExtendedMetadata, SerializesToTheFrozenFormat) {
  EXPECT_EQ(text(VideoDownloadExtendedMetadata().serialize()), "{chunkSecond:1000000}{itemType:0}");
  EXPECT_EQ(VideoDownloadExtendedMetadata().serialize().size(), 33U);
  EXPECT_EQ(text(VideoDownloadExtendedMetadata(-5, static_cast<ItemType>(-1)).serialize()),
            "{chunkSecond:-5}{itemType:-1}");
}

TEST(VideoDownloadExtendedMetadata, ReadsBackWhatItWrote) {
  constexpr int least = std::numeric_limits<int>::min();
  constexpr int largest = std::numeric_limits<int>::max();
  for (const int second : {least, -1, 0, 12, 1000000, largest}) {
    for (const int type : {least, -1, 0, 1, 2, 3, 4, largest}) {
      VideoDownloadExtendedMetadata copy;
      copy.deserialize(VideoDownloadExtendedMetadata(second, static_cast<ItemType>(type)).serialize());
      EXPECT_EQ(copy.getExtendedMetadata(), second);
      EXPECT_EQ(static_cast<int>(copy.getItemType()), type);
    }
  }
}

TEST(VideoDownloadExtendedMetadata, ReadsNothingAsALateChunkOfUnreadableType) { EXPECT_EQ(readFrom(""), "1000000/4"); }

TEST(VideoDownloadExtendedMetadata, ReadsAMissingTypeAsUnreadable) {
  EXPECT_EQ(readFrom("{chunkSecond:12}"), "12/4");
  EXPECT_EQ(readFrom("{chunkSecond:12}{itemType:}"), "12/4");
}

TEST(VideoDownloadExtendedMetadata, ReadsByPositionAndNotByKey) {
  EXPECT_EQ(readFrom("{itemType:2}{chunkSecond:5}"), "2/5");
  EXPECT_EQ(readFrom("{x:2}{y:5}{z:6}"), "2/5");
}

TEST(VideoDownloadExtendedMetadata, ReadsEachValueOnItsOwn) {
  EXPECT_EQ(readFrom("{chunkSecond:x}{itemType:2}"), "1000000/2");
}

TEST(VideoDownloadExtendedMetadata, ToleratesWhiteSpaceAroundANumberAndAPlusSign) {
  EXPECT_EQ(readFrom("{a: \t\n\v\f\r12 \t\n\v\f\r}{b: 3}"), "12/3");
  EXPECT_EQ(readFrom("{a:+12}{b: +3 }"), "12/3");
  EXPECT_EQ(readFrom("{a:0012}{b:-0}"), "12/0");
}

TEST(VideoDownloadExtendedMetadata, TakesNothingButAWholeDecimalNumber) {
  for (const std::string bad : {"", " ", "x", "12x", "x12", "1 2", "1.0", "1e3", "0x10", "+", "-", "+-1", "-+1", "--1",
                                "++1", "- 1", "+ 1", "1,000", "\xd9\xa1"}) {
    EXPECT_EQ(readFrom("{a:" + bad + "}{b:" + bad + "}"), "1000000/4") << "'" << bad << "'";
  }
  const std::string zeroByteAfter("1\0", 2);
  EXPECT_EQ(readFrom("{a:" + zeroByteAfter + "}{b:1}"), "1000000/1");
}

TEST(VideoDownloadExtendedMetadata, TakesNumbersOfThirtyTwoBitsOnly) {
  EXPECT_EQ(readFrom("{a:2147483647}{b:-2147483648}"), "2147483647/-2147483648");
  EXPECT_EQ(readFrom("{a:2147483648}{b:-2147483649}"), "1000000/4");
  EXPECT_EQ(readFrom("{a:99999999999999999999999999}{b:4294967296}"), "1000000/4");
}

TEST(VideoDownloadExtendedMetadataFactory, MakesANewDefaultObjectEachTime) {
  const VideoDownloadExtendedMetadataFactory factory;
  const auto made = std::dynamic_pointer_cast<VideoDownloadExtendedMetadata>(factory.getExtendedMetadata());
  ASSERT_NE(made, nullptr);
  EXPECT_EQ(text(made->serialize()), "{chunkSecond:1000000}{itemType:0}");
  EXPECT_NE(factory.getExtendedMetadata(), made);
}

TEST(VideoDownloadExtendedMetadataFactory, HandsBackMetadataThatIsThere) {
  const VideoDownloadExtendedMetadataFactory factory;
  const auto mine = std::make_shared<VideoDownloadExtendedMetadata>(1, static_cast<ItemType>(2));
  EXPECT_EQ(factory.getExtendedMetadata(mine), mine);
  EXPECT_EQ(mine->getExtendedMetadata(), 1);
}

TEST(VideoDownloadExtendedMetadataFactory, MakesADefaultObjectInPlaceOfNone) {
  const VideoDownloadExtendedMetadataFactory factory;
  const auto made = factory.getExtendedMetadata(nullptr);
  ASSERT_NE(made, nullptr);
  EXPECT_EQ(text(made->serialize()), "{chunkSecond:1000000}{itemType:0}");
}

// A host's chunks that know their resolution too, in a third record.
class ChunkWithResolution : public VideoDownloadExtendedMetadata {
 public:
  ChunkWithResolution() = default;
  ChunkWithResolution(int chunkSecond, std::string resolution)
      : VideoDownloadExtendedMetadata(chunkSecond, ItemType::VideoChunk), resolution_(std::move(resolution)) {}

  std::vector<unsigned char> serialize() const override {
    auto bytes = VideoDownloadExtendedMetadata::serialize();
    pushKeyValueIntoBinary("resolution", resolution_, bytes);
    return bytes;
  }
  void deserialize(const std::vector<unsigned char>& bytes) override {
    VideoDownloadExtendedMetadata::deserialize(bytes);
    resolution_ = binaryToValueString<3>(bytes)[2];
  }
  std::string resolution() const { return resolution_; }

 private:
  std::string resolution_;
};

TEST(VideoDownloadExtendedMetadata, MayBeDerivedFromTogetherWithItsFactory) {
  class Factory : public VideoDownloadExtendedMetadataFactory {
   public:
    using VideoDownloadExtendedMetadataFactory::getExtendedMetadata;
    std::shared_ptr<DiskCacheItem::ExtendedMetadata> getExtendedMetadata() const override {
      return std::make_shared<ChunkWithResolution>();
    }
  };
  const std::shared_ptr<ExtendedMetadataFactory> factory = std::make_shared<Factory>();
  const auto metadata = factory->getExtendedMetadata(nullptr);
  metadata->deserialize(ChunkWithResolution(12, "720p").serialize());
  const auto chunk = std::dynamic_pointer_cast<ChunkWithResolution>(metadata);
  ASSERT_NE(chunk, nullptr);
  EXPECT_EQ(chunk->getExtendedMetadata(), 12);
  EXPECT_EQ(chunk->resolution(), "720p");
  EXPECT_EQ(text(chunk->serialize()), "{chunkSecond:12}{itemType:0}{resolution:720p}");
}

TEST(ExtendedMetadataFactory, CannotBeDeletedThroughItsBase) {
  EXPECT_FALSE(std::is_destructible_v<ExtendedMetadataFactory>);
  EXPECT_FALSE(std::has_virtual_destructor_v<ExtendedMetadataFactory>);
}

TEST(ExtendedMetadataFactoryFactory, MakesAFactoryForVideoDownloadsAlone) {
  const auto factory = ExtendedMetadataFactoryFactory(ExtendedMetadataFactoryIdentifier::VideoDownload);
  EXPECT_NE(std::dynamic_pointer_cast<VideoDownloadExtendedMetadataFactory>(factory), nullptr);
  EXPECT_NE(ExtendedMetadataFactoryFactory(static_cast<ExtendedMetadataFactoryIdentifier>(1)), factory);
  for (const int number : {-1, 0, 2, 7}) {
    EXPECT_EQ(ExtendedMetadataFactoryFactory(static_cast<ExtendedMetadataFactoryIdentifier>(number)), nullptr)
        << number;
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
