// The whole library on real threads: from the text of a configuration to values that are there again after a restart.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <filesystem>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskCache.h"
#include "DiskCacheManifest.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "PersistentKeyValueStore.h"
#include "Store.h"
#include "StoreDirectoryNameBuilder.h"
#include "StoreManager.h"
#include "StoreManagerFactory.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/DirectoryPathLocations.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

namespace fs = std::filesystem;

using host::await;
using host::ThreadQueueFactory;
using test::Bytes;
using test::EventLog;
using test::LogCapture;
using test::runOnThreads;
using test::TemporaryDirectory;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::Not;
using testing::SizeIs;
using testing::UnorderedElementsAre;
using testing::UnorderedElementsAreArray;

using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

constexpr std::chrono::minutes kPatience(10);

const char* const kConfiguration = R"({
  "media": {
    "max_size": "1KB",
    "session_scoped": false,
    "stores": {
      "thumbs": {"type": "disk_cache", "lru_size_limit": "512B", "survival_size": "128B", "prune_strategy": "lru"},
      "chunks": {"type": "disk_cache", "lru_size_limit": "1MB", "inline_data": true,
                 "metadata_factory": "video_download", "prune_strategy": "video_download"},
      "recent": {"type": "pkvs", "capacity": 3},
      "letters": {"type": "pkvs", "name": "mail", "stale_age": "1 years"},
      "settings": {"type": "pkvs", "inline_data": true},
      "downloads": {"type": "unmanaged"}
    }
  },
  "inbox": {
    "area": "documents",
    "stores": {"drafts": {"type": "pkvs"}}
  }
})";

// Every queue is the same one.
class OneQueueForAll final : public TaskQueueFactory {
 public:
  explicit OneQueueForAll(std::shared_ptr<AsyncExecutor> queue) : queue_(std::move(queue)) {}
  std::shared_ptr<AsyncExecutor> createQueue() override { return queue_; }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return queue_; }

 private:
  const std::shared_ptr<AsyncExecutor> queue_;
};

// An application that keeps its data under one root: everything that the library is given, for one run of a process.
class Application {
 public:
  struct Options {
    std::string versionTag = "250";
    std::string sessionKey;
    bool hasOneQueue = false;
  };

  Application(const std::string& root, std::shared_ptr<EventLog> events, Options options)
      : sessionKey_(options.sessionKey) {
    const auto files = std::make_shared<FileUtils>();
    const auto reporter = test::recordingReporter(std::move(events));
    std::shared_ptr<TaskQueueFactory> queues = threads_;
    if (options.hasOneQueue) queues = std::make_shared<OneQueueForAll>(threads_->createQueue());
    const auto trash = std::make_shared<TrashCollector>(root + "/trash", files, reporter, queues);
    const auto attributes = std::make_shared<AttributeStore>(files);
    const auto sizes = std::make_shared<DiskSizeCalculator>(files, attributes, reporter);
    const auto configuration = std::make_shared<const Configuration>(kConfiguration);
    const auto locations = std::make_shared<host::DirectoryPathLocations>(root);
    const auto names = std::make_shared<StoreDirectoryNameBuilderFactory>(options.versionTag, "US", "en");
    lazyWork = LazyDispatcher::createLazyDispatcher(queues, 3600);
    const auto factory = [&](bool servesSessionScoped) {
      return std::make_unique<StoreManagerFactory>(servesSessionScoped, reporter, attributes, configuration, sizes,
                                                   files, lazyWork, locations, names, queues, trash,
                                                   [](const std::string& sessionKey) { return sessionKey; });
    };
    sessionless_ = factory(false);
    sessionScoped_ = factory(true);
  }
  Application(const Application&) = delete;
  Application& operator=(const Application&) = delete;
  // As a process that ends in good order.
  ~Application() {
    lazyWork->willBeTriggeredExternally();
    settle();
    sessionless_.reset();
    sessionScoped_.reset();
    lazyWork.reset();
    threads_->shutDown();
  }

  std::shared_ptr<StoreManager> manager(const std::string& storeIdentifier) {
    StoreManagerFactory& factory = storeIdentifier == "drafts" ? *sessionScoped_ : *sessionless_;
    return factory.managerForStoreIdentifier(storeIdentifier, sessionKey_, true);
  }
  template <class StoreType = PersistentKeyValueStore> std::shared_ptr<StoreType> store(const std::string& identifier) {
    return manager(identifier)->getStore<StoreType>(identifier);
  }

  // Waits until nothing is left to do.
  void settle() { EXPECT_TRUE(threads_->drain(kPatience)); }

  void invalidate() {
    sessionless_->invalidate();
    sessionScoped_->invalidate();
  }

  std::shared_ptr<LazyDispatcher> lazyWork;

 private:
  const std::string sessionKey_;
  const std::shared_ptr<ThreadQueueFactory> threads_ = std::make_shared<ThreadQueueFactory>();
  std::unique_ptr<StoreManagerFactory> sessionless_;
  std::unique_ptr<StoreManagerFactory> sessionScoped_;
};

class EndToEnd : public testing::TestWithParam<bool> {
 protected:
  void start() { start(Application::Options()); }
  void start(Application::Options options) {
    options.hasOneQueue = GetParam();
    application_ = std::make_unique<Application>(directory_.path(), events_, options);
  }
  void stop() { application_.reset(); }
  void restart() {
    stop();
    start();
  }

  std::shared_ptr<PersistentKeyValueStore> store(const std::string& identifier) {
    return application_->store(identifier);
  }
  void put(const std::string& identifier, const std::string& key, const Bytes& value) {
    await(store(identifier)->store(key, value));
  }
  Fetched get(const std::string& identifier, const std::string& key) { return await(store(identifier)->fetch(key)); }
  std::optional<Bytes> value(const std::string& identifier, const std::string& key) {
    const Fetched fetched = get(identifier, key);
    return fetched == nullptr ? std::nullopt : std::make_optional(fetched->value);
  }
  std::vector<std::string> keys(const std::string& identifier) {
    const auto opened = store(identifier);
    application_->settle();
    return opened->getAllKeys();
  }
  // The value files of a store, by name.
  std::vector<std::string> files(const std::string& identifier) {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(store(identifier)->path)) {
      const std::string name = entry.path().filename().string();
      if (name.rfind("manifest_v1.sqlite", 0) != 0) names.push_back(name);
    }
    return names;
  }

  TemporaryDirectory directory_;
  std::shared_ptr<EventLog> events_ = std::make_shared<EventLog>();
  std::unique_ptr<Application> application_;
};

INSTANTIATE_TEST_SUITE_P(Queues, EndToEnd, testing::Bool(), [](const auto& parameter) {
  return parameter.param ? std::string("OneForAll") : std::string("OneForEach");
});

const Bytes kValue = {0, 1, 2, 255, '\n', 0};

TEST_P(EndToEnd, ValuesOfEveryKindOfStoreAreThereAgainAfterARestart) {
  const std::vector<std::string> identifiers = {"thumbs", "chunks", "recent", "letters", "settings", "drafts"};
  start();
  for (const std::string& identifier : identifiers) {
    put(identifier, "key", kValue);
    put(identifier, "empty", {});
    put(identifier, "removed", kValue);
    await(store(identifier)->removeItem("removed"));
  }
  restart();
  for (const std::string& identifier : identifiers) {
    EXPECT_EQ(value(identifier, "key"), kValue) << identifier;
    EXPECT_EQ(value(identifier, "empty"), Bytes()) << identifier;
    EXPECT_EQ(value(identifier, "removed"), std::nullopt) << identifier;
    EXPECT_THAT(keys(identifier), UnorderedElementsAre("key", "empty")) << identifier;
  }
}

TEST_P(EndToEnd, OverwrittenValuesAreTheLastOnesAfterARestart) {
  start();
  for (const char* identifier : {"thumbs", "settings"}) {
    const auto opened = store(identifier);
    std::vector<Future<void>> writes;
    for (unsigned char i = 0; i < 50; ++i) writes.push_back(opened->store("key", Bytes(i, i)));
    for (const auto& write : writes) await(write);
  }
  restart();
  EXPECT_EQ(value("thumbs", "key"), Bytes(49, 49));
  EXPECT_EQ(value("settings", "key"), Bytes(49, 49));
}

TEST_P(EndToEnd, ACacheIsPrunedByItsManagerAsSoonAsTheManagerIsOverItsLimit) {
  start();
  for (int i = 0; i < 10; ++i) put("thumbs", std::to_string(i), Bytes(100, 'x'));
  application_->settle();
  EXPECT_THAT(keys("thumbs"), SizeIs(10));  // over its own limit, but the manager is not over its

  put("thumbs", "10", Bytes(100, 'x'));
  application_->settle();
  EXPECT_THAT(keys("thumbs"), SizeIs(5));
  EXPECT_THAT(files("thumbs"), UnorderedElementsAreArray(keys("thumbs")));
  restart();
  EXPECT_THAT(keys("thumbs"), SizeIs(5));
}

TEST_P(EndToEnd, AKeyValueStoreIsNeverPrunedForItsSize) {
  start();
  for (int i = 0; i < 20; ++i) put("letters", std::to_string(i), Bytes(100, 'x'));
  put("thumbs", "small", Bytes(100, 'x'));
  application_->settle();
  EXPECT_THAT(keys("letters"), SizeIs(20));
  EXPECT_THAT(keys("thumbs"), ElementsAre("small"));  // the manager is over its limit, the cache is not
}

TEST_P(EndToEnd, ANumberOfItemsThatIsLimitedIsNeverPassed) {
  start();
  const auto recent = store("recent");
  std::vector<Future<void>> writes;
  for (int i = 0; i < 30; ++i) writes.push_back(recent->store(std::to_string(i), kValue));
  for (const auto& write : writes) await(write);
  application_->settle();
  EXPECT_THAT(keys("recent"), SizeIs(3));
  EXPECT_THAT(files("recent"), UnorderedElementsAreArray(keys("recent")));
}

TEST_P(EndToEnd, ClearingAStoreLeavesTheOthers) {
  start();
  for (int i = 0; i < 120; ++i) put("letters", std::to_string(i), {});
  put("drafts", "key", kValue);
  std::promise<void> cleared;
  store("letters")->clear([&] { cleared.set_value(); },
                          [&](const std::exception& error) { cleared.set_exception(std::make_exception_ptr(error)); });
  cleared.get_future().get();
  application_->settle();
  EXPECT_THAT(keys("letters"), IsEmpty());
  EXPECT_THAT(files("letters"), IsEmpty());
  EXPECT_EQ(value("drafts", "key"), kValue);
}

TEST_P(EndToEnd, ManyThreadsMayUseAllStoresAtOnce) {
  start();
  const std::vector<std::string> identifiers = {"thumbs", "chunks", "recent", "letters", "settings", "drafts"};
  std::atomic<int> completed{0};
  runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 40; ++i) {
      const auto opened = application_->store(identifiers[(thread + static_cast<std::size_t>(i)) % identifiers.size()]);
      const std::string key = std::to_string(i % 8);
      await(opened->store(key, Bytes(static_cast<std::size_t>(i), 'x')));
      (void)await(opened->fetch(key));
      await(opened->updateLastAccessDate(key));
      if (i % 5 == 0) await(opened->removeItem(key));
      ++completed;
    }
  });
  EXPECT_EQ(completed, 160);
  restart();
  for (const std::string& identifier : identifiers) {
    for (const std::string& key : keys(identifier))
      EXPECT_NE(value(identifier, key), std::nullopt) << identifier << key;
    if (identifier == "chunks" || identifier == "settings") continue;
    EXPECT_THAT(files(identifier), UnorderedElementsAreArray(keys(identifier))) << identifier;
  }
}

TEST_P(EndToEnd, WritesThatNobodyWaitedForAreFinishedBeforeTheEnd) {
  start();
  const auto letters = store("letters");
  for (int i = 0; i < 200; ++i) letters->store(std::to_string(i), kValue);
  restart();
  EXPECT_THAT(keys("letters"), SizeIs(200));
  EXPECT_EQ(value("letters", "199"), kValue);
}

TEST_P(EndToEnd, ADamagedManifestCostsItsOwnStoreAndNoOther) {
  start();
  put("letters", "key", kValue);
  put("thumbs", "key", kValue);
  const std::string path = store("letters")->path;
  stop();
  ASSERT_TRUE(fs::exists(path + "/manifest_v1.sqlite"));
  FileUtils().writeFile(path + "/manifest_v1.sqlite", Bytes(5000, 'x'));

  const LogCapture log;
  start();
  EXPECT_EQ(value("letters", "key"), std::nullopt);
  EXPECT_THAT(files("letters"), IsEmpty());
  put("letters", "new", kValue);
  EXPECT_EQ(value("thumbs", "key"), kValue);
  restart();
  EXPECT_THAT(keys("letters"), ElementsAre("new"));
}

TEST_P(EndToEnd, AStoreMarkedForTheTrashBeginsEmptyAtTheNextStart) {
  start();
  put("letters", "key", kValue);
  put("settings", "key", kValue);
  application_->manager("letters")->trashStoreOnStartup("letters");
  EXPECT_EQ(value("letters", "key"), kValue);
  restart();
  EXPECT_EQ(value("letters", "key"), std::nullopt);
  EXPECT_EQ(value("settings", "key"), kValue);
  put("letters", "key", kValue);
  restart();
  EXPECT_EQ(value("letters", "key"), kValue);
}

TEST_P(EndToEnd, AnotherVersionOfTheApplicationBeginsEmptyAndCleansUp) {
  start();
  put("letters", "key", kValue);
  const std::string old = store("letters")->path;
  stop();

  Application::Options newer;
  newer.versionTag = "251";
  start(newer);
  EXPECT_EQ(value("letters", "key"), std::nullopt);
  EXPECT_NE(store("letters")->path, old);
  application_->settle();
  EXPECT_FALSE(fs::exists(old));
}

TEST_P(EndToEnd, AnotherSessionFindsNothingOfTheFirst) {
  Application::Options first;
  first.sessionKey = "first";
  start(first);
  put("drafts", "key", kValue);
  put("letters", "key", kValue);
  const std::string path = store("drafts")->path;
  stop();

  Application::Options second;
  second.sessionKey = "second";
  start(second);
  EXPECT_EQ(value("drafts", "key"), std::nullopt);
  EXPECT_EQ(value("letters", "key"), kValue);
  application_->settle();
  EXPECT_FALSE(fs::exists(path));
}

TEST_P(EndToEnd, InvalidatingDiscardsEverythingAndTheNextRequestBeginsAgain) {
  start();
  put("letters", "key", kValue);
  put("drafts", "key", kValue);
  const auto held = store("letters");
  application_->invalidate();
  EXPECT_THROW(static_cast<void>(await(held->fetch("key"))), InvalidatedException);
  EXPECT_THROW(static_cast<void>(await(held->store("key", kValue))), InvalidatedException);
  application_->settle();
  EXPECT_FALSE(directory_.exists("trash"));

  EXPECT_EQ(value("letters", "key"), std::nullopt);
  EXPECT_EQ(value("drafts", "key"), std::nullopt);
  put("letters", "key", kValue);
  restart();
  EXPECT_EQ(value("letters", "key"), kValue);
}

TEST_P(EndToEnd, InvalidatingWhileManyThreadsWriteLeavesEveryFutureWithAnAnswer) {
  start();
  std::atomic<int> fulfilled{0};
  std::atomic<int> refused{0};
  const auto letters = store("letters");
  const auto thumbs = application_->store<DiskCache>("thumbs");
  runOnThreads(4, [&](std::size_t thread) {
    if (thread == 0) return application_->invalidate();
    for (int i = 0; i < 100; ++i) {
      try {
        if (i % 2 == 0) {
          await(letters->store(std::to_string(i), kValue));
        } else {
          (void)await(thumbs->fetch(std::to_string(i)));
        }
        ++fulfilled;
      } catch (const InvalidatedException&) {
        ++refused;
      }
    }
  });
  EXPECT_EQ(fulfilled + refused, 300);
  EXPECT_THROW(static_cast<void>(await(letters->store("late", kValue))), InvalidatedException);
}

TEST_P(EndToEnd, StoresThatNobodyAskedForAreCreatedWithTheLazyWork) {
  start();
  const auto manager = application_->manager("thumbs");
  application_->lazyWork->dispatchNow();
  application_->settle();
  for (const char* identifier : {"thumbs", "chunks", "recent", "letters", "settings"}) {
    const auto opened = manager->getStore<PersistentKeyValueStore>(identifier);
    EXPECT_TRUE(opened->getManifest()->isLoaded()) << identifier;
  }
}

TEST_P(EndToEnd, AccessesAndFirstSizesAreReported) {
  start();
  put("letters", "key", kValue);
  get("letters", "key");
  get("letters", "missing");
  application_->settle();
  const auto events = events_->events();
  EXPECT_THAT(events, Not(IsEmpty()));
  const auto mentioning = [&](const std::string& text) {
    return std::count_if(events.begin(), events.end(),
                         [&](const auto& event) { return event.payload.find(text) != std::string::npos; });
  };
  EXPECT_GE(mentioning("\"mail\""), 3);  // a store goes by its name, not by its identifier
  EXPECT_EQ(mentioning("\"letters\""), 0);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
