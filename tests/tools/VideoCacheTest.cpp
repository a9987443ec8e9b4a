#include "tune/VideoCache.h"

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
class VideoCacheTest : public testing::Test {
 protected:
  static void weigh(int weight, int cutoff) {
    VideoDownloadPruneStrategy::priorityWeight = weight;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = cutoff;
  }
  ~VideoCacheTest() override { weigh(0, 0); }
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

std::uint64_t hitsOf(const std::vector<Access>& trace, std::int64_t limit) {
  VideoCache cache(limit);
  std::uint64_t hits = 0;
  for (const Access& access : trace) {
    if (cache.access(access, VideoCache::kNever) && access.kind == AccessKind::Fetch) ++hits;
  }
  return hits;
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

TEST_F(VideoCacheTest, AnEarlyChunkOutlivesLaterOnesThatWereUsedSince) {
  weigh(1000, 5);
  std::vector<Access> trace = {chunk(0, 1, 2)};
  for (std::uint32_t i = 1; i <= 5; ++i) trace.push_back(chunk(i, 1 + i, 100));
  trace.push_back(chunk(0, 10, 2));
  EXPECT_EQ(hitsOf(trace, 20), 1U);
}

TEST_F(VideoCacheTest, WithoutAWeightTheLeastRecentlyUsedGoes) {
  weigh(0, 5);
  std::vector<Access> trace = {chunk(0, 1, 2)};
  for (std::uint32_t i = 1; i <= 5; ++i) trace.push_back(chunk(i, 1 + i, 100));
  trace.push_back(chunk(0, 10, 2));
  trace.push_back(chunk(5, 11, 100));
  EXPECT_EQ(hitsOf(trace, 20), 1U);
}

TEST_F(VideoCacheTest, StoresAreNoRequestsAndWhatIsRemovedIsGone) {
  Access store = chunk(0, 1, 0);
  store.kind = AccessKind::Store;
  Access removal = store;
  removal.kind = AccessKind::Remove;
  Access clear = store;
  clear.kind = AccessKind::Clear;
  const Access fetch = chunk(0, 2, 0);
  EXPECT_EQ(hitsOf({store, store}, 100), 0U);
  EXPECT_EQ(hitsOf({store, store, fetch}, 100), 1U);
  EXPECT_EQ(hitsOf({store, store, fetch, removal, fetch}, 100), 1U);
  EXPECT_EQ(hitsOf({store, store, fetch, clear, fetch, fetch}, 100), 2U);
}

TEST_F(VideoCacheTest, AgreeWithTheStrategyItselfOnRandomTraces) {
  weigh(1337, 4);
  std::mt19937 random(3);
  std::vector<Access> trace;
  for (int i = 0; i < 1500; ++i) {
    const auto key = static_cast<std::uint32_t>(random() % 40);
    // Dates a hundred apart and a weight that is no multiple of it: no two items rank the same.
    trace.push_back(chunk(key, 1000 + 100 * i, static_cast<int>(key % 9), static_cast<int>(key % 5)));
    trace.back().size = 1 + key % 13;
  }
  for (const std::int64_t limit : {0, 7, 40, 90, 150, 400}) {
    EXPECT_EQ(hitsOf(trace, limit), hitsOfAPlainCache(trace, limit)) << limit;
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
