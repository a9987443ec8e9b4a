#include "PersistentKeyValueStore.h"

#include <glog/logging.h>

#include <algorithm>
#include <array>
#include <ctime>
#include <stdexcept>
#include <string_view>
#include <utility>

#include "AnalyticsEventReporter.h"
#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskCacheManifest.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "StoreDefaults.h"
#include "TrashCollector.h"
#include "WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

namespace {

const std::string kManifestName = "manifest_v1.sqlite";

constexpr long kFirstStaleRemovalDelay = 300;  // seconds
constexpr long kStaleRemovalInterval = 3600;   // seconds
constexpr std::uint64_t kNanosecondsPerSecond = 1'000'000'000;

// The code of a write to a manifest that could be opened for reading only.
constexpr int kReadOnlyManifest = 8;

// How far the files of writes may get ahead of their records: the first of them waits for the last.
constexpr std::size_t kMaxWritesAtOnce = 32;
constexpr std::uint64_t kMaxBytesAtOnce = 1 << 20;

std::int64_t currentTime() { return static_cast<std::int64_t>(std::time(nullptr)); }
std::int32_t currentDate() { return static_cast<std::int32_t>(currentTime()); }

// What stands beside the values in a store with files. Made when it is needed: one name is another file's constant.
const std::array<std::string, 5>& reservedNames() {
  static const std::array<std::string, 5> names = {kManifestName, kManifestName + "-journal", kManifestName + "-wal",
                                                   kManifestName + "-shm", AttributeStore::fileName};
  return names;
}

bool isReserved(const std::string& filename) {
  const std::string_view name = std::string_view(filename).substr(filename.rfind('/') + 1);  // whatever way leads there
  const auto& reserved = reservedNames();
  return std::find(reserved.begin(), reserved.end(), name) != reserved.end();
}

void count(std::atomic<std::uint64_t>& counter, std::uint64_t occurrences = 1) {
  counter.fetch_add(occurrences, std::memory_order_relaxed);
}

// Whether the file cannot become a manifest that works, however often it is opened: it is damaged, or holds a table of
// another program's that the manifest's own statements do not fit.
bool isNotAManifest(const ManifestPersistenceException& error) {
  constexpr int kStatementDoesNotFit = 1;
  return dynamic_cast<const ManifestCorruptedException*>(&error) != nullptr || error.code() == kStatementDoesNotFit;
}

// Fulfils the promise with what the operation does or throws. No lock may be held: an inline callback runs here.
template <class Operation> void settle(Promise<void>& promise, Operation operation) {
  try {
    operation();
  } catch (...) {
    promise.setException(std::current_exception());
    return;
  }
  promise.setValue();
}

}  // namespace

// One key or several, where they lie.
class PersistentKeyValueStore::Keys {
 public:
  explicit Keys(const std::string& key) : first_(&key), count_(1) {}
  explicit Keys(const std::vector<std::string>& keys) : first_(keys.data()), count_(keys.size()) {}

  const std::string* begin() const { return first_; }
  const std::string* end() const { return first_ + count_; }

 private:
  const std::string* first_;
  std::size_t count_;
};

// A write of a file, on its way through the queues.
struct PersistentKeyValueStore::FileWrite {
  // Discarded: what the writer wrote has to be deleted. Failed: it is deleted, or was never written.
  enum class Outcome : std::uint8_t { Open, Written, Discarded, Failed };

  std::string key;
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;
  Writer writer;
  const bool mayRunEarly;  // before the writes in front of it are over
  const std::weak_ptr<PersistentKeyValueStore> store;
  const Token operation;
  std::shared_ptr<Promise<void>> promise = std::make_shared<Promise<void>>();
  std::shared_ptr<WritesInFlight::Write> inFlight;  // once its record stands in the manifest

  std::atomic<bool> isTaken{false};  // by a task of the file queue: its own, or that of an earlier write
  Outcome outcome = Outcome::Open;
  unsigned int size = 0;
  std::optional<std::uint32_t> total;  // of all items with this one, to report
  std::exception_ptr failure;

  std::mutex nextMutex;           // taken last; guards the one below
  std::weak_ptr<FileWrite> next;  // the write of the store whose task stands right behind on the file queue

  FileWrite(const std::string& key_, std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata_, Writer writer_,
            bool mayRunEarly_, PersistentKeyValueStore& store_)
      : key(key_),
        extendedMetadata(std::move(extendedMetadata_)),
        writer(std::move(writer_)),
        mayRunEarly(mayRunEarly_),
        store(store_.weak_from_this<PersistentKeyValueStore>()),
        operation(store_.operation_) {}
  FileWrite(const FileWrite&) = delete;
  FileWrite& operator=(const FileWrite&) = delete;

  // A queue may drop the write without running it. Takes the store's mutex, so a write must not be released by who
  // holds it.
  ~FileWrite() {
    if (inFlight == nullptr || outcome == Outcome::Written || outcome == Outcome::Discarded) return;
    if (const auto owner = store.lock()) owner->rollBack(*this);
  }

  DiskCacheItem record() const {
    const std::int32_t date = currentDate();
    return {key, key, size, false, date, date, extendedMetadata};
  }

  std::shared_ptr<FileWrite> getNext() {
    const std::lock_guard<std::mutex> lock(nextMutex);
    return next.lock();
  }

  void setNext(const std::shared_ptr<FileWrite>& write) {
    const std::lock_guard<std::mutex> lock(nextMutex);
    next = write;
  }

  // The next write for the task that has taken these. Null when there is none, another task has it, it may not run
  // early, or its key is one of theirs, for which each write has to be over before the next begins.
  static std::shared_ptr<FileWrite> takeNext(const std::vector<std::shared_ptr<FileWrite>>& taken) {
    auto write = taken.back()->getNext();
    if (write == nullptr || !write->mayRunEarly) return nullptr;
    const auto hasItsKey = [&](const std::shared_ptr<FileWrite>& other) { return other->key == write->key; };
    if (std::any_of(taken.begin(), taken.end(), hasItsKey)) return nullptr;
    return write->isTaken.exchange(true) ? nullptr : write;
  }

  void deliver() { failure == nullptr ? promise->setValue() : promise->setException(failure); }
};

// A clear that is under way.
struct PersistentKeyValueStore::Clear {
  bool hasBegun = false;
  std::unordered_set<std::string> storedSince;         // keys that it leaves alone
  std::optional<std::vector<std::string>> keysLeft{};  // to be looked at, once pruning does not get on
};

// A fetch, on its way through the queues.
struct PersistentKeyValueStore::Fetch {
  const std::vector<std::string> keys;
  const Loader loader;
  const std::weak_ptr<PersistentKeyValueStore> store;
  const Token operation;
  std::shared_ptr<const DiskCacheItem> item;  // once it is found
  Promise<Fetched> promise;

  Fetch(std::vector<std::string> keys_, Loader loader_, PersistentKeyValueStore& store_)
      : keys(std::move(keys_)),
        loader(std::move(loader_)),
        store(store_.weak_from_this<PersistentKeyValueStore>()),
        operation(store_.operation_) {}
};

std::shared_ptr<PersistentKeyValueStore> PersistentKeyValueStore::createPersistentKeyValueStore(
    const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
    std::optional<std::uint64_t> capacity, long staleAge, bool inlineData,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<DiskCacheManifestInterface> manifest,
    std::shared_ptr<FileUtils> fileUtils, std::function<void(unsigned int)> sizeChangedCallback,
    unsigned int batchSize) {
  auto store = std::make_shared<PersistentKeyValueStore>(
      directory, temporaryDirectoryPath, name, capacity, staleAge, inlineData, std::move(taskQueueFactory), nullptr,
      std::move(trashCollector), nullptr, std::move(analyticsReporter), std::move(manifest), std::move(fileUtils),
      std::move(sizeChangedCallback), batchSize);
  store->loadManifest();
  return store;
}

PersistentKeyValueStore::PersistentKeyValueStore(
    const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
    std::optional<std::uint64_t> capacity, long staleAge, bool inlineData,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory,
    std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<PruneStrategyBase> pruneStrategy, std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
    std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize)
    : Store(directory),
      name_(name),
      capacity_(capacity),
      inlineData_(inlineData),
      extendedMetadataFactory_(std::move(extendedMetadataFactory)),
      trashCollector_(std::move(trashCollector)),
      pruneStrategy_(std::move(pruneStrategy)),
      analyticsReporter_(std::move(analyticsReporter)),
      fileUtils_(std::move(fileUtils)),
      batchSize_(std::max(batchSize, 1U)),
      sizeChangedCallback_(std::move(sizeChangedCallback)),
      temporaryDirectoryPath_(temporaryDirectoryPath),
      manifestPath_(fileUtils_->combinePath(directory, kManifestName)),
      staleAge_(staleAge),
      writesInFlight_(std::make_unique<WritesInFlight>()),
      manifest_(std::move(manifest)) {
  fileUtils_->createDirectory(directory, true);
  fileQueue_ = taskQueueFactory->createQueue();
  workQueue_ = taskQueueFactory->createWorkQueue();
}

PersistentKeyValueStore::~PersistentKeyValueStore() { restoreRecords(); }

// --- Storing ---

Future<void> PersistentKeyValueStore::store(const std::string& key, const std::vector<unsigned char>& data,
                                            std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata) {
  const auto value = std::make_shared<const std::vector<unsigned char>>(data);
  if (!inlineData_) {
    const auto writeValue = [fileUtils = fileUtils_, value](const std::string& filePath) {
      fileUtils->writeFile(filePath, *value);
      return static_cast<unsigned int>(value->size());
    };
    return storeFile(std::make_shared<FileWrite>(key, std::move(extendedMetadata), writeValue, true, *this));
  }
  const auto promise = std::make_shared<Promise<void>>();
  Future<void> future = promise->getFuture();
  dispatchWork(Keys(key), *promise,
               [weakThis = weak_from_this<PersistentKeyValueStore>(), operation = operation_, key, value,
                extendedMetadata, promise] {
                 if (const auto self = weakThis.lock()) {
                   self->storeInline(key, *value, extendedMetadata, promise);
                 } else {
                   promise->setValue();
                 }
               });
  return future;
}

Future<void> PersistentKeyValueStore::store(const std::string& key,
                                            std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata,
                                            Writer writer) {
  if (inlineData_ && !invalidated_) {
    Promise<void> promise;
    Future<void> future = promise.getFuture();
    const std::runtime_error unsupported("Write callback not supported by inline store.");
    promise.setException(std::make_exception_ptr(unsupported));
    return future;
  }
  // A host's writer may take its time, or wait for an earlier store.
  return storeFile(std::make_shared<FileWrite>(key, std::move(extendedMetadata), std::move(writer), false, *this));
}

Future<void> PersistentKeyValueStore::storeFile(const std::shared_ptr<FileWrite>& write) {
  Future<void> future = write->promise->getFuture();
  dispatchWork(Keys(write->key), *write->promise, [write] {
    const auto self = write->store.lock();
    if (self == nullptr) return write->promise->setValue();
    try {
      std::shared_ptr<FileWrite> last;
      {
        const std::lock_guard<std::mutex> lock(self->mutex_);
        self->throwIfInvalid();
        last = self->beginFileWrite(write);
      }
      if (write->inFlight == nullptr) return write->promise->setValue();  // the store was purged instead
      // A queue that takes no task drops the write: its end takes the record away again.
      self->fileQueue_->dispatch([write] {
        if (write->isTaken.exchange(true)) return;
        if (const auto owner = write->store.lock()) {
          owner->finishFileWrites(write);
        } else {
          write->promise->setValue();
        }
      });
    } catch (...) {
      // The task of an earlier write may have it by now, though the queue has refused its own.
      if (!write->isTaken.exchange(true)) write->promise->setException(std::current_exception());
    }
  });
  return future;
}

// Puts a provisional record into the manifest; none, if the store had to be purged. Returns the write before, which the
// caller may be the last to hold, to release it without the mutex.
std::shared_ptr<PersistentKeyValueStore::FileWrite> PersistentKeyValueStore::beginFileWrite(
    const std::shared_ptr<FileWrite>& write) {
  std::optional<ReplacedItem> replaced;
  const auto setRecord = [&] { replaced = getManifest()->replaceItem(write->record(), true); };
  if (!prepareWrite() || !purgingIfUnwritable(setRecord)) {
    writesInFlight_->revoke(write->key);  // an earlier value must not take the place of this one
    return nullptr;
  }
  auto settled = replaced ? SettledValue{std::move(replaced->item), std::move(replaced->inlineData)}
                          : SettledValue{nullptr, {}, true};
  if (noteStored(write->key) && !settled.isPlainMiss()) settled = SettledValue::lost();  // a clear would have taken it
  write->inFlight = writesInFlight_->begin(write->key, std::move(settled));
  auto last = lastFileWrite_.lock();
  if (last != nullptr) last->setNext(write);
  lastFileWrite_ = write;
  return last;
}

// Writes a file, and then its record. To wait for the manifest would cost two switches between threads for each write:
// while others are busy with it, the files of the next writes are written instead, and then all their records at once.
void PersistentKeyValueStore::finishFileWrites(const std::shared_ptr<FileWrite>& first) {
  const Token deletion = fileDeletion_;  // of what a writer that fails, or is revoked, leaves behind
  std::vector<std::shared_ptr<FileWrite>> writes = {first};
  writeFile(*first);
  std::unique_lock<std::mutex> lock(mutex_, std::try_to_lock);
  if (!lock.owns_lock()) {
    writes.reserve(kMaxWritesAtOnce);
    std::uint64_t bytes = first->size;
    while (writes.size() < kMaxWritesAtOnce && bytes < kMaxBytesAtOnce) {
      auto write = FileWrite::takeNext(writes);
      if (write == nullptr) break;
      writeFile(*write);
      bytes += write->size;
      writes.push_back(std::move(write));
    }
    lock.lock();
  }
  for (const auto& write : writes) recordWritten(*write);
  for (const auto& write : writes) reportTotal(*write);  // together, so that the work queue's thread is woken once
  lock.unlock();
  std::exception_ptr failure;  // of a callback: the executor's affair, but not the other writes'
  for (const auto& write : writes) {
    if (write->outcome == FileWrite::Outcome::Discarded) deleteLeftoverFile(write->key);
    try {
      write->deliver();
    } catch (...) {
      failure = std::current_exception();
    }
  }
  if (failure != nullptr) std::rethrow_exception(failure);
}

void PersistentKeyValueStore::writeFile(FileWrite& write) {
  try {
    throwIfClosed();
    if (writesInFlight_->start(*write.inFlight)) {
      write.size = runWriter(write);
      write.outcome = FileWrite::Outcome::Written;
    } else {
      write.outcome = FileWrite::Outcome::Discarded;
    }
  } catch (...) {
    write.failure = std::current_exception();
    write.outcome = FileWrite::Outcome::Failed;
  }
}

unsigned int PersistentKeyValueStore::runWriter(const FileWrite& write) {
  try {
    return write.writer(getFilePath(write.key));
  } catch (...) {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      writesInFlight_->settle(write.key, SettledValue::lost());
    }
    rollBack(write);
    deleteLeftoverFile(write.key);
    throw;
  }
}

void PersistentKeyValueStore::recordWritten(FileWrite& write) {
  if (write.outcome == FileWrite::Outcome::Failed) return;
  if (write.inFlight->isRevoked) write.outcome = FileWrite::Outcome::Discarded;
  if (write.outcome == FileWrite::Outcome::Discarded) {
    const auto settled = writesInFlight_->drop(write.inFlight);
    if (settled && settled->isReplaced) discardRecord(write.key, false);
    return;
  }
  const bool othersAreInFlight = writesInFlight_->end(write.inFlight);
  try {
    const DiskCacheItem record = write.record();
    const auto setRecord = [&] {
      if (!write.inFlight->hasRecord) removeOldestItemIfOverMaxCapacity();
      getManifest()->setItem(record);
      count(stores_);
    };
    if (purgingIfUnwritable(setRecord) && othersAreInFlight) {
      writesInFlight_->settle(write.key, {std::make_unique<DiskCacheItem>(record)});
    }
  } catch (...) {
    write.failure = std::current_exception();
    write.outcome = FileWrite::Outcome::Discarded;
    discardRecord(write.key, othersAreInFlight);
    return;
  }
  write.total = totalToReport();
}

// Takes back the provisional record of a write whose final one could not be written.
void PersistentKeyValueStore::discardRecord(const std::string& key, bool othersAreInFlight) {
  if (othersAreInFlight) return writesInFlight_->settle(key, SettledValue::lost());
  try {
    restoreRecord(key, SettledValue::lost());
  } catch (const std::exception& error) {
    logLostRecord(key, error);
  }
}

void PersistentKeyValueStore::reportTotal(FileWrite& write) {
  if (!write.total) return;
  try {
    dispatchReport(*write.total);
  } catch (...) {
    write.failure = std::current_exception();
  }
}

// Ends a write that has failed or was dropped. When no other write of its key is in flight, the key goes back to what
// it has without them.
void PersistentKeyValueStore::rollBack(const FileWrite& write) {
  const Token deletion = fileDeletion_;
  bool hasStrayFile = false;
  try {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto settled = writesInFlight_->drop(write.inFlight);
    if (!settled) return;
    hasStrayFile = settled->hasStrayFile;
    purgingIfDamaged([&] { restoreRecord(write.key, *settled); });
  } catch (const std::exception& error) {
    logLostRecord(write.key, error);
  }
  if (hasStrayFile) deleteLeftoverFile(write.key);
}

// Called with the mutex held, or by the destructor.
void PersistentKeyValueStore::restoreRecord(const std::string& key, const SettledValue& settled) {
  const auto manifest = getManifest();
  if (settled.isUnknown && hasFile(key)) return;
  if (settled.record == nullptr) return manifest->removeItem(key);
  manifest->setItem(*settled.record);
  if (settled.record->hasInlineData) manifest->setInlineData(key, settled.inlineData);
}

// The same for every write in flight, none of which will start any more. Purges nothing: the directory may be that of
// another store by now.
void PersistentKeyValueStore::restoreRecords() {
  for (const auto& [key, settled] : writesInFlight_->dropAll()) {
    try {
      restoreRecord(key, settled);
    } catch (const std::exception& error) {
      logLostRecord(key, error);
    }
    if (settled.hasStrayFile) deleteLeftoverFile(key);
  }
}

void PersistentKeyValueStore::logLostRecord(const std::string& key, const std::exception& error) const {
  LOG(ERROR) << "Store \"" << name_ << "\" could not restore the record of \"" << key << "\": " << error.what();
}

bool PersistentKeyValueStore::hasFile(const std::string& key) {
  const std::string filePath = getFilePath(key);
  return fileUtils_->pathExists(filePath) && !fileUtils_->isDirectory(filePath);
}

void PersistentKeyValueStore::deleteLeftoverFile(const std::string& key) {
  if (isClosed_) return;
  try {
    if (hasFile(key)) fileUtils_->deleteFile(getFilePath(key));
  } catch (const std::exception& error) {
    LOG(ERROR) << "Store \"" << name_ << "\" could not delete the file of an unfinished write of \"" << key
               << "\": " << error.what();
  }
}

void PersistentKeyValueStore::storeInline(const std::string& key, const std::vector<unsigned char>& data,
                                          std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata,
                                          const std::shared_ptr<Promise<void>>& promise) {
  std::optional<std::string> replacedFile;
  try {
    const std::lock_guard<std::mutex> lock(mutex_);
    throwIfInvalid();
    replacedFile = writeInline(key, data, std::move(extendedMetadata));
  } catch (...) {
    return promise->setException(std::current_exception());
  }
  if (replacedFile) {
    deleteReplacedFile(*replacedFile, promise);
  } else {
    promise->setValue();
  }
}

// The path of the file that held the value so far, if one did.
std::optional<std::string> PersistentKeyValueStore::writeInline(
    const std::string& key, const std::vector<unsigned char>& data,
    std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata) {
  std::optional<ReplacedItem> replaced;
  const auto write = [&] {
    const auto manifest = getManifest();
    const std::int32_t date = currentDate();
    const auto size = static_cast<std::uint32_t>(data.size());
    replaced = manifest->replaceItem({key, key, size, false, date, date, std::move(extendedMetadata)}, false);
    manifest->setInlineData(key, data);
    count(stores_);
  };
  bool isWritten = false;
  try {
    isWritten = prepareWrite() && purgingIfUnwritable(write);
  } catch (...) {
    if (replaced) takeInlineRecordBack(key, std::move(*replaced));
    throw;
  }
  reportSize();
  if (!isWritten) {
    writesInFlight_->revoke(key);
    return std::nullopt;
  }
  noteStored(key);
  return replaced && replaced->item != nullptr ? fileOf(*replaced->item) : std::nullopt;
}

// A record whose bytes could not be written must not be left: the value in a file is back then, an inline one is gone.
void PersistentKeyValueStore::takeInlineRecordBack(const std::string& key, ReplacedItem replaced) {
  SettledValue settled;
  if (replaced.item != nullptr && !replaced.item->hasInlineData) settled.record = std::move(replaced.item);
  try {
    restoreRecord(key, settled);
  } catch (const std::exception& error) {
    logLostRecord(key, error);
  }
}

// On the file queue, behind the fetches that wait for the file. The promise waits too: as long as the file is there, a
// kill in the middle of the next write of the key could bring its value back.
void PersistentKeyValueStore::deleteReplacedFile(const std::string& filePath,
                                                 const std::shared_ptr<Promise<void>>& promise) {
  const auto deleteIt = [weakThis = weak_from_this<PersistentKeyValueStore>(), operation = operation_,
                         deletion = fileDeletion_, filePath, promise] {
    if (const auto self = weakThis.lock()) self->deleteFiles({filePath});
    promise->setValue();
  };
  try {
    fileQueue_->dispatch(deleteIt);
  } catch (...) {
    deleteIt();
  }
}

// Keeps the clears that are under way from the key. Whether one of them would have taken its present value yet.
bool PersistentKeyValueStore::noteStored(const std::string& key) {
  bool isDueToBeCleared = false;
  for (const auto& clear : clearsUnderWay_) {
    if (const auto state = clear.lock()) isDueToBeCleared = state->storedSince.insert(key).second || isDueToBeCleared;
  }
  return isDueToBeCleared;
}

// Makes room for a write. False when the store was purged instead.
bool PersistentKeyValueStore::prepareWrite() {
  getManifest();  // one that cannot be opened now fails this operation, and purges nothing
  beginAnew();
  return !capacity_ || purgingIfUnwritable([&] { removeOldestItemIfOverMaxCapacity(); });
}

// --- Fetching ---

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetch(const std::string& key) {
  // Called on a store that is alive: the loader runs from a task that holds it.
  return fetch(key, [this](std::shared_ptr<const DiskCacheItem> item, const std::string& filePath,
                           std::vector<unsigned char>& value) { return readValue(std::move(item), filePath, value); });
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
  return fetchFirstOf(std::vector<std::string>(1, key), std::move(loader));
}

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetchFirst(
    const std::vector<std::string>& keys, Loader loader) {
  return fetchFirstOf(keys, std::move(loader));
}

Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>> PersistentKeyValueStore::fetchFirstOf(
    std::vector<std::string> keys, Loader loader) {
  const auto fetch = std::make_shared<Fetch>(std::move(keys), std::move(loader), *this);
  Future<Fetched> future = fetch->promise.getFuture();
  dispatchWork(Keys(fetch->keys), fetch->promise, [fetch] {
    if (const auto self = fetch->store.lock()) {
      self->find(fetch);
    } else {
      fetch->promise.setValue(nullptr);
    }
  });
  return future;
}

void PersistentKeyValueStore::find(const std::shared_ptr<Fetch>& fetch) {
  try {
    std::unique_ptr<DiskCacheItem> found;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      throwIfInvalid();
      found = lookUp(Keys(fetch->keys));
      if (found != nullptr) lastFileWrite_.reset();
    }
    fetch->item = std::move(found);
    if (!fetch->keys.empty()) {
      count(fetch->item != nullptr ? hits_ : misses_);
      reportAccess(fetch->item.get(), fetch->keys.front());
    }
    if (fetch->item != nullptr) {
      fileQueue_->dispatch([fetch] {
        if (const auto self = fetch->store.lock()) {
          self->load(*fetch);
        } else {
          fetch->promise.setValue(nullptr);
        }
      });
      return;
    }
  } catch (...) {
    return fetch->promise.setException(std::current_exception());
  }
  fetch->promise.setValue(nullptr);
}

// The record of the first key that has one; null for a miss, and when looking for it purged the store.
std::unique_ptr<DiskCacheItem> PersistentKeyValueStore::lookUp(Keys keys) {
  std::unique_ptr<DiskCacheItem> item;
  purgingIfDamaged([&] {
    beginAnew();
    for (auto key = keys.begin(); key != keys.end() && item == nullptr; ++key) item = getManifest()->getItem(*key);
  });
  return item;
}

void PersistentKeyValueStore::load(Fetch& fetch) {
  const auto& item = fetch.item;
  Fetched result;
  try {
    throwIfClosed();
    auto fetched = std::make_unique<FetchResult>(FetchResult{item->key, {}, item->modificationDate});
    if (fetch.loader(item, getFilePath(item->filename), fetched->value)) {
      const std::lock_guard<std::mutex> lock(mutex_);
      purgingIfDamaged([&] { getManifest()->updateLastAccessDate(item->key); });
      result = std::move(fetched);
    }
  } catch (...) {
    if (isClosed_ || !hasLostItem(*item)) return fetch.promise.setException(std::current_exception());
  }
  fetch.promise.setValue(std::move(result));
}

// Whether the store itself has taken the item away since it was looked up: removed it, or removed it and stored it
// anew.
bool PersistentKeyValueStore::hasLostItem(const DiskCacheItem& item) {
  try {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (lookUp(Keys(item.key)) == nullptr) return true;
    return writesInFlight_->contains(item.key) && !fileUtils_->pathExists(getFilePath(item.filename));
  } catch (const std::exception&) {
    return false;
  }
}

bool PersistentKeyValueStore::readValue(std::shared_ptr<const DiskCacheItem> item, const std::string& filePath,
                                        std::vector<unsigned char>& value) {
  if (!item->hasInlineData) {
    value = fileUtils_->readFile(filePath);
    return true;
  }
  const std::lock_guard<std::mutex> lock(mutex_);  // record and value are written one after the other
  bool isThere = false;
  purgingIfDamaged([&] {
    const auto manifest = getManifest();
    value = manifest->getInlineData(item->key);
    isThere = !value.empty();
    if (isThere) return;
    const auto current = manifest->getItem(item->key);
    isThere = current != nullptr && current->size == 0;  // an empty value, not one that has vanished
  });
  return isThere;
}

std::vector<std::string> PersistentKeyValueStore::getAllKeys() {
  throwIfInvalid();
  return getManifest()->getAllKeys();
}

std::optional<std::int32_t> PersistentKeyValueStore::fetchModificationDate(const std::string& key) {
  throwIfReserved(key);
  const std::lock_guard<std::mutex> lock(mutex_);  // no purge and no invalidation comes in between
  throwIfInvalid();
  std::optional<std::int32_t> date;
  purgingIfDamaged([&] {
    beginAnew();
    date = getManifest()->getModificationDate(key);
  });
  return date;
}

Future<void> PersistentKeyValueStore::updateLastAccessDate(const std::string& key) {
  const auto promise = std::make_shared<Promise<void>>();
  Future<void> future = promise->getFuture();
  dispatchWork(
      Keys(key), *promise,
      [weakThis = weak_from_this<PersistentKeyValueStore>(), operation = operation_, key, promise] {
        settle(*promise, [&] {
          const auto self = weakThis.lock();
          if (self == nullptr) return;
          self->throwIfInvalid();
          if (self->analyticsReporter_ != nullptr) {
            self->analyticsReporter_->reportEvent(
                PersistentKeyValueStoreEventBuilder(PersistentKeyValueStoreEvent::Hit::Found, self->name_, key).get());
          }
          const std::lock_guard<std::mutex> lock(self->mutex_);
          self->purgingIfDamaged([&] { self->getManifest()->updateLastAccessDate(key); });
        });
      });
  return future;
}

// A hit carries the item found; a miss, the key that was looked for first.
void PersistentKeyValueStore::reportAccess(const DiskCacheItem* item, const std::string& key) {
  if (analyticsReporter_ == nullptr) return;
  using Hit = PersistentKeyValueStoreEvent::Hit;
  PersistentKeyValueStoreEventBuilder event(item != nullptr ? Hit::Found : Hit::Missing, name_,
                                            item != nullptr ? item->key : key);
  if (item != nullptr) event.age(ageOf(currentTime() - item->modificationDate)).size(item->size);
  analyticsReporter_->reportEvent(event.get());
}

// --- Removing ---

Future<void> PersistentKeyValueStore::removeItem(const std::string& key) {
  const auto promise = std::make_shared<Promise<void>>();
  Future<void> future = promise->getFuture();
  dispatchWork(Keys(key), *promise,
               [weakThis = weak_from_this<PersistentKeyValueStore>(), operation = operation_, key, promise] {
                 if (const auto self = weakThis.lock()) {
                   self->remove(key, promise);
                 } else {
                   promise->setValue();
                 }
               });
  return future;
}

void PersistentKeyValueStore::remove(const std::string& key, const std::shared_ptr<Promise<void>>& promise) {
  bool leftToWrite = false;
  const auto removeAll = [&] {
    const std::lock_guard<std::mutex> removal(removalMutex_);
    std::optional<std::string> filePath;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      throwIfInvalid();
      const auto item = lookUp(Keys(key));
      const bool isRemoved = item != nullptr && purgingIfDamaged([&] { getManifest()->removeItem(key); });
      if (isRemoved) filePath = fileOf(*item);
      // A write that is on its way deletes what it finds; the removal is done when the file queue has got past it.
      if (writesInFlight_->revoke(key)) {
        lastFileWrite_.reset();
        fileQueue_->dispatch([promise] { promise->setValue(); });
        leftToWrite = true;
        return;
      }
    }
    if (filePath) fileUtils_->deleteFile(*filePath);
  };
  try {
    removeAll();
  } catch (...) {
    return promise->setException(std::current_exception());
  }
  if (!leftToWrite) promise->setValue();
}

void PersistentKeyValueStore::clear(std::function<void()> onSuccess,
                                    std::function<void(const std::exception&)> onError) {
  const auto takeNextBatch = [weakThis = weak_from_this<PersistentKeyValueStore>(),
                              clear = std::make_shared<Clear>()]() -> std::vector<DiskCacheItem> {
    const auto self = weakThis.lock();
    if (self == nullptr) return {};
    return self->takeBatch([&](DiskCacheManifestInterface&) { return self->takeForClear(clear); });
  };
  deleteFilesInBatches(takeNextBatch, std::move(onSuccess), std::move(onError));
}

// The next items to be deleted. Pruning to nothing leaves items of no size, and would take what has been stored since
// the clear began.
std::vector<DiskCacheItem> PersistentKeyValueStore::takeForClear(const std::shared_ptr<Clear>& clear) {
  std::vector<DiskCacheItem> items;
  if (!clear->hasBegun) {
    const auto hasEnded = [](const std::weak_ptr<Clear>& other) { return other.expired(); };
    clearsUnderWay_.erase(std::remove_if(clearsUnderWay_.begin(), clearsUnderWay_.end(), hasEnded),
                          clearsUnderWay_.end());
    clearsUnderWay_.push_back(clear);
    clear->hasBegun = true;
    items = cancelWrites();
  }
  for (DiskCacheItem& item : takeNext(*clear)) items.push_back(std::move(item));
  // What somebody else has removed, a prune say, may have its files still: the file queue has to pass them.
  if (items.empty() && fileDeletion_.use_count() > 1) items.emplace_back();
  return items;
}

std::vector<DiskCacheItem> PersistentKeyValueStore::takeNext(Clear& clear) {
  if (clear.storedSince.empty() && !clear.keysLeft) {
    auto items = getManifest()->pruneToSize(0, batchSize_);
    if (!items.empty() || getManifest()->count() == 0) return items;
  }
  return takeAllBut(clear);
}

// Not in their turn like other items: a write that is cancelled must not leave its record to a later batch. Returns
// items without a file, so that the file queue has passed these writes before the next batch.
std::vector<DiskCacheItem> PersistentKeyValueStore::cancelWrites() {
  std::vector<DiskCacheItem> cancelled;
  const auto keys = writesInFlight_->keys();
  const auto manifest = getManifest();
  try {
    if (!manifest->isLoaded()) manifest->load();
    for (const std::string& key : keys) {
      manifest->removeItem(key);
      writesInFlight_->revoke(key);
      cancelled.emplace_back(key, std::string(), 0, false, 0, 0, nullptr);
    }
  } catch (const ManifestCorruptedException&) {
    for (const std::string& key : keys) writesInFlight_->revoke(key);  // the purge takes their records
    throw;
  }
  return cancelled;
}

// What is stored from here on is in `storedSince`, so one look at all keys is enough.
std::vector<DiskCacheItem> PersistentKeyValueStore::takeAllBut(Clear& clear) {
  std::vector<DiskCacheItem> items;
  const auto manifest = getManifest();
  if (!clear.keysLeft) clear.keysLeft = manifest->getAllKeys();
  for (auto& keys = *clear.keysLeft; !keys.empty() && items.size() < batchSize_; keys.pop_back()) {
    const std::string& key = keys.back();
    const auto item = clear.storedSince.count(key) > 0 ? nullptr : manifest->getItem(key);
    if (item == nullptr) continue;
    try {
      manifest->removeItem(key);
    } catch (const ManifestPersistenceException&) {
      if (items.empty()) throw;
      break;  // the files of those that are removed must be deleted too
    }
    items.push_back(*item);
  }
  return items;
}

void PersistentKeyValueStore::removeOldestItemIfOverMaxCapacity() {
  const auto manifest = getManifest();
  if (!capacity_ || manifest->count() < *capacity_) return;
  const auto item = manifest->pruneOldestItem();
  if (item == nullptr) return;
  count(evictions_);
  const auto filePath = fileOf(*item);
  if (!filePath || writesInFlight_->revoke(item->key)) return;
  const auto deleteIt = [weakThis = weak_from_this<PersistentKeyValueStore>(), deletion = fileDeletion_,
                         path = *filePath] {
    const auto self = weakThis.lock();
    if (self == nullptr) return;
    try {
      self->fileUtils_->deleteFile(path);
    } catch (const LarderException& error) {
      LOG(ERROR) << "Failed to remove the oldest item " << error.what();
    }
  };
  lastFileWrite_.reset();
  try {
    fileQueue_->dispatch(deleteIt);
  } catch (...) {
    deleteIt();  // its record has gone already
    throw;
  }
}

std::vector<DiskCacheItem> PersistentKeyValueStore::takeBatch(
    const std::function<std::vector<DiskCacheItem>(DiskCacheManifestInterface& manifest)>& prune) {
  const std::lock_guard<std::mutex> lock(mutex_);
  throwIfInvalid();
  std::vector<DiskCacheItem> items;
  if (!purgingIfDamaged([&] { items = prune(*getManifest()); })) return {};
  for (DiskCacheItem& item : items) {
    if (writesInFlight_->revoke(item.key)) item.filename.clear();  // its file is left to that write
  }
  return items;
}

std::vector<DiskCacheItem> PersistentKeyValueStore::evictBatch(
    const std::function<std::vector<DiskCacheItem>(DiskCacheManifestInterface& manifest)>& prune) {
  auto items = takeBatch(prune);
  count(evictions_, items.size());
  return items;
}

void PersistentKeyValueStore::deleteFilesInBatches(std::function<const std::vector<DiskCacheItem>()> provider,
                                                   std::function<void()> onSuccess,
                                                   std::function<void(const std::exception&)> onError) {
  const auto countedProvider = [operation = operation_, provider = std::move(provider)] { return provider(); };
  workQueue_->dispatch([weakThis = weak_from_this<PersistentKeyValueStore>(), countedProvider,
                        onSuccess = std::move(onSuccess), onError = std::move(onError)] {
    if (const auto self = weakThis.lock()) self->deleteNextBatch(countedProvider, onSuccess, onError);
  });
}

void PersistentKeyValueStore::deleteNextBatch(std::function<const std::vector<DiskCacheItem>()> provider,
                                              std::function<void()> onSuccess,
                                              std::function<void(const std::exception&)> onError) {
  bool done = false;
  try {
    throwIfInvalid();
    const std::vector<DiskCacheItem> batch = provider();
    if (batch.empty()) {
      reportSize();
      done = true;
    } else {
      std::vector<std::string> paths;
      for (const DiskCacheItem& item : batch) {
        if (auto filePath = fileOf(item)) paths.push_back(std::move(*filePath));
      }
      deleteBatch(paths).then(workQueue_, [weakThis = weak_from_this<PersistentKeyValueStore>(), provider, onSuccess,
                                           onError](std::future<void>& deleted) {
        const auto self = weakThis.lock();
        if (self == nullptr) return;
        try {
          deleted.get();
        } catch (const std::exception& error) {
          if (onError) onError(error);
          return;
        }
        self->deleteNextBatch(provider, onSuccess, onError);
      });
    }
  } catch (const std::exception& error) {
    if (onError) onError(error);
  }
  if (done && onSuccess) onSuccess();
}

Future<void> PersistentKeyValueStore::deleteBatch(const std::vector<std::string>& paths) {
  try {
    throwIfInvalid();
    const Token deletion = paths.empty() ? nullptr : fileDeletion_;
    auto deleted =
        dispatchTask<void>(fileQueue_, [weakThis = weak_from_this<PersistentKeyValueStore>(), deletion, paths] {
          const auto self = weakThis.lock();
          if (self == nullptr) return;
          self->throwIfClosed();
          self->deleteFiles(paths);
        });
    const std::lock_guard<std::mutex> lock(mutex_);  // not before: a queue may run the task at once
    lastFileWrite_.reset();
    return deleted;
  } catch (...) {
    Promise<void> failed;
    failed.setException(std::current_exception());
    return failed.getFuture();
  }
}

void PersistentKeyValueStore::deleteFiles(const std::vector<std::string>& paths) {
  for (const std::string& filePath : paths) {
    try {
      fileUtils_->deleteFile(filePath);
    } catch (const LarderException& error) {
      LOG(ERROR) << "Failed to delete file at \"" << filePath << "\" " << error.what();
    }
  }
}

// Where the item's value is; empty when it is not in a file of its own. A record may have any name, an inline store
// takes any key, and what is not a value must not be deleted as one.
std::optional<std::string> PersistentKeyValueStore::fileOf(const DiskCacheItem& item) {
  if (item.hasInlineData || item.filename.empty() || isReserved(item.filename)) return std::nullopt;
  return getFilePath(item.filename);
}

// --- Expiry ---

void PersistentKeyValueStore::loadManifest() {
  workQueue_->dispatch([weakThis = weak_from_this<PersistentKeyValueStore>()] {
    const auto self = weakThis.lock();
    if (self == nullptr) return;
    const std::lock_guard<std::mutex> lock(self->mutex_);
    if (self->invalidated_) return;
    // Armed whatever happens: a load that fails for a passing reason is tried again then.
    std::exception_ptr failure;
    try {
      self->purgingIfDamaged([&] { self->getManifest()->load(); });
    } catch (...) {
      failure = std::current_exception();
    }
    self->armStaleRemoval(kFirstStaleRemovalDelay);
    if (failure != nullptr) std::rethrow_exception(failure);
  });
}

void PersistentKeyValueStore::scheduleStaleRemoval(long delaySeconds) {
  const std::lock_guard<std::mutex> lock(mutex_);
  armStaleRemoval(delaySeconds);
}

void PersistentKeyValueStore::armStaleRemoval(long delaySeconds) {
  if (invalidated_) return;
  const auto delay = static_cast<std::int64_t>(static_cast<std::uint64_t>(delaySeconds) * kNanosecondsPerSecond);
  const auto onTimer = [weakThis = weak_from_this<PersistentKeyValueStore>()] {
    if (const auto self = weakThis.lock()) self->startStaleItemRemoval();
  };
  staleRemovalTimer_ = workQueue_->scheduleAfter(delay, onTimer, nullptr);
}

void PersistentKeyValueStore::startStaleItemRemoval() {
  const auto onError = [weakThis = weak_from_this<PersistentKeyValueStore>()](const std::exception& error) {
    if (const auto self = weakThis.lock()) self->scheduleStaleRemoval(kStaleRemovalInterval);
    LOG(ERROR) << "Failed to delete stale items: " << error.what();
  };
  const auto onSuccess = [weakThis = weak_from_this<PersistentKeyValueStore>()] {
    if (const auto self = weakThis.lock()) self->scheduleStaleRemoval(kStaleRemovalInterval);
  };

  long cutoff = 0;
  try {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (invalidated_) return;
    purgingIfDamaged([&] {
      if (!getManifest()->isLoaded()) getManifest()->load();
    });
    reportSize();
    const std::int64_t now = currentTime();
    cutoff = staleAge_ > now
                 ? 0
                 : static_cast<long>(static_cast<std::uint64_t>(now) - static_cast<std::uint64_t>(staleAge_));
  } catch (const std::exception& error) {
    return onError(error);
  }

  const auto takeStaleItems = [weakThis = weak_from_this<PersistentKeyValueStore>(),
                               cutoff]() -> std::vector<DiskCacheItem> {
    const auto self = weakThis.lock();
    if (self == nullptr) return {};
    return self->evictBatch(
        [&](DiskCacheManifestInterface& manifest) { return manifest.pruneOldEntries(cutoff, self->batchSize_); });
  };
  try {
    deleteFilesInBatches(takeStaleItems, onSuccess, onError);
  } catch (const std::exception& error) {
    onError(error);
  }
}

void PersistentKeyValueStore::overrideConfiguration(long staleAge) {
  const std::lock_guard<std::mutex> lock(mutex_);
  staleAge_ = staleAge;
}

bool PersistentKeyValueStore::isPrunable() { return false; }

PersistentKeyValueStore::OperationCounts PersistentKeyValueStore::operationCounts() const {
  const auto read = [](const std::atomic<std::uint64_t>& counter) { return counter.load(std::memory_order_relaxed); };
  return {read(hits_), read(misses_), read(stores_), read(evictions_)};
}

// --- Invalidation and recovery ---

void PersistentKeyValueStore::invalidate() {
  Future<void> barrier;
  if (!markInvalid(barrier)) return;
  try {
    barrier.get();
  } catch (const std::future_error&) {
    // The file queue is shut down, so nothing is being written either.
  }
  { const std::lock_guard<std::mutex> removal(removalMutex_); }
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

void PersistentKeyValueStore::keepUntilIdle() {
  if (operation_.use_count() > 1) passQueues(weak_from_this<PersistentKeyValueStore>().lock());
}

// What the work queue has taken so far has put its tasks on the file queue when the first of these runs.
void PersistentKeyValueStore::passQueues(const std::shared_ptr<PersistentKeyValueStore>& self) {
  const auto passFileQueue = [self] {
    self->fileQueue_->dispatch([self] {
      if (self->operation_.use_count() > 1) passQueues(self);
    });
  };
  try {
    self->workQueue_->dispatch(passFileQueue);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Store \"" << self->name_ << "\" cannot finish what it has accepted: " << error.what();
  }
}

// False when the store is invalid already.
bool PersistentKeyValueStore::markInvalid(Future<void>& barrier) {
  const std::lock_guard<std::mutex> lock(mutex_);
  if (invalidated_) return false;
  invalidated_ = true;
  staleRemovalTimer_.reset();
  lastFileWrite_.reset();
  try {
    barrier = dispatchTask<void>(fileQueue_, [weakThis = weak_from_this<PersistentKeyValueStore>()] {
      if (const auto self = weakThis.lock()) self->isClosed_ = true;
    });
  } catch (...) {  // the file queue is shut down, so nothing is being written either
    isClosed_ = true;
    Promise<void> done;
    barrier = done.getFuture();
    done.setValue();
  }
  return true;
}

void PersistentKeyValueStore::closeManifest() {
  {
    // Writes whose task has come to the file queue behind the barrier will not start any more.
    const std::lock_guard<std::mutex> lock(mutex_);
    isClosed_ = true;
    restoreRecords();
  }
  const std::lock_guard<std::mutex> lock(manifestMutex_);
  if (manifest_ != nullptr) manifest_->invalidate();
}

void PersistentKeyValueStore::throwIfInvalid() {
  if (invalidated_) throw InvalidatedException("Store has been invalidated.");
}

void PersistentKeyValueStore::throwIfClosed() {
  if (isClosed_) throwIfInvalid();
}

void PersistentKeyValueStore::handleCorruptedManifest(const LarderException& error) {
  const std::lock_guard<std::mutex> lock(mutex_);
  throwIfInvalid();
  if (!purge(error)) throw LarderException(error.description(), error.domain(), error.code());
}

// Runs what uses the manifest. A damaged one purges the store: false then. Throws what else goes wrong, and the damage
// itself when the store cannot be purged.
template <class Operation> bool PersistentKeyValueStore::purgingIfDamaged(Operation operation) {
  try {
    operation();
    return true;
  } catch (const ManifestCorruptedException& error) {
    if (!purge(error)) throw;
    return false;
  }
}

// The same for what writes a value's record: a manifest that cannot be written purges too, unless it is only that it
// could not be opened for writing, which is true for the moment.
template <class Operation> bool PersistentKeyValueStore::purgingIfUnwritable(Operation operation) {
  try {
    operation();
    return true;
  } catch (const ManifestPersistenceException& error) {
    if (error.code() == kReadOnlyManifest || !purge(error)) throw;
    return false;
  }
}

// False, and nothing has changed, when the directory cannot be collected: what the old manifest says would be back at
// the next start.
bool PersistentKeyValueStore::purge(const LarderException& error) {
  throwIfClosed();
  {
    const auto startsAreHeld = writesInFlight_->holdStarts();
    if (!trashCollector_->collectPath(path) && fileUtils_->pathExists(manifestPath_)) return false;
    writesInFlight_->loseRecords(startsAreHeld);
    isHalfPurged_ = true;
    beginAnew();
  }
  logPurge(error);
  return true;
}

void PersistentKeyValueStore::logPurge(const LarderException& error) const {
  LOG(ERROR) << "Store \"" << name_ << "\" purged due to corrupted manifest. " << error.what();
}

// The second half of a purge. On a full disk it can fail; the next operation then tries it again.
void PersistentKeyValueStore::beginAnew() {
  if (!isHalfPurged_) return;
  fileUtils_->createDirectory(path, true);
  const auto manifest = getManifest();
  manifest->clear();
  manifest->load();
  isHalfPurged_ = false;
}

void PersistentKeyValueStore::reportSize() {
  if (const auto total = totalToReport()) dispatchReport(*total);
}

std::optional<std::uint32_t> PersistentKeyValueStore::totalToReport() {
  if (!sizeChangedCallback_) return std::nullopt;
  const auto manifest = getManifest();
  return manifest->isLoaded() ? std::make_optional(manifest->size()) : std::nullopt;
}

void PersistentKeyValueStore::dispatchReport(std::uint32_t total) {
  workQueue_->dispatch([weakThis = weak_from_this<PersistentKeyValueStore>(), total] {
    if (const auto self = weakThis.lock()) self->sizeChangedCallback_(total);
  });
}

// --- Parts ---

std::shared_ptr<DiskCacheManifestInterface> PersistentKeyValueStore::getManifest() {
  if (manifestCreated_) return manifest_;
  const std::lock_guard<std::mutex> lock(manifestMutex_);
  if (manifest_ == nullptr) {
    const auto create = [this] {
      return DiskCacheManifest::createDiskCacheManifest(manifestPath_, workQueue_, extendedMetadataFactory_,
                                                        pruneStrategy_);
    };
    try {
      manifest_ = create();
    } catch (const ManifestPersistenceException& error) {
      if (!isNotAManifest(error)) throw;
      trashCollector_->collectPath(path);
      fileUtils_->createDirectory(path, true);
      manifest_ = create();
      logPurge(error);
    }
  }
  manifestCreated_ = true;
  return manifest_;
}

std::string PersistentKeyValueStore::getFilePath(const std::string& filename) {
  return fileUtils_->combinePath(path, filename);
}

std::string PersistentKeyValueStore::getTemporaryDirectoryPath() { return temporaryDirectoryPath_; }

// Hands the task over, or fails the promise with the reason why not.
template <class T>
void PersistentKeyValueStore::dispatchWork(Keys keys, Promise<T>& promise, std::function<void()> task) {
  try {
    throwIfInvalid();
    for (const std::string& key : keys) throwIfReserved(key);
    workQueue_->dispatch(std::move(task));
  } catch (...) {
    promise.setException(std::current_exception());
  }
}

void PersistentKeyValueStore::throwIfReserved(const std::string& key) const {
  if (inlineData_) return;
  if (key.find('\0') != std::string::npos) throw std::invalid_argument("Key '" + key + "' holds a zero byte.");
  if (isReserved(key)) throw std::invalid_argument("Key '" + key + "' is reserved.");
}

std::shared_ptr<Store> PKVSDefinition::createStore(
    const std::string& storePath, const std::string& temporaryDirectoryPath,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, PruneStrategyIdentifier /*pruneStrategy*/,
    std::shared_ptr<const StoreDefinition> /*definition*/) const {
  return PersistentKeyValueStore::createPersistentKeyValueStore(
      storePath, temporaryDirectoryPath, name, capacity, staleAgeOf(staleAge), inlineData, std::move(taskQueueFactory),
      std::move(trashCollector), std::move(analyticsReporter), nullptr, std::move(fileUtils),
      std::move(sizeChangedCallback), kDefaultBatchSize);
}

}  // namespace velmora::mobile::xplat::cellar
