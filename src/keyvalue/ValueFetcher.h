#pragma once

#include <cstdint>
#include <exception>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Future.h"
#include "PersistentKeyValueStore.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class FileQueue;
class StoreManifest;
class ValueFiles;
class WorkQueue;
class WritesInFlight;

// Looks items up, on the work queue, and reads their values, on the file queue.
class ValueFetcher {
 public:
  using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;
  using Loader = PersistentKeyValueStore::Loader;

  ValueFetcher(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, WorkQueue& workQueue,
               FileQueue& fileQueue, ValueFiles& files)
      : context_(context),
        manifest_(manifest),
        writes_(writes),
        workQueue_(workQueue),
        fileQueue_(fileQueue),
        files_(files) {}

  // Without a loader (empty) the value is read as it is.
  Future<Fetched> fetchFirst(std::vector<std::string> keys, Loader loader);

  // What a plain fetch does.
  bool readValue(const DiskCacheItem& item, const std::string& path, std::vector<unsigned char>& value);

  std::optional<std::int32_t> modificationDate(const std::string& key);

  Future<void> updateLastAccessDate(const std::string& key);

 private:
  struct Fetch;

  void find(const std::shared_ptr<Fetch>& fetch);
  void load(Fetch& fetch);
  bool load(Fetch& fetch, const std::string& path, std::vector<unsigned char>& value);
  bool readInlineValue(const std::string& key, std::vector<unsigned char>& value,
                       std::optional<std::uint32_t>& checksum);
  std::optional<std::uint32_t> checksumOf(const DiskCacheItem& item) const;
  bool checkFile(const DiskCacheItem& item, const std::string& path);
  bool handleDamage(const DiskCacheItem& item);
  void drop(const DiskCacheItem& item);
  bool isMiss(const DiskCacheItem& item, const std::exception_ptr& failure);
  bool hasLostItem(const DiskCacheItem& item);
  void noteAccess(const std::string& key);
  void reportAccess(const DiskCacheItem* item, const std::string& key);

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  WorkQueue& workQueue_;
  FileQueue& fileQueue_;
  ValueFiles& files_;
};

}  // namespace velmora::mobile::xplat::cellar
