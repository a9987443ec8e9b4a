#pragma once

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "Store.h"

namespace velmora::mobile::xplat::cellar::test {

// One call of `pruneBackToNormal`, as it came.
struct PruneRequest {
  std::function<void()> onSuccess;
  std::function<void(const std::exception&)> onError;
  bool survivalMode;
};

// A store that does nothing by itself: it remembers what it is asked and answers when the test says so. Thread-safe;
// the hooks are to be set before other threads use the store.
class FakeStore : public Store {
 public:
  FakeStore(const std::string& path_, std::function<void(unsigned int)> sizeChanged, bool prunable)
      : Store(path_), sizeChanged_(std::move(sizeChanged)), prunable_(prunable) {}

  // Called instead of keeping the request, with no lock held. What it throws leaves `pruneBackToNormal`.
  std::function<void(const PruneRequest&)> onPrune;
  // Called at the end of `invalidate`, with no lock held.
  std::function<void()> onInvalidate;

  bool isPrunable() override { return prunable_; }

  void invalidate() override {
    ++invalidations_;
    if (onInvalidate) onInvalidate();
  }

  void pruneBackToNormal(std::function<void()> onSuccess, std::function<void(const std::exception&)> onError,
                         bool survivalMode) override {
    PruneRequest request{std::move(onSuccess), std::move(onError), survivalMode};
    ++pruneCount_;
    survivalMode_ = survivalMode;
    if (onPrune) return onPrune(request);
    const std::lock_guard<std::mutex> lock(mutex_);
    waiting_.push_back(std::move(request));
  }

  // Tells the manager the store's size, as a store does after each write.
  void reportSize(unsigned int size) { sizeChanged_(size); }

  std::size_t invalidations() const { return invalidations_; }
  std::size_t pruneCount() const { return pruneCount_; }
  bool lastPruneWasForSurvival() const { return survivalMode_; }

  std::size_t prunesUnderWay() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return waiting_.size();
  }

  // Takes the oldest request that has not been answered; throws std::logic_error when there is none.
  PruneRequest takePrune() {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (waiting_.empty()) throw std::logic_error("No prune is under way.");
    PruneRequest request = std::move(waiting_.front());
    waiting_.pop_front();
    return request;
  }
  void finishPrune() { takePrune().onSuccess(); }
  void failPrune(const std::exception& error) { takePrune().onError(error); }

 private:
  const std::function<void(unsigned int)> sizeChanged_;
  const bool prunable_;
  std::atomic<std::size_t> invalidations_{0};
  std::atomic<std::size_t> pruneCount_{0};
  std::atomic<bool> survivalMode_{false};
  mutable std::mutex mutex_;  // guards the requests
  std::deque<PruneRequest> waiting_;
};

// What a definition was given to create a store with. The services are for comparison only: nothing is kept alive.
struct Creation {
  std::string name;
  std::string storePath;
  std::string temporaryDirectoryPath;
  const TaskQueueFactory* taskQueueFactory;
  const TrashCollector* trashCollector;
  const AnalyticsEventReporter* analyticsReporter;
  const FileUtils* fileUtils;
  bool hasSizeCallback;
  PruneStrategyIdentifier pruneStrategy;
  const StoreDefinition* definition;
};

// What happens when stores of its definitions are created, and what was created. Shared by a test and the definitions.
// It keeps no store alive. Thread-safe; the hooks are to be set before other threads create stores.
class FakeStores {
 public:
  using SizeCallback = std::function<void(unsigned int)>;

  // Called as a store is about to be made, with no lock held: it may wait, call back or throw.
  std::function<void(const std::string& name, const SizeCallback& sizeChanged)> onCreate;
  // Called with a store that has just been made.
  std::function<void(const std::string& name, FakeStore& store)> onCreated;

  void add(Creation creation, const std::shared_ptr<FakeStore>& store) {
    const std::lock_guard<std::mutex> lock(mutex_);
    stores_[creation.name] = store;
    creations_.push_back(std::move(creation));
  }

  std::vector<Creation> creations() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return creations_;
  }

  // The names of the stores that were created, in that order.
  std::vector<std::string> createdNames() const {
    std::vector<std::string> names;
    for (const Creation& creation : creations()) names.push_back(creation.name);
    return names;
  }

  // The store that was last created under that name; throws when it was not or is gone.
  std::shared_ptr<FakeStore> operator[](const std::string& name) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    auto store = stores_.at(name).lock();
    if (store == nullptr) throw std::logic_error("Store " + name + " is gone.");
    return store;
  }

 private:
  mutable std::mutex mutex_;  // guards both
  std::vector<Creation> creations_;
  std::unordered_map<std::string, std::weak_ptr<FakeStore>> stores_;
};

// Creates fake stores.
class FakeStoreDefinition final : public StoreDefinition {
 public:
  struct Options {
    unsigned int maxSize = 0;
    bool isManaged = true;
    bool isPrunable = true;
    unsigned int version = 1;
  };

  FakeStoreDefinition(const std::string& name_, std::shared_ptr<FakeStores> stores, const Options& options)
      : StoreDefinition(Type::PKVS, name_, "fakes", false, false, options.version, options.maxSize, false,
                        options.isManaged),
        stores_(std::move(stores)),
        prunable_(options.isPrunable) {}
  FakeStoreDefinition(const std::string& name_, std::shared_ptr<FakeStores> stores)
      : FakeStoreDefinition(name_, std::move(stores), Options()) {}

  using StoreDefinition::createStore;
  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                     std::shared_ptr<TrashCollector> trashCollector,
                                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                     std::shared_ptr<FileUtils> fileUtils,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override {
    if (stores_->onCreate) stores_->onCreate(name, sizeChangedCallback);
    const auto store = std::make_shared<FakeStore>(storePath, sizeChangedCallback, prunable_);
    if (stores_->onCreated) stores_->onCreated(name, *store);
    stores_->add(
        {name, storePath, temporaryDirectoryPath, taskQueueFactory.get(), trashCollector.get(), analyticsReporter.get(),
         fileUtils.get(), sizeChangedCallback != nullptr, pruneStrategy, definition.get()},
        store);
    return store;
  }

 private:
  const std::shared_ptr<FakeStores> stores_;
  const bool prunable_;
};

}  // namespace velmora::mobile::xplat::cellar::test
