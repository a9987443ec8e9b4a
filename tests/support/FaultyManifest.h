#pragma once

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <exception>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "DiskCacheManifest.h"
#include "ManifestPersistence.h"

namespace velmora::mobile::xplat::cellar::test {

// A manifest's medium in memory: quick, and the test can look at it. It outlives the persistences made over it.
// Thread-safe.
class MemoryMedium {
 public:
  struct Row {
    DiskCacheItem item;
    std::vector<unsigned char> inlineData;
  };

  std::map<std::string, Row> rows() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return rows_;
  }

  template <class Change> void change(Change change) {
    const std::lock_guard<std::mutex> lock(mutex_);
    change(rows_);
  }

 private:
  mutable std::mutex mutex_;  // guards the rows
  std::map<std::string, Row> rows_;
};

class MemoryPersistence final : public ManifestPersistence {
 public:
  explicit MemoryPersistence(std::shared_ptr<MemoryMedium> medium) : medium_(std::move(medium)) {}

  void clearItems() override {
    change([](auto& rows) { rows.clear(); });
  }
  void setItem(const DiskCacheItem& item) override {
    change([&](auto& rows) { rows[item.key] = {item, {}}; });
  }
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) const override {
    const auto rows = medium_->rows();
    const auto found = rows.find(key);
    return isSilent_ || found == rows.end() ? nullptr : std::make_unique<DiskCacheItem>(found->second.item);
  }
  void removeItem(const std::string& key) override {
    change([&](auto& rows) { rows.erase(key); });
  }
  void updateLastAccessDate(const std::string& key, long date) override {
    change([&](auto& rows) {
      if (rows.count(key) > 0) rows[key].item.lastAccessDate = static_cast<std::int32_t>(date);
    });
  }
  std::vector<std::unique_ptr<DiskCacheItem>> getItemsLastAccessedBefore(long date) const override {
    auto items = getAllItems();
    const auto isRecent = [date](const auto& item) { return item->lastAccessDate >= date; };
    items.erase(std::remove_if(items.begin(), items.end(), isRecent), items.end());
    return items;
  }
  void invalidate() override { isSilent_ = true; }
  std::vector<std::unique_ptr<DiskCacheItem>> getAllItems() const override {
    std::vector<std::unique_ptr<DiskCacheItem>> items;
    if (isSilent_) return items;
    for (const auto& row : medium_->rows()) items.push_back(std::make_unique<DiskCacheItem>(row.second.item));
    return items;
  }
  std::vector<unsigned char> getInlineData(const std::string& key) const override {
    const auto rows = medium_->rows();
    const auto found = rows.find(key);
    return isSilent_ || found == rows.end() ? std::vector<unsigned char>() : found->second.inlineData;
  }
  void setInlineData(const std::string& key, const std::vector<unsigned char>& data) override {
    change([&](auto& rows) {
      if (rows.count(key) == 0) return;
      rows[key].inlineData = data;
      rows[key].item.hasInlineData = true;
    });
  }
  void removeInlineData(const std::string& key) override {
    change([&](auto& rows) {
      if (rows.count(key) == 0) return;
      rows[key].inlineData.clear();
      rows[key].item.hasInlineData = false;
    });
  }

 private:
  template <class Change> void change(Change change) {
    if (!isSilent_) medium_->change(change);
  }

  const std::shared_ptr<MemoryMedium> medium_;
  std::atomic<bool> isSilent_{false};
};

enum class ManifestCall {
  Clear,
  Load,
  Invalidate,
  SetItem,
  GetItem,
  UpdateLastAccessDate,
  GetModificationDate,
  RemoveItem,
  GetInlineData,
  SetInlineData,
  RemoveInlineData,
  PruneToSize,
  PruneOldEntries,
  PruneOldestItem,
  GetAllKeys,
};

// Another manifest with every call recorded, and chosen calls failing before they reach it. `size`, `count` and
// `isLoaded` are neither: they never leave memory. Thread-safe; `onCall` is to be set before other threads use it.
class FaultyManifest final : public DiskCacheManifestInterface {
 public:
  // Called at the beginning of each call, before it may fail, with the name and the arguments: "setItem key 12".
  std::function<void(ManifestCall call, const std::string& text)> onCall;

  explicit FaultyManifest(std::shared_ptr<DiskCacheManifestInterface> real) : real_(std::move(real)) {}

  template <class Exception> void failNext(ManifestCall call, const Exception& exception) {
    const std::lock_guard<std::mutex> lock(mutex_);
    next_[call].push_back(std::make_exception_ptr(exception));
  }

  std::vector<std::string> trace() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return trace_;
  }
  void clearTrace() {
    const std::lock_guard<std::mutex> lock(mutex_);
    trace_.clear();
  }
  std::size_t calls(ManifestCall call) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto found = counts_.find(call);
    return found == counts_.end() ? 0 : found->second;
  }

  void clear() override {
    enter(ManifestCall::Clear, "clear");
    real_->clear();
  }
  void load() override {
    enter(ManifestCall::Load, "load");
    real_->load();
  }
  void invalidate() override {
    enter(ManifestCall::Invalidate, "invalidate");
    real_->invalidate();
  }
  void setItem(const DiskCacheItem& item) override {
    enter(ManifestCall::SetItem, "setItem " + item.key + " " + std::to_string(item.size));
    real_->setItem(item);
  }
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) override {
    enter(ManifestCall::GetItem, "getItem " + key);
    return real_->getItem(key);
  }
  void updateLastAccessDate(const std::string& key) override {
    enter(ManifestCall::UpdateLastAccessDate, "updateLastAccessDate " + key);
    real_->updateLastAccessDate(key);
  }
  std::optional<std::int32_t> getModificationDate(const std::string& key) override {
    enter(ManifestCall::GetModificationDate, "getModificationDate " + key);
    return real_->getModificationDate(key);
  }
  void removeItem(const std::string& key) override {
    enter(ManifestCall::RemoveItem, "removeItem " + key);
    real_->removeItem(key);
  }
  std::vector<unsigned char> getInlineData(const std::string& key) override {
    enter(ManifestCall::GetInlineData, "getInlineData " + key);
    return real_->getInlineData(key);
  }
  void setInlineData(const std::string& key, const std::vector<unsigned char>& data) override {
    enter(ManifestCall::SetInlineData, "setInlineData " + key + " " + std::to_string(data.size()));
    real_->setInlineData(key, data);
  }
  void removeInlineData(const std::string& key) override {
    enter(ManifestCall::RemoveInlineData, "removeInlineData " + key);
    real_->removeInlineData(key);
  }
  std::vector<DiskCacheItem> pruneToSize(std::uint32_t size, std::uint32_t count) override {
    enter(ManifestCall::PruneToSize, "pruneToSize " + std::to_string(size) + " " + std::to_string(count));
    return real_->pruneToSize(size, count);
  }
  std::vector<DiskCacheItem> pruneOldEntries(long date, std::uint32_t count) override {
    enter(ManifestCall::PruneOldEntries, "pruneOldEntries " + std::to_string(date) + " " + std::to_string(count));
    return real_->pruneOldEntries(date, count);
  }
  std::unique_ptr<DiskCacheItem> pruneOldestItem() override {
    enter(ManifestCall::PruneOldestItem, "pruneOldestItem");
    return real_->pruneOldestItem();
  }
  std::vector<std::string> getAllKeys() override {
    enter(ManifestCall::GetAllKeys, "getAllKeys");
    return real_->getAllKeys();
  }
  std::uint32_t size() override { return real_->size(); }
  std::uint32_t count() override { return real_->count(); }
  bool isLoaded() override { return real_->isLoaded(); }
  std::optional<ReplacedItem> replaceItem(const DiskCacheItem& item, bool withInlineData) override {
    enter(ManifestCall::SetItem, "setItem " + item.key + " " + std::to_string(item.size));
    return real_->replaceItem(item, withInlineData);
  }

 private:
  void enter(ManifestCall call, const std::string& text) {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      trace_.push_back(text);
      ++counts_[call];
    }
    if (onCall) onCall(call, text);
    std::exception_ptr failure;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      std::deque<std::exception_ptr>& queued = next_[call];
      if (queued.empty()) return;
      failure = queued.front();
      queued.pop_front();
    }
    std::rethrow_exception(failure);
  }

  const std::shared_ptr<DiskCacheManifestInterface> real_;
  mutable std::mutex mutex_;  // guards the below
  std::vector<std::string> trace_;
  std::map<ManifestCall, std::size_t> counts_;
  std::map<ManifestCall, std::deque<std::exception_ptr>> next_;
};

}  // namespace velmora::mobile::xplat::cellar::test
