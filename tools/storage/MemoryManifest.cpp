#include "storage/MemoryManifest.h"

#include <cstdint>
#include <functional>
#include <string>
#include <utility>

#include "ManifestPersistence.h"
#include "PruneStrategy.h"
#include "executor/AsyncExecutor.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Has the items once, to be loaded.
class ItemsAlone final : public ManifestPersistence {
 public:
  explicit ItemsAlone(const std::vector<DiskCacheItem>& items) : items_(items) {}

  std::vector<std::unique_ptr<DiskCacheItem>> getAllItems() const override {
    std::vector<std::unique_ptr<DiskCacheItem>> items;
    items.reserve(items_.size());
    for (const DiskCacheItem& item : items_) items.push_back(std::make_unique<DiskCacheItem>(item));
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
  const std::vector<DiskCacheItem>& items_;  // as long as they are loaded
};

// Runs tasks at once. An invalidated manifest has no timers.
class AtOnce final : public AsyncExecutor {
 public:
  void dispatch(std::function<void()> task) override { task(); }
  std::unique_ptr<executor::AsyncTimer> dispatchAfter(std::int64_t /*delay*/, std::function<void()> /*task*/,
                                                      std::function<void()> /*companion*/) override {
    return nullptr;
  }
  std::unique_ptr<executor::AsyncTimer> scheduleAfter(std::int64_t /*delay*/, std::function<void()> /*task*/,
                                                      std::function<void()> /*companion*/) override {
    return nullptr;
  }
};

}  // namespace

std::shared_ptr<DiskCacheManifest> memoryManifest(const std::vector<DiskCacheItem>& items,
                                                  PruneStrategyIdentifier strategy) {
  auto manifest = std::make_shared<DiskCacheManifest>(std::make_unique<ItemsAlone>(items), std::make_shared<AtOnce>(),
                                                      PruneStrategyFactory(strategy));
  manifest->invalidate();  // memory works on
  manifest->load();
  return manifest;
}

}  // namespace velmora::mobile::xplat::cellar::tools
