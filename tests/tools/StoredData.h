#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <cellar/SQLiteManifestPersistence.h>

#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {

// Storage as an application leaves it on disk, made piece by piece: in `root` of a directory of the test's own.
class StoredData {
 public:
  static constexpr std::int32_t kNow = 1'700'000'000;

  // A record with its file; dates in seconds before `kNow`.
  void putItem(const std::string& store, const std::string& key, const std::string& value, std::int32_t age = 0);
  void putInline(const std::string& store, const std::string& key, const std::string& value, std::int32_t age = 0);

  // One half of it each.
  void putRecord(const std::string& store, const DiskCacheItem& item);
  void putFile(const std::string& path, const std::string& bytes);

  // An empty manifest.
  void makeStore(const std::string& store);

  // Runs a script on a manifest, on a connection that shares no code with the library.
  void run(const std::string& store, const std::string& script) const;

  // The manifest as a killed application leaves it, with what it wrote last in the log.
  void killWhileWriting(const std::string& store, const std::string& key);

  // Each row of a manifest as "key size inline inline-bytes".
  std::vector<std::string> rows(const std::string& store) const;

  // Sets all dates so that the next reading moves the access dates, on file systems that move them at all.
  void makeReadingVisible() const;

  // Every entry with what would change if it was written, replaced, removed or read: type, inode, size, dates of access
  // and change.
  std::vector<std::string> trace() const;

  std::string root() const { return directory_.file("root"); }
  std::string path(const std::string& below) const { return directory_.file("root/" + below); }
  const TemporaryDirectory& directory() const { return directory_; }

 private:
  TemporaryDirectory directory_;
};

}  // namespace velmora::mobile::xplat::cellar::test
