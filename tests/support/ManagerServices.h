#pragma once

#include <atomic>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskSizeCalculator.h"
#include "StoreDirectoryNameBuilder.h"
#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/FakeStore.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {

// A file system whose size the test chooses, so that no outcome depends on the machine's disk. Large at first.
class DiskOfChosenSize final : public FaultyFileUtils {
 public:
  std::atomic<long long> total{1LL << 40};
  std::atomic<long long> available{1LL << 39};

  FileUtils::DiskSpace getDiskSpace(const std::string& path) override {
    FaultyFileUtils::getDiskSpace(path);  // fails when it is told to
    return {total, available};
  }
};

// A real collector that remembers what it was asked to collect, and refuses on demand. Thread-safe.
class RecordingTrashCollector final : public TrashCollector {
 public:
  using TrashCollector::TrashCollector;

  std::atomic<bool> refuses{false};
  // Called at the beginning of each collect. To be set before other threads use the object.
  std::function<void(const std::string& path)> onCollect;

  bool collectPath(const std::string& path) override {
    if (onCollect) onCollect(path);
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      collected_.push_back(path);
    }
    return !refuses && TrashCollector::collectPath(path);
  }

  std::vector<std::string> collected() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return collected_;
  }

 private:
  mutable std::mutex mutex_;  // guards the paths
  std::vector<std::string> collected_;
};

// Answers with sizes that the test chooses, 0 at first, and remembers what was registered. Thread-safe.
class FakeDiskSizeCalculator final : public DiskSizeCalculator {
 public:
  using DiskSizeCalculator::DiskSizeCalculator;

  void setSize(const std::string& path, long long size) {
    const std::lock_guard<std::mutex> lock(mutex_);
    sizes_[path] = size;
  }

  long long fetchDirectorySize(const std::string& path) override {
    const std::lock_guard<std::mutex> lock(mutex_);
    fetched_.push_back(path);
    return sizes_[path];
  }

  void addDirectory(const std::string& path, long staleInterval) override {
    const std::lock_guard<std::mutex> lock(mutex_);
    registered_.emplace_back(path, staleInterval);
  }

  std::vector<std::string> fetched() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return fetched_;
  }
  std::vector<std::pair<std::string, long>> registered() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return registered_;
  }

 private:
  mutable std::mutex mutex_;  // guards all of it
  std::unordered_map<std::string, long long> sizes_;
  std::vector<std::string> fetched_;
  std::vector<std::pair<std::string, long>> registered_;
};

// Everything that a manager is built with, under the test's control. The area is `directory/area`, the trash beside it.
struct ManagerServices {
  TemporaryDirectory directory;
  std::shared_ptr<DiskOfChosenSize> files = std::make_shared<DiskOfChosenSize>();
  std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  std::shared_ptr<AnalyticsEventReporter> reporter = recordingReporter(events);
  std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<ManualQueueFactory> trashQueues = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<RecordingTrashCollector> trash =
      std::make_shared<RecordingTrashCollector>(directory.file("trash"), files, nullptr, trashQueues);
  std::shared_ptr<AttributeStore> attributes = std::make_shared<AttributeStore>(files);
  std::shared_ptr<FakeDiskSizeCalculator> sizes = std::make_shared<FakeDiskSizeCalculator>(files, attributes, nullptr);
  StoreDirectoryNameBuilderFactory names{"250", "US", "en"};
  std::shared_ptr<FakeStores> stores = std::make_shared<FakeStores>();

  std::string areaPath() const { return directory.file("area"); }

  std::shared_ptr<const StoreDefinition> fake(const std::string& name,
                                              const FakeStoreDefinition::Options& options = {}) const {
    return std::make_shared<FakeStoreDefinition>(name, stores, options);
  }

  static std::shared_ptr<const StoreDefinition> unmanaged(const std::string& name, unsigned int maxSize = 0,
                                                          bool isCache = false) {
    return std::make_shared<UnmanagedStoreDefinition>(name, "fakes", false, false, 1U, maxSize, isCache);
  }

  using Stores = std::unordered_map<std::string, std::shared_ptr<const StoreDefinition>>;

  static StoreManagerDefinition manager(Stores definitions, unsigned int maxSize = 0, unsigned int pruneInterval = 1) {
    return {"media", Area::Caches, maxSize, pruneInterval, std::move(definitions), false};
  }
};

}  // namespace velmora::mobile::xplat::cellar::test
