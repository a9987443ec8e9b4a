#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Durability.h"
#include "Export.h"
#include "ManifestPersistence.h"
#include "PruneStrategy.h"
#include "executor/AsyncExecutor.h"

namespace velmora::mobile::xplat::cellar {

class AccessDates;
class ExtendedMetadataFactory;
class ManifestRecord;
class ManifestRecords;
class ManifestUndo;
class StoreTime;

// The record that another one has replaced, null if there was none, and its inline value if that was asked for.
struct CELLAR_EXPORT ReplacedItem {
  std::unique_ptr<DiskCacheItem> item;
  std::vector<unsigned char> inlineData;
};

// What a store knows of its items. A key without a record is never an error. Always held by shared pointers; any thread
// may call.
class CELLAR_EXPORT DiskCacheManifestInterface : public std::enable_shared_from_this<DiskCacheManifestInterface> {
 public:
  virtual ~DiskCacheManifestInterface();

  virtual void clear() = 0;
  virtual void load() = 0;
  virtual void invalidate() = 0;
  virtual void setItem(const DiskCacheItem& item) = 0;
  virtual std::unique_ptr<DiskCacheItem> getItem(const std::string& key) = 0;
  virtual void updateLastAccessDate(const std::string& key) = 0;
  virtual std::optional<std::int32_t> getModificationDate(const std::string& key) = 0;
  virtual void removeItem(const std::string& key) = 0;
  virtual std::vector<unsigned char> getInlineData(const std::string& key) = 0;
  virtual void setInlineData(const std::string& key, const std::vector<unsigned char>& data) = 0;
  virtual void removeInlineData(const std::string& key) = 0;
  virtual std::vector<DiskCacheItem> pruneToSize(std::uint32_t size, std::uint32_t count) = 0;
  virtual std::vector<DiskCacheItem> pruneOldEntries(long date, std::uint32_t count) = 0;
  virtual std::unique_ptr<DiskCacheItem> pruneOldestItem() = 0;
  virtual std::vector<std::string> getAllKeys() = 0;
  virtual std::uint32_t size() = 0;
  virtual std::uint32_t count() = 0;
  virtual bool isLoaded() = 0;

  // As `setItem`, and returns what it has replaced; empty when the manifest does not tell, as here. A store then takes
  // what lies in the key's place for its value when it has to take a write back.
  virtual std::optional<ReplacedItem> replaceItem(const DiskCacheItem& item, bool withInlineData);

  // Runs `changes`, which call operations of this manifest, so that they take effect together. False when nothing has
  // changed, or all of it was taken back: because this manifest cannot do it, as here, or because one of the changes,
  // or their completion, has failed. They can then be made one by one. Other threads' operations wait. Not nested.
  virtual bool changeTogether(const std::function<void()>& changes);

  // As `setItem`, with the item's checksum and its inline value; null: it has none.
  virtual void storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData);

  // As `changeTogether`, once this manifest is loaded, but throws what has failed. Here the changes are made one by
  // one.
  virtual void changeTogetherOrThrow(const std::function<void()>& changes);

  // By which items are dated and expire, in seconds since the Unix epoch: the time on the clock, as here, unless that
  // cannot be right.
  virtual std::int64_t currentDate();

  // Whether somebody has removed or replaced what the records are kept in.
  virtual bool hasMoved();

  // Whether nothing is found wrong with it when all of it is read. Here: true.
  virtual bool isSound();

  // Lets go of what the records are kept in, until the next operation.
  virtual void release();

  // The same until `resume` or `reload`: what would have to be read or written fails meanwhile.
  virtual void suspend();
  virtual void resume();

  // Reads all records again, from what is there by now. Those in memory are dropped.
  virtual void reload();

  // A weak pointer to this manifest as a T; empty when it is not owned by a shared pointer, or no T.
  template <class T> std::weak_ptr<T> weak_from_this() { return std::dynamic_pointer_cast<T>(weak_from_this().lock()); }
  using std::enable_shared_from_this<DiskCacheManifestInterface>::weak_from_this;
};

// Every item's record in memory, with the total of their sizes, and written through to a persistence at once. Access
// dates are the exception: they change with every read, so they wait in memory and are written every 120 seconds, when
// more than 512 of them have come together, and at destruction. After a write of dates that failed, which is one error
// line in the log, all wait for the next 120 seconds to pass. A killed process loses what waits; items then look less
// recently used than they were.
//
// Before it is loaded, single records are read from the persistence as they are asked for, and prunes do nothing. What
// the persistence throws passes through and leaves memory as it was. Sizes are unsigned 32-bit bytes and their total
// wraps; dates are seconds since the Unix epoch.
class CELLAR_EXPORT DiskCacheManifest : public DiskCacheManifestInterface {
 public:
  // A manifest over the database at `path`. Access dates are written on `executor`. `strategy` orders `pruneToSize`;
  // null: least recently used first. Without a metadata factory (null), metadata is written but not read back. Throws
  // `ManifestCorruptedException` for a damaged or foreign database, `ManifestPersistenceException` for one that cannot
  // be opened.
  static std::shared_ptr<DiskCacheManifest> createDiskCacheManifest(const std::string& path,
                                                                    std::shared_ptr<AsyncExecutor> executor,
                                                                    std::shared_ptr<ExtendedMetadataFactory> factory,
                                                                    std::shared_ptr<PruneStrategyBase> strategy);

  // Over any persistence. The manifest must be owned by a shared pointer.
  DiskCacheManifest(std::unique_ptr<ManifestPersistence> persistence, std::shared_ptr<AsyncExecutor> executor,
                    std::shared_ptr<PruneStrategyBase> strategy);

  // The same for a store of that durability: in a safe or synced one dates never go backwards, and a clock that cannot
  // be right is not believed.
  DiskCacheManifest(std::unique_ptr<ManifestPersistence> persistence, std::shared_ptr<AsyncExecutor> executor,
                    std::shared_ptr<PruneStrategyBase> strategy, Durability durability);
  ~DiskCacheManifest() override;
  DiskCacheManifest(const DiskCacheManifest&) = delete;
  DiskCacheManifest& operator=(const DiskCacheManifest&) = delete;

  // Starts again from nothing, loaded. The caller has removed the persistence's file before.
  void clear() override;

  // Reads every record; those that are in memory already are newer and stay. Starts the writing of access dates every
  // 120 seconds.
  void load() override;

  // Silences the persistence for good: what changes from now on is not written. Memory keeps working.
  void invalidate() override;

  // Replaces the record of the item's key, and drops its inline value.
  void setItem(const DiskCacheItem& item) override;

  // A copy of the record; null when there is none.
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) override;

  // Notes that the item was used now.
  void updateLastAccessDate(const std::string& key) override;

  // Empty when there is no record.
  std::optional<std::int32_t> getModificationDate(const std::string& key) override;

  void removeItem(const std::string& key) override;

  // The inline value; empty when the item has none.
  std::vector<unsigned char> getInlineData(const std::string& key) override;

  // Adds the value to the item's record and marks it as inline; size and dates stay as they are.
  void setInlineData(const std::string& key, const std::vector<unsigned char>& data) override;

  // Drops the value and the mark.
  void removeInlineData(const std::string& key) override;

  // The three prunes return the removed records in the order of removal; the caller deletes their files. One that fails
  // midway returns what it has removed so far; one that fails at its first item throws.

  // Removes items in the strategy's order until the total is at most `size`, but no more than `count`.
  std::vector<DiskCacheItem> pruneToSize(std::uint32_t size, std::uint32_t count) override;

  // Removes items last used strictly before `date`, oldest first, but no more than `count`. Of items stored in the same
  // second and not used since, those first that were stored first.
  std::vector<DiskCacheItem> pruneOldEntries(long date, std::uint32_t count) override;

  // Removes the item that was used least recently, as above; null when there is none.
  std::unique_ptr<DiskCacheItem> pruneOldestItem() override;

  // Throws `DiskCacheManifestException` before the manifest is loaded.
  std::vector<std::string> getAllKeys() override;

  // Does not tell when the record has to be read from disk and cannot be read.
  std::optional<ReplacedItem> replaceItem(const DiskCacheItem& item, bool withInlineData) override;

  // Only once it is loaded, and if the persistence can do it.
  bool changeTogether(const std::function<void()>& changes) override;

  void storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData) override;
  void changeTogetherOrThrow(const std::function<void()>& changes) override;
  std::int64_t currentDate() override;
  bool hasMoved() override;
  bool isSound() override;
  void release() override;
  void suspend() override;
  void resume() override;
  void reload() override;

  std::uint32_t size() override;   // total bytes of the items in memory
  std::uint32_t count() override;  // number of items in memory
  bool isLoaded() override;

 private:
  using ItemsLock = std::lock_guard<std::recursive_mutex>;  // of the items mutex
  using Next = std::function<const ManifestRecord*()>;

  std::int32_t now(const ItemsLock& lock);
  bool change(const std::function<void()>& changes);
  void noteFormer(const ItemsLock& lock, const std::string& key);
  void set(const ItemsLock& lock, const DiskCacheItem& item);
  std::optional<ReplacedItem> whatIsReplaced(const ItemsLock& lock, const std::string& key, bool withInlineData);
  const ManifestRecord* findOrRead(const ItemsLock& lock, const std::string& key);
  DiskCacheItem remove(const ItemsLock& lock, const ManifestRecord& record);
  template <class Order, class MayGo>
  std::vector<DiskCacheItem> prune(const ItemsLock& lock, Order order, std::uint32_t count, MayGo mayGo);
  template <class MayGo> void removeInOrder(const ItemsLock& lock, const ManifestRecord* record, const Next& next,
                                            std::uint32_t count, MayGo mayGo, std::vector<DiskCacheItem>& removed);

  void armFlushTimer();

  const std::unique_ptr<ManifestPersistence> persistence_;
  const std::shared_ptr<AsyncExecutor> executor_;

  std::mutex loadMutex_;             // keeps load, clear and removal apart; taken before itemsMutex_
  std::recursive_mutex itemsMutex_;  // guards the below; also held around changes that are made together
  const std::unique_ptr<ManifestRecords> records_;
  const std::unique_ptr<StoreTime> time_;  // null: the clock is believed
  bool loaded_ = false;
  bool invalidated_ = false;
  std::unique_ptr<ManifestUndo> undo_;              // of the changes that are being made together; null otherwise
  const std::unique_ptr<AccessDates> accessDates_;  // that wait to be written
  std::unique_ptr<AsyncTimer> flushTimer_;
};

}  // namespace velmora::mobile::xplat::cellar
