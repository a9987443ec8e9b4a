// Metrics that are read while other threads work, and on the threads of a host itself.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "Future.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "StoreManager.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/ThreadQueueFactory.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::Bytes;
using test::Latch;
using test::runOnThreads;
using test::TemporaryDirectory;
using test::Watchdog;

const char* const kConfiguration = R"({
  "media": {"session_scoped": false, "max_size": "1KB", "stores": {
    "thumbs": {"type": "disk_cache", "lru_size_limit": "1KB"}, "files": {"type": "unmanaged"}}},
  "inbox": {"stores": {"letters": {"type": "pkvs"}}}
})";

class MetricsThreads : public testing::Test {
 protected:
  std::unique_ptr<Host> start() const {
    HostOptions options;
    options.configuration = kConfiguration;
    options.root = directory.path();
    options.lazyDelaySeconds = 3600;
    options.shutDownPatience = std::chrono::hours(1);
    return std::make_unique<Host>(std::move(options));
  }

  const Watchdog watchdog{120};
  const TemporaryDirectory directory;
};

const StoreMetrics& storeIn(const HostMetrics& metrics, const std::string& identifier) {
  for (const ManagerMetrics& manager : metrics.managers) {
    for (const StoreMetrics& store : manager.stores) {
      if (store.identifier == identifier) return store;
    }
  }
  throw std::out_of_range(identifier);
}

// What an application does while others read its metrics.
void work(Host& host, std::size_t round) {
  const std::string key = std::to_string(round % 10);
  const auto thumbs = host.store<DiskCache>("thumbs");
  await(thumbs->store(key, Bytes(300)));
  static_cast<void>(await(thumbs->fetch(key)));
  try {
    await(host.store<PersistentKeyValueStore>("letters", "alice")->store(key, Bytes(10)));
  } catch (const InvalidatedException&) {
    // The session is being ended.
  }
}

TEST_F(MetricsThreads, AreReadWhileStoresWorkAndASessionIsLoggedOut) {
  const auto host = start();
  std::atomic<bool> isOver{false};
  runOnThreads(5, [&](std::size_t thread) {
    if (thread == 0) {
      for (std::size_t round = 0; round < 40; ++round) work(*host, round);
      isOver = true;
    } else if (thread == 1) {
      while (!isOver) {
        host->logOut("alice");
        host->lazyWork()->dispatchNow();
      }
    } else {
      std::uint64_t writes = 0;
      while (!isOver) {
        const HostMetrics metrics = host->metrics(thread == 2 ? TrashSize::Measured : TrashSize::Skipped);
        const std::uint64_t now = storeIn(metrics, "thumbs").writes.value_or(0);
        EXPECT_GE(now, writes);
        writes = now;
        EXPECT_EQ(metrics.managers.front().name, "inbox");
      }
    }
  });
  const StoreMetrics thumbs = storeIn(host->metrics(), "thumbs");
  EXPECT_EQ(thumbs.writes, 40U);
  EXPECT_EQ(thumbs.hits.value_or(0) + thumbs.misses.value_or(0), 40U);
}

TEST_F(MetricsThreads, AreReadWhileManagersAreInvalidatedByWhoeverHoldsThem) {
  const auto host = start();
  std::atomic<bool> isOver{false};
  runOnThreads(3, [&](std::size_t thread) {
    while (thread > 0 && !isOver) static_cast<void>(host->metrics());
    if (thread > 0) return;
    for (int round = 0; round < 20; ++round) {
      await(host->store<PersistentKeyValueStore>("letters", "alice")->store("key", Bytes(10)));
      host->manager("inbox")->invalidate();
      host->logOut();
    }
    isOver = true;
  });
  EXPECT_FALSE(storeIn(host->metrics(), "letters").isCreated);
}

TEST_F(MetricsThreads, AreReadOnTheThreadsOfTheHostUntilItEnds) {
  auto host = start();
  std::atomic<int> reads{0};
  const auto queue = host->queues()->createQueue();
  std::function<void()> readAgain = [&, raw = host.get()] {
    EXPECT_EQ(raw->metrics().managers.size(), 2U);
    if (++reads < 200) queue->dispatch(readAgain);
  };
  queue->dispatch(readAgain);
  for (std::size_t round = 0; round < 10; ++round) work(*host, round);
  host.reset();  // finishes what was accepted
  EXPECT_EQ(reads, 200);
}

TEST_F(MetricsThreads, AreReadInACallbackOfAStore) {
  const auto host = start();
  const auto thumbs = host->store<DiskCache>("thumbs");
  await(thumbs->store("cat", Bytes(3)));
  const auto seen = std::make_shared<Promise<HostMetrics>>();  // still in use when its value is there
  const auto metrics = seen->getFuture();
  thumbs->fetch("cat").then(nullptr, [&host, seen](auto& /*fetched*/) { seen->setValue(host->metrics()); });
  EXPECT_EQ(storeIn(await(metrics), "thumbs").hits, 1U);
}

TEST_F(MetricsThreads, DoNotWaitForAStoreThatIsStuck) {
  const auto host = start();
  const auto thumbs = host->store<DiskCache>("thumbs");
  Latch begun(1);
  Latch release(1);
  const auto stuck = thumbs->store("cat", nullptr, [&](const std::string& /*path*/) -> unsigned int {
    begun.countDown();
    release.wait();
    throw std::runtime_error("enough");
  });
  begun.wait();
  const HostMetrics metrics = host->metrics();
  ASSERT_TRUE(metrics.queues);
  EXPECT_GE(metrics.queues->running, 1U);
  release.countDown();
  EXPECT_THROW(await(stuck), std::runtime_error);
}

// All threads are within a task, so the figures are exact.
TEST_F(MetricsThreads, TellHowManyTasksWaitAndRun) {
  const auto host = start();
  const auto factory = std::dynamic_pointer_cast<ThreadQueueFactory>(host->queues());
  ASSERT_NE(factory, nullptr);
  const std::size_t threads = std::max(std::thread::hardware_concurrency(), 1U) + 1;
  Latch begun(threads);
  Latch release(1);
  std::vector<std::shared_ptr<AsyncExecutor>> queues;
  for (std::size_t i = 0; i < threads; ++i) {
    queues.push_back(factory->createQueue());
    queues.back()->dispatch([&] {
      begun.countDown();
      release.wait();
    });
  }
  begun.wait();
  for (const auto& queue : {queues.front(), queues.front(), factory->createWorkQueue()}) queue->dispatch([] {});
  const auto busy = host->metrics().queues;
  ASSERT_TRUE(busy);
  EXPECT_EQ(busy->running, threads);
  EXPECT_EQ(busy->waiting, 3U);
  release.countDown();
  ASSERT_TRUE(factory->drain(std::chrono::hours(1)));
  const auto idle = host->metrics().queues;
  ASSERT_TRUE(idle);
  EXPECT_EQ(idle->running, 0U);
  EXPECT_EQ(idle->waiting, 0U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
