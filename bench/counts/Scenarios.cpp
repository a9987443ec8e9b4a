#include <cstddef>
#include <ctime>
#include <functional>
#include <limits>
#include <map>
#include <stdexcept>
#include <vector>

#include <cellar/AnalyticsEventReporter.h>
#include <cellar/DiskCache.h>
#include <cellar/DiskCacheManifest.h>
#include <cellar/FileUtils.h>
#include <cellar/PruneStrategy.h>
#include <cellar/StoreDefinition.h>
#include <cellar/TrashCollector.h>
#include <cellar/host/testing/ManualQueue.h>

#include "counts/Scenario.h"
#include "host/testing/ManualClock.h"
#include "lower_bounds/FileLowerBound.h"
#include "lower_bounds/ManifestLowerBound.h"
#include "support/Values.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kOperations = 1'000;
constexpr std::size_t kItems = 10'000;
constexpr std::size_t kSize = 4'096;
constexpr std::time_t kNow = 1'700'000'000;
constexpr long kTenYears = 315'360'000;
constexpr unsigned int kBatchSize = 50;  // as managers have it

void throwUnless(bool condition, const char* message) {
  if (!condition) throw std::runtime_error(message);
}

using Strategy = PruneStrategyIdentifier;

// A disk cache with manual queues.
class CacheScenario : public Scenario {
 public:
  // `itemsBefore`: the number of items in its manifest when it is opened.
  CacheScenario(const std::string& directory, std::size_t itemsBefore, std::uint32_t normalSize, Strategy strategy)
      : directory_(directory + "/store") {
    const auto files = std::make_shared<FileUtils>();
    files->createDirectory(directory_, true);
    if (itemsBefore > 0) ManifestLowerBound(directory_).fill(itemsBefore, kSize);
    const auto queues = std::shared_ptr<TaskQueueFactory>(&queues_, [](TaskQueueFactory*) {});
    cache_ = std::make_shared<DiskCache>(
        directory_, directory + "/tmp", "counted", std::nullopt, kTenYears, normalSize, normalSize, false, queues,
        nullptr, std::make_shared<TrashCollector>(directory + "/trash", files, nullptr, nullptr),
        PruneStrategyFactory(strategy), nullptr, nullptr, files, [](unsigned int) {}, kBatchSize);
  }

 protected:
  const std::string& directory() const { return directory_; }
  DiskCache& cache() { return *cache_; }
  void runQueues() { queues_.runAll(); }

  void load() {
    cache_->loadManifest();
    runQueues();
  }

  // So many at a time wait on the queues.
  void storeAll(std::size_t outstanding = 1) {
    Bytes value = valueOf(kSize);
    std::vector<Future<void>> futures;
    for (std::size_t number = 0; number < kOperations; ++number) {
      stamp(value, number);
      futures.push_back(cache_->store(keyOf(number), value));
      if (futures.size() < outstanding && number + 1 < kOperations) continue;
      runQueues();
      for (auto& future : futures) future.get();
      futures.clear();
    }
  }

 private:
  const test::ManualClock clock_{kNow};
  const std::string directory_;
  test::ManualQueueFactory queues_;
  std::shared_ptr<DiskCache> cache_;
};

constexpr std::uint32_t kNoLimit = std::numeric_limits<std::uint32_t>::max();

class Stores : public CacheScenario {
 public:
  Stores(const std::string& directory, std::size_t outstanding, Strategy strategy = Strategy::LRU)
      : CacheScenario(directory, 0, kNoLimit, strategy), outstanding_(outstanding) {
    load();
  }
  void run() override { storeAll(outstanding_); }
  void verify() override {
    for (std::size_t number = 0; number < kOperations; ++number) {
      throwUnlessValue(readFile(directory() + "/" + keyOf(number), kSize), kSize, number);
    }
    throwUnless(cache().getManifest()->count() == kOperations, "not every store has a record");
  }

 private:
  const std::size_t outstanding_;
};

class Fetches : public CacheScenario {
 public:
  explicit Fetches(const std::string& directory, Strategy strategy = Strategy::LRU)
      : CacheScenario(directory, 0, kNoLimit, strategy) {
    load();
    storeAll();
  }
  void run() override {
    for (std::size_t number = 0; number < kOperations; ++number) {
      auto future = cache().fetch(keyOf(number));
      future.then(nullptr, [&](auto& result) {
        const auto found = result.get();
        throwUnlessStamped(found->value.data(), found->value.size(), kSize, number);
        ++found_;
      });
      runQueues();
    }
  }
  void verify() override { throwUnless(found_ == kOperations, "not everything was found"); }

 private:
  std::size_t found_ = 0;
};

class Prune : public CacheScenario {
 public:
  explicit Prune(const std::string& directory, Strategy strategy = Strategy::LRU)
      : CacheScenario(directory, kItems, 0, strategy) {
    const Bytes value(1);
    for (std::size_t number = 0; number < kItems; ++number) writeFile(this->directory() + "/" + keyOf(number), value);
    load();
  }
  void run() override {
    cache().pruneBackToNormal([this] { isDone_ = true; }, nullptr, false);
    runQueues();
  }
  void verify() override {
    throwUnless(isDone_ && cache().getManifest()->count() == 0, "not everything was pruned");
    throwUnless(!FileUtils().pathExists(directory() + "/" + keyOf(kItems - 1)), "files were left behind");
  }

 private:
  bool isDone_ = false;
};

class Load : public CacheScenario {
 public:
  explicit Load(const std::string& directory, Strategy strategy = Strategy::LRU)
      : CacheScenario(directory, kItems, kNoLimit, strategy) {}
  void run() override { load(); }
  void verify() override { throwUnless(cache().getManifest()->count() == kItems, "not everything was loaded"); }
};

class Sink : public XAnalytics {
 public:
  explicit Sink(std::size_t& events) : events_(events) {}
  void logEvent(const std::string& /*eventName*/, const std::string& /*category*/, const std::string& payload,
                const std::string& /*time*/) override {
    if (!payload.empty()) ++events_;
  }

 private:
  std::size_t& events_;
};

class Events : public Scenario {
 public:
  void run() override {
    for (std::size_t number = 0; number < kOperations; ++number) {
      PersistentKeyValueStoreEventBuilder builder(PersistentKeyValueStoreEvent::Hit::Found, "counted", keyOf(number));
      reporter_.reportEvent(builder.age(86'400).size(kSize).get());
    }
  }
  void verify() override { throwUnless(events_ == kOperations, "not everything was reported"); }

 private:
  const test::ManualClock clock_{kNow};
  std::size_t events_ = 0;
  const AnalyticsEventReporter reporter_{std::make_unique<Sink>(events_)};
};

using Create = std::function<std::unique_ptr<Scenario>(const std::string& directory)>;

const std::map<std::string, Create>& scenarios() {
  static const std::map<std::string, Create> all = {
      {"1,000 stores", [](const std::string& directory) { return std::make_unique<Stores>(directory, 1); }},
      {"1,000 stores, 32 at a time",
       [](const std::string& directory) { return std::make_unique<Stores>(directory, 32); }},
      {"1,000 fetches", [](const std::string& directory) { return std::make_unique<Fetches>(directory); }},
      {"a prune of 10,000", [](const std::string& directory) { return std::make_unique<Prune>(directory); }},
      {"a load of 10,000", [](const std::string& directory) { return std::make_unique<Load>(directory); }},
      {"1,000 stores, greedy_dual",
       [](const std::string& directory) { return std::make_unique<Stores>(directory, 1, Strategy::GreedyDual); }},
      {"1,000 fetches, greedy_dual",
       [](const std::string& directory) { return std::make_unique<Fetches>(directory, Strategy::GreedyDual); }},
      {"a prune of 10,000, greedy_dual",
       [](const std::string& directory) { return std::make_unique<Prune>(directory, Strategy::GreedyDual); }},
      {"a load of 10,000, greedy_dual",
       [](const std::string& directory) { return std::make_unique<Load>(directory, Strategy::GreedyDual); }},
      {"1,000 events", [](const std::string& /*directory*/) { return std::make_unique<Events>(); }},
  };
  return all;
}

}  // namespace

const std::vector<std::string>& scenarioNames() {
  static const std::vector<std::string> names = [] {
    std::vector<std::string> found;
    for (const auto& [name, create] : scenarios()) found.push_back(name);
    return found;
  }();
  return names;
}

std::unique_ptr<Scenario> createScenario(const std::string& name, const std::string& directory) {
  const auto found = scenarios().find(name);
  if (found == scenarios().end()) throw std::invalid_argument("no scenario '" + name + "'");
  return found->second(directory);
}

}  // namespace velmora::mobile::xplat::cellar::bench
