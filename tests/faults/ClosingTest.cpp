// Storage that is closed while every value is being overwritten: by an application that has threads, and by one that
// lets go of everything. Each value is old or new afterwards, and the new one where that was acknowledged.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <exception>
#include <future>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "FileUtils.h"
#include "PersistentKeyValueStore.h"
#include "StoreManager.h"
#include "TrashCollector.h"
#include "faults/ScriptedWorkload.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

constexpr std::size_t kKeys = 500;

const char* const kConfiguration = R"({
  "media": {
    "session_scoped": false,
    "stores": {
      "letters": {"type": "pkvs", "stale_age": "100 years"},
      "settings": {"type": "pkvs", "stale_age": "100 years", "inline_data": true}
    }
  }
})";

using Store = std::shared_ptr<PersistentKeyValueStore>;
using Futures = std::vector<Future<void>>;

std::string keyOf(std::size_t number) { return "key" + std::to_string(number); }

Futures storeAll(PersistentKeyValueStore& store, const std::string& version) {
  Futures futures;
  for (std::size_t i = 0; i < kKeys; ++i) futures.push_back(store.store(keyOf(i), bytesOf(version + keyOf(i))));
  return futures;
}

// Whether it was acknowledged.
bool hasSucceeded(Future<void>& future) {
  try {
    host::await(std::move(future));
    return true;
  } catch (const std::exception&) {
    return false;
  }
}

std::size_t countSuccesses(Futures& futures) {
  return static_cast<std::size_t>(std::count_if(futures.begin(), futures.end(), hasSucceeded));
}

class Closing : public testing::Test {
 protected:
  struct Contents {
    std::size_t old = 0;
    std::size_t renewed = 0;
    std::size_t missing = 0;
    std::size_t broken = 0;
  };

  static void count(PersistentKeyValueStore& store, std::size_t key, Contents& contents) {
    try {
      const auto found = host::await(store.fetch(keyOf(key)));
      if (found == nullptr) {
        ++contents.missing;
      } else if (textOf(found->value) == "old " + keyOf(key)) {
        ++contents.old;
      } else {
        ++(textOf(found->value) == "new " + keyOf(key) ? contents.renewed : contents.broken);
      }
    } catch (const std::exception&) {
      ++contents.broken;
    }
  }

  static Contents contentsOf(PersistentKeyValueStore& store) {
    Contents contents;
    for (std::size_t i = 0; i < kKeys; ++i) count(store, i, contents);
    return contents;
  }

  // What the next process finds.
  Contents contentsOf(const char* store) const {
    host::Host host(kConfiguration, directory_.path());
    return contentsOf(*host.store<PersistentKeyValueStore>(store));
  }

  static void expectNothingIsLost(const Contents& contents) {
    EXPECT_EQ(contents.missing, 0U) << "of " << kKeys;
    EXPECT_EQ(contents.broken, 0U);
  }

  std::unique_ptr<host::Host> startWith(std::shared_ptr<TaskQueueFactory> queues) const {
    host::HostOptions options;
    options.configuration = kConfiguration;
    options.root = directory_.path();
    options.taskQueueFactory = std::move(queues);
    return std::make_unique<host::Host>(std::move(options));
  }

  void fill() const {
    host::Host host(kConfiguration, directory_.path());
    for (const char* name : {"letters", "settings"}) {
      Futures stored = storeAll(*host.store<PersistentKeyValueStore>(name), "old ");
      EXPECT_EQ(countSuccesses(stored), kKeys);
    }
  }

  // A store that nobody manages.
  Store open(const std::shared_ptr<host::ThreadQueueFactory>& queues) const {
    const auto files = std::make_shared<FileUtils>();
    return PersistentKeyValueStore::createPersistentKeyValueStore(
        directory_.file("store"), directory_.file("temporary"), "store", std::nullopt, 1000, false, queues,
        std::make_shared<TrashCollector>(directory_.file("trash"), files, nullptr, queues), nullptr, nullptr, files,
        nullptr, 50);
  }

  Contents contentsOfStore() const { return contentsOf(*open(std::make_shared<host::ThreadQueueFactory>())); }

  // On the store's work queue, as its next task.
  template <class Task> static void runOnWorkQueue(PersistentKeyValueStore& store, Task task) {
    std::promise<void> done;
    store.deleteFilesInBatches(
        [&]() -> std::vector<DiskCacheItem> {
          task();
          done.set_value();
          return {};
        },
        nullptr, nullptr);
    done.get_future().wait();
  }

  const Watchdog watchdog_{120};
  const TemporaryDirectory directory_{quickPlace()};
};

using HostClosing = Closing;
using ThreadQueueFactoryClosing = Closing;
using StoreManagerRelease = Closing;
using PersistentKeyValueStoreRelease = Closing;

TEST_F(HostClosing, WhileItsOverwritesWaitLosesNoValue) {
  fill();
  auto host = startWith(nullptr);
  Store letters = host->store<PersistentKeyValueStore>("letters");
  Store settings = host->store<PersistentKeyValueStore>("settings");
  Futures overwrites;
  Futures inlineOverwrites;
  // On a queue of its own it does not wait, with all of them in front of it.
  runOnWorkQueue(*letters, [&] {
    overwrites = storeAll(*letters, "new ");
    inlineOverwrites = storeAll(*settings, "new ");
    host.reset();
  });
  EXPECT_EQ(countSuccesses(overwrites), kKeys);
  EXPECT_EQ(countSuccesses(inlineOverwrites), kKeys);
  letters.reset();
  settings.reset();
  const Contents after = contentsOf("letters");
  expectNothingIsLost(after);
  EXPECT_EQ(after.renewed, kKeys);
  const Contents inlineAfter = contentsOf("settings");
  expectNothingIsLost(inlineAfter);
  EXPECT_EQ(inlineAfter.renewed, kKeys);
}

TEST_F(ThreadQueueFactoryClosing, WhileOverwritesWaitLosesNoValue) {
  const auto queues = std::make_shared<host::ThreadQueueFactory>();
  Store store = open(queues);
  Futures stored = storeAll(*store, "old ");
  ASSERT_EQ(countSuccesses(stored), kKeys);
  Futures overwrites;
  runOnWorkQueue(*store, [&] {
    for (int i = 0; i < 4; ++i) overwrites = storeAll(*store, "new ");
    queues->shutDown();
  });
  const std::size_t successes = countSuccesses(overwrites);
  queues->shutDown();
  store.reset();
  const Contents after = contentsOfStore();
  expectNothingIsLost(after);
  EXPECT_GE(after.renewed, successes);
}

TEST_F(PersistentKeyValueStoreRelease, WhileItsOverwritesWaitForTheFileQueueLosesNoValue) {
  const auto queues = std::make_shared<host::ThreadQueueFactory>();
  Store store = open(queues);
  Futures stored = storeAll(*store, "old ");
  ASSERT_EQ(countSuccesses(stored), kKeys);
  Latch released(1);
  Future<void> first = store->store("first", nullptr, [&](const std::string& path) {
    released.wait();
    FileUtils().writeFile(path, bytesOf("x"));
    return 1U;
  });
  Futures overwrites = storeAll(*store, "new ");
  (void)host::await(store->fetch("nothing"));  // a miss: by now each of them waits for the file queue
  store.reset();
  released.countDown();
  EXPECT_TRUE(hasSucceeded(first));
  countSuccesses(overwrites);  // of a store that has gone they say nothing
  queues->shutDown();
  expectNothingIsLost(contentsOfStore());
}

TEST_F(StoreManagerRelease, FinishesWhatItsStoresHaveAccepted) {
  fill();
  const auto queues = std::make_shared<ManualQueueFactory>();
  auto host = startWith(queues);
  Store letters = host->store<PersistentKeyValueStore>("letters");
  Store settings = host->store<PersistentKeyValueStore>("settings");
  Futures overwrites = storeAll(*letters, "new ");
  Futures inlineOverwrites = storeAll(*settings, "new ");
  letters.reset();
  settings.reset();
  host.reset();
  queues->runAll();
  EXPECT_EQ(countSuccesses(overwrites), kKeys);
  EXPECT_EQ(countSuccesses(inlineOverwrites), kKeys);
  EXPECT_EQ(contentsOf("letters").renewed, kKeys);
  EXPECT_EQ(contentsOf("settings").renewed, kKeys);
}

TEST_F(StoreManagerRelease, WhoseQueuesNeverRunAgainLosesNothing) {
  fill();
  const auto queues = std::make_shared<ManualQueueFactory>();
  auto host = startWith(queues);
  Store letters = host->store<PersistentKeyValueStore>("letters");
  Futures overwrites = storeAll(*letters, "new ");
  // Those of the work queue run, so that each overwrite waits for its file.
  for (std::size_t i = 0; i < queues->workQueueCount(); ++i) queues->workQueue(i)->runAll();
  letters.reset();
  host.reset();
  for (const auto& queue : queues->all()) queue->dropAll();
  EXPECT_EQ(countSuccesses(overwrites), 0U);
  EXPECT_EQ(contentsOf("letters").old, kKeys);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
