#include "tune/VideoCaches.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "ExtendedMetadata.h"
#include "PruneStrategy.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using ItemType = VideoDownloadExtendedMetadata::ItemType;

// The strategy's settings hold for the whole process.
class VideoCachesTest : public testing::Test {
 protected:
  static void weigh(int weight, int cutoff) {
    VideoDownloadPruneStrategy::priorityWeight = weight;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = cutoff;
  }
  ~VideoCachesTest() override { weigh(0, 0); }
};

Access chunk(std::uint32_t key, std::int64_t date, int second, int type = 0) {
  Access access;
  access.key = key;
  access.date = date;
  access.size = 10;
  access.chunkSecond = second;
  access.itemType = type;
  return access;
}

// Pruned by asking the strategy itself, item by item.
std::uint64_t hitsOfAPlainCache(const std::vector<Access>& trace, std::int64_t limit) {
  const VideoDownloadPruneStrategy strategy;
  std::vector<DiskCacheItem> items;
  std::uint64_t hits = 0;
  for (const Access& access : trace) {
    const std::string key = std::to_string(access.key);
    const auto old = std::find_if(items.begin(), items.end(), [&](const auto& item) { return item.key == key; });
    if (old != items.end()) {
      ++hits;
      items.erase(old);
    }
    const auto date = static_cast<std::int32_t>(access.date);
    items.emplace_back(
        key, key, static_cast<std::uint32_t>(access.size), false, date, date,
        std::make_shared<VideoDownloadExtendedMetadata>(access.chunkSecond, static_cast<ItemType>(access.itemType)));
    const auto total = [&] {
      std::int64_t sum = 0;
      for (const DiskCacheItem& item : items) sum += item.size;
      return sum;
    };
    while (total() > limit) {
      items.erase(std::min_element(items.begin(), items.end(),
                                   [&](const auto& a, const auto& b) { return strategy.compare(&a, &b); }));
    }
  }
  return hits;
}

TEST_F(VideoCachesTest, AnEarlyChunkOutlivesLaterOnesThatWereUsedSince) {
  weigh(1000, 5);
  VideoCaches caches({20});
  caches.access(chunk(0, 1, 2));
  for (std::uint32_t i = 1; i <= 5; ++i) caches.access(chunk(i, 1 + i, 100));
  caches.access(chunk(0, 10, 2));
  EXPECT_EQ(caches.results().front().hits, 1U);
}

TEST_F(VideoCachesTest, WithoutAWeightTheLeastRecentlyUsedGoes) {
  weigh(0, 5);
  VideoCaches caches({20});
  caches.access(chunk(0, 1, 2));
  for (std::uint32_t i = 1; i <= 5; ++i) caches.access(chunk(i, 1 + i, 100));
  caches.access(chunk(0, 10, 2));
  caches.access(chunk(5, 11, 100));
  EXPECT_EQ(caches.results().front().hits, 1U);
}

TEST_F(VideoCachesTest, StoresAreNoRequestsAndWhatIsRemovedIsGone) {
  VideoCaches caches({100});
  Access access = chunk(0, 1, 0);
  access.kind = AccessKind::Store;
  caches.access(access);
  caches.access(access);
  EXPECT_EQ(caches.results().front().hits, 0U);
  caches.access(chunk(0, 2, 0));
  EXPECT_EQ(caches.results().front().hits, 1U);
  access.kind = AccessKind::Remove;
  caches.access(access);
  caches.access(chunk(0, 3, 0));
  EXPECT_EQ(caches.results().front().hits, 1U);
}

TEST_F(VideoCachesTest, AgreeWithTheStrategyItselfOnRandomTraces) {
  weigh(1337, 4);
  std::mt19937 random(3);
  std::vector<Access> trace;
  for (int i = 0; i < 1500; ++i) {
    const auto key = static_cast<std::uint32_t>(random() % 40);
    // Dates a hundred apart and a weight that is no multiple of it: no two items rank the same.
    trace.push_back(chunk(key, 1000 + 100 * i, static_cast<int>(key % 9), static_cast<int>(key % 5)));
    trace.back().size = 1 + key % 13;
  }
  const std::vector<std::int64_t> limits = {0, 7, 40, 90, 150, 400};
  VideoCaches caches(limits);
  for (const Access& access : trace) caches.access(access);
  for (const VideoCaches::Result& result : caches.results()) {
    EXPECT_EQ(result.hits, hitsOfAPlainCache(trace, result.limit)) << result.limit;
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
