// Many threads on one host, with everything invalidated under their feet. What counts is that every call has an answer,
// that no value is another key's, and what the sanitizers say. CELLAR_STRESS_ROUNDS makes it last longer.

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <memory>
#include <random>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "DiskCacheManifest.h"
#include "DiskSizeCalculator.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "PersistentKeyValueStore.h"
#include "Store.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using host::await;
using host::Host;
using test::Bytes;
using test::runOnThreads;
using test::TemporaryDirectory;

const char* const kConfiguration = R"({
  "media": {
    "max_size": "16KB", "prune_interval": "1 minutes", "session_scoped": false,
    "stores": {
      "thumbs": {"type": "disk_cache", "lru_size_limit": "8KB", "survival_size": "1KB", "prune_strategy": "lru"},
      "chunks": {"type": "disk_cache", "lru_size_limit": "8KB", "inline_data": true, "prune_strategy": "lru"}
    }
  },
  "inbox": {
    "area": "documents",
    "stores": {
      "letters": {"type": "pkvs", "capacity": 20},
      "flags": {"type": "pkvs", "inline_data": true},
      "files": {"type": "unmanaged", "is_cache": true, "max_size": "1MB"}
    }
  }
})";

constexpr std::array<const char*, 4> kKeyValueStores = {"thumbs", "chunks", "letters", "flags"};
constexpr std::size_t kThreads = 8;
constexpr int kCallsOfAThread = 150;

int rounds() {
  const char* const text = std::getenv("CELLAR_STRESS_ROUNDS");
  return text == nullptr ? 3 : std::atoi(text);
}

Bytes valueOf(const std::string& store, const std::string& key, std::size_t length) {
  const std::string text = store + "/" + key + ":";
  Bytes value(text.begin(), text.end());
  value.resize(value.size() + length, 'x');
  return value;
}

bool isValueOf(const std::string& store, const std::string& key, const Bytes& value) {
  const std::string text = store + "/" + key + ":";
  return std::string(value.begin(), value.end()).rfind(text, 0) == 0;
}

// What became of the calls, counted over all threads.
struct Tally {
  std::atomic<int> answered{0};
  std::atomic<int> refused{0};
  std::atomic<int> strange{0};  // a value of another key, or an error that nobody has announced
};

// One thread's random calls, several of them outstanding at a time.
class User {
 public:
  User(Host& host, const TemporaryDirectory& directory, Tally& tally, unsigned int seed)
      : host_(host), directory_(directory), tally_(tally), random_(seed), name_(std::to_string(seed)) {}

  void work() {
    for (int call = 0; call < kCallsOfAThread; ++call) {
      attempt([this] { callSomething(); });
      if (chance(8)) settle();
    }
    settle();
  }

 private:
  bool chance(unsigned int oneIn) { return random_() % oneIn == 0; }

  // Runs it and takes the errors that a session's end may bring.
  template <class Call> void attempt(Call call) {
    try {
      call();
      ++tally_.answered;
    } catch (const InvalidatedException&) {
      ++tally_.refused;
    } catch (const DiskCacheManifestException&) {
      ++tally_.answered;  // keys were asked for before the manifest was loaded
    } catch (const FileUtilsIoException&) {
      ++tally_.refused;  // the directory went to the trash meanwhile
    } catch (const std::exception& error) {
      ADD_FAILURE() << error.what();
      ++tally_.strange;
    }
  }

  void settle() {
    for (auto& write : std::exchange(writes_, {})) {
      attempt([&] { await(std::move(write)); });
    }
    for (auto& pair : std::exchange(fetches_, {})) {
      attempt([&, &expected = pair.first, &fetch = pair.second] {
        const auto found = await(std::move(fetch));
        if (found != nullptr && !isValueOf(expected.first, expected.second, found->value)) ++tally_.strange;
      });
    }
  }

  void callSomething() {
    switch (random_() % 12) {
      case 0:
        return calculateSizes();
      case 1:
        return collectSomething();
      case 2:
        host_.lazyWork()->addTask([&tally = tally_] { ++tally.answered; }, host_.queues()->createWorkQueue());
        if (chance(4)) host_.lazyWork()->dispatchNow();
        return;
      case 3:
        return writeIntoADirectory();
      default:
        return useAStore();
    }
  }

  void useAStore() {
    const std::string identifier = kKeyValueStores[random_() % kKeyValueStores.size()];
    const auto store = host_.store<PersistentKeyValueStore>(identifier);
    const std::string key = "key" + std::to_string(random_() % 30);
    switch (random_() % 16) {
      case 0:
        writes_.push_back(store->removeItem(key));
        return;
      case 1:
        writes_.push_back(store->updateLastAccessDate(key));
        return;
      case 2:
        store->getAllKeys();
        return;
      case 3:
        if (chance(4)) store->clear(nullptr, nullptr);
        return;
      case 4:
      case 5:
      case 6:
      case 7:
      case 8:
        fetches_.emplace_back(std::make_pair(identifier, key), store->fetch(key));
        return;
      default:
        writes_.push_back(store->store(key, valueOf(identifier, key, random_() % 1000)));
        return;
    }
  }

  void calculateSizes() {
    const auto store = host_.store<UnmanagedStore>("files");
    host_.sizes()->addDirectory(store->path, 1);
    if (chance(2)) host_.sizes()->fetchDirectorySize(store->path);
  }

  void collectSomething() {
    const std::string path = directory_.file("loose-" + name_ + "-" + std::to_string(random_()));
    std::filesystem::create_directories(path + "/deep");
    std::ofstream(path + "/deep/file") << "x";
    if (!host_.trash()->collectPath(path)) ++tally_.strange;
    if (chance(4)) host_.trash()->emptyAllTrash();
  }

  void writeIntoADirectory() {
    std::ofstream(host_.store<UnmanagedStore>("files")->path + "/" + name_) << std::string(random_() % 5000, 'x');
  }

  Host& host_;
  const TemporaryDirectory& directory_;
  Tally& tally_;
  std::mt19937 random_;
  const std::string name_;
  std::vector<Future<void>> writes_;
  std::vector<
      std::pair<std::pair<std::string, std::string>, Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>>>>
      fetches_;
};

host::HostOptions optionsFor(const std::string& root, const std::shared_ptr<test::EventLog>& events) {
  host::HostOptions options;
  options.configuration = kConfiguration;
  options.root = root;
  options.analytics = std::make_unique<test::RecordingAnalytics>(events);
  return options;
}

TEST(Stress, EveryCallHasAnAnswerWhileSessionsEnd) {
  const TemporaryDirectory directory;
  const test::LogCapture log;  // what goes wrong when a session ends is logged, line by line
  const auto events = std::make_shared<test::EventLog>();
  Tally tally;
  for (int round = 0; round < rounds(); ++round) {
    Host host(optionsFor(directory.file("root"), events));
    std::atomic<std::size_t> working{kThreads};
    runOnThreads(kThreads + 1, [&](std::size_t thread) {
      const auto seed = static_cast<unsigned int>(round * 100) + static_cast<unsigned int>(thread);
      if (thread < kThreads) {
        User(host, directory, tally, seed).work();
        --working;
        return;
      }
      for (std::mt19937 random(seed); working > 0;) {
        for (auto calls = random() % 40; calls > 0 && working > 0; --calls) {
          await(host.store<PersistentKeyValueStore>("flags")->updateLastAccessDate("key1"));
        }
        random() % 3 == 0 ? host.invalidate() : host.logOut();
      }
    });
  }
  EXPECT_EQ(tally.strange, 0);
  EXPECT_GT(tally.answered, rounds() * kCallsOfAThread);
  RecordProperty("answered", tally.answered);
  RecordProperty("refused", tally.refused);
  std::cout << tally.answered << " calls answered, " << tally.refused << " refused\n";
}

TEST(Stress, WhatIsThereAfterwardsIsEachKeysOwn) {
  const TemporaryDirectory directory;
  const test::LogCapture log;
  const auto events = std::make_shared<test::EventLog>();
  Tally tally;
  {
    Host host(optionsFor(directory.file("root"), events));
    runOnThreads(kThreads, [&](std::size_t thread) {
      User(host, directory, tally, 1000 + static_cast<unsigned int>(thread)).work();
    });
  }
  EXPECT_EQ(tally.refused, 0);
  EXPECT_EQ(tally.strange, 0);

  Host host(optionsFor(directory.file("root"), events));
  std::size_t found = 0;
  for (const std::string identifier : kKeyValueStores) {
    const auto store = host.store<PersistentKeyValueStore>(identifier);
    await(store->updateLastAccessDate(""));  // the manifest is loaded by then
    for (const std::string& key : store->getAllKeys()) {
      const auto value = await(store->fetch(key));
      ASSERT_NE(value, nullptr) << identifier << " " << key;
      EXPECT_TRUE(isValueOf(identifier, key, value->value)) << identifier << " " << key;
      ++found;
    }
  }
  EXPECT_GT(found, 0U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
