#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "DiskCacheItem.h"
#include "DiskCacheManifest.h"
#include "Future.h"
#include "PersistentKeyValueStore.h"
#include "keyvalue/Chain.h"
#include "keyvalue/ManifestChange.h"
#include "keyvalue/StoreContext.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

class ValueWriter;

// A write of a file, on its way through the queues.
struct FileWrite final : WritesInFlight::Write,
                         ManifestChange,
                         Chain<FileWrite>::Link,
                         std::enable_shared_from_this<FileWrite> {
  using State = WritesInFlight::State;

  const std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;
  const PersistentKeyValueStore::Writer writer;
  const bool isGroupable;  // may be written before the writes in front of it are over
  const std::weak_ptr<ValueWriter> owner;
  const Token operation;
  Promise<void> promise;

  // What its provisional record has replaced, and what was evicted for it.
  std::optional<ReplacedItem> replaced;
  std::unique_ptr<DiskCacheItem> evicted;

  // What has come of it, for the task of the file queue.
  unsigned int size = 0;
  std::optional<DiskCacheItem> finalRecord;  // once the manifest has it
  bool leavesFile = false;                   // that has to be deleted
  std::optional<std::uint32_t> total;        // of all items with this one, to report

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
  ~FileWrite() override;

  // As the manifest has it from now on.
  DiskCacheItem record() const;

  // As a change, run by who holds the store.
  void runAlone() override;
  void change(const StoreLock& lock) override;
  void note(const StoreLock& lock) override;
  void finish() override;
};

}  // namespace velmora::mobile::xplat::cellar
