#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "ManifestPersistence.h"
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar::test {

// What a manifest's persistence writes on, in memory: quick, a test can look at it, change it behind the manifest's
// back, and have chosen operations fail. It outlives the persistences made over it. Thread-safe; `onCall` is to be set
// before other threads use it.
class MemoryMedium {
 public:
  struct Row {
    DiskCacheItem item;
    Bytes inlineData;
  };
  using Rows = std::map<std::string, Row>;

  // Called at the end of each operation that has not failed, with no lock held.
  std::function<void(const std::string& operation, const std::string& key)> onCall;

  // Whether its persistences have transactions. To be set before other threads use it.
  bool canPerformTogether = true;

  void put(const DiskCacheItem& item, const Bytes& inlineData = {}) {
    change([&](Rows& rows) { rows[item.key] = {item, inlineData}; });
  }
  template <class Change> void change(Change change) {
    const std::lock_guard<std::mutex> lock(mutex_);
    change(rows_);
  }

  Rows rows() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return rows_;
  }
  Row row(const std::string& key) const { return rows().at(key); }
  std::vector<std::string> keys() const {
    std::vector<std::string> keys;
    for (const auto& row : rows()) keys.push_back(row.first);
    return keys;
  }
  std::int32_t accessDate(const std::string& key) const { return row(key).item.lastAccessDate; }

  // The keys that an operation was called with, failed calls too.
  std::vector<std::string> calls(const std::string& operation) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::string> keys;
    for (const auto& call : calls_) {
      if (call.first == operation) keys.push_back(call.second);
    }
    return keys;
  }
  std::size_t writes() const {
    return calls("setItem").size() + calls("removeItem").size() + calls("updateLastAccessDate").size() +
           calls("setInlineData").size() + calls("removeInlineData").size();
  }
  void forgetCalls() {
    const std::lock_guard<std::mutex> lock(mutex_);
    calls_.clear();
  }

  void noteCall(const std::string& operation) {
    const std::lock_guard<std::mutex> lock(mutex_);
    calls_.emplace_back(operation, "");
  }

  // The operation fails from its n-th call from now on (0: the next).
  void fail(const std::string& operation, int after = 0) {
    const std::lock_guard<std::mutex> lock(mutex_);
    failures_[operation] = after;
  }
  // Only its n-th call from now on fails.
  void failOnce(const std::string& operation, int after) {
    const std::lock_guard<std::mutex> lock(mutex_);
    failures_[operation] = after;
    failsOnce_ = true;
  }
  std::size_t failures() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return failed_;
  }
  void heal() {
    const std::lock_guard<std::mutex> lock(mutex_);
    failures_.clear();
  }

  // What the action returns for the rows, unless the operation is to fail.
  template <class Action> auto perform(const std::string& operation, const std::string& key, Action action) {
    auto result = [&] {
      const std::lock_guard<std::mutex> lock(mutex_);
      enter(operation, key);
      return action(rows_);
    }();
    if (onCall) onCall(operation, key);
    return result;
  }

 private:
  void enter(const std::string& operation, const std::string& key) {
    calls_.emplace_back(operation, key);
    const auto failure = failures_.find(operation);
    if (failure == failures_.end() || failure->second-- > 0) return;
    failure->second = 0;
    ++failed_;
    if (std::exchange(failsOnce_, false)) failures_.erase(failure);
    throw ManifestPersistenceException("The medium is full.", 13);
  }

  mutable std::mutex mutex_;  // guards all below
  Rows rows_;
  std::vector<std::pair<std::string, std::string>> calls_;
  std::map<std::string, int> failures_;
  bool failsOnce_ = false;
  std::size_t failed_ = 0;
};

// Thread-safe. Leaves its medium alone once it has been invalidated.
class MemoryPersistence final : public ManifestPersistence {
  using Rows = MemoryMedium::Rows;
  using Row = MemoryMedium::Row;

  template <class Action> auto perform(const std::string& operation, const std::string& key, Action action) const {
    using Result = decltype(medium_->perform(operation, key, action));
    return isSilent_ ? Result() : medium_->perform(operation, key, action);
  }

 public:
  explicit MemoryPersistence(std::shared_ptr<MemoryMedium> medium = std::make_shared<MemoryMedium>())
      : medium_(std::move(medium)) {}

  void clearItems() override {
    perform("clearItems", "", [](Rows& rows) { return std::exchange(rows, {}).size(); });
  }
  void setItem(const DiskCacheItem& item) override {
    perform("setItem", item.key, [&](Rows& rows) { return rows.insert_or_assign(item.key, Row{item, {}}).second; });
  }
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) const override {
    return perform("getItem", key, [&](Rows& rows) {
      const auto found = rows.find(key);
      return found == rows.end() ? nullptr : std::make_unique<DiskCacheItem>(found->second.item);
    });
  }
  void removeItem(const std::string& key) override {
    perform("removeItem", key, [&](Rows& rows) { return rows.erase(key); });
  }
  void updateLastAccessDate(const std::string& key, long date) override {
    edit("updateLastAccessDate", key, [&](Row& row) { row.item.lastAccessDate = static_cast<std::int32_t>(date); });
  }
  std::vector<std::unique_ptr<DiskCacheItem>> getItemsLastAccessedBefore(long date) const override {
    return items("getItemsLastAccessedBefore", [&](const DiskCacheItem& item) { return item.lastAccessDate < date; });
  }
  void invalidate() override {
    perform("invalidate", "", [](Rows& rows) { return rows.size(); });
    isSilent_ = true;
  }
  std::vector<std::unique_ptr<DiskCacheItem>> getAllItems() const override {
    return items("getAllItems", [](const DiskCacheItem&) { return true; });
  }
  Bytes getInlineData(const std::string& key) const override {
    return perform("getInlineData", key, [&](Rows& rows) {
      const auto found = rows.find(key);
      return found == rows.end() ? Bytes() : found->second.inlineData;
    });
  }
  void setInlineData(const std::string& key, const Bytes& data) override {
    edit("setInlineData", key, [&](Row& row) {
      row.item.hasInlineData = true;
      row.inlineData = data;
    });
  }
  void removeInlineData(const std::string& key) override {
    edit("removeInlineData", key, [](Row& row) {
      row.item.hasInlineData = false;
      row.inlineData.clear();
    });
  }

  // Operations of its own: "begin", "commit" and "roll back", of which the last does not fail.
  bool performTogether(const std::function<void()>& operations) override {
    if (isSilent_ || !medium_->canPerformTogether) return false;
    Rows before = perform("begin", "", [](Rows& rows) { return rows; });
    try {
      operations();
      perform("commit", "", [](Rows& rows) { return rows.size(); });
    } catch (...) {
      medium_->change([&](Rows& rows) { rows = std::move(before); });
      medium_->noteCall("roll back");
      throw;
    }
    return true;
  }

 private:
  // Changes the row, if there is one.
  template <class Change> void edit(const std::string& operation, const std::string& key, Change change) {
    perform(operation, key, [&](Rows& rows) {
      const auto found = rows.find(key);
      if (found != rows.end()) change(found->second);
      return found != rows.end();
    });
  }

  template <class Wanted>
  std::vector<std::unique_ptr<DiskCacheItem>> items(const std::string& operation, Wanted wanted) const {
    return perform(operation, "", [&](Rows& rows) {
      std::vector<std::unique_ptr<DiskCacheItem>> found;
      for (const auto& row : rows) {
        if (wanted(row.second.item)) found.push_back(std::make_unique<DiskCacheItem>(row.second.item));
      }
      return found;
    });
  }

  const std::shared_ptr<MemoryMedium> medium_;
  std::atomic<bool> isSilent_{false};
};

}  // namespace velmora::mobile::xplat::cellar::test
