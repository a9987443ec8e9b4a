// A database file of any bytes, taken for a manifest: it is refused as described, or loads, is used and pruned; a sound
// one is afterwards what memory said it was, and a refused one can always begin again.

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <iterator>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <tuple>
#include <vector>

#include "DiskCacheItem.h"
#include "DiskCacheManifest.h"
#include "ExtendedMetadata.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "SQLiteStore.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"
#include "harness/ManifestFile.h"
#include "harness/Scratch.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

constexpr std::time_t kNow = 1'700'000'000;
constexpr std::int64_t kFlushInterval = 120'000'000'000;

// One manifest after the other over one file.
class Manifest {
 public:
  explicit Manifest(const Scratch& scratch) : path_(scratch.file("manifest_v1.sqlite")) {}

  const std::string& path() const { return path_; }
  DiskCacheManifest* operator->() const { return manifest_.get(); }

  // False when the file is refused; nothing but the described exception leaves.
  bool open() {
    return attempt([this] {
      auto persistence = std::make_unique<SQLiteManifestPersistence>(
          path_, std::make_shared<VideoDownloadExtendedMetadataFactory>(),
          [](const std::string& file) { return std::make_unique<SQLiteStore>(file); });
      manifest_ = std::make_shared<DiskCacheManifest>(std::move(persistence), executor_, nullptr);
    });
  }

  void close() { manifest_.reset(); }

  void flush() { (void)executor_->fireTimer(kFlushInterval); }

  void removeFiles() const {
    for (const char* suffix : {"", "-wal", "-shm", "-journal"}) std::filesystem::remove(path_ + suffix);
  }

  // Whether the action succeeded.
  template <class Action> bool attempt(Action action) {
    try {
      action();
      return true;
    } catch (const ManifestPersistenceException&) {
      hasFailed_ = true;
      return false;
    }
  }

  bool hasFailed() const { return hasFailed_; }

 private:
  const std::string path_;
  std::shared_ptr<test::ManualExecutor> executor_ = std::make_shared<test::ManualExecutor>();
  std::shared_ptr<DiskCacheManifest> manifest_;
  bool hasFailed_ = false;
};

using Record = std::tuple<std::string, std::uint32_t, bool, std::int32_t, std::int32_t>;
using Records = std::map<std::string, Record>;

// What the manifest says it holds, which must add up.
Records recordsOf(const Manifest& manifest) {
  Records records;
  std::uint32_t total = 0;
  const auto keys = manifest->getAllKeys();
  for (const std::string& key : keys) {
    const auto item = manifest->getItem(key);
    check(item != nullptr && item->key == key, "a record that is listed is there", key);
    check(manifest->getModificationDate(key) == item->modificationDate, "its date is the record's", key);
    total += item->size;
    records[key] = {item->filename, item->size, item->hasInlineData, item->modificationDate, item->lastAccessDate};
  }
  check(records.size() == keys.size() && manifest->count() == keys.size(), "records are counted once");
  check(manifest->size() == total, "the total is the sum");
  return records;
}

void checkRemoved(const Manifest& manifest, const std::vector<DiskCacheItem>& removed) {
  std::optional<std::int32_t> last;
  for (const DiskCacheItem& item : removed) {
    check(manifest->getItem(item.key) == nullptr, "what was pruned is gone", item.key);
    check(!last || *last <= item.lastAccessDate, "the least recently used go first", item.key);
    last = item.lastAccessDate;
  }
}

void read(Manifest& manifest, const Records& records) {
  for (const auto& [key, record] : records) {
    manifest.attempt([&, name = key] { (void)manifest->getInlineData(name); });
    manifest->updateLastAccessDate(key);
    check(manifest->getItem(key)->lastAccessDate == static_cast<std::int32_t>(kNow), "a use is noted", key);
    if (key.size() % 2 == 0) return;  // the others keep their dates, which the prunes go by
  }
}

void write(Manifest& manifest, bool isSound) {
  const DiskCacheItem item("a new key", "a new key", 12, false, 5, 6,
                           std::make_shared<VideoDownloadExtendedMetadata>());
  const std::vector<unsigned char> value = {1, 0, 2};
  const bool written = manifest.attempt([&] {
    manifest->setItem(item);
    manifest->setInlineData(item.key, value);
  });
  if (!written) return;
  const auto found = manifest->getItem(item.key);
  check(found != nullptr && found->size == 12 && found->hasInlineData, "what was written is there");
  manifest.attempt([&] {
    const auto inlineData = manifest->getInlineData(item.key);
    check(!isSound || inlineData == value, "an inline value reads back");
  });
}

void prune(Manifest& manifest, const Records& records, bool isSound) {
  manifest.attempt([&] {
    const auto removed = manifest->pruneOldEntries(kNow / 2, 3);
    check(removed.size() <= 3, "no more go than were asked for");
    checkRemoved(manifest, removed);
    for (const DiskCacheItem& item : removed) check(item.lastAccessDate < kNow / 2, "only what is old goes", item.key);
  });
  const std::uint32_t target = manifest->size() / 2;
  manifest.attempt([&] {
    const bool wasOver = manifest->size() > target;
    const auto removed = manifest->pruneToSize(target, 4);
    checkRemoved(manifest, removed);
    const bool done = manifest->size() <= target || manifest->count() == 0 || removed.size() == 4;
    check(done || !isSound, "pruning goes on until there is room");  // or the damage is met midway
    check(wasOver || removed.empty(), "what has room is left alone");
  });
  manifest.attempt([&] {
    const auto oldest = manifest->pruneOldestItem();
    if (oldest != nullptr) checkRemoved(manifest, {*oldest});
  });
  if (records.empty()) return;
  const std::string& key = std::next(records.begin(), static_cast<std::ptrdiff_t>(records.size() / 2))->first;
  if (manifest.attempt([&] { manifest->removeItem(key); })) {
    check(manifest->getItem(key) == nullptr, "what was removed is gone", key);
  }
}

bool isSound(const Manifest& manifest) {
  const std::string copy = manifest.path() + ".copy";
  copyFile(manifest.path(), copy);
  ManifestFile file(copy);
  return file.isSound();
}

// The file is gone, as when a store was purged.
void beginAgain(Manifest& manifest) {
  manifest.removeFiles();
  check(manifest.open(), "a manifest whose file is gone opens");
  manifest->clear();
  manifest->load();
  check(recordsOf(manifest).empty(), "a manifest that begins again is empty");
  manifest->setItem({"key", "key", 1, false, 1, 1, nullptr});
  manifest.close();
  check(manifest.open(), "a manifest that began again opens");
  manifest->load();
  check(recordsOf(manifest).size() == 1, "a manifest that began again works");
  manifest.close();
}

void run(const std::string& bytes) {
  const test::ManualClock clock(kNow);
  const Scratch scratch;
  scratch.write("manifest_v1.sqlite", bytes);
  Manifest manifest(scratch);
  const bool sound = isSound(manifest);

  if (manifest.open() && manifest.attempt([&] { manifest->load(); })) {
    const Records records = recordsOf(manifest);
    read(manifest, records);
    write(manifest, sound);
    prune(manifest, records, sound);
    manifest.flush();
    const Records left = recordsOf(manifest);
    manifest.close();
    const bool reopened = manifest.open() && manifest.attempt([&] { manifest->load(); });
    if (sound && !manifest.hasFailed()) check(reopened && recordsOf(manifest) == left, "a restart changes nothing");
  }
  manifest.close();
  beginAgain(manifest);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run(std::string(data, data + size));
  return 0;
}
