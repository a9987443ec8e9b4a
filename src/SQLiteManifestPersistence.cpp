#include "SQLiteManifestPersistence.h"

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <ios>
#include <system_error>
#include <type_traits>
#include <utility>

#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "base/FunctionReference.h"
#include "base/ManifestErrors.h"
#include "base/Schema.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// SQLite's number for writing through a connection that it could open for reading only.
constexpr int kReadOnly = 8;
// And for a statement that was not carried out because another one had failed.
constexpr int kAbort = 4;
// And for a database that another connection has locked.
constexpr int kBusy = 5;
constexpr int kTooBig = 18;

constexpr const char* beForbearing = "PRAGMA busy_timeout = 1000";

// Links are followed, as SQLite does. True when it cannot be told.
bool isThere(const std::string& path) {
  std::error_code error;
  const auto size = std::filesystem::file_size(path, error);
  return error ? error != std::errc::no_such_file_or_directory && error != std::errc::not_a_directory : size > 0;
}

// By way of the signed 64-bit number, so that a date before the epoch keeps its sign on disk.
void bindDate(SQLiteStoreCursor& cursor, int index, std::int64_t date) {
  cursor.bind<unsigned long long>(index, static_cast<unsigned long long>(date));
}

// The first seven parameters.
void bindItem(SQLiteStoreCursor& cursor, const DiskCacheItem& item) {
  cursor.bind<std::string>(1, item.key);
  cursor.bind<std::string>(2, item.filename);
  cursor.bind<unsigned long long>(3, item.size);
  cursor.bind<bool>(4, item.hasInlineData);
  bindDate(cursor, 5, item.modificationDate);
  bindDate(cursor, 6, item.lastAccessDate);
  if (item.extendedMetadata != nullptr) {
    cursor.bind<std::vector<unsigned char>>(7, item.extendedMetadata->serialize());
  }
}

std::int32_t dateIn(SQLiteStoreCursor& cursor, int column) {
  return static_cast<std::int32_t>(cursor.get<unsigned long long>(column));
}

}  // namespace

SQLiteManifestPersistence::SQLiteManifestPersistence(const std::string& path,
                                                     std::shared_ptr<ExtendedMetadataFactory> extendedMetadataFactory,
                                                     SQLiteStoreFactory storeFactory, Durability durability)
    : path_(path),
      extendedMetadataFactory_(std::move(extendedMetadataFactory)),
      storeFactory_(std::move(storeFactory)),
      durability_(durability) {
  translatingManifestErrors([this] {
    store_ = openStore();
    initializeDatabase(*store_);
  });
}

SQLiteManifestPersistence::~SQLiteManifestPersistence() = default;

std::unique_ptr<SQLiteStore> SQLiteManifestPersistence::openStore() const {
  if (storeFactory_) return storeFactory_(path_);
  return SQLiteStore::createEnsuredSQLiteStore(path_, nullptr);
}

void SQLiteManifestPersistence::initializeDatabase(SQLiteStore& store) const {
  if (hasChecksums()) store.exec(beForbearing);
  initializeManifestTable(store);
  if (hasChecksums()) addChecksums(store);
  if (durability_ == Durability::Synced) store.exec("PRAGMA synchronous = FULL");
}

// Does nothing when the persistence has been invalidated, and returns what is empty then.
template <class Operation> auto SQLiteManifestPersistence::perform(const Operation& operation) const {
  if constexpr (std::is_void_v<decltype(operation())>) {
    performUnlessInvalidated(operation);
  } else {
    decltype(operation()) result{};
    performUnlessInvalidated([&] { result = operation(); });
    return result;
  }
}

void SQLiteManifestPersistence::performUnlessInvalidated(FunctionReference operation) const {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  if (invalidated_) return;
  translatingManifestErrors([&] {
    prepare();
    try {
      operation();
      setPatience(true);
    } catch (const SQLiteStoreException& exception) {
      handleFailure(exception);
      throw;
    }
  });
}

void SQLiteManifestPersistence::prepare() const {
  if (transaction_ == Transaction::Failed) throw SQLiteStoreException("The transaction has failed.", kAbort);
  if (isSuspended_) throw SQLiteStoreException("The manifest is being replaced.", kBusy);
  if (!mustReopen_) return;
  // To SQLite a file that is missing, or has no bytes, is an empty database.
  if (hasChecksums() && !isThere(path_)) throw SQLiteStoreCorruptedException("The manifest is missing.", -1);
  reopen();
}

// Waits for another connection's lock again as soon as one was had.
void SQLiteManifestPersistence::setPatience(bool isPatient) const {
  if (!hasChecksums() || waitsForLocks_ == isPatient || store_ == nullptr) return;
  store_->exec(isPatient ? beForbearing : "PRAGMA busy_timeout = 0");
  waitsForLocks_ = isPatient;
}

void SQLiteManifestPersistence::handleFailure(const SQLiteStoreException& exception) const {
  if (exception.code() == kTooBig && hasChecksums()) throwIfDamaged(exception);
  if (transaction_ == Transaction::Open) transaction_ = Transaction::Failed;
  if (exception.code() == kBusy) setPatience(false);
  if (exception.code() == kReadOnly) handleReadOnly(exception);
}

// A row that says of itself that it is larger than any can be, unless somebody has stored such a value.
void SQLiteManifestPersistence::throwIfDamaged(const SQLiteStoreException& exception) const {
  bool isDamaged = false;
  try {
    isDamaged = !isIntact();
  } catch (const SQLiteStoreException&) {
    isDamaged = true;
  }
  if (isDamaged) throw SQLiteStoreCorruptedException(exception.description(), exception.code());
}

bool SQLiteManifestPersistence::isIntact() const {
  SQLiteStoreCursor cursor = store_->cursor("PRAGMA integrity_check(1);");
  return cursor.next() && cursor.get<std::string>(0) == "ok";
}

// Either the file could not be opened for writing when it was opened, or it says itself that it must never be written:
// its format's version for writers, a byte of its header, is not one that there is.
void SQLiteManifestPersistence::handleReadOnly(const SQLiteStoreException& exception) const {
  constexpr std::streamoff kWriterVersionOffset = 18;
  constexpr int kLatestWriterVersion = 2;
  constexpr int kFoundByOurselves = -1;
  std::ifstream file(path_, std::ios::binary);
  if (file.seekg(kWriterVersionOffset) && file.get() > kLatestWriterVersion) {
    throw SQLiteStoreCorruptedException(exception.description(), kFoundByOurselves);
  }
  mustReopen_ = true;
}

// The old connection takes SQLite's companion files along when it closes, so the new one must not have made its own by
// then: it is opened before, because opening can fail, but used only afterwards.
void SQLiteManifestPersistence::reopen() const {
  store_ = openStore();
  waitsForLocks_ = true;
  initializeDatabase(*store_);
  mustReopen_ = false;
}

void SQLiteManifestPersistence::release() {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  if (invalidated_) return;
  store_.reset();
  mustReopen_ = true;
}

void SQLiteManifestPersistence::suspend() {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  release();
  isSuspended_ = true;
}

void SQLiteManifestPersistence::resume() {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  isSuspended_ = false;
}

bool SQLiteManifestPersistence::hasMoved() const {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  if (invalidated_) return false;
  return store_ == nullptr ? !isThere(path_) : store_->hasMoved();
}

bool SQLiteManifestPersistence::isSound() const {
  try {
    return perform([this] { return isIntact(); });
  } catch (const ManifestCorruptedException&) {
    return false;
  }
}

std::string SQLiteManifestPersistence::selectItems(const char* condition) const {
  std::string statement =
      "SELECT  key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  extended_manifest ";
  if (hasChecksums()) statement += ",  checksum,  checksum IS NOT NULL ";
  return statement + "FROM LarderManifest" + condition;
}

void SQLiteManifestPersistence::clearItems() {
  perform([this] { reopen(); });
}

void SQLiteManifestPersistence::setItem(const DiskCacheItem& item) {
  perform([&] {
    SQLiteStoreCursor cursor = store_->cursor(
        "INSERT OR REPLACE INTO LarderManifest("
        "key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  extended_manifest )"
        "VALUES  (?1, ?2, ?3, ?4, ?5, ?6, ?7);");
    bindItem(cursor, item);
    cursor.next();
  });
}

void SQLiteManifestPersistence::storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData) {
  if (!hasChecksums()) return ManifestPersistence::storeItem(item, inlineData);
  perform([&] {
    SQLiteStoreCursor cursor = store_->cursor(
        "INSERT OR REPLACE INTO LarderManifest("
        "key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  extended_manifest,  "
        "inline_data,  checksum )"
        "VALUES  (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9);");
    bindItem(cursor, item);
    if (inlineData != nullptr) cursor.bind<std::vector<unsigned char>>(8, *inlineData);
    if (item.checksum) cursor.bind<unsigned long long>(9, inChecksumColumn(*item.checksum));
    cursor.next();
  });
}

std::unique_ptr<DiskCacheItem> SQLiteManifestPersistence::getItem(const std::string& key) const {
  return perform([&] {
    SQLiteStoreCursor cursor = store_->cursor(selectItems(" WHERE key = ?1;"));
    cursor.bind<std::string>(1, key);
    return cursor.next() ? itemInRowOf(cursor) : nullptr;
  });
}

void SQLiteManifestPersistence::removeItem(const std::string& key) {
  perform([&] {
    SQLiteStoreCursor cursor = store_->cursor("DELETE FROM LarderManifest WHERE key = ?1;");
    cursor.bind<std::string>(1, key);
    cursor.next();
  });
}

void SQLiteManifestPersistence::updateLastAccessDate(const std::string& key, long date) {
  perform([&] {
    SQLiteStoreCursor cursor = store_->cursor("UPDATE LarderManifest SET last_access_date = ?2 WHERE key = ?1;");
    cursor.bind<std::string>(1, key);
    bindDate(cursor, 2, date);
    cursor.next();
  });
}

std::vector<std::unique_ptr<DiskCacheItem>> SQLiteManifestPersistence::getItemsLastAccessedBefore(long date) const {
  return perform([&] {
    SQLiteStoreCursor cursor = store_->cursor(selectItems(" WHERE last_access_date < ?1;"));
    bindDate(cursor, 1, date);
    return itemsOf(cursor);
  });
}

void SQLiteManifestPersistence::invalidate() {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  store_.reset();
  invalidated_ = true;
}

std::vector<std::unique_ptr<DiskCacheItem>> SQLiteManifestPersistence::getAllItems() const {
  return perform([this] {
    SQLiteStoreCursor cursor = store_->cursor(selectItems(";"));
    return itemsOf(cursor);
  });
}

std::vector<unsigned char> SQLiteManifestPersistence::getInlineData(const std::string& key) const {
  return perform([&] {
    SQLiteStoreCursor cursor =
        store_->cursor("SELECT  inline_data FROM  LarderManifest WHERE  has_inline_data IS 1 AND  key = ?1");
    cursor.bind<std::string>(1, key);
    return cursor.next() ? cursor.get<std::vector<unsigned char>>(0) : std::vector<unsigned char>();
  });
}

void SQLiteManifestPersistence::setInlineData(const std::string& key, const std::vector<unsigned char>& data) {
  perform([&] {
    SQLiteStoreCursor cursor =
        store_->cursor("UPDATE   LarderManifest SET   has_inline_data = 1,  inline_data = ?2 WHERE   key = ?1;");
    cursor.bind<std::string>(1, key);
    cursor.bind<std::vector<unsigned char>>(2, data);
    cursor.next();
  });
}

void SQLiteManifestPersistence::removeInlineData(const std::string& key) {
  perform([&] {
    SQLiteStoreCursor cursor =
        store_->cursor("UPDATE   LarderManifest SET   has_inline_data = 0,   inline_data = NULL WHERE   key = ?1;");
    cursor.bind<std::string>(1, key);
    cursor.next();
  });
}

bool SQLiteManifestPersistence::performTogether(const std::function<void()>& operations) {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  const auto run = [this](const char* statement) {
    return perform([&] {
      store_->cursor(statement).next();
      return true;
    });
  };
  // At once for writing: one that begins by reading could find later that another connection has written meanwhile.
  if (!run("BEGIN IMMEDIATE;")) return false;
  transaction_ = Transaction::Open;
  try {
    operations();
    if (!run("COMMIT;")) throw ManifestPersistenceException("The transaction has lost its database.", kAbort);
  } catch (...) {
    rollBack();
    throw;
  }
  transaction_ = Transaction::None;
  return true;
}

// SQLite has ended the transaction itself after most failures of the medium; then there is nothing to roll back.
void SQLiteManifestPersistence::rollBack() noexcept {
  constexpr int kNoTransaction = 1;
  transaction_ = Transaction::None;
  if (store_ == nullptr) return;
  try {
    store_->exec("ROLLBACK;");
  } catch (const SQLiteStoreException& exception) {
    if (exception.code() != kNoTransaction) mustReopen_ = true;
  } catch (...) {
    mustReopen_ = true;
  }
}

void SQLiteManifestPersistence::setSize(const std::string& key, std::uint32_t size) {
  perform([&] {
    SQLiteStoreCursor cursor = store_->cursor("UPDATE LarderManifest SET size = ?2 WHERE key = ?1;");
    cursor.bind<std::string>(1, key);
    cursor.bind<unsigned long long>(2, size);
    cursor.next();
  });
}

std::unique_ptr<DiskCacheItem> SQLiteManifestPersistence::itemInRowOf(SQLiteStoreCursor& cursor) const {
  auto item = std::make_unique<DiskCacheItem>();
  item->key = cursor.get<std::string>(0);
  item->filename = cursor.get<std::string>(1);
  item->size = static_cast<std::uint32_t>(cursor.get<unsigned long long>(2));
  item->hasInlineData = cursor.get<bool>(3);
  item->modificationDate = dateIn(cursor, 4);
  item->lastAccessDate = dateIn(cursor, 5);
  if (extendedMetadataFactory_ != nullptr) {
    item->extendedMetadata = extendedMetadataFactory_->getExtendedMetadata();
    item->extendedMetadata->deserialize(cursor.get<std::vector<unsigned char>>(6));
  }
  if (hasChecksums() && cursor.get<bool>(8)) item->checksum = fromChecksumColumn(cursor.get<unsigned long long>(7));
  return item;
}

std::vector<std::unique_ptr<DiskCacheItem>> SQLiteManifestPersistence::itemsOf(SQLiteStoreCursor& cursor) const {
  std::vector<std::unique_ptr<DiskCacheItem>> items;
  while (cursor.next()) items.push_back(itemInRowOf(cursor));
  return items;
}

}  // namespace velmora::mobile::xplat::cellar
