#include "PruneStrategy.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <limits>
#include <memory>
#include <string>
#include <type_traits>
#include <vector>

#include "Configuration.h"
#include "DiskCacheItem.h"
#include "ExtendedMetadata.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using ItemType = VideoDownloadExtendedMetadata::ItemType;

constexpr auto firstDate = std::numeric_limits<std::int32_t>::min();
constexpr auto lastDate = std::numeric_limits<std::int32_t>::max();

class ForeignMetadata final : public DiskCacheItem::ExtendedMetadata {
 public:
  std::vector<unsigned char> serialize() const override { return {}; }
  void deserialize(const std::vector<unsigned char>& /*bytes*/) override {}
};

class HostsVideoMetadata : public VideoDownloadExtendedMetadata {
 public:
  using VideoDownloadExtendedMetadata::VideoDownloadExtendedMetadata;
};

// Prunes the largest key first, so that its order is told from that of the dates.
class LargestKeyFirst final : public PruneStrategyBase {
 public:
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override { return a->key > b->key; }
};

DiskCacheItem usedAt(std::int32_t date, std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata = nullptr) {
  return {"key" + std::to_string(date), "file", 1, false, 0, date, std::move(metadata)};
}

DiskCacheItem chunkUsedAt(std::int32_t date, int chunkSecond, int itemType = 0) {
  return usedAt(date, std::make_shared<VideoDownloadExtendedMetadata>(chunkSecond, static_cast<ItemType>(itemType)));
}

bool before(const PruneStrategyBase& strategy, const DiskCacheItem& a, const DiskCacheItem& b) {
  return strategy.compare(&a, &b);
}

// The two tunables are the whole process's: each test gets them as they are at start, and leaves them so.
class VideoDownloadPruneStrategyTest : public testing::Test {
 protected:
  void TearDown() override { tune(0, 0); }

  static void tune(int weight, int cutoff) {
    VideoDownloadPruneStrategy::priorityWeight = weight;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = cutoff;
  }

  int priority(int chunkSecond, int itemType) const {
    return strategy.VideoDownloadExtendedMetadataToPriority(chunkSecond, static_cast<ItemType>(itemType));
  }

  const VideoDownloadPruneStrategy strategy{};
};

TEST(LRUPruneStrategy, PrunesTheOlderItemFirst) {
  const LRUPruneStrategy strategy;
  EXPECT_TRUE(before(strategy, usedAt(1), usedAt(2)));
  EXPECT_FALSE(before(strategy, usedAt(2), usedAt(1)));
}

TEST(LRUPruneStrategy, LeavesItemsOfTheSameDateUnordered) {
  const LRUPruneStrategy strategy;
  EXPECT_FALSE(before(strategy, usedAt(5), usedAt(5)));
}

TEST(LRUPruneStrategy, ComparesDatesWithTheirSign) {
  const LRUPruneStrategy strategy;
  EXPECT_TRUE(before(strategy, usedAt(-1), usedAt(0)));
  EXPECT_FALSE(before(strategy, usedAt(0), usedAt(-1)));
  EXPECT_TRUE(before(strategy, usedAt(firstDate), usedAt(lastDate)));
  EXPECT_FALSE(before(strategy, usedAt(lastDate), usedAt(firstDate)));
}

TEST(LRUPruneStrategy, LooksAtNothingButTheAccessDate) {
  const LRUPruneStrategy strategy;
  const DiskCacheItem older("z", "z", 1, false, 900, 1, nullptr);
  const DiskCacheItem newer("a", "a", 9, true, 100, 2, nullptr);
  EXPECT_TRUE(before(strategy, older, newer));
  EXPECT_FALSE(before(strategy, newer, older));
}

TEST_F(VideoDownloadPruneStrategyTest, TheTunablesAreZeroUntilTheHostAssignsThem) {
  EXPECT_EQ(VideoDownloadPruneStrategy::priorityWeight, 0);
  EXPECT_EQ(VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff, 0);
  EXPECT_EQ(VideoDownloadPruneStrategy::lowPriority, 0);
  EXPECT_EQ(VideoDownloadPruneStrategy::highPriority, 1);
}

TEST_F(VideoDownloadPruneStrategyTest, SpecialItemTypesAreAlwaysOfHighPriority) {
  for (const int type : {1, 2, 3}) {
    for (const int second : {-5, 0, 1, 1000000}) EXPECT_EQ(priority(second, type), 1) << type << ' ' << second;
  }
}

TEST_F(VideoDownloadPruneStrategyTest, ItemTypesBeyondTheKnownOnesAreOfLowPriority) {
  tune(0, 1000);
  for (const int type : {-1, 4, 5, std::numeric_limits<int>::min(), std::numeric_limits<int>::max()}) {
    for (const int second : {-5, 0, 1, 1000000}) EXPECT_EQ(priority(second, type), 0) << type << ' ' << second;
  }
}

TEST_F(VideoDownloadPruneStrategyTest, ByDefaultOnlyTheVeryFirstSecondOfAVideoIsEarly) {
  EXPECT_EQ(priority(-1, 0), 0);
  EXPECT_EQ(priority(0, 0), 1);
  EXPECT_EQ(priority(1, 0), 0);
}

TEST_F(VideoDownloadPruneStrategyTest, ChunksUpToTheCutoffAreEarly) {
  tune(0, 10);
  EXPECT_EQ(priority(0, 0), 1);
  EXPECT_EQ(priority(10, 0), 1);
  EXPECT_EQ(priority(11, 0), 0);
  EXPECT_EQ(priority(VideoDownloadExtendedMetadata::DefaultChunkSecond, 0), 0);
}

TEST_F(VideoDownloadPruneStrategyTest, ANegativeSecondIsOfLowPriorityWhateverTheCutoff) {
  tune(0, 10);
  EXPECT_EQ(priority(-5, 0), 0);
  tune(0, -3);
  EXPECT_EQ(priority(-5, 0), 0);
  EXPECT_EQ(priority(0, 0), 0);
}

TEST_F(VideoDownloadPruneStrategyTest, WithoutAWeightEveryPairIsOrderedByDateAlone) {
  tune(0, 10);
  const LRUPruneStrategy lru;
  std::vector<DiskCacheItem> items;
  for (const std::int32_t date : {firstDate, -1, 0, 1, 100, lastDate}) {
    items.push_back(usedAt(date));
    items.push_back(usedAt(date, std::make_shared<ForeignMetadata>()));
    for (const int type : {-1, 0, 1, 2, 3, 4}) {
      for (const int second : {-5, 0, 10, 11}) items.push_back(chunkUsedAt(date, second, type));
    }
  }
  for (const DiskCacheItem& a : items) {
    for (const DiskCacheItem& b : items) ASSERT_EQ(before(strategy, a, b), before(lru, a, b));
  }
}

TEST_F(VideoDownloadPruneStrategyTest, AnEarlyChunkCountsAsUsedLaterByTheWeight) {
  tune(100, 10);
  const DiskCacheItem early = chunkUsedAt(1000, 5);
  EXPECT_FALSE(before(strategy, early, chunkUsedAt(1099, 500)));
  EXPECT_TRUE(before(strategy, chunkUsedAt(1099, 500), early));
  EXPECT_FALSE(before(strategy, early, chunkUsedAt(1100, 500)));
  EXPECT_FALSE(before(strategy, chunkUsedAt(1100, 500), early));
  EXPECT_TRUE(before(strategy, early, chunkUsedAt(1101, 500)));
}

TEST_F(VideoDownloadPruneStrategyTest, TwoItemsOfTheSamePriorityAreOrderedByDate) {
  tune(100, 10);
  EXPECT_TRUE(before(strategy, chunkUsedAt(1, 5), chunkUsedAt(2, 0, 3)));
  EXPECT_FALSE(before(strategy, chunkUsedAt(2, 0, 3), chunkUsedAt(1, 5)));
  EXPECT_TRUE(before(strategy, chunkUsedAt(1, 500), chunkUsedAt(2, 0, 4)));
}

TEST_F(VideoDownloadPruneStrategyTest, AnItemWithoutVideoMetadataIsComparedByDateAlone) {
  tune(100, 10);
  const DiskCacheItem early = chunkUsedAt(1000, 5);
  for (const DiskCacheItem& plain : {usedAt(1001), usedAt(1001, std::make_shared<ForeignMetadata>())}) {
    EXPECT_TRUE(before(strategy, early, plain));
    EXPECT_FALSE(before(strategy, plain, early));
  }
}

TEST_F(VideoDownloadPruneStrategyTest, AClassDerivedFromTheVideoMetadataCountsAsVideoMetadata) {
  tune(100, 10);
  const DiskCacheItem early = usedAt(1000, std::make_shared<HostsVideoMetadata>(5, ItemType::VideoChunk));
  const DiskCacheItem late = chunkUsedAt(1099, 500);
  EXPECT_TRUE(before(strategy, late, early));
  EXPECT_FALSE(before(strategy, early, late));
}

TEST_F(VideoDownloadPruneStrategyTest, ANegativeWeightPrunesHighPriorityEarlier) {
  tune(-100, 10);
  EXPECT_TRUE(before(strategy, chunkUsedAt(1099, 5), chunkUsedAt(1000, 500)));
  EXPECT_FALSE(before(strategy, chunkUsedAt(1100, 5), chunkUsedAt(1000, 500)));
}

TEST_F(VideoDownloadPruneStrategyTest, SumsBeyondTheRangeOfADateWrap) {
  tune(1, 10);
  EXPECT_TRUE(before(strategy, chunkUsedAt(lastDate, 5), chunkUsedAt(0, 500)));  // counts as the first date of all
  EXPECT_FALSE(before(strategy, chunkUsedAt(0, 500), chunkUsedAt(lastDate, 5)));
  tune(-1, 10);
  EXPECT_FALSE(before(strategy, chunkUsedAt(firstDate, 5), chunkUsedAt(0, 500)));  // counts as the last
  EXPECT_TRUE(before(strategy, chunkUsedAt(0, 500), chunkUsedAt(firstDate, 5)));
  tune(std::numeric_limits<int>::min(), 10);
  EXPECT_TRUE(before(strategy, chunkUsedAt(0, 5), chunkUsedAt(-1, 500)));
}

TEST(GreedyDualPruneStrategy, ComparesTwoItemsByLastUse) {
  DiskCacheItem older("small", "small", 1, false, 10, 20, nullptr);
  DiskCacheItem newer("large", "large", 1 << 20, false, 5, 21, nullptr);
  const GreedyDualPruneStrategy strategy;
  EXPECT_TRUE(strategy.compare(&older, &newer));
  EXPECT_FALSE(strategy.compare(&newer, &older));
  newer.lastAccessDate = 20;
  EXPECT_FALSE(strategy.compare(&older, &newer));
  EXPECT_FALSE(strategy.compare(&newer, &older));
}

TEST(PruneStrategyBase, CannotBeDeletedThroughItsBase) {
  EXPECT_FALSE(std::is_destructible_v<PruneStrategyBase>);
  EXPECT_FALSE(std::has_virtual_destructor_v<PruneStrategyBase>);
}

TEST(PruneStrategyBase, ItsStrategiesMayBeDerivedFrom) {
  class OldestLast : public LRUPruneStrategy {
   public:
    bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override {
      return LRUPruneStrategy::compare(b, a);
    }
  };
  class VideoOldestLast : public VideoDownloadPruneStrategy {
   public:
    bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override {
      return VideoDownloadPruneStrategy::compare(b, a);
    }
  };
  const DiskCacheItem older = usedAt(1);
  const DiskCacheItem newer = usedAt(2);
  const std::vector<std::shared_ptr<PruneStrategyBase>> strategies = {std::make_shared<OldestLast>(),
                                                                      std::make_shared<VideoOldestLast>()};
  for (const auto& strategy : strategies) {
    EXPECT_TRUE(Comparator(strategy)(&newer, &older));
    EXPECT_FALSE(Comparator(strategy)(&older, &newer));
  }
}

TEST(PruneStrategyFactory, MakesTheStrategyOfAnIdentifier) {
  EXPECT_NE(std::dynamic_pointer_cast<LRUPruneStrategy>(PruneStrategyFactory(PruneStrategyIdentifier::LRU)), nullptr);
  EXPECT_NE(std::dynamic_pointer_cast<VideoDownloadPruneStrategy>(
                PruneStrategyFactory(PruneStrategyIdentifier::VideoDownload)),
            nullptr);
  EXPECT_NE(
      std::dynamic_pointer_cast<GreedyDualPruneStrategy>(PruneStrategyFactory(PruneStrategyIdentifier::GreedyDual)),
      nullptr);
  EXPECT_NE(PruneStrategyFactory(static_cast<PruneStrategyIdentifier>(0)), nullptr);
  EXPECT_NE(PruneStrategyFactory(static_cast<PruneStrategyIdentifier>(2)), nullptr);
}

TEST(PruneStrategyFactory, MakesANewOneEachTime) {
  EXPECT_NE(PruneStrategyFactory(PruneStrategyIdentifier::LRU), PruneStrategyFactory(PruneStrategyIdentifier::LRU));
}

TEST(PruneStrategyFactory, KnowsNoOtherIdentifier) {
  for (const int number : {-1, 1, 3, 7}) {
    EXPECT_EQ(PruneStrategyFactory(static_cast<PruneStrategyIdentifier>(number)), nullptr) << number;
  }
}

TEST(Comparator, OrdersByLastUseWhenBuiltFromNothing) {
  const std::vector<Comparator> comparators = {
      Comparator(), Comparator(nullptr), Comparator(PruneStrategyFactory(static_cast<PruneStrategyIdentifier>(1))),
      Comparator(PruneStrategyFactory(static_cast<PruneStrategyIdentifier>(7)))};
  const DiskCacheItem older = usedAt(1);
  const DiskCacheItem newer = usedAt(2);
  for (const Comparator& comparator : comparators) {
    EXPECT_TRUE(comparator(&older, &newer));
    EXPECT_FALSE(comparator(&newer, &older));
    EXPECT_FALSE(comparator(&older, &older));
  }
}

TEST(Comparator, OrdersByItsStrategy) {
  const Comparator comparator(std::make_shared<LargestKeyFirst>());
  const DiskCacheItem a("a", "", 0, false, 0, 1, nullptr);
  const DiskCacheItem b("b", "", 0, false, 0, 2, nullptr);
  EXPECT_TRUE(comparator(&b, &a));
  EXPECT_FALSE(comparator(&a, &b));
}

TEST(Comparator, CopiesShareTheStrategyAndKeepItAlive) {
  auto strategy = std::make_shared<LargestKeyFirst>();
  const std::weak_ptr<LargestKeyFirst> observed = strategy;
  auto comparator = std::make_unique<Comparator>(std::move(strategy));
  auto copy = std::make_unique<Comparator>(*comparator);
  comparator.reset();
  const DiskCacheItem a("a", "", 0, false, 0, 1, nullptr);
  const DiskCacheItem b("b", "", 0, false, 0, 2, nullptr);
  EXPECT_TRUE((*copy)(&b, &a));
  copy.reset();
  EXPECT_TRUE(observed.expired());
}

TEST(Comparator, SortsItemPointersOldestFirst) {
  const std::vector<DiskCacheItem> items = {usedAt(3), usedAt(-1), usedAt(2)};
  std::vector<const DiskCacheItem*> order;
  for (const DiskCacheItem& item : items) order.push_back(&item);
  std::sort(order.begin(), order.end(), Comparator());
  std::vector<std::int32_t> dates;
  for (const DiskCacheItem* item : order) dates.push_back(item->lastAccessDate);
  EXPECT_EQ(dates, (std::vector<std::int32_t>{-1, 2, 3}));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
