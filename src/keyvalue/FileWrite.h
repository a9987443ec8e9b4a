#pragma once

#include <cstdint>
#include <exception>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "DiskCacheItem.h"
#include "Future.h"
#include "PersistentKeyValueStore.h"
#include "keyvalue/StoreContext.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

class ValueWriter;

// A write of a file, on its way through the queues.
struct FileWrite : WritesInFlight::Write {
  using State = WritesInFlight::State;

  const std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;
  const PersistentKeyValueStore::Writer writer;
  const bool isGroupable;  // may be written before the writes in front of it are over
  const std::weak_ptr<ValueWriter> owner;
  const Token operation;
  Promise<void> promise;

  std::weak_ptr<FileWrite> next;  // the write right behind on the file queue; guarded by FileQueue

  // What has come of it, for the task of the file queue.
  unsigned int size = 0;
  bool leavesFile = false;             // that has to be deleted
  std::optional<std::uint32_t> total;  // of all items with this one, to report
  std::exception_ptr failure;

  FileWrite(std::string key_, std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata_,
            PersistentKeyValueStore::Writer writer_, bool isGroupable_, std::weak_ptr<ValueWriter> owner_,
            Token operation_)
      : Write(std::move(key_)),
        extendedMetadata(std::move(extendedMetadata_)),
        writer(std::move(writer_)),
        isGroupable(isGroupable_),
        owner(std::move(owner_)),
        operation(std::move(operation_)) {}
  FileWrite(const FileWrite&) = delete;
  FileWrite& operator=(const FileWrite&) = delete;

  // Rolls back a write that was dropped. Takes the store's mutex: a write must not be released by who holds it.
  ~FileWrite();

  // As the manifest has it from now on.
  DiskCacheItem record() const;
};

}  // namespace velmora::mobile::xplat::cellar
