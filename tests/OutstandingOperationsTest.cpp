// What thousands of outstanding operations and of items cost in memory, and that all of it is given back. A program of
// its own, because it counts every allocation.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <future>
#include <iostream>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "DiskCacheManifest.h"
#include "FileUtils.h"
#include "PersistentKeyValueStore.h"
#include "StoreOptions.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/MemoryPersistence.h"
#include "support/TemporaryDirectory.h"

namespace {

std::atomic<std::size_t> bytesInUse{0};        // as they were asked for
std::atomic<std::size_t> bytesOfAllocator{0};  // as a usual allocator gives them out

// The size stands in front of the block.
constexpr std::size_t kHeader = alignof(std::max_align_t);

// A word before the block says its size, and blocks begin at every second word.
constexpr std::size_t roundedUp(std::size_t size) {
  constexpr std::size_t word = sizeof(std::size_t);
  return (size + word + 2 * word - 1) / (2 * word) * (2 * word);
}

void* allocate(std::size_t size) {
  void* const block = std::malloc(size + kHeader);
  if (block == nullptr) throw std::bad_alloc();
  *static_cast<std::size_t*>(block) = size;
  bytesInUse += size;
  bytesOfAllocator += roundedUp(size);
  return static_cast<char*>(block) + kHeader;
}

void release(void* pointer) {
  if (pointer == nullptr) return;
  void* const block = static_cast<char*>(pointer) - kHeader;
  const std::size_t size = *static_cast<std::size_t*>(block);
  bytesInUse -= size;
  bytesOfAllocator -= roundedUp(size);
  std::free(block);
}

}  // namespace

void* operator new(std::size_t size) { return allocate(size); }
void* operator new[](std::size_t size) { return allocate(size); }
void operator delete(void* pointer) noexcept { release(pointer); }
void operator delete[](void* pointer) noexcept { release(pointer); }
void operator delete(void* pointer, std::size_t) noexcept { release(pointer); }
void operator delete[](void* pointer, std::size_t) noexcept { release(pointer); }

namespace velmora::mobile::xplat::cellar {
namespace {

constexpr std::size_t kOperations = 10'000;
constexpr std::size_t kValueBytes = 4096;

class PersistentKeyValueStoreOutstandingOperations : public testing::Test {
 protected:
  PersistentKeyValueStoreOutstandingOperations() { queues->runAll(); }

  // What each of many calls holds until the queues get to it, and that nothing stays behind.
  template <class Call> std::size_t bytesOfACall(const char* name, Call call) {
    using Result = decltype(call(std::string()));
    const std::string key(24, 'k');
    call(key);
    queues->runAll();
    const std::size_t before = bytesInUse;
    std::vector<Result> futures;
    futures.reserve(kOperations);
    const std::size_t begun = bytesInUse;
    for (std::size_t i = 0; i < kOperations; ++i) futures.push_back(call(key));
    const std::size_t bytes = (bytesInUse - begun) / kOperations;
    queues->runAll();
    for (auto& future : futures) (void)host::await(std::move(future));
    futures.clear();
    futures.shrink_to_fit();
    EXPECT_LT(bytesInUse, before + 64 * 1024) << name;
    std::cout << name << ": " << bytes << " bytes for each outstanding call\n";
    RecordProperty(name, static_cast<int>(bytes));
    return bytes;
  }

  std::shared_ptr<PersistentKeyValueStore> createIn(const test::TemporaryDirectory& parent) const {
    KeyValueStoreOptions options;
    options.directory = parent.file("store");
    options.staleAge = 1000;
    return PersistentKeyValueStore::create(options, {queues, trash, files, nullptr});
  }

  const test::TemporaryDirectory directory;
  const std::shared_ptr<FileUtils> files = std::make_shared<FileUtils>();
  const std::shared_ptr<test::ManualQueueFactory> queues = std::make_shared<test::ManualQueueFactory>();
  const std::shared_ptr<TrashCollector> trash =
      std::make_shared<TrashCollector>(directory.file("trash"), files, nullptr, queues);
  const std::shared_ptr<PersistentKeyValueStore> store = createIn(directory);
};

TEST_F(PersistentKeyValueStoreOutstandingOperations, HoldTheirValueOnceAndLittleElse) {
  const std::vector<unsigned char> value(kValueBytes, 'x');
  const std::size_t bytes = bytesOfACall("store", [&](const std::string& key) { return store->store(key, value); });
  EXPECT_GE(bytes, kValueBytes);
  EXPECT_LE(bytes, kValueBytes + 1536);
}

TEST_F(PersistentKeyValueStoreOutstandingOperations, ThatBringNoValueAreSmall) {
  EXPECT_LE(bytesOfACall("fetch", [&](const std::string& key) { return store->fetch(key); }), 1024U);
  EXPECT_LE(bytesOfACall("removeItem", [&](const std::string& key) { return store->removeItem(key); }), 1024U);
  EXPECT_LE(
      bytesOfACall("updateLastAccessDate", [&](const std::string& key) { return store->updateLastAccessDate(key); }),
      1024U);
}

TEST_F(PersistentKeyValueStoreOutstandingOperations, OfAStoreThatGoesWithItsQueueFullAreGivenBack) {
  const std::size_t before = bytesInUse;
  {
    const test::TemporaryDirectory another;
    auto doomed = createIn(another);
    std::vector<Future<void>> futures;
    for (std::size_t i = 0; i < kOperations; ++i) {
      futures.push_back(doomed->store("key" + std::to_string(i), std::vector<unsigned char>(kValueBytes, 'x')));
    }
    doomed.reset();
    queues->runAll();
    for (auto& future : futures) host::await(std::move(future));
    EXPECT_TRUE(another.names("store").empty());
  }
  EXPECT_LT(bytesInUse, before + 64 * 1024);
}

TEST(QueueOfTheKit, GivesBackTheMemoryOfARush) {
  host::ThreadQueueFactory factory;
  const auto queue = factory.createQueue();
  const auto rush = [&](std::size_t tasks) {
    std::promise<void> begin;
    queue->dispatch([&begin] { begin.get_future().wait(); });
    for (std::size_t i = 0; i < tasks; ++i) queue->dispatch([] {});
    begin.set_value();
    EXPECT_TRUE(factory.drain(std::chrono::hours(1)));
    queue->dispatch([] {});  // behind whatever the queue does after a task
    EXPECT_TRUE(factory.drain(std::chrono::hours(1)));
  };
  rush(1);
  const std::size_t before = bytesInUse;
  rush(10 * kOperations);
  EXPECT_LT(bytesInUse, before + 64 * 1024);
}

// Of an item with a key of 24 characters, when a manifest is loaded and when another item has come to it.
TEST(DiskCacheManifestItemsInMemory, AreSmall) {
  constexpr std::size_t items = 10'000;
  constexpr std::size_t longest = 24;
  constexpr std::size_t most = sizeof(void*) == 4 ? 110 : 200;
  const auto medium = std::make_shared<test::MemoryMedium>();
  medium->change([](auto& rows) {
    for (std::size_t number = 0; number < items; ++number) {
      std::string key = std::to_string(number);
      key.insert(0, longest - key.size(), '0');
      rows[key] = {{key, key, 1, false, 1000, static_cast<std::int32_t>(number), nullptr}, {}};
    }
  });
  DiskCacheManifest manifest(std::make_unique<test::MemoryPersistence>(medium),
                             std::make_shared<test::ManualExecutor>(), nullptr);
  const std::size_t before = bytesOfAllocator;
  manifest.load();
  const std::size_t loaded = bytesOfAllocator;
  manifest.setItem({"another", "another", 1, false, 1000, 1000, nullptr});
  const std::size_t grown = bytesOfAllocator;
  ASSERT_EQ(manifest.count(), items + 1);
  std::cout << "an item: " << (loaded - before) / items << " bytes loaded, " << (grown - before) / items
            << " bytes with room for more\n";
  EXPECT_GT(loaded, before + items * longest);
  EXPECT_LE(loaded - before, items * most);
  EXPECT_LE(grown - before, items * most + 1024);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
