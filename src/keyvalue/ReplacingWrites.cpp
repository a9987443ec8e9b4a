#include "keyvalue/ReplacingWrites.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <exception>
#include <optional>
#include <utility>

#include "LarderException.h"
#include "base/Checksum.h"
#include "keyvalue/Clearing.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/GroupCommit.h"
#include "keyvalue/ItemRemover.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/VersionedFiles.h"
#include "keyvalue/WorkQueue.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// How many files share one sync of their directory, and how far they may get ahead of their records.
constexpr std::size_t kMaxGroupSize = 32;
constexpr std::uint64_t kMaxGroupBytes = 1 << 20;

// Whether a record that could not be written may have been written nevertheless.
bool mayBeInLog(const std::exception_ptr& failure) {
  constexpr std::array<int, 4> kBeforeWriting = {5, 6, 8,
                                                 14};  // SQLite's codes for locked, read-only, cannot be opened
  try {
    std::rethrow_exception(failure);
  } catch (const ManifestPersistenceException& error) {
    return std::find(kBeforeWriting.begin(), kBeforeWriting.end(), error.code()) == kBeforeWriting.end();
  } catch (...) {
    return false;
  }
}

}  // namespace

// A write, on its way through the queues.
struct ReplacingWrites::Write final : ManifestChange, Chain<Write>::Link, std::enable_shared_from_this<Write> {
  const std::string key;
  const std::vector<unsigned char> value;
  const PersistentKeyValueStore::Writer writer;  // empty: the value is above
  const Metadata metadata;
  const std::weak_ptr<ReplacingWrites> owner;
  const Token operation;
  Promise<void> promise;
  std::shared_ptr<KeysAhead::Passage> passage;  // until it is on the work queue

  bool isWritten = false;   // or has failed; on the file queue
  bool isRecorded = false;  // for good
  std::string filename;     // of the new file; empty: there is none
  std::uint32_t size = 0;
  std::uint32_t checksum = 0;

  std::unique_ptr<DiskCacheItem> evicted;    // for it
  std::unique_ptr<DiskCacheItem> replaced;   // by it
  std::optional<std::uint32_t> total;        // of all items with this one, to report
  std::vector<std::string> filesToDelete{};  // paths
  bool mayBeInLog = false;                   // the record, though it is not recorded

  Write(const std::string& key_, std::vector<unsigned char> value_, PersistentKeyValueStore::Writer writer_,
        Metadata metadata_, std::weak_ptr<ReplacingWrites> owner_, Token operation_)
      : key(key_),
        value(std::move(value_)),
        writer(std::move(writer_)),
        metadata(std::move(metadata_)),
        owner(std::move(owner_)),
        operation(std::move(operation_)) {}

  Write(const Write&) = delete;
  Write& operator=(const Write&) = delete;

  // Gives up the file of one that a queue has refused or dropped.
  ~Write() override {
    if (filename.empty() || isRecorded) return;
    if (const auto self = owner.lock()) self->giveUpFile(*this);
  }

  std::size_t bytes() const override { return filename.empty() ? value.size() : 0; }

  // Whoever runs a write holds the store.
  void runAlone() override { owner.lock()->replaceAlone(*this); }
  void change(const StoreLock& lock) override {
    mayBeInLog = true;  // should the commit fail
    owner.lock()->replaceRecord(lock, *this);
  }
  void note(const StoreLock& lock) override { owner.lock()->noteReplaced(lock, *this); }
  void finish() override { owner.lock()->fulfil(*this); }
};

Future<void> ReplacingWrites::store(const std::string& key, const std::vector<unsigned char>& value,
                                    Metadata metadata) {
  const auto write =
      std::make_shared<Write>(key, value, nullptr, std::move(metadata), context_.weak(*this), context_.operation);
  if (!context_.options.inlineData) return begin(write);
  write->size = static_cast<std::uint32_t>(value.size());
  write->checksum = Checksum::of(key, value);
  return groupCommit_.submit(write);
}

Future<void> ReplacingWrites::store(const std::string& key, PersistentKeyValueStore::Writer writer, Metadata metadata) {
  return begin(std::make_shared<Write>(key, std::vector<unsigned char>(), std::move(writer), std::move(metadata),
                                       context_.weak(*this), context_.operation));
}

Future<void> ReplacingWrites::begin(const std::shared_ptr<Write>& write) {
  Future<void> future = write->promise.getFuture();
  try {
    context_.throwIfInvalid();
    write->passage = workQueue_.enterBehind(KeyRange(write->key));
    writes_.append(write);
    fileQueue_.dispatch([write] {
      if (const auto self = write->owner.lock()) return self->writeFiles(write);
      write->promise.setException(StoreContext::storeIsGone());
    });
    writes_.cutUnlessLast(write);
  } catch (...) {
    write->promise.setException(std::current_exception());
  }
  return future;
}

// The task of a write on the file queue. In a synced store it also writes the files of those behind it, because they
// are synced together; each is handed to the work queue by its own task, in its turn.
void ReplacingWrites::writeFiles(const std::shared_ptr<Write>& first) {
  if (!first->isWritten) {
    const Writes writes = takeBehind(first);
    for (const auto& write : writes) writeFile(*write);
    if (context_.options.durability == Durability::Synced) sync(writes);
  }
  const auto passage = std::move(first->passage);
  if (first->failure == nullptr) return groupCommit_.submitHere(first);
  giveUpFile(*first);
  first->promise.setException(first->failure);
}

ReplacingWrites::Writes ReplacingWrites::takeBehind(const std::shared_ptr<Write>& first) {
  Writes writes{first};
  if (context_.options.durability != Durability::Synced || first->writer) return writes;
  std::uint64_t bytes = first->value.size();
  while (writes.size() < kMaxGroupSize && bytes < kMaxGroupBytes) {
    auto next = writes_.after(*writes.back());
    if (next == nullptr || next->isWritten || next->writer) break;
    bytes += next->value.size();
    writes.push_back(std::move(next));
  }
  return writes;
}

void ReplacingWrites::writeFile(Write& write) {
  write.isWritten = true;
  try {
    context_.throwIfInvalid();
    manifest_.get();  // a file without any manifest would look, after a kill, as if the manifest had been lost
    auto written = write.writer ? versions_.write(write.key, write.writer) : versions_.write(write.key, write.value);
    write.filename = std::move(written.name);
    write.size = written.size;
    write.checksum = written.checksum;
  } catch (...) {
    write.failure = std::current_exception();
  }
}

// A sync that has failed is not tried again: the system may have given up the data, and say that all is well.
void ReplacingWrites::sync(const Writes& writes) {
  const auto ofEach = [&](const auto& work) {
    for (const auto& write : writes) {
      if (write->failure == nullptr) work(*write);
    }
  };
  if (writes.size() > 1) ofEach([&](const Write& write) { versions_.beginSync(write.filename); });
  ofEach([&](Write& write) {
    try {
      versions_.sync(write.filename);
    } catch (...) {
      write.failure = std::current_exception();
    }
  });
  try {
    versions_.syncDirectory();
  } catch (...) {
    ofEach([failure = std::current_exception()](Write& write) { write.failure = failure; });
  }
}

void ReplacingWrites::replaceAlone(Write& write) {
  try {
    const StoreLock lock = context_.lock();
    context_.throwIfInvalid();
    manifest_.recoveringFromFailedWrite(lock, [&] {
      manifest_.prepareChange(lock);
      const auto manifest = manifest_.get();
      if (!manifest->isLoaded()) manifest->load();
      write.evicted.reset();
      if (remover_.isFull(lock)) {
        manifest->changeTogetherOrThrow([&] { replaceRecord(lock, write); });
      } else {
        replaceRecord(lock, write);
      }
    });
    noteReplaced(lock, write);
  } catch (...) {
    write.failure = std::current_exception();
  }
  fulfil(write);
}

void ReplacingWrites::replaceRecord(const StoreLock& lock, Write& write) {
  const auto manifest = manifest_.get();
  write.evicted = remover_.takeOldestIfFull(lock);
  write.replaced = manifest->getItem(write.key);
  const auto date = static_cast<std::int32_t>(manifest->currentDate());
  const bool isInline = context_.options.inlineData;
  DiskCacheItem item(write.key, isInline ? write.key : write.filename, write.size, isInline, date, date,
                     write.metadata);
  item.checksum = write.checksum;
  manifest->storeItem(item, isInline ? &write.value : nullptr);
  write.total = manifest_.totalToReport();
}

void ReplacingWrites::noteReplaced(const StoreLock& lock, Write& write) {
  write.isRecorded = true;
  remover_.noteEvicted(lock, write.evicted.get());
  StoreContext::count(context_.stores);
  clearing_.noteStored(lock, write.key);
  if (write.replaced != nullptr) {
    const bool isItsOwn = write.replaced->filename == write.filename;  // of a record whose file had been removed
    auto path = isItsOwn ? std::nullopt : files_.fileOf(*write.replaced);
    if (path) write.filesToDelete.push_back(std::move(*path));
  }
  // The log of the manifest has gone on since: what had failed before is not in it.
  for (std::string& path : doubtfulFiles_) write.filesToDelete.push_back(std::move(path));
  doubtfulFiles_.clear();
}

void ReplacingWrites::fulfil(Write& write) {
  if (write.failure != nullptr) {
    write.mayBeInLog = write.mayBeInLog || mayBeInLog(write.failure);
    giveUpFile(write);
    return write.promise.setException(write.failure);
  }
  deleteFiles(std::move(write.filesToDelete));
  try {
    if (write.total) manifest_.dispatchReport(*write.total);
  } catch (const std::exception& error) {  // the value is stored all the same
    errorLine(__LINE__).stream() << "Store \"" << context_.options.name
                                 << "\" could not report its size: " << error.what();
  }
  write.promise.setValue();
}

// When writing the manifest has failed, the row may be in its log all the same, and be found there at the next start:
// the file stays until the log has gone on.
void ReplacingWrites::giveUpFile(Write& write) {
  if (write.filename.empty() || write.isRecorded) return;
  const std::string path = files_.pathOf(std::exchange(write.filename, {}));
  if (!write.mayBeInLog) return deleteFiles({path});
  const StoreLock lock = context_.lock();
  doubtfulFiles_.push_back(path);
}

// Behind the fetches that read them. What is not deleted is removed at the next start.
void ReplacingWrites::deleteFiles(std::vector<std::string> paths) {
  if (paths.empty()) return;
  try {
    fileQueue_.dispatch([weakThis = context_.weak(*this), deletion = context_.fileDeletion, paths = std::move(paths)] {
      const auto self = weakThis.lock();
      if (self != nullptr && !self->context_.isClosed) self->files_.deleteAll(paths);
    });
  } catch (const std::exception&) {  // the queue takes no tasks
  }
}

}  // namespace velmora::mobile::xplat::cellar
