#include "DiskCacheItem.h"

#include <gtest/gtest.h>

#include <memory>
#include <type_traits>
#include <vector>

namespace velmora::mobile::xplat::cellar {
namespace {

class CountedMetadata final : public DiskCacheItem::ExtendedMetadata {
 public:
  explicit CountedMetadata(int& destroyed) : destroyed_(destroyed) {}
  CountedMetadata(const CountedMetadata&) = delete;
  CountedMetadata& operator=(const CountedMetadata&) = delete;
  ~CountedMetadata() { ++destroyed_; }

  std::vector<unsigned char> serialize() const override { return bytes_; }
  void deserialize(const std::vector<unsigned char>& bytes) override { bytes_ = bytes; }

 private:
  int& destroyed_;
  std::vector<unsigned char> bytes_;
};

TEST(DiskCacheItem, IsEmptyByDefault) {
  const DiskCacheItem item;
  EXPECT_EQ(item.key, "");
  EXPECT_EQ(item.filename, "");
  EXPECT_EQ(item.size, 0U);
  EXPECT_FALSE(item.hasInlineData);
  EXPECT_EQ(item.modificationDate, 0);
  EXPECT_EQ(item.lastAccessDate, 0);
  EXPECT_EQ(item.extendedMetadata, nullptr);
}

TEST(DiskCacheItem, ACopyIsIndependentButSharesTheMetadata) {
  int destroyed = 0;
  DiskCacheItem original("key", "file", 3, true, 4, 5, std::make_shared<CountedMetadata>(destroyed));
  const DiskCacheItem copy = original;
  original.key = "another";
  original.size = 9;
  EXPECT_EQ(copy.key, "key");
  EXPECT_EQ(copy.size, 3U);
  EXPECT_EQ(copy.extendedMetadata, original.extendedMetadata);
  copy.extendedMetadata->deserialize({7});
  EXPECT_EQ(original.extendedMetadata->serialize(), std::vector<unsigned char>{7});
}

TEST(DiskCacheItem, TheLastOwnerDestroysTheMetadataByItsOwnType) {
  int destroyed = 0;
  auto item =
      std::make_unique<DiskCacheItem>("key", "file", 3, true, 4, 5, std::make_shared<CountedMetadata>(destroyed));
  auto copy = std::make_unique<DiskCacheItem>(*item);
  item.reset();
  EXPECT_EQ(destroyed, 0);
  copy.reset();
  EXPECT_EQ(destroyed, 1);
}

TEST(DiskCacheItem, MetadataCannotBeDeletedThroughItsBase) {
  EXPECT_FALSE(std::is_destructible_v<DiskCacheItem::ExtendedMetadata>);
  EXPECT_FALSE(std::has_virtual_destructor_v<DiskCacheItem::ExtendedMetadata>);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
