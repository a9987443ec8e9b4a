#include "support/StoreUnderTest.h"

#include <chrono>
#include <future>
#include <stdexcept>

#include <cellar/FileUtils.h>
#include <cellar/PruneStrategy.h>
#include <cellar/TrashCollector.h>
#include <cellar/host/Await.h>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr long kTenYears = 315'360'000;
constexpr unsigned int kBatchSize = 50;  // as managers have it
constexpr std::chrono::minutes kPatience(10);

std::shared_ptr<DiskCache> createCache(const std::string& directory, const StoreOptions& options,
                                       const std::shared_ptr<host::ThreadQueueFactory>& queues) {
  const auto files = std::make_shared<FileUtils>();
  const auto trash = std::make_shared<TrashCollector>(directory + "-trash", files, nullptr, nullptr);
  DiskCacheOptions cacheOptions;
  cacheOptions.directory = directory;
  cacheOptions.temporaryDirectory = directory + "-tmp";
  cacheOptions.name = "bench";
  cacheOptions.capacity = options.capacity;
  cacheOptions.staleAge = kTenYears;
  cacheOptions.inlineData = options.inlineData;
  cacheOptions.batchSize = kBatchSize;
  cacheOptions.onSizeChanged = [](unsigned int) {};
  cacheOptions.pruneStrategy = PruneStrategyFactory(options.strategy);
  cacheOptions.durability = options.durability;
  cacheOptions.normalSize = options.normalSize;
  cacheOptions.survivalSize = options.normalSize;
  const auto cache = std::make_shared<DiskCache>(cacheOptions, StoreServices{queues, trash, files, options.reporter});
  if (options.load) cache->loadManifest();
  return cache;
}

// Starts what ends with one of two callbacks, and waits for it.
template <class Start> void awaitEnd(Start start) {
  std::promise<void> done;
  start([&] { done.set_value(); },
        [&](const std::exception& error) {
          done.set_exception(std::make_exception_ptr(std::runtime_error(error.what())));
        });
  done.get_future().get();
}

}  // namespace

StoreUnderTest::StoreUnderTest(const std::string& directory, const StoreOptions& options)
    : queues_(std::make_shared<host::ThreadQueueFactory>()), cache_(createCache(directory, options, queues_)) {
  settle();
}

StoreUnderTest::~StoreUnderTest() {
  cache_.reset();
  queues_->shutDown();
}

void StoreUnderTest::settle() {
  if (!queues_->drain(kPatience)) throw std::runtime_error("the queues do not come to rest");
}

void StoreUnderTest::prune() {
  awaitEnd([&](auto onSuccess, auto onError) { cache_->pruneBackToNormal(onSuccess, onError, false); });
}

void StoreUnderTest::clear() {
  awaitEnd([&](auto onSuccess, auto onError) { cache_->clear(onSuccess, onError); });
}

void StoreUnderTest::expireAll() {
  cache_->overrideConfiguration(0);
  cache_->startStaleItemRemoval();
  settle();
}

void StoreUnderTest::verify(std::size_t count, std::size_t size) {
  for (std::size_t number = 0; number < count; ++number) {
    const auto found = host::await(cache_->fetch(keyOf(number)));
    if (found == nullptr) throw std::runtime_error("item " + std::to_string(number) + " is missing");
    throwUnlessValue(found->value, size, number);
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
