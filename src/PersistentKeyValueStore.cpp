#include "PersistentKeyValueStore.h"

#include <glog/logging.h>

#include <functional>
#include <future>
#include <stdexcept>
#include <utility>

#include "LarderException.h"
#include "keyvalue/BatchRemoval.h"
#include "keyvalue/Clearing.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/GroupCommit.h"
#include "keyvalue/InPlaceWrites.h"
#include "keyvalue/ItemRemover.h"
#include "keyvalue/Leftovers.h"
#include "keyvalue/Purge.h"
#include "keyvalue/ReplacingWrites.h"
#include "keyvalue/Rollback.h"
#include "keyvalue/Salvage.h"
#include "keyvalue/StaleItemRemoval.h"
#include "keyvalue/StoreContext.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFetcher.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/VersionedFiles.h"
#include "keyvalue/WorkQueue.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

// Each knows those above it.
struct PersistentKeyValueStore::Parts {
  StoreContext context;
  WritesInFlight writes;
  FileQueue fileQueue{context.fileQueue};
  WorkQueue workQueue{context, fileQueue};
  ValueFiles files{context};
  StoreManifest manifest{context};
  GroupCommit groupCommit{context, manifest, workQueue};
  Rollback rollback{context, manifest, writes, files};
  ItemRemover remover{context, manifest, writes, fileQueue, files, groupCommit};
  BatchRemoval batches{context, manifest, writes, workQueue, fileQueue, files};
  Clearing clearing{context, manifest, writes, batches};
  StaleItemRemoval staleItems{context, manifest, batches};
  ValueFetcher fetcher{context, manifest, writes, workQueue, fileQueue, files};

  // What its durability decides.
  std::unique_ptr<VersionedFiles> versions{};  // null in a relaxed store, and the next one too
  std::unique_ptr<Leftovers> leftovers{};
  std::unique_ptr<ManifestRecovery> recovery{};
  std::unique_ptr<WritePath> writePath{};

  Parts(Store& store, KeyValueStoreOptions options, const StoreServices& services)
      : context(store, std::move(options), services) {
    context.isSafe() ? makeSafe() : makeRelaxed();
    manifest.setRecovery(*recovery);
  }

  void makeRelaxed() {
    recovery = std::make_unique<Purge>(context, manifest, writes);
    writePath = std::make_unique<InPlaceWrites>(context, manifest, writes, fileQueue, files, remover, clearing,
                                                rollback, groupCommit);
  }

  void makeSafe() {
    versions = std::make_unique<VersionedFiles>(context);
    leftovers = std::make_unique<Leftovers>(context, manifest, fileQueue, files, *versions);
    recovery = std::make_unique<Salvage>(context, manifest, *versions);
    writePath = std::make_unique<ReplacingWrites>(context, manifest, workQueue, fileQueue, files, *versions, remover,
                                                  clearing, groupCommit);
  }
};

// --- Creation ---

std::shared_ptr<PersistentKeyValueStore> PersistentKeyValueStore::create(KeyValueStoreOptions options,
                                                                         const StoreServices& services) {
  auto store = std::make_shared<PersistentKeyValueStore>(std::move(options), services);
  store->loadManifest();
  return store;
}

std::shared_ptr<PersistentKeyValueStore> PersistentKeyValueStore::createPersistentKeyValueStore(
    const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
    std::optional<std::uint64_t> capacity, long staleAge, bool inlineData,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<DiskCacheManifestInterface> manifest,
    std::shared_ptr<FileUtils> fileUtils, std::function<void(unsigned int)> sizeChangedCallback,
    unsigned int batchSize) {
  return create(
      {directory, temporaryDirectoryPath, name, capacity, staleAge, inlineData, batchSize,
       std::move(sizeChangedCallback), std::move(manifest), nullptr, nullptr},
      {std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils), std::move(analyticsReporter)});
}

PersistentKeyValueStore::PersistentKeyValueStore(
    const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
    std::optional<std::uint64_t> capacity, long staleAge, bool inlineData,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory,
    std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<PruneStrategyBase> pruneStrategy, std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
    std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize)
    : PersistentKeyValueStore({directory, temporaryDirectoryPath, name, capacity, staleAge, inlineData, batchSize,
                               std::move(sizeChangedCallback), std::move(manifest), std::move(extendedMetadataFactory),
                               std::move(pruneStrategy)},
                              {std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils),
                               std::move(analyticsReporter)}) {}

PersistentKeyValueStore::PersistentKeyValueStore(KeyValueStoreOptions options, const StoreServices& services)
    : Store(options.directory), parts_(std::make_unique<Parts>(*this, std::move(options), services)) {}

PersistentKeyValueStore::~PersistentKeyValueStore() { parts_->rollback.endAll(parts_->context.lock()); }

void PersistentKeyValueStore::loadManifest() {
  parts_->context.workQueue->dispatch([weakThis = weak_from_this<PersistentKeyValueStore>()] {
    const auto self = weakThis.lock();
    if (self == nullptr) return;
    self->parts_->staleItems.loadThenArm();
    if (self->parts_->leftovers != nullptr) self->parts_->leftovers->remove();
  });
}

// --- Values ---

Future<void> PersistentKeyValueStore::store(const std::string& key, const std::vector<unsigned char>& data,
                                            std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata) {
  return parts_->writePath->store(key, data, std::move(extendedMetadata));
}

Future<void> PersistentKeyValueStore::store(const std::string& key,
                                            std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata,
                                            Writer writer) {
  if (parts_->context.options.inlineData && !parts_->context.isInvalidated) {
    Promise<void> promise;
    Future<void> future = promise.getFuture();
    const std::runtime_error unsupported("Write callback not supported by inline store.");
    promise.setException(std::make_exception_ptr(unsupported));
    return future;
  }
  return parts_->writePath->store(key, std::move(writer), std::move(extendedMetadata));
}

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetch(const std::string& key) {
  return parts_->fetcher.fetchFirst(std::vector<std::string>(1, key), nullptr);
}

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetch(const std::string& key,
                                                                                             Reader reader) {
  return fetch(key, [reader = std::move(reader)](const std::shared_ptr<const DiskCacheItem>& /*item*/,
                                                 const std::string& filePath, std::vector<unsigned char>& value) {
    value = reader(filePath);
    return true;
  });
}

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetch(const std::string& key,
                                                                                             Loader loader) {
  return fetchFirst(std::vector<std::string>(1, key), std::move(loader));
}

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetchFirst(
    const std::vector<std::string>& keys, Loader loader) {
  if (!loader) loader = [](const auto&...) -> bool { throw std::bad_function_call(); };
  return parts_->fetcher.fetchFirst(keys, std::move(loader));
}

bool PersistentKeyValueStore::readValue(std::shared_ptr<const DiskCacheItem> item, const std::string& filePath,
                                        std::vector<unsigned char>& value) {
  return parts_->fetcher.readValue(*item, filePath, value);
}

Future<void> PersistentKeyValueStore::removeItem(const std::string& key) { return parts_->remover.remove(key); }

void PersistentKeyValueStore::clear(std::function<void()> onSuccess,
                                    std::function<void(const std::exception&)> onError) {
  parts_->clearing.clear(std::move(onSuccess), std::move(onError));
}

std::vector<std::string> PersistentKeyValueStore::getAllKeys() {
  throwIfInvalid();
  return getManifest()->getAllKeys();
}

std::optional<std::int32_t> PersistentKeyValueStore::fetchModificationDate(const std::string& key) {
  return parts_->fetcher.modificationDate(key);
}

Future<void> PersistentKeyValueStore::updateLastAccessDate(const std::string& key) {
  return parts_->fetcher.updateLastAccessDate(key);
}

// --- Maintenance ---

bool PersistentKeyValueStore::isPrunable() { return false; }

void PersistentKeyValueStore::overrideConfiguration(long staleAge) {
  parts_->staleItems.setStaleAge(parts_->context.lock(), staleAge);
}

void PersistentKeyValueStore::scheduleStaleRemoval(long delaySeconds) {
  parts_->staleItems.arm(parts_->context.lock(), delaySeconds);
}

void PersistentKeyValueStore::startStaleItemRemoval() { parts_->staleItems.start(); }

void PersistentKeyValueStore::removeOldestItemIfOverMaxCapacity() {
  const StoreLock lock = parts_->context.lock();
  throwIfInvalid();
  parts_->remover.evictOldestIfFull(lock);
}

std::vector<DiskCacheItem> PersistentKeyValueStore::evictBatch(const Prune& prune) {
  return parts_->batches.evict([&](const StoreLock&, DiskCacheManifestInterface& manifest) { return prune(manifest); });
}

void PersistentKeyValueStore::deleteFilesInBatches(std::function<const std::vector<DiskCacheItem>()> provider,
                                                   std::function<void()> onSuccess,
                                                   std::function<void(const std::exception&)> onError) {
  parts_->batches.run(std::move(provider), std::move(onSuccess), std::move(onError));
}

void PersistentKeyValueStore::deleteNextBatch(std::function<const std::vector<DiskCacheItem>()> provider,
                                              std::function<void()> onSuccess,
                                              std::function<void(const std::exception&)> onError) {
  parts_->batches.step(provider, onSuccess, onError);
}

Future<void> PersistentKeyValueStore::deleteBatch(const std::vector<std::string>& paths) {
  return parts_->batches.deleteFiles(paths);
}

void PersistentKeyValueStore::handleCorruptedManifest(const LarderException& error) {
  const StoreLock lock = parts_->context.lock();
  throwIfInvalid();
  parts_->manifest.recover(lock, error);
}

void PersistentKeyValueStore::reportSize() { parts_->manifest.reportSize(); }

PersistentKeyValueStore::OperationCounts PersistentKeyValueStore::operationCounts() const {
  const StoreContext& context = parts_->context;
  const auto read = [](const StoreContext::Counter& counter) { return counter.load(std::memory_order_relaxed); };
  return {read(context.hits), read(context.misses), read(context.stores), read(context.evictions)};
}

// --- The end ---

void PersistentKeyValueStore::invalidate() {
  Future<void> barrier;
  if (!markInvalid(barrier)) return;
  try {
    barrier.get();
  } catch (const std::future_error&) {
    // The file queue is shut down, so nothing is being written either.
  }
  parts_->remover.finish();
  closeManifest();
}

Future<void> PersistentKeyValueStore::invalidateWithFuture() {
  Future<void> barrier;
  if (markInvalid(barrier)) return barrier;
  Promise<void> done;
  done.setValue();
  return done.getFuture();
}

void PersistentKeyValueStore::invalidateSoon() {
  Future<void> barrier;
  if (!markInvalid(barrier)) return;
  barrier.then(nullptr, [weakThis = weak_from_this<PersistentKeyValueStore>()](std::future<void>&) {
    if (const auto self = weakThis.lock()) self->closeManifest();
  });
}

// False when the store is invalid already. The barrier is kept when the file queue has got past what it has now.
bool PersistentKeyValueStore::markInvalid(Future<void>& barrier) {
  StoreContext& context = parts_->context;
  const StoreLock lock = context.lock();
  if (context.isInvalidated) return false;
  context.isInvalidated = true;
  parts_->staleItems.disarm(lock);
  try {
    barrier = parts_->fileQueue.run([weakContext = context.weak(context)] {
      if (const auto self = weakContext.lock()) self->isClosed = true;
    });
  } catch (...) {  // the file queue is shut down, so nothing is being written either
    context.isClosed = true;
    Promise<void> done;
    barrier = done.getFuture();
    done.setValue();
  }
  return true;
}

void PersistentKeyValueStore::closeManifest() {
  {
    // Writes whose task has come to the file queue behind the barrier will not start any more.
    const StoreLock lock = parts_->context.lock();
    parts_->context.isClosed = true;
    parts_->rollback.endAll(lock);
  }
  parts_->manifest.close();
}

void PersistentKeyValueStore::throwIfInvalid() { parts_->context.throwIfInvalid(); }

void PersistentKeyValueStore::keepUntilIdle() {
  if (parts_->context.operation.use_count() > 1) passQueues();
}

// What the work queue has taken so far has put its tasks on the file queue when the first of these runs.
void PersistentKeyValueStore::passQueues() {
  const auto self = std::static_pointer_cast<PersistentKeyValueStore>(shared_from_this());
  const auto passFileQueue = [self] { self->parts_->context.fileQueue->dispatch([self] { self->keepUntilIdle(); }); };
  try {
    parts_->context.workQueue->dispatch(passFileQueue);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Store \"" << parts_->context.options.name
               << "\" cannot finish what it has accepted: " << error.what();
  }
}

// --- Parts ---

std::shared_ptr<DiskCacheManifestInterface> PersistentKeyValueStore::getManifest() { return parts_->manifest.get(); }

std::string PersistentKeyValueStore::getFilePath(const std::string& filename) { return parts_->files.pathOf(filename); }

std::string PersistentKeyValueStore::getTemporaryDirectoryPath() { return parts_->context.options.temporaryDirectory; }

std::mutex& PersistentKeyValueStore::mutex() { return parts_->context.mutex; }

unsigned int PersistentKeyValueStore::batchSize() const { return parts_->context.options.batchSize; }

const std::shared_ptr<PruneStrategyBase>& PersistentKeyValueStore::pruneStrategy() const {
  return parts_->context.options.pruneStrategy;
}

}  // namespace velmora::mobile::xplat::cellar
