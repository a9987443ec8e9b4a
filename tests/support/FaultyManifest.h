#pragma once

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
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar::test {

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
// `isLoaded` are neither: they never leave memory. Thread-safe; what is public is to be set before other threads use
// it.
class FaultyManifest final : public DiskCacheManifestInterface {
 public:
  using Create = std::function<std::shared_ptr<DiskCacheManifestInterface>()>;

  // Called at the beginning of each call, before it may fail, with the name and the arguments: "setItem key 12".
  std::function<void(ManifestCall call, const std::string& text)> onCall;
  // As a host's own manifest that has only what every manifest must have.
  bool cannotReplace = false;

  explicit FaultyManifest(std::shared_ptr<DiskCacheManifestInterface> real) : real_(std::move(real)) {}
  explicit FaultyManifest(Create create) : create_(std::move(create)) {}  // when a call first reaches it

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
    real().clear();
  }
  void load() override {
    enter(ManifestCall::Load, "load");
    real().load();
  }
  void invalidate() override {
    enter(ManifestCall::Invalidate, "invalidate");
    real().invalidate();
  }
  void setItem(const DiskCacheItem& item) override {
    enter(ManifestCall::SetItem, "setItem " + item.key + " " + std::to_string(item.size));
    real().setItem(item);
  }
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) override {
    enter(ManifestCall::GetItem, "getItem " + key);
    return real().getItem(key);
  }
  void updateLastAccessDate(const std::string& key) override {
    enter(ManifestCall::UpdateLastAccessDate, "updateLastAccessDate " + key);
    real().updateLastAccessDate(key);
  }
  std::optional<std::int32_t> getModificationDate(const std::string& key) override {
    enter(ManifestCall::GetModificationDate, "getModificationDate " + key);
    return real().getModificationDate(key);
  }
  void removeItem(const std::string& key) override {
    enter(ManifestCall::RemoveItem, "removeItem " + key);
    real().removeItem(key);
  }
  Bytes getInlineData(const std::string& key) override {
    enter(ManifestCall::GetInlineData, "getInlineData " + key);
    return real().getInlineData(key);
  }
  void setInlineData(const std::string& key, const Bytes& data) override {
    enter(ManifestCall::SetInlineData, "setInlineData " + key + " " + std::to_string(data.size()));
    real().setInlineData(key, data);
  }
  void removeInlineData(const std::string& key) override {
    enter(ManifestCall::RemoveInlineData, "removeInlineData " + key);
    real().removeInlineData(key);
  }
  std::vector<DiskCacheItem> pruneToSize(std::uint32_t size, std::uint32_t count) override {
    enter(ManifestCall::PruneToSize, "pruneToSize " + std::to_string(size) + " " + std::to_string(count));
    return real().pruneToSize(size, count);
  }
  std::vector<DiskCacheItem> pruneOldEntries(long date, std::uint32_t count) override {
    enter(ManifestCall::PruneOldEntries, "pruneOldEntries " + std::to_string(date) + " " + std::to_string(count));
    return real().pruneOldEntries(date, count);
  }
  std::unique_ptr<DiskCacheItem> pruneOldestItem() override {
    enter(ManifestCall::PruneOldestItem, "pruneOldestItem");
    return real().pruneOldestItem();
  }
  std::vector<std::string> getAllKeys() override {
    enter(ManifestCall::GetAllKeys, "getAllKeys");
    return real().getAllKeys();
  }
  std::uint32_t size() override { return real().size(); }
  std::uint32_t count() override { return real().count(); }
  bool isLoaded() override { return real().isLoaded(); }
  std::optional<ReplacedItem> replaceItem(const DiskCacheItem& item, bool withInlineData) override {
    if (cannotReplace) return DiskCacheManifestInterface::replaceItem(item, withInlineData);
    enter(ManifestCall::SetItem, "setItem " + item.key + " " + std::to_string(item.size));
    return real().replaceItem(item, withInlineData);
  }
  bool changeTogether(const std::function<void()>& changes) override {
    return cannotReplace ? DiskCacheManifestInterface::changeTogether(changes) : real().changeTogether(changes);
  }

 private:
  DiskCacheManifestInterface& real() {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (real_ == nullptr) real_ = create_();
    return *real_;
  }

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

  const Create create_;
  mutable std::mutex mutex_;  // guards the below
  std::shared_ptr<DiskCacheManifestInterface> real_;
  std::vector<std::string> trace_;
  std::map<ManifestCall, std::size_t> counts_;
  std::map<ManifestCall, std::deque<std::exception_ptr>> next_;
};

}  // namespace velmora::mobile::xplat::cellar::test
