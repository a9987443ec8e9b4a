#pragma once

// The manifest on disk: an SQLite database in the store's directory (`kManifestFileName`, with SQLite's own "-wal" and
// "-shm" beside it while it is open) with one table.
//
//   LarderManifest
//   +-------------------+---------+------------------------------------------------------------------+
//   | key               | TEXT    | primary key                                                      |
//   | filename          | TEXT    | the item's file within the store's directory                     |
//   | size              | INTEGER | bytes                                                            |
//   | has_inline_data   | BOOLEAN | 1 when the value lies in inline_data, 0 when it lies in the file |
//   | inline_data       | BLOB    | the value, or NULL                                               |
//   | modification_date | INTEGER | seconds since the Unix epoch                                     |
//   | last_access_date  | INTEGER | seconds since the Unix epoch; index last_access_date_idx         |
//   | extended_manifest | BLOB    | serialised extended metadata, or NULL                            |
//   +-------------------+---------+------------------------------------------------------------------+
//
// The first version of the table ended with last_access_date: opening such a database adds the last column and keeps
// every row. A safe store adds one more behind all others, which other stores leave alone:
//
//   | checksum          | INTEGER | of key and value, or NULL: the value is not checked                    |
//
// A table whose columns differ in name, type or order in any other way is foreign and is refused, and so is
// one that calls functions: in a check, a default value, a generated column or an index. Columns beyond these are left
// alone; triggers and views are not run.

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Durability.h"
#include "Export.h"
#include "ManifestPersistence.h"
#include "SQLiteStore.h"

namespace velmora::mobile::xplat::cellar {

class ExtendedMetadataFactory;
class FunctionReference;
class SQLiteStoreException;

inline constexpr char kManifestFileName[] = "manifest_v1.sqlite";

// The manifest in an SQLite database. What an operation has written survives the death of the process; a power failure
// may take the last writes with it, but never damages the rest. On a full disk an operation throws and changes nothing.
// SQLite's description and code are found unchanged in the exceptions; a foreign table is ManifestCorruptedException
// "Invalid schema." with code -1. Nothing is repaired, deleted or tried again here, but for the opening of the
// database.
class CELLAR_EXPORT SQLiteManifestPersistence : public ManifestPersistence {
 public:
  // Opens the database at `path`, creating file and table when they are missing. Without a metadata factory, metadata
  // is written but not read back. An empty store factory means SQLiteStore::createEnsuredSQLiteStore, which tries for
  // about 120 ms. Throws what every operation throws. That of a safe or synced store has checksums and waits for
  // another connection's lock, about a second at most; that of a synced one syncs each change.
  SQLiteManifestPersistence(const std::string& path, std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
                            SQLiteStoreFactory storeFactory, Durability durability = Durability::Relaxed);
  ~SQLiteManifestPersistence() override;

  SQLiteManifestPersistence(const SQLiteManifestPersistence&) = delete;
  SQLiteManifestPersistence& operator=(const SQLiteManifestPersistence&) = delete;

  // Reopens the database and closes the old connection. When opening fails, the old one remains in use. Deletes no
  // row: the table is empty afterwards only if the caller removed the database file before.
  void clearItems() override;
  void setItem(const DiskCacheItem& item) override;
  std::unique_ptr<DiskCacheItem> getItem(const std::string& key) const override;
  void removeItem(const std::string& key) override;
  void updateLastAccessDate(const std::string& key, long date) override;
  std::vector<std::unique_ptr<DiskCacheItem>> getItemsLastAccessedBefore(long date) const override;
  void invalidate() override;
  std::vector<std::unique_ptr<DiskCacheItem>> getAllItems() const override;
  std::vector<unsigned char> getInlineData(const std::string& key) const override;
  void setInlineData(const std::string& key, const std::vector<unsigned char>& data) override;
  void removeInlineData(const std::string& key) override;

  // In a transaction.
  bool performTogether(const std::function<void()>& operations) override;

  // In one statement. The checksum is kept by that of a safe or synced store.
  void storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData) override;

  bool hasMoved() const override;
  bool isSound() const override;

  // Closes the database.
  void release() override;
  void suspend() override;
  void resume() override;

  // Corrects the size of a record that is there already; everything else of it stays, an inline value too.
  void setSize(const std::string& key, std::uint32_t size);

 private:
  template <class Operation> auto perform(const Operation& operation) const;
  void performUnlessInvalidated(FunctionReference operation) const;
  void setPatience(bool isPatient) const;

  bool hasChecksums() const { return durability_ != Durability::Relaxed; }
  std::string selectItems(const char* condition) const;
  std::unique_ptr<SQLiteStore> openStore() const;
  void initializeDatabase(SQLiteStore& store) const;
  void prepare() const;
  void handleFailure(const SQLiteStoreException& exception) const;
  void throwIfDamaged(const SQLiteStoreException& exception) const;
  bool isIntact() const;
  void reopen() const;
  void rollBack() noexcept;
  void handleReadOnly(const SQLiteStoreException& exception) const;
  std::unique_ptr<DiskCacheItem> itemInRowOf(SQLiteStoreCursor& cursor) const;
  std::vector<std::unique_ptr<DiskCacheItem>> itemsOf(SQLiteStoreCursor& cursor) const;

  const std::string path_;
  // Held by every operation from its beginning to its end, and around those that are performed together; guards what
  // follows.
  mutable std::recursive_mutex mutex_;
  bool invalidated_ = false;
  mutable std::unique_ptr<SQLiteStore> store_;  // null once invalidated
  // The next operation opens the database again: SQLite opens what may not be written just now for reading only, and a
  // transaction that cannot be rolled back ends with its connection.
  mutable bool mustReopen_ = false;
  bool isSuspended_ = false;
  mutable bool waitsForLocks_ = true;  // not again for one that was waited for in vain
  // Whether operations are being performed together, and one of them has failed: SQLite may have ended the transaction.
  enum class Transaction : std::uint8_t { None, Open, Failed };
  mutable Transaction transaction_ = Transaction::None;
  const std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory_;
  const SQLiteStoreFactory storeFactory_;
  const Durability durability_;
};

}  // namespace velmora::mobile::xplat::cellar
