#pragma once

#include <cstdint>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Export.h"
#include "Future.h"
#include "Store.h"
#include "StoreOptions.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

class LarderException;

// Values by key, in a directory of their own: one file for each, or inside the manifest ("inline", for small ones).
// Found again after a restart, expired when they have not been used for long, limited in number if configured.
//
//   <store directory>/
//     manifest_v1.sqlite   the records of all items and the inline values (and SQLite's companions, -wal and -shm)
//     <key>                the value, for a store with files; the key is the file name, unchanged
//
// Threads. Any thread may call. Calls only take their arguments in and return a future: the manifest is used on the
// work queue and files on the file queue, both the host's and serial. `getAllKeys`, `fetchModificationDate`,
// `getManifest` and `invalidate` work on the caller's thread. Operations on one key take effect in the order in which
// they were called, but an inline value that is replaced while a fetch waits is delivered in its new form. A store that
// is destroyed leaves undone what it has not started: the key keeps what it had. (A manager that is released lets its
// stores finish first.)
//
// All of this holds for a relaxed store, the default. A safe or a synced one (`KeyValueStoreOptions::durability`) keeps
// each value in a file of its own, "<key, encoded>.<number>.<checksum>", and replaces it as a whole; takes any key;
// fails only the operation at hand, also where a relaxed one is purged; and delivers no bytes but those that were
// stored: `DamagedValueException`, or a miss in a cache. See docs/reliability.md.
//
// Errors travel in the futures: `InvalidatedException` after invalidation, `FileUtilsIoException` for files, what a
// writer, reader or loader throws, `std::invalid_argument` for a reserved key of a store with files (one that ends in
// the manifest's or the attributes' file name). A manifest that is damaged, or cannot be written, fails nothing: the
// store is PURGED, all its values go to the trash, the log says so in one line, and work continues with an empty store.
// Where it cannot be purged the operation fails. A manifest that cannot be opened fails the operation at hand, too, and
// is opened again by the next one.
//
// Keys are used as file names, unchanged: one that holds a "/" or is ".." reaches outside the store's directory. Encode
// what is not under your own control (the host kit has `encodeFileName`). A key that holds a zero byte fails with
// `std::invalid_argument`.
//
// What survives. The process killed: every value whose future has been fulfilled. Caught in the middle of an overwrite:
// the old value, the new one, or a part of it; of a first write: a part, or an error. Power cut: as much as the file
// system kept; the last records may be lost. Full disk: a write fails with its error and leaves a miss; if the manifest
// itself cannot be written, the store is purged.
class CELLAR_EXPORT PersistentKeyValueStore : public Store {
 public:
  // Creates the file at `path` and returns its size in bytes. Called on the file queue, when all earlier writes are
  // over.
  using Writer = std::function<unsigned int(const std::string& path)>;

  // The value in the file at `path`. Called on the file queue.
  using Reader = std::function<std::vector<unsigned char>(const std::string& path)>;

  // Fills in the value of the item, whose file (unless it is inline) is at `path`; false: the fetch is a miss. Called
  // on the file queue.
  using Loader = std::function<bool(std::shared_ptr<const DiskCacheItem> item, const std::string& path,
                                    std::vector<unsigned char>& value)>;

  struct CELLAR_EXPORT FetchResult {
    std::string key;
    std::vector<unsigned char> value;
    long modificationDate;  // seconds since the Unix epoch
  };

  // What a store has done since it was created, each number counted by itself: read while the store works they need not
  // belong to one moment.
  struct CELLAR_EXPORT OperationCounts {
    std::uint64_t hits;       // fetches that found an item, whether its value could be read or not
    std::uint64_t misses;     // fetches that found none; those without a key count as neither
    std::uint64_t stores;     // values that were written, those that replaced another too
    std::uint64_t evictions;  // items removed for the capacity, by a prune or by expiry; not those of a clear or purge
  };

  // Creates the store's directory, takes two queues from the services and starts loading the manifest. Throws what
  // creating the directory throws.
  static std::shared_ptr<PersistentKeyValueStore> create(KeyValueStoreOptions options, const StoreServices& services);

  // The same, with each option as a parameter.
  static std::shared_ptr<PersistentKeyValueStore> createPersistentKeyValueStore(
      const std::string& directory, const std::string& temporaryDirectoryPath, const std::string& name,
      std::optional<std::uint64_t> capacity, long staleAge, bool inlineData,
      std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
      std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<DiskCacheManifestInterface> manifest,
      std::shared_ptr<FileUtils> fileUtils, std::function<void(unsigned int)> sizeChangedCallback,
      unsigned int batchSize);

  // As the two above, but loads nothing. The store must be owned by a shared pointer.
  PersistentKeyValueStore(KeyValueStoreOptions options, const StoreServices& services);
  PersistentKeyValueStore(const std::string& directory, const std::string& temporaryDirectoryPath,
                          const std::string& name, std::optional<std::uint64_t> capacity, long staleAge,
                          bool inlineData, std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                          std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
                          std::shared_ptr<TrashCollector> trashCollector,
                          std::shared_ptr<PruneStrategyBase> pruneStrategy,
                          std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                          std::shared_ptr<DiskCacheManifestInterface> manifest, std::shared_ptr<FileUtils> fileUtils,
                          std::function<void(unsigned int)> sizeChangedCallback, unsigned int batchSize);
  ~PersistentKeyValueStore() override;

  // --- Values ---

  // Stores the value under the key, replacing what is there. The bytes are copied once, here. Fulfilled when value and
  // record are written, and the file of a value that is inline from now on is deleted.
  Future<void> store(const std::string& key, const std::vector<unsigned char>& data,
                     std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata = nullptr);

  // The same with a value that `writer` writes into its file. When the writer throws, the future fails with that
  // exception and the key is a miss. An inline store fails with `std::runtime_error`.
  Future<void> store(const std::string& key, std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata,
                     Writer writer);

  // The value; a null result for a miss. A hit counts as a use of the item. A file that has vanished behind the store
  // is an error, unless the store itself removed it meanwhile: that is a miss.
  [[nodiscard]] Future<std::unique_ptr<FetchResult>> fetch(const std::string& key);
  [[nodiscard]] Future<std::unique_ptr<FetchResult>> fetch(const std::string& key, Reader reader);
  [[nodiscard]] Future<std::unique_ptr<FetchResult>> fetch(const std::string& key, Loader loader);

  // The value of the first of the keys that has an item; the result says which. A null result when none has, or there
  // are no keys.
  [[nodiscard]] Future<std::unique_ptr<FetchResult>> fetchFirst(const std::vector<std::string>& keys, Loader loader);

  // The loader of a plain fetch: the inline value, or the bytes of the file.
  bool readValue(std::shared_ptr<const DiskCacheItem> item, const std::string& path, std::vector<unsigned char>& value);

  // Removes value and record. Not an error: a key that is not there.
  Future<void> removeItem(const std::string& key);

  // Removes every item, in batches, and calls one of the two on the work queue when that is done and the files are
  // deleted, those of writes that it found under way too. What is stored after the first batch has been taken stays.
  void clear(std::function<void()> onSuccess, std::function<void(const std::exception&)> onError);

  // The keys of all items, in no order. Throws `DiskCacheManifestException` before the manifest is loaded, and
  // `InvalidatedException`.
  std::vector<std::string> getAllKeys();

  // When the value was stored, in seconds since the Unix epoch; empty for a miss. Waits for the operation on the
  // manifest that is under way, and reads one record from disk before the manifest is loaded. Throws
  // `InvalidatedException`, and what reading throws.
  std::optional<std::int32_t> fetchModificationDate(const std::string& key);

  // Counts as a use of the item, and is reported as one. Not an error: a key that is not there.
  Future<void> updateLastAccessDate(const std::string& key);

  // --- Maintenance ---

  bool isPrunable() override;  // never

  // Refuses all work from now on. What still waits on the work queue fails with `InvalidatedException`; file writes
  // that have been queued, and a removal that has begun, are finished first: this blocks until then, and must not be
  // called on one of the store's queues. The files stay, theirs to discard who invalidates. A second call does nothing.
  void invalidate() override;

  // The same without waiting: fulfilled when the file queue has got so far. Leaves the manifest open.
  Future<void> invalidateWithFuture();

  // Invalidates without waiting, on any thread; the manifest is closed when the file queue has got so far.
  void invalidateSoon() override;

  // Passes both queues until no operation is under way. The store is then released by the last of these tasks, or when
  // a queue drops it. Not kept: a store without operations, or one whose work queue takes no tasks.
  void keepUntilIdle() override;

  // Throws `InvalidatedException` "Store has been invalidated." once that is so.
  void throwIfInvalid();

  // Replaces the stale age (seconds), from the next expiry on.
  void overrideConfiguration(long staleAge);

  // Loads the manifest on the work queue and arms the first expiry.
  void loadManifest();

  // Arms the next expiry, in so many seconds, in place of the one that is armed. Does nothing once invalidated.
  void scheduleStaleRemoval(long delaySeconds);

  // Expires what is stale now. Called on the work queue.
  void startStaleItemRemoval();

  // Evicts the item used least recently if the store is at its capacity. Takes the store's mutex. Throws
  // `InvalidatedException`, and what the manifest throws.
  void removeOldestItemIfOverMaxCapacity();

  // Deletes the files of what `provider` yields, batch by batch, until a batch is empty. Each batch is asked for on the
  // work queue when the files of the last one are deleted. Then one of the callbacks is called there. No lock is held
  // around any of the three.
  void deleteFilesInBatches(std::function<const std::vector<DiskCacheItem>()> provider, std::function<void()> onSuccess,
                            std::function<void(const std::exception&)> onError);

  // One step of it. Called on the work queue.
  void deleteNextBatch(std::function<const std::vector<DiskCacheItem>()> provider, std::function<void()> onSuccess,
                       std::function<void(const std::exception&)> onError);

  // Deletes the files on the file queue, in order. One that cannot be deleted is one error line.
  Future<void> deleteBatch(const std::vector<std::string>& paths);

  // Purges the store: its directory goes to the trash, and it continues empty. Throws when it cannot even begin again,
  // when the directory cannot be collected (nothing has changed then), and once the store is invalidated.
  void handleCorruptedManifest(const LarderException& error);

  // Tells the size callback the total bytes of all items, on the work queue, if the manifest is loaded.
  void reportSize();

  // Takes no lock and asks no queue: any thread, as often as it likes, after invalidation too.
  OperationCounts operationCounts() const;

  // --- Parts ---

  // The manifest, created on first use. What creating it throws is thrown; later calls try again. A
  // corrupted one is replaced by an empty one together with all files.
  std::shared_ptr<DiskCacheManifestInterface> getManifest();

  std::string getFilePath(const std::string& filename);
  std::string getTemporaryDirectoryPath();

 protected:
  using Prune = std::function<std::vector<DiskCacheItem>(DiskCacheManifestInterface& manifest)>;

  // Takes a batch out of the manifest by `prune`, for `deleteFilesInBatches`, and counts its items as evicted. A
  // damaged manifest purges the store and yields an empty batch.
  std::vector<DiskCacheItem> evictBatch(const Prune& prune);

  std::mutex& mutex();
  unsigned int batchSize() const;
  const std::shared_ptr<PruneStrategyBase>& pruneStrategy() const;

 private:
  struct Parts;

  bool markInvalid(Future<void>& barrier);
  void closeManifest();
  void passQueues();

  const std::unique_ptr<Parts> parts_;
};

}  // namespace velmora::mobile::xplat::cellar
