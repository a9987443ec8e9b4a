#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <map>
#include <memory>
#include <ostream>
#include <random>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "DiskCacheManifest.h"
#include "ExtendedMetadata.h"
#include "PruneStrategy.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/MemoryPersistence.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::ManualClock;
using test::ManualExecutor;
using test::MemoryPersistence;

using Items = std::map<std::string, DiskCacheItem>;

bool isLarger(const DiskCacheItem* a, const DiskCacheItem* b) {
  return a->size != b->size ? a->size > b->size : a->filename < b->filename;
}

// A host's order, on top of nothing or in place of the one that it derives from.
class LargestFirst final : public PruneStrategyBase {
 public:
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override { return isLarger(a, b); }
};
class LargestInsteadOfOldestFirst : public LRUPruneStrategy {
 public:
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override { return isLarger(a, b); }
};
class LargestInsteadOfUnimportantFirst : public VideoDownloadPruneStrategy {
 public:
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override { return isLarger(a, b); }
};
class VideoByAnotherName : public VideoDownloadPruneStrategy {};

class HostsVideoMetadata : public VideoDownloadExtendedMetadata {
 public:
  using VideoDownloadExtendedMetadata::VideoDownloadExtendedMetadata;
};

enum class Strategy { None, LeastRecentlyUsed, Video, OfAHost, OfAHostFromLRU, OfAHostFromVideo, VideoByAnotherName };
enum class Metadata { None, Video, Mixed, OfAHostFromVideo };

struct Case {
  std::string name;
  Strategy strategy;
  Metadata metadata;
  bool tunablesChange;
};

void PrintTo(const Case& what, std::ostream* out) { *out << what.name; }

std::shared_ptr<PruneStrategyBase> make(Strategy strategy) {
  switch (strategy) {
    case Strategy::LeastRecentlyUsed:
      return std::make_shared<LRUPruneStrategy>();
    case Strategy::Video:
      return std::make_shared<VideoDownloadPruneStrategy>();
    case Strategy::OfAHost:
      return std::make_shared<LargestFirst>();
    case Strategy::OfAHostFromLRU:
      return std::make_shared<LargestInsteadOfOldestFirst>();
    case Strategy::OfAHostFromVideo:
      return std::make_shared<LargestInsteadOfUnimportantFirst>();
    case Strategy::VideoByAnotherName:
      return std::make_shared<VideoByAnotherName>();
    case Strategy::None:
      break;
  }
  return nullptr;
}

// A manifest and a plain map side by side go through the same random life: items come, are replaced and used, the clock
// is set forth and back, the host changes the tunables. Whatever a prune removes must be what a sort of the map gives.
class EvictionOrder : public testing::TestWithParam<Case> {
 protected:
  EvictionOrder() : before_(make(GetParam().strategy)) {
    manifest_ = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(),
                                                    std::make_shared<ManualExecutor>(), make(GetParam().strategy));
    manifest_->load();
  }
  ~EvictionOrder() override { setTunables(0, 0); }

  static void setTunables(int weight, int cutoff) {
    VideoDownloadPruneStrategy::priorityWeight = weight;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = cutoff;
  }

  std::uint32_t upTo(std::uint32_t highest) { return static_cast<std::uint32_t>(random_() % (highest + 1)); }
  std::string anyKey() { return "a key of some length " + std::to_string(upTo(120)); }

  std::shared_ptr<DiskCacheItem::ExtendedMetadata> anyMetadata() {
    const Metadata kind = GetParam().metadata;
    if (kind == Metadata::None || (kind == Metadata::Mixed && upTo(30) == 0)) return nullptr;
    const auto chunkSecond = static_cast<int>(upTo(20));
    const auto type = static_cast<VideoDownloadExtendedMetadata::ItemType>(upTo(4));
    if (kind == Metadata::OfAHostFromVideo) return std::make_shared<HostsVideoMetadata>(chunkSecond, type);
    return std::make_shared<VideoDownloadExtendedMetadata>(chunkSecond, type);
  }

  void store() {
    const std::string key = anyKey();
    const auto date = static_cast<std::int32_t>(now_ - 500 + upTo(600));
    items_[key] = DiskCacheItem(key, upTo(3) == 0 ? "another name" : key, upTo(9), false, date, date, anyMetadata());
    manifest_->setItem(items_[key]);
  }
  void use() {
    const std::string key = anyKey();
    manifest_->updateLastAccessDate(key);
    if (items_.count(key) > 0) items_[key].lastAccessDate = static_cast<std::int32_t>(now_);
  }
  void remove() {
    const std::string key = anyKey();
    manifest_->removeItem(key);
    items_.erase(key);
  }
  void moveClock() {
    now_ += static_cast<int>(upTo(40)) - 10;
    clock_.set(static_cast<std::time_t>(now_));
  }

  std::uint32_t total() const {
    std::uint32_t sum = 0;
    for (const auto& item : items_) sum += item.second.size;
    return sum;
  }

  // Nothing that stayed would have had to go before what went, which is all that an order with equals says. With three
  // items in a circle not even that holds: then only what went is compared.
  void expectWent(const std::vector<DiskCacheItem>& gone, const Comparator& before) {
    for (const DiskCacheItem& item : gone) {
      ASSERT_EQ(items_.count(item.key), 1U) << item.key;
      const DiskCacheItem expected = items_[item.key];
      EXPECT_EQ(item.filename, expected.filename);
      EXPECT_EQ(item.size, expected.size);
      EXPECT_EQ(item.lastAccessDate, expected.lastAccessDate);
      EXPECT_EQ(item.extendedMetadata, expected.extendedMetadata);
      items_.erase(item.key);
      if (isCircular()) continue;
      for (const auto& other : items_) {
        EXPECT_FALSE(before(&other.second, &expected)) << other.first << " before " << item.key;
      }
    }
  }
  static bool isCircular() {
    return GetParam().strategy == Strategy::Video && GetParam().metadata == Metadata::Mixed &&
           VideoDownloadPruneStrategy::priorityWeight != 0;
  }

  void pruneToSize() {
    const std::uint32_t target = total() - std::min(total(), upTo(60));
    const std::uint32_t count = upTo(12);
    const auto gone = manifest_->pruneToSize(target, count);
    expectWent(gone, before_);
    EXPECT_TRUE(gone.size() == count || total() <= target);
    EXPECT_EQ(manifest_->size(), total());
  }
  void expire() {
    const auto cutoff = static_cast<long>(now_ - 500 + upTo(100));
    const std::uint32_t count = upTo(12);
    const auto gone = manifest_->pruneOldEntries(cutoff, count);
    expectWent(gone, byDate_);
    for (const DiskCacheItem& item : gone) EXPECT_LT(item.lastAccessDate, cutoff);
    if (gone.size() == count) return;
    for (const auto& item : items_) EXPECT_GE(item.second.lastAccessDate, cutoff);
  }
  void evict() {
    const bool wasEmpty = items_.empty();
    const auto gone = manifest_->pruneOldestItem();
    ASSERT_EQ(gone == nullptr, wasEmpty);
    if (gone != nullptr) expectWent({*gone}, byDate_);
  }

  std::mt19937 random_{20261121};
  std::int64_t now_ = 1'700'000'000;
  ManualClock clock_{static_cast<std::time_t>(now_)};
  const Comparator before_;
  const Comparator byDate_;
  Items items_;
  std::shared_ptr<DiskCacheManifest> manifest_;
};

TEST_P(EvictionOrder, IsWhatASortGivesThroughoutALife) {
  setTunables(GetParam().metadata == Metadata::None ? 0 : 200, 10);
  for (int step = 0; step < 6000; ++step) {
    const std::uint32_t what = upTo(99);
    if (what < 40) {
      store();
    } else if (what < 70) {
      use();
    } else if (what < 80) {
      moveClock();
    } else if (what < 85) {
      remove();
    } else if (what < 90) {
      pruneToSize();
    } else if (what < 94) {
      expire();
    } else if (what < 98) {
      evict();
    } else if (GetParam().tunablesChange) {
      setTunables(static_cast<int>(upTo(3)) * 100 - 100, static_cast<int>(upTo(20)));
    }
    ASSERT_EQ(manifest_->count(), items_.size());
    ASSERT_EQ(manifest_->size(), total());
    if (HasFailure()) FAIL() << "at step " << step;
  }
  setTunables(0, 0);
  expectWent(manifest_->pruneToSize(0, 1000), before_);
  EXPECT_EQ(total(), 0U);
}

TEST_P(EvictionOrder, StartsAgainWhenTheManifestIsCleared) {
  for (int i = 0; i < 100; ++i) store();
  evict();
  pruneToSize();
  manifest_->clear();
  items_.clear();
  evict();
  for (int i = 0; i < 100; ++i) store();
  evict();
  expire();
  pruneToSize();
  EXPECT_EQ(manifest_->count(), items_.size());
}

// A second is long: all of a burst may come within one.
TEST(EvictionOrderOfOneSecond, IsThatInWhichTheItemsCame) {
  DiskCacheManifest manifest(std::make_unique<MemoryPersistence>(), std::make_shared<ManualExecutor>(), nullptr);
  manifest.load();
  const auto store = [&](int number) {
    const std::string key = std::to_string(number);
    manifest.setItem({key, key, 1, false, 1000, 1000, nullptr});
  };
  for (int number = 0; number < 100; ++number) store(number);
  store(50);  // comes anew
  manifest.removeItem("70");
  std::vector<std::string> expected;
  for (int number = 0; number < 100; ++number) {
    if (number != 50 && number != 70) expected.push_back(std::to_string(number));
  }
  expected.emplace_back("50");
  std::vector<std::string> gone = {manifest.pruneOldestItem()->key};
  for (const auto& item : manifest.pruneOldEntries(1001, 20)) gone.push_back(item.key);
  for (const auto& item : manifest.pruneToSize(0, 1000)) gone.push_back(item.key);
  EXPECT_EQ(gone, expected);
}

// The files of those that went have to go too.
TEST(EvictionOrderOfAHost, ThatThrowsMidwayYieldsWhatHasGone) {
  class Tired final : public PruneStrategyBase {
   public:
    explicit Tired(int& left) : left_(left) {}
    bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override {
      if (left_-- == 0) throw std::runtime_error("of the strategy");
      return a->key < b->key;
    }

   private:
    int& left_;
  };
  int left = 1000;
  DiskCacheManifest manifest(std::make_unique<MemoryPersistence>(), std::make_shared<ManualExecutor>(),
                             std::make_shared<Tired>(left));
  manifest.load();
  for (const char* key : {"a", "b", "c", "d", "e", "f", "g", "h"})
    manifest.setItem({key, key, 1, false, 1, 1, nullptr});
  std::size_t gone = 0;
  for (int compares = 0; gone == 0; ++compares) {
    left = compares;
    try {
      gone = manifest.pruneToSize(0, 100).size();
    } catch (const std::runtime_error&) {
      EXPECT_EQ(manifest.count(), 8U);
    }
  }
  EXPECT_LT(gone, 8U);
  EXPECT_EQ(manifest.count(), 8U - gone);
}

// What comes while the tunables are others is in its place for those; it has to leave it when they come back.
TEST(EvictionOrderByPriority, FollowsTunablesThatWereOthersForAWhile) {
  const auto set = [](int weight) { VideoDownloadPruneStrategy::priorityWeight = weight; };
  DiskCacheManifest manifest(std::make_unique<MemoryPersistence>(), std::make_shared<ManualExecutor>(),
                             make(Strategy::Video));
  manifest.load();
  const auto metadata = std::make_shared<VideoDownloadExtendedMetadata>(0, VideoDownloadExtendedMetadata::ItemType(1));
  const auto store = [&](const std::string& key, std::int32_t date) {
    manifest.setItem({key, key, 1, false, date, date, metadata});
  };
  set(100);
  for (int number = 0; number < 50; ++number) store("early " + std::to_string(number), 1000 + number);
  EXPECT_EQ(manifest.pruneToSize(49, 1).at(0).key, "early 0");
  set(1'000'000);
  store("earliest", 10);
  set(100);
  EXPECT_EQ(manifest.pruneToSize(49, 1).at(0).key, "earliest");
  set(0);
}

INSTANTIATE_TEST_SUITE_P(
    Orders, EvictionOrder,
    testing::Values(Case{"None", Strategy::None, Metadata::None, false},
                    Case{"LeastRecentlyUsed", Strategy::LeastRecentlyUsed, Metadata::Video, true},
                    Case{"Video", Strategy::Video, Metadata::Video, false},
                    Case{"VideoWithChangingTunables", Strategy::Video, Metadata::Video, true},
                    Case{"VideoWithoutMetadata", Strategy::Video, Metadata::None, true},
                    Case{"VideoWithMixedMetadata", Strategy::Video, Metadata::Mixed, true},
                    Case{"OfAHost", Strategy::OfAHost, Metadata::Mixed, true},
                    Case{"OfAHostFromLRU", Strategy::OfAHostFromLRU, Metadata::None, true},
                    Case{"OfAHostFromVideo", Strategy::OfAHostFromVideo, Metadata::Video, true},
                    Case{"VideoByAnotherName", Strategy::VideoByAnotherName, Metadata::Video, true},
                    Case{"VideoWithMetadataOfAHost", Strategy::Video, Metadata::OfAHostFromVideo, true}),
    [](const testing::TestParamInfo<Case>& test) { return test.param.name; });

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
