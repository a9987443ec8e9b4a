#include "keyvalue/ValueWriter.h"

#include <cstddef>
#include <exception>
#include <optional>
#include <utility>

#include "keyvalue/Clearing.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/GroupCommit.h"
#include "keyvalue/ItemRemover.h"
#include "keyvalue/Rollback.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// How far the files of writes may get ahead of their records: the first of them waits for the last.
constexpr std::size_t kMaxGroupSize = 32;
constexpr std::uint64_t kMaxGroupBytes = 1 << 20;

}  // namespace

Future<void> ValueWriter::store(const std::string& key,
                                std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata,
                                PersistentKeyValueStore::Writer writer, bool isGroupable) {
  const auto write = std::make_shared<FileWrite>(key, std::move(extendedMetadata), std::move(writer), isGroupable,
                                                 context_.weak(*this), context_.operation);
  return groupCommit_.submit(write);
}

void ValueWriter::begin(const std::shared_ptr<FileWrite>& write) {
  bool hasBegun = false;
  try {
    const StoreLock lock = context_.lock();
    context_.throwIfInvalid();
    hasBegun = beginRecord(lock, *write);
  } catch (...) {
    return write->promise.setException(std::current_exception());
  }
  if (hasBegun) return dispatch(write);
  write->promise.setValue();  // the store was purged instead
}

void ValueWriter::change(const StoreLock& lock, FileWrite& write) {
  write.evicted = remover_.takeOldestIfFull(lock);
  setProvisionalRecord(write);
}

void ValueWriter::note(const StoreLock& lock, FileWrite& write) {
  remover_.noteEvicted(lock, write.evicted.get());
  try {
    noteProvisionalRecord(lock, write);
  } catch (...) {
    rollback_.tryToRestore(lock, write.key, SettledValue::lost());
    throw;
  }
}

// A queue that takes no task refuses the write: its record is taken away again.
void ValueWriter::dispatch(const std::shared_ptr<FileWrite>& write) {
  if (write->failure != nullptr) return write->promise.setException(write->failure);
  try {
    handToFileQueue(write);
  } catch (...) {
    // The task of an earlier write may have it by now, though the queue has refused its own.
    if (!writes_.claim(*write)) return;
    rollback_.end(*write);  // before a removal behind it is told to be over
    write->promise.setException(std::current_exception());
  }
}

void ValueWriter::handToFileQueue(const std::shared_ptr<FileWrite>& write) {
  fileQueue_.dispatchWrite(write, [write] {
    if (const auto self = write->owner.lock()) {
      if (self->writes_.claim(*write)) self->commitGroup(write);
    } else if (!write->isClaimed()) {
      write->promise.setValue();
    }
  });
}

// False when the store had to be purged instead.
bool ValueWriter::beginRecord(const StoreLock& lock, FileWrite& write) {
  if (!remover_.makeRoom(lock) || !manifest_.recoveringFromFailedWrite(lock, [&] { setProvisionalRecord(write); })) {
    writes_.revoke(write.key);  // an earlier value must not take the place of this one
    return false;
  }
  noteProvisionalRecord(lock, write);
  return true;
}

void ValueWriter::setProvisionalRecord(FileWrite& write) {
  write.replaced = manifest_.get()->replaceItem(write.record(), true);
}

void ValueWriter::noteProvisionalRecord(const StoreLock& lock, FileWrite& write) {
  auto replaced = std::exchange(write.replaced, std::nullopt);
  auto settled = replaced ? SettledValue{std::move(replaced->item), std::move(replaced->inlineData)}
                          : SettledValue{nullptr, {}, true};
  const bool isDueToBeCleared = clearing_.noteStored(lock, write.key);
  if (isDueToBeCleared && !settled.isPlainMiss()) settled = SettledValue::lost();
  writes_.begin(write, std::move(settled));
}

// Writes a file, and then its record. To wait for the manifest would cost two switches between threads for each write:
// while others are busy with it, the files of the next writes are written instead, and then all their records at once.
void ValueWriter::commitGroup(const std::shared_ptr<FileWrite>& first) {
  const Token deletion = context_.fileDeletion;  // of what a writer that fails, or is revoked, leaves behind
  Group group;
  group.reserve(kMaxGroupSize);
  group.push_back(first);
  writeFile(*first);
  StoreLock lock = StoreLock::tryTo(context_.mutex);
  if (!lock.isHeld()) {
    extendGroup(group);
    lock.lock();
  }
  setFinalRecords(lock, group);
  for (const auto& write : group) recordWritten(lock, *write);
  for (const auto& write : group) reportTotal(*write);  // together, so that the work queue's thread is woken once
  lock.unlock();
  deliver(group);
}

void ValueWriter::extendGroup(Group& group) {
  std::uint64_t bytes = group.back()->size;
  while (group.size() < kMaxGroupSize && bytes < kMaxGroupBytes) {
    auto write = fileQueue_.next(group);
    if (write == nullptr || !writes_.claim(*write)) return;
    writeFile(*write);
    bytes += write->size;
    group.push_back(std::move(write));
  }
}

void ValueWriter::deliver(const Group& group) {
  std::exception_ptr failure;  // of a callback: the executor's affair, but not the other writes'
  for (const auto& write : group) {
    if (write->leavesFile) files_.deleteLeftover(write->key);
    try {
      write->failure == nullptr ? write->promise.setValue() : write->promise.setException(write->failure);
    } catch (...) {
      failure = std::current_exception();
    }
  }
  if (failure != nullptr) std::rethrow_exception(failure);
}

void ValueWriter::writeFile(FileWrite& write) {
  try {
    context_.throwIfClosed();
    if (write.state == FileWrite::State::Writing) write.size = runWriter(write);
  } catch (...) {
    write.failure = std::current_exception();
  }
}

unsigned int ValueWriter::runWriter(FileWrite& write) {
  try {
    return write.writer(files_.pathOf(write.key));
  } catch (...) {
    {
      const StoreLock lock = context_.lock();
      writes_.settle(write.key, SettledValue::lost());
    }
    rollback_.end(write);
    files_.deleteLeftover(write.key);
    throw;
  }
}

// Those of the writes that have come about, in one transaction. Where that fails, `recordWritten` sets them one by one.
void ValueWriter::setFinalRecords(const StoreLock& lock, const Group& group) {
  Group written;
  for (const auto& write : group) {
    const bool isWritten = write->failure == nullptr && write->state == FileWrite::State::Writing && write->hasRecord;
    if (isWritten) written.push_back(write);
  }
  if (written.size() < 2) return;
  const auto setAll = [&] {
    for (const auto& write : written) {
      setFinalRecord(*write);
      write->total = manifest_.totalToReport();
    }
  };
  if (manifest_.changeTogether(lock, setAll)) return;
  for (const auto& write : written) {
    write->finalRecord.reset();
    write->total.reset();
  }
}

void ValueWriter::setFinalRecord(FileWrite& write) {
  DiskCacheItem record = write.record();
  manifest_.get()->setItem(record);
  write.finalRecord = std::move(record);
}

void ValueWriter::recordWritten(const StoreLock& lock, FileWrite& write) {
  if (write.failure != nullptr) return;
  if (write.state == FileWrite::State::Discarded) {
    write.leavesFile = true;
    write.total.reset();
    const auto settled = writes_.drop(write);
    if (settled && settled->isReplaced) rollback_.discardRecord(lock, write.key, false);
    return;
  }
  const bool othersAreInFlight = writes_.end(write);
  try {
    if (!write.finalRecord) setFinalRecordAlone(lock, write);
  } catch (...) {
    write.failure = std::current_exception();
    write.leavesFile = true;
    rollback_.discardRecord(lock, write.key, othersAreInFlight);
    return;
  }
  if (!write.finalRecord) return;
  StoreContext::count(context_.stores);
  if (!othersAreInFlight) return;
  SettledValue settled;
  settled.record = std::make_unique<DiskCacheItem>(std::move(*write.finalRecord));
  writes_.settle(write.key, std::move(settled));
}

// The store may have to be purged instead.
void ValueWriter::setFinalRecordAlone(const StoreLock& lock, FileWrite& write) {
  manifest_.recoveringFromFailedWrite(lock, [&] {
    if (!write.hasRecord) remover_.evictOldestIfFull(lock);
    setFinalRecord(write);
  });
  noteTotal(write);
}

void ValueWriter::noteTotal(FileWrite& write) {
  try {
    write.total = manifest_.totalToReport();
  } catch (...) {
    write.failure = std::current_exception();
  }
}

void ValueWriter::reportTotal(FileWrite& write) {
  try {
    if (write.total) manifest_.dispatchReport(*write.total);
  } catch (...) {
    write.failure = std::current_exception();
  }
}

void ValueWriter::rollBack(FileWrite& write) { rollback_.end(write); }

}  // namespace velmora::mobile::xplat::cellar
