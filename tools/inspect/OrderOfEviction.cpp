#include "inspect/OrderOfEviction.h"

#include <algorithm>
#include <cstdint>
#include <limits>
#include <memory>
#include <utility>

#include "DiskCacheManifest.h"
#include "ManifestPersistence.h"
#include "PruneStrategy.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Records = std::vector<ManifestSnapshot::Record>;

// The records, to be loaded once. Writes nothing anywhere.
class RecordsAlone final : public ManifestPersistence {
 public:
  explicit RecordsAlone(const Records& records) : records_(records) {}

  std::vector<std::unique_ptr<DiskCacheItem>> getAllItems() const override {
    std::vector<std::unique_ptr<DiskCacheItem>> items;
    items.reserve(records_.size());
    for (const auto& record : records_) items.push_back(std::make_unique<DiskCacheItem>(record.item));
    return items;
  }

  void clearItems() override {}
  void setItem(const DiskCacheItem& /*item*/) override {}
  std::unique_ptr<DiskCacheItem> getItem(const std::string& /*key*/) const override { return nullptr; }
  void removeItem(const std::string& /*key*/) override {}
  void updateLastAccessDate(const std::string& /*key*/, long /*date*/) override {}
  std::vector<std::unique_ptr<DiskCacheItem>> getItemsLastAccessedBefore(long /*date*/) const override { return {}; }
  void invalidate() override {}
  std::vector<unsigned char> getInlineData(const std::string& /*key*/) const override { return {}; }
  void setInlineData(const std::string& /*key*/, const std::vector<unsigned char>& /*data*/) override {}
  void removeInlineData(const std::string& /*key*/) override {}

 private:
  const Records& records_;
};

// Of one that goes although others have not been used for longer.
const char* reasonBesideUse(PruneStrategyIdentifier strategy) {
  return strategy == PruneStrategyIdentifier::GreedyDual
             ? "its size: smaller ones that were used less recently stay longer"
             : "its priority: others that were used less recently have a higher one";
}

}  // namespace

std::vector<EvictedItem> orderOfEviction(const Records& records, PruneStrategyIdentifier strategy) {
  const auto manifest = std::make_shared<DiskCacheManifest>(std::make_unique<RecordsAlone>(records), nullptr,
                                                            PruneStrategyFactory(strategy));
  manifest->invalidate();  // memory alone works, without a queue
  manifest->load();
  std::vector<EvictedItem> order;
  order.reserve(records.size());
  for (auto& item : manifest->pruneToSize(0, std::numeric_limits<std::uint32_t>::max())) {
    order.push_back({std::move(item), ""});
  }
  // A prune has no need for those without a size that are left then.
  while (auto item = manifest->pruneOldestItem()) order.push_back({std::move(*item), ""});
  std::int32_t oldest = std::numeric_limits<std::int32_t>::max();
  for (auto place = order.rbegin(); place != order.rend(); ++place) {
    oldest = std::min(oldest, place->item.lastAccessDate);
    place->reason =
        place->item.lastAccessDate == oldest ? "the least recently used of those left" : reasonBesideUse(strategy);
  }
  return order;
}

std::string nameOfOrder(PruneStrategyIdentifier strategy) {
  switch (strategy) {
    case PruneStrategyIdentifier::VideoDownload:
      return "video_download";
    case PruneStrategyIdentifier::GreedyDual:
      return "greedy_dual";
    case PruneStrategyIdentifier::LRU:
    case PruneStrategyIdentifier::Null:
      break;
  }
  return "lru";
}

}  // namespace velmora::mobile::xplat::cellar::tools
