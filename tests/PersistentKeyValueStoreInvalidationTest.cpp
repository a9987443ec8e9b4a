// The end of a key-value store: what is refused, what is finished, who waits for whom.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <deque>
#include <filesystem>
#include <functional>
#include <future>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::Bytes;
using test::bytesOf;
using test::Fetched;
using test::KeyValueStoreFixture;
using test::kInvalid;
using test::Latch;
using test::ManifestCall;
using test::Operation;
using test::told;
using test::watch;
using test::Written;
using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;

// File queues that keep their tasks until the test takes them, in any order.
class AnyOrderQueues : public test::ManualQueueFactory {
 public:
  std::deque<std::function<void()>> tasks;

  std::shared_ptr<AsyncExecutor> createQueue() override {
    const auto queue = std::make_shared<Keeping>(tasks);
    test::ManualQueueFactory::createQueue();  // the fixture asks for it
    return queue;
  }

  void runLast() {
    const auto task = std::move(tasks.back());
    tasks.pop_back();
    task();
  }
  void runAll() {
    for (; !tasks.empty(); tasks.pop_front()) tasks.front()();
  }

 private:
  class Keeping : public test::ManualExecutor {
   public:
    explicit Keeping(std::deque<std::function<void()>>& tasks) : tasks_(tasks) {}
    void dispatch(std::function<void()> task) override { tasks_.push_back(std::move(task)); }

   private:
    std::deque<std::function<void()>>& tasks_;
  };
};

class PersistentKeyValueStoreInvalidation : public KeyValueStoreFixture {
 protected:
  // Whoever puts something on the file queue finds it done.
  void runFilesAtOnce() const {
    file().onDispatch = [&queue = file()] { queue.runAll(); };
  }
};

TEST_F(PersistentKeyValueStoreInvalidation, WithAFutureIsDoneWhenTheFileQueueHasGotSoFar) {
  openWatched();
  watch(store->store("key", bytesOf("value")));
  work().runAll();
  const Written barrier = watch(store->invalidateWithFuture());
  EXPECT_EQ(file().pending(), 2U);
  ASSERT_TRUE(file().runNext());
  EXPECT_TRUE(barrier->isPending());
  ASSERT_TRUE(file().runNext());
  EXPECT_EQ(told(barrier), "<done>");
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 0U);
}

TEST_F(PersistentKeyValueStoreInvalidation, BlocksUntilARemovalThatIsUnderWayHasDeletedItsFile) {
  openWatched();
  put("key", "value");
  Latch barrierIsSet(1);
  file().onDispatch = [&] { barrierIsSet.countDown(); };
  std::future<bool> sawFile;
  files->onCall = [&](Operation operation, const std::string& path) {
    if (operation != Operation::DeleteFile) return;
    sawFile = std::async(std::launch::async, [this, path] {
      store->invalidate();
      return std::filesystem::exists(path);
    });
    barrierIsSet.wait();
    file().runAll();
    sawFile.wait_for(std::chrono::milliseconds(50));  // it must not get on before the file has gone
  };
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_FALSE(sawFile.get());
}

// An invalidation may come between a task's last look and its turn on the file queue; another store has the paths then.
TEST_F(PersistentKeyValueStoreInvalidation, LeavesNothingToTasksThatComeAfterItsBarrier) {
  openWatched();
  put("key", "value");
  const auto late = std::make_shared<AnyOrderQueues>();
  queues = late;
  openUnloaded();
  settle();
  const Fetched fetched = watch(store->fetch("key"));
  const Written written = watch(store->store("key", bytesOf("newer")));
  const Written fresh = watch(store->store("fresh", bytesOf("value")));
  settle();
  ASSERT_EQ(late->tasks.size(), 3U);
  const Written barrier = watch(store->invalidateWithFuture());
  late->runLast();
  EXPECT_EQ(told(barrier), "<done>");
  late->runAll();
  EXPECT_EQ(told(fetched), "<error> " + kInvalid);
  EXPECT_EQ(told(written), "<error> " + kInvalid);
  EXPECT_EQ(told(fresh), "<error> " + kInvalid);
  store.reset();
  EXPECT_EQ(valueFile("key"), "value");
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

TEST_F(PersistentKeyValueStoreInvalidation, BetweenABatchAndItsFilesLeavesThemToWhoInvalidates) {
  openWatched();
  put("key", "value");
  const auto takeItThenInvalidate = [this]() -> std::vector<DiskCacheItem> {
    const auto items = manifest->pruneToSize(0, 1);
    watch(store->invalidateWithFuture());
    return items;
  };
  store->deleteFilesInBatches(takeItThenInvalidate, onSuccess(), onError());
  settle();
  EXPECT_EQ(ending, "<error> " + kInvalid);
  EXPECT_EQ(valueFile("key"), "value");
}

TEST_F(PersistentKeyValueStoreInvalidation, ASecondTimeIsDoneAtOnce) {
  open();
  const Written first = watch(store->invalidateWithFuture());
  const Written second = watch(store->invalidateWithFuture());
  EXPECT_TRUE(first->isPending());
  EXPECT_EQ(told(second), "<done>");
  EXPECT_EQ(file().pending(), 1U);
  settle();
  EXPECT_EQ(told(first), "<done>");
}

TEST_F(PersistentKeyValueStoreInvalidation, BlocksUntilTheWritesThatAreUnderWayAreFinishedThenSilencesTheManifest) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  work().runAll();
  Latch barrierIsSet(1);
  file().onDispatch = [&] { barrierIsSet.countDown(); };
  std::atomic<bool> returned{false};
  std::thread caller([&] {
    store->invalidate();
    returned = true;
  });
  barrierIsSet.wait();
  EXPECT_FALSE(returned);
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 0U);
  ASSERT_TRUE(file().runNext());
  EXPECT_FALSE(returned);
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 0U);
  EXPECT_EQ(medium->rows().at("key").item.size, 5U);
  ASSERT_TRUE(file().runNext());
  caller.join();
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 1U);
}

TEST_F(PersistentKeyValueStoreInvalidation, ASecondBlockingCallReturnsAtOnceAndSilencesNothing) {
  openWatched();
  Latch barrierIsSet(1);
  file().onDispatch = [&] { barrierIsSet.countDown(); };
  std::thread caller([&] { store->invalidate(); });
  barrierIsSet.wait();
  store->invalidate();
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 0U);
  file().runAll();
  caller.join();
  store->invalidate();
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 1U);
}

TEST_F(PersistentKeyValueStoreInvalidation, WithoutWaitingSilencesTheManifestWhenTheFileQueueHasGotSoFar) {
  openWatched();
  const Written written = watch(store->store("key", bytesOf("value")));
  work().runAll();
  store->invalidateSoon();
  EXPECT_THROW(store->throwIfInvalid(), InvalidatedException);
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 0U);
  ASSERT_TRUE(file().runNext());
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 0U);
  EXPECT_EQ(told(written), "<done>");
  ASSERT_TRUE(file().runNext());
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 1U);
  store->invalidateSoon();
  store->invalidate();
  settle();
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 1U);
}

TEST_F(PersistentKeyValueStoreInvalidation, RefusesWhatWaitsOnTheWorkQueueAndItHasNoEffect) {
  openWatched();
  put("key", "value");
  const std::vector<Written> written = {watch(store->store("new", bytesOf("x"))), watch(store->removeItem("key")),
                                        watch(store->updateLastAccessDate("key"))};
  const std::vector<Fetched> fetched = {
      watch(store->fetch("key")),
      watch(store->fetchFirst({"other", "key"}, [](const auto&, const auto&, Bytes&) { return true; }))};
  store->clear(onSuccess(), onError());
  watch(store->invalidateWithFuture());
  manifest->clearTrace();
  files->clearTrace();
  settle();
  for (const Written& outcome : written) EXPECT_EQ(told(outcome), "<error> " + kInvalid);
  for (const Fetched& outcome : fetched) EXPECT_EQ(told(outcome), "<error> " + kInvalid);
  EXPECT_EQ(ending, "<error> " + kInvalid);
  EXPECT_THAT(manifest->trace(), IsEmpty());
  EXPECT_THAT(files->trace(), IsEmpty());
  EXPECT_THAT(accesses(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, RefusesInlineWritesThatWait) {
  options.inlineData = true;
  openWatched();
  const Written written = watch(store->store("key", bytesOf("x")));
  watch(store->invalidateWithFuture());
  settle();
  EXPECT_EQ(told(written), "<error> " + kInvalid);
  EXPECT_THAT(keysInMedium(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, FinishesAWriteAndAReadingThatAreOnTheFileQueue) {
  open();
  put("key", "value");
  const Written written = watch(store->store("new", bytesOf("12345")));
  const Fetched fetched = watch(store->fetch("key"));
  work().runAll();
  const Written barrier = watch(store->invalidateWithFuture());
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(fetched), "value");
  EXPECT_EQ(told(barrier), "<done>");
  EXPECT_EQ(valueFile("new"), "12345");
  EXPECT_THAT(rowsOnDisk(), Contains("new new 5 0 1000000 1000000 -"));
}

TEST_F(PersistentKeyValueStoreInvalidation, CancelsTheTimerAndArmsNoOther) {
  openWatched();
  put("key", "value");
  clock.advance(1001);
  ASSERT_TRUE(fire(300));
  work().runAll();
  watch(store->invalidateWithFuture());
  EXPECT_THAT(work().armedDelays(), IsEmpty());
  settle();
  EXPECT_THAT(work().armedDelays(), IsEmpty());
  store->scheduleStaleRemoval(10);
  EXPECT_THAT(work().armedDelays(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, OfARealManifestLeavesNoTimerAtAll) {
  open();
  EXPECT_EQ(work().armedDelays().size(), 2U);
  runFilesAtOnce();
  store->invalidate();
  EXPECT_THAT(work().armedDelays(), IsEmpty());
  settle();
  EXPECT_THAT(work().armedDelays(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, BeforeLoadingLoadsNothingAndArmsNothing) {
  openWatchedUnloaded();
  watch(store->invalidateWithFuture());
  settle();
  EXPECT_EQ(manifest->calls(ManifestCall::Load), 0U);
  EXPECT_THAT(work().armedDelays(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, CreatesNoManifest) {
  openUnloaded();
  runFilesAtOnce();
  store->invalidate();
  settle();
  EXPECT_THAT(directory.names("store"), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, StartsNoExpiry) {
  openWatched();
  watch(store->invalidateWithFuture());
  manifest->clearTrace();
  store->startStaleItemRemoval();
  settle();
  EXPECT_THAT(manifest->trace(), IsEmpty());
  EXPECT_THAT(sizes, IsEmpty());
  EXPECT_THAT(work().armedDelays(), IsEmpty());
}

TEST_F(PersistentKeyValueStoreInvalidation, EndsADeletionBetweenItsBatches) {
  options.batchSize = 1;
  openWatched();
  putMany(3);
  store->clear(onSuccess(), onError());
  work().runAll();
  watch(store->invalidateWithFuture());
  settle();
  EXPECT_EQ(ending, "<error> " + kInvalid);
  EXPECT_EQ(medium->rows().size(), 2U);
  EXPECT_EQ(valueFiles().size(), 2U);  // the files of the batch that was taken are gone
}

TEST_F(PersistentKeyValueStoreInvalidation, LeavesTheFilesAndWritesNothingMore) {
  open();
  put("key", "value");
  runFilesAtOnce();
  store->invalidate();
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 5 0 1000000 1000000 -"));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
  reopen();
  EXPECT_EQ(get("key"), "value");
}

TEST_F(PersistentKeyValueStoreInvalidation, WhoseStoreGoesBeforeAWriteBeginsLeavesNoRecordWithoutAFile) {
  open();
  const Written written = watch(store->store("key", bytesOf("value")));
  work().runAll();
  const Written barrier = watch(store->invalidateWithFuture());
  store.reset();
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(barrier), "<done>");
  EXPECT_EQ(valueFiles().size(), rowsOnDisk().size());
}

TEST_F(PersistentKeyValueStoreInvalidation, OfAShutDownFileQueueReturnsAndSilencesTheManifest) {
  openWatched();
  file().onDispatch = [&queue = file()] { queue.dropAll(); };
  store->invalidate();
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 1U);
  EXPECT_THROW(store->throwIfInvalid(), InvalidatedException);
}

TEST_F(PersistentKeyValueStoreInvalidation, OfAFileQueueThatTakesNothingRefusesWorkAndSilencesTheManifest) {
  openWatched();
  file().throwOnDispatch(true);
  EXPECT_NO_THROW(store->invalidate());
  EXPECT_THROW(store->throwIfInvalid(), InvalidatedException);
  EXPECT_EQ(manifest->calls(ManifestCall::Invalidate), 1U);
}

TEST_F(PersistentKeyValueStoreInvalidation, FromWithinAWriterLetsThatWriteFinish) {
  openWatched();
  Written barrier;
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    barrier = watch(store->invalidateWithFuture());
    files->writeFile(path, bytesOf("value"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(barrier), "<done>");
  EXPECT_EQ(medium->rows().at("key").item.size, 5U);
}

// The writer's record evicts an item, whose file is deleted behind the barrier that the writer has queued.
TEST_F(PersistentKeyValueStoreInvalidation, FromWithinAWriterDeletesNoFileOfTheNextStoreAtThePath) {
  options.capacity = 1;
  open();
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    files->writeFile(path, bytesOf("value"));
    store->invalidateSoon();
    return 5U;
  }));
  work().runAll();
  store->handleCorruptedManifest(LarderException("Rotten.", "domain", 11));  // so that the final record makes room
  store->getManifest()->setItem({"next", "next", 1, false, 0, 0, nullptr});
  directory.write("store/next", "of the next store");
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(store->operationCounts().evictions, 1U);
  EXPECT_EQ(directory.read("store/next"), "of the next store");
}

TEST_F(PersistentKeyValueStoreInvalidation, RefusesAnEviction) {
  options.capacity = 1;
  open();
  put("key", "value");
  store->invalidateSoon();
  settle();
  EXPECT_THROW(store->removeOldestItemIfOverMaxCapacity(), InvalidatedException);
  EXPECT_EQ(directory.read("store/key"), "value");
}

// A file queue on which something else gets in between a write's record and its task.
class InterruptedQueue final : public AsyncExecutor {
 public:
  std::function<void()> beforeDispatch;
  const std::shared_ptr<test::ManualExecutor> queue = std::make_shared<test::ManualExecutor>();

  void dispatch(std::function<void()> task) override {
    if (const auto interrupt = std::exchange(beforeDispatch, nullptr)) interrupt();
    queue->dispatch(std::move(task));
  }
  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delay, std::function<void()> task,
                                            std::function<void()> companion) override {
    return queue->dispatchAfter(delay, std::move(task), std::move(companion));
  }
  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delay, std::function<void()> task,
                                            std::function<void()> companion) override {
    return queue->scheduleAfter(delay, std::move(task), std::move(companion));
  }
};

class InterruptedQueues final : public TaskQueueFactory {
 public:
  const std::shared_ptr<InterruptedQueue> file = std::make_shared<InterruptedQueue>();
  const std::shared_ptr<test::ManualExecutor> work = std::make_shared<test::ManualExecutor>();

  std::shared_ptr<AsyncExecutor> createQueue() override { return file; }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return work; }
};

TEST_F(PersistentKeyValueStoreInvalidation, BetweenARecordAndItsFileLeavesNoRecordWithoutAFile) {
  open();
  put("old", "value");
  close();
  for (const std::string key : {"fresh", "old"}) {
    InterruptedQueues between;
    const std::shared_ptr<TaskQueueFactory> interruptedQueues(&between, [](TaskQueueFactory*) {});
    const auto interrupted = PersistentKeyValueStore::create(options, {interruptedQueues, trash, files, nullptr});
    between.work->runAll();
    const Written written = watch(interrupted->store(key, bytesOf("newer")));
    between.file->beforeDispatch = [&] {
      std::thread other([&] { interrupted->invalidate(); });
      while (between.file->queue->pending() == 0) std::this_thread::yield();
      between.file->queue->runAll();
      other.join();
    };
    between.work->runAll();
    between.file->queue->runAll();
    EXPECT_THAT(told(written), testing::HasSubstr("Store has been invalidated."));
  }
  open();
  EXPECT_EQ(get("fresh"), "<miss>");
  EXPECT_EQ(get("old"), "value");
  EXPECT_EQ(rowsOnDisk().size(), 1U);
}

TEST_F(PersistentKeyValueStoreInvalidation, RacesWithOperationsOfManyThreads) {
  open();
  std::atomic<bool> stop{false};
  std::thread workThread([&] {
    while (!stop) {
      if (!work().runNext()) std::this_thread::yield();
    }
    work().runAll();
  });
  std::thread fileThread([&] {
    while (!stop) {
      if (!file().runNext()) std::this_thread::yield();
    }
    file().runAll();
  });
  std::atomic<int> completed{0};
  constexpr int kRounds = 40;
  test::runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < kRounds; ++i) {
      const std::string key = "key" + std::to_string(i % 3);
      store->store(key, bytesOf("value")).then(nullptr, [&](std::future<void>&) { ++completed; });
      store->fetch(key).then(nullptr, [&](std::future<std::unique_ptr<test::FetchResult>>&) { ++completed; });
      store->removeItem(key).then(nullptr, [&](std::future<void>&) { ++completed; });
      store->updateLastAccessDate(key).then(nullptr, [&](std::future<void>&) { ++completed; });
      store->clear([&] { ++completed; }, [&](const std::exception&) { ++completed; });
      store->overrideConfiguration(i);
      try {
        store->getAllKeys();
        store->fetchModificationDate(key);
      } catch (const InvalidatedException&) {
        // What the other thread is about.
      }
      if (thread == 0 && i == kRounds / 2) store->invalidate();
      if (thread == 1 && i == kRounds / 2) store->invalidate();
    }
  });
  stop = true;
  workThread.join();
  fileThread.join();
  settle();
  EXPECT_EQ(completed, 4 * kRounds * 5);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
