// More than two thousand manifests, damaged one after the other by rule: whatever lies there, a disk cache opens,
// delivers no value of another key, and works: it stores, fetches, removes, prunes and finds everything after a
// restart.

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <exception>
#include <filesystem>
#include <iostream>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "LarderException.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Fetched;
using test::KeyValueStoreFixture;
using test::told;
using test::watch;
using test::Written;

namespace fs = std::filesystem;

const char* const kManifest = "manifest_v1.sqlite";
constexpr std::size_t kPageSize = 512;  // small, so that a small manifest has many pages to damage
constexpr std::size_t kHeaderSize = 100;
constexpr unsigned int kNormalSize = 60;

// The manifest and its companions by suffix: "", "-wal", "-shm", "-journal".
using Files = std::map<std::string, std::string>;

struct Damage {
  std::string name;
  Files files;
};

using Damages = std::vector<Damage>;

void flipBit(std::string& bytes, std::size_t bit) {
  bytes[bit / 8] = static_cast<char>(static_cast<unsigned char>(bytes[bit / 8]) ^ (1U << (bit % 8)));
}

// --- Ways to damage one of the files ---

// Bits spread evenly over the file.
Damages flippedBits(const Files& files, const std::string& suffix, std::size_t count) {
  Damages damages;
  const std::size_t bits = files.at(suffix).size() * 8;
  for (std::size_t i = 0; i < count; ++i) {
    Files damaged = files;
    const std::size_t bit = (i * bits + i % 8) / count % bits;
    flipBit(damaged[suffix], bit);
    damages.push_back({"bit " + std::to_string(bit) + " flipped" + suffix, damaged});
  }
  return damages;
}

Damages truncated(const Files& files, const std::string& suffix, std::size_t count) {
  Damages damages;
  const std::size_t size = files.at(suffix).size();
  for (std::size_t i = 0; i < count; ++i) {
    Files damaged = files;
    damaged[suffix].resize(i * size / count);
    damages.push_back({"cut to " + std::to_string(i * size / count) + suffix, damaged});
  }
  return damages;
}

Damages headerBytes(const Files& files) {
  Damages damages;
  for (std::size_t i = 0; i < kHeaderSize; ++i) {
    for (const char byte : {'\x00', '\x01', '\x7f', '\xff'}) {
      Files damaged = files;
      if (std::exchange(damaged[""][i], byte) == byte) continue;
      damages.push_back({"header byte " + std::to_string(i), damaged});
    }
  }
  return damages;
}

Damages filledPages(const Files& files, char byte) {
  Damages damages;
  for (std::size_t page = 0; page < files.at("").size() / kPageSize; ++page) {
    Files damaged = files;
    damaged[""].replace(page * kPageSize, kPageSize, kPageSize, byte);
    damages.push_back({"page " + std::to_string(page) + " filled", damaged});
  }
  return damages;
}

Damages swappedPages(const Files& files) {
  Damages damages;
  const std::string& bytes = files.at("");
  for (std::size_t a = 0; a < bytes.size() / kPageSize; ++a) {
    for (std::size_t b = 0; b < a; ++b) {
      Files damaged = files;
      damaged[""].replace(a * kPageSize, kPageSize, bytes, b * kPageSize, kPageSize);
      damaged[""].replace(b * kPageSize, kPageSize, bytes, a * kPageSize, kPageSize);
      damages.push_back({"pages " + std::to_string(b) + " and " + std::to_string(a) + " swapped", damaged});
    }
  }
  return damages;
}

void add(Damages& damages, Damages more) {
  damages.insert(damages.end(), std::make_move_iterator(more.begin()), std::make_move_iterator(more.end()));
}

// --- The store that meets them ---

class DamagedManifests : public KeyValueStoreFixture {
 protected:
  // Thousands of databases are opened and closed, and a disk is asked to sync for each.
  static void SetUpTestSuite() {
    const char* const inMemory = "/dev/shm";
    if (std::getenv("TEST_TMPDIR") != nullptr || ::access(inMemory, W_OK) != 0) return;
    movesToMemory_ = ::setenv("TEST_TMPDIR", inMemory, 1) == 0;
  }
  static void TearDownTestSuite() {
    if (std::exchange(movesToMemory_, false)) ::unsetenv("TEST_TMPDIR");
  }

  // No two differ in a single bit, so that no flipped bit makes one of another.
  static std::vector<std::string> keys() {
    std::vector<std::string> all;
    for (char letter = 'a'; letter <= 'l'; ++letter) all.emplace_back(70, letter);
    return all;
  }

  static std::string valueOf(const std::string& key) { return "the value of " + key.substr(0, 2); }

  // --- Manifests to damage ---

  // What a store with those values leaves behind.
  Files closedManifest(bool inlineData) {
    fill(inlineData);
    close();
    return takeFiles();
  }

  // The same, copied while the store is open: most of it is in the write-ahead log.
  Files openManifest() {
    fill(false);
    const Files sound = readFiles();
    close();
    (void)takeFiles();
    return sound;
  }

  Files databaseOf(const std::string& script) {
    fs::create_directories(storePath());
    run("PRAGMA page_size = 512;" + script);
    return takeFiles();
  }

  Files firstVersion() {
    std::string script =
        "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data "
        "BLOB, modification_date INTEGER, last_access_date INTEGER, PRIMARY KEY(key));";
    for (const std::string& key : keys()) {
      const std::string quoted = "'" + key + "'";
      script += "INSERT INTO LarderManifest VALUES (" + quoted + "," + quoted + ", 15, 0, NULL, 999990, 999990);";
    }
    return databaseOf(script);
  }

  // --- Trying them ---

  void tryAll(const Damages& damages, bool inlineData) {
    ASSERT_FALSE(damages.empty());
    for (const Damage& damage : damages) {
      SCOPED_TRACE(damage.name);
      tryOne(damage, inlineData);
      if (HasFatalFailure()) return;
    }
    RecordProperty("manifests", static_cast<int>(damages.size()));
    RecordProperty("valuesOfAnotherKey", strayValues_);
    std::cout << damages.size() << " damaged manifests, " << strayValues_ << " values of another key, "
              << purgesAtRestart_ << " stores purged by a restart" << std::endl;
  }

 private:
  void tryOne(const Damage& damage, bool inlineData) {
    lay(damage.files, inlineData);
    const bool isSound = !inlineData || isSoundToSQLite(damage.files);
    openCache(inlineData);
    expectNoValueOfAnotherKey(inlineData, isSound);
    expectWorks("new");
    expectWorks(keys()[0]);
    expectRemoved(keys()[1]);
    expectPruned();
    expectKept("newer", damage, isSound);
    close();
    fs::remove_all(storePath());
  }

  void lay(const Files& damaged, bool inlineData) {
    for (const auto& [suffix, bytes] : damaged) directory.write("store/" + (kManifest + suffix), bytes);
    if (inlineData) return;
    for (const std::string& key : keys()) directory.write("store/" + key, valueOf(key));
  }

  void openCache(bool inlineData) {
    isDiskCache = true;
    options.inlineData = inlineData;
    options.normalSize = kNormalSize;
    options.batchSize = 5;
    options.onSizeChanged = [this](unsigned int size) { lastSize_ = size; };
    openUnloaded();
    settleAll();
  }

  void close() {
    settleAll();
    KeyValueStoreFixture::close();
    queues = std::make_shared<test::ManualQueueFactory>();  // it would keep the queues of every store
  }

  // A store whose manifest cannot be opened at all says so out of its first task, and tries again later.
  void settleAll() const {
    for (bool done = false; !done;) {
      try {
        settle();
        done = true;
      } catch (const ManifestPersistenceException&) {
      }
    }
  }

  std::string fetched(const std::string& key) {
    const Fetched fetch = watch(store->fetch(key));
    settleAll();
    return told(fetch);
  }

  std::string stored(const std::string& key, const std::string& value) {
    const Written write = watch(store->store(key, bytesOf(value)));
    settleAll();
    return told(write);
  }

  // An inline value is found by way of an index. When an entry of it leads to another row, SQLite notices only in a
  // check of the whole database, which nobody makes at run time: those are counted.
  void expectNoValueOfAnotherKey(bool inlineData, bool isSound) {
    for (const std::string& key : keys()) {
      const std::string value = fetched(key);
      const bool isMissing = value == "<miss>" || value.rfind("<error>", 0) == 0;
      EXPECT_TRUE(inlineData || isMissing || value == valueOf(key)) << key << ": " << value;
      for (const std::string& other : keys()) {
        if (other == key || value != valueOf(other)) continue;
        EXPECT_FALSE(isSound) << key << ": " << value;
        ++strayValues_;
      }
    }
  }

  bool isSoundToSQLite(const Files& damaged) {
    for (const auto& [suffix, bytes] : damaged) directory.write("copy/" + (kManifest + suffix), bytes);
    sqlite3* database = nullptr;
    EXPECT_EQ(sqlite3_open(directory.file("copy/" + std::string(kManifest)).c_str(), &database), SQLITE_OK);
    std::string verdict;
    const auto take = [](void* target, int, char** values, char**) {
      *static_cast<std::string*>(target) = values[0];
      return 0;
    };
    const int result = sqlite3_exec(database, "PRAGMA integrity_check(1)", take, &verdict, nullptr);
    sqlite3_close(database);
    fs::remove_all(directory.file("copy"));
    return result == SQLITE_OK && verdict == "ok";
  }

  // The first attempt may be what meets the damage and purges the store.
  void expectWorks(const std::string& key) {
    std::string last;
    for (int attempt = 0; attempt < 2 && last != "works"; ++attempt) {
      ASSERT_EQ(stored(key, "works"), "<done>");
      last = fetched(key);
    }
    EXPECT_EQ(last, "works") << key;
  }

  void expectRemoved(const std::string& key) {
    const Written removed = watch(store->removeItem(key));
    settleAll();
    EXPECT_FALSE(removed->isPending());
    EXPECT_EQ(fetched(key), "<miss>") << key;
  }

  void expectPruned() {
    ending.clear();
    store->pruneBackToNormal(onSuccess(), onError(), false);
    settleAll();
    EXPECT_EQ(ending, "<done>");
    EXPECT_LE(lastSize_, kNormalSize);
  }

  // Damage that nothing has met before the store is closed, or loaded again, purges it then.
  void expectKept(const std::string& key, const Damage& damage, bool isSound) {
    expectWorks(key);
    const bool inlineData = !fs::exists(storePath() + "/" + key);
    close();
    openCache(inlineData);
    if (fetched(key) != "works") {
      EXPECT_TRUE(store->getAllKeys().empty()) << "only one value is gone after a restart";
      EXPECT_FALSE(isSoundToSQLite(damage.files));
      expectWorks(key);
      ++purgesAtRestart_;
    }
    const bool isBack = fetched(keys()[1]) == valueOf(keys()[1]);
    EXPECT_FALSE(isBack && isSound) << "what was removed has come back";
    if (isBack) ++strayValues_;
  }

  void fill(bool inlineData) {
    fs::create_directories(storePath());
    run("PRAGMA page_size = 512; CREATE TABLE other (x); DROP TABLE other");
    openCache(inlineData);
    for (const std::string& key : keys()) ASSERT_EQ(stored(key, valueOf(key)), "<done>");
  }

  void run(const std::string& script) const {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(pathOf(kManifest).c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, script.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(database);
    sqlite3_close(database);
  }

  Files readFiles() const {
    Files found;
    for (const char* suffix : {"", "-wal", "-shm"}) {
      const std::string name = std::string("store/") + kManifest + suffix;
      if (directory.exists(name)) found[suffix] = directory.read(name);
    }
    return found;
  }

  Files takeFiles() const {
    Files found = readFiles();
    fs::remove_all(storePath());
    return found;
  }

  unsigned int lastSize_ = 0;
  int strayValues_ = 0;
  int purgesAtRestart_ = 0;
  inline static bool movesToMemory_ = false;
};

class DiskCacheManifestOfFiles : public DamagedManifests {
 protected:
  Damages bits() { return flippedBits(closedManifest(false), "", 500); }
  Damages cuts() { return truncated(closedManifest(false), "", 150); }
  Damages header() { return headerBytes(closedManifest(false)); }
  Damages pages() {
    const Files sound = closedManifest(false);
    Damages damages = filledPages(sound, '\0');
    add(damages, filledPages(sound, '\xff'));
    add(damages, swappedPages(sound));
    return damages;
  }
};

class DiskCacheManifestWithValues : public DamagedManifests {
 protected:
  Damages bits() { return flippedBits(closedManifest(true), "", 500); }
  Damages pages() {
    const Files sound = closedManifest(true);
    Damages damages = filledPages(sound, '\0');
    add(damages, filledPages(sound, '\xff'));
    add(damages, swappedPages(sound));
    return damages;
  }
};

class DiskCacheManifestOfTheFirstVersion : public DamagedManifests {
 protected:
  Damages all() {
    const Files sound = firstVersion();
    Damages damages = flippedBits(sound, "", 200);
    add(damages, truncated(sound, "", 50));
    add(damages, filledPages(sound, '\0'));
    return damages;
  }
};

// Another program's, or another version's.
class DiskCacheForeignManifest : public DamagedManifests {
 protected:
  Damages all() {
    Damages damages;
    for (const std::string& script : scripts()) damages.push_back({script, databaseOf(script)});
    damages.push_back({"nothing", {{"", ""}}});
    damages.push_back({"text", {{"", std::string(5000, 'x')}}});
    return damages;
  }

 private:
  static std::vector<std::string> scripts() {
    const std::string head = "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, ";
    const std::string tail =
        "has_inline_data BOOLEAN, inline_data BLOB, modification_date INTEGER, last_access_date INTEGER, "
        "extended_manifest BLOB, PRIMARY KEY(key))";
    const std::string row = "; INSERT INTO LarderManifest VALUES ";
    return {
        "CREATE TABLE contacts (id INTEGER PRIMARY KEY, name TEXT)",
        "CREATE TABLE LarderManifest (key TEXT)",
        "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size BIGINT)",
        "CREATE VIEW LarderManifest AS SELECT 1 AS key",
        "CREATE TABLE other (x); CREATE INDEX LarderManifest ON other(x)",
        "CREATE TABLE other (last_access_date); CREATE INDEX last_access_date_idx ON other(last_access_date)",
        head + tail + " WITHOUT ROWID",
        "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER CHECK (size > 100), " + tail,
        head + tail + row + "(NULL, NULL, NULL, NULL, NULL, NULL, NULL, NULL)",
        head + tail + row + "(x'00ff', 5, 'large', 'yes', 7, 1e300, -1e300, 3)",
        head + tail + row + "('a', 'a', -1, 2, NULL, 9223372036854775807, -9223372036854775808, NULL)",
        head + tail + row + "('z', '../../nowhere', 4294967295, 0, NULL, 1, 1, NULL)",
        head + tail + "; CREATE TRIGGER t BEFORE INSERT ON LarderManifest BEGIN SELECT RAISE(ABORT, 'no'); END",
        head + tail + "; CREATE TRIGGER t AFTER DELETE ON LarderManifest BEGIN SELECT RAISE(FAIL, 'no'); END",
        "PRAGMA encoding = 'UTF-16le'; " + head + tail + row + "('a', 'a', 1, 0, NULL, 1, 1, NULL)",
        "PRAGMA user_version = 99; PRAGMA application_id = 7; " + head + tail,
        "PRAGMA auto_vacuum = FULL; " + head + tail,
    };
  }
};

// Copied while it was in use, as a backup does that knows nothing of databases; and the companions damaged or lost.
class DiskCacheManifestInUse : public DamagedManifests {
 protected:
  Damages all() {
    const Files sound = openManifest();
    Damages damages = flippedBits(sound, "-wal", 150);
    add(damages, truncated(sound, "-wal", 100));
    add(damages, flippedBits(sound, "-shm", 60));
    add(damages, truncated(sound, "-shm", 30));
    for (const char* lost : {"", "-wal", "-shm"}) {
      Files damaged = sound;
      damaged.erase(lost);
      damages.push_back({std::string("lost") + lost, damaged});
    }
    return damages;
  }

  // Companions that belong to no manifest, or to another one.
  Damages strangers() {
    const Files inUse = openManifest();
    const Files closed = closedManifest(false);
    const Files first = firstVersion();
    Damages damages;
    for (const char* suffix : {"-wal", "-shm", "-journal"}) {
      for (const std::string& bytes :
           {std::string(), std::string(4000, '\0'), std::string(4000, 'x'), inUse.at("-wal")}) {
        for (const Files& beside : {closed, Files(), first}) {
          Files damaged = beside;
          damaged[suffix] = bytes;
          damages.push_back({std::string("strange ") + suffix, damaged});
        }
      }
    }
    return damages;
  }
};

TEST_F(DiskCacheManifestOfFiles, WithAFlippedBitLeavesAWorkingStore) { tryAll(bits(), false); }
TEST_F(DiskCacheManifestOfFiles, CutShortLeavesAWorkingStore) { tryAll(cuts(), false); }
TEST_F(DiskCacheManifestOfFiles, WithAnotherHeaderLeavesAWorkingStore) { tryAll(header(), false); }
TEST_F(DiskCacheManifestOfFiles, WithLostOrSwappedPagesLeavesAWorkingStore) { tryAll(pages(), false); }
TEST_F(DiskCacheManifestWithValues, WithAFlippedBitLeavesAWorkingStore) { tryAll(bits(), true); }
TEST_F(DiskCacheManifestWithValues, WithLostOrSwappedPagesLeavesAWorkingStore) { tryAll(pages(), true); }
TEST_F(DiskCacheManifestOfTheFirstVersion, DamagedLeavesAWorkingStore) { tryAll(all(), false); }
TEST_F(DiskCacheForeignManifest, LeavesAWorkingStore) { tryAll(all(), false); }
TEST_F(DiskCacheManifestInUse, CopiedInPartsLeavesAWorkingStore) { tryAll(all(), false); }
TEST_F(DiskCacheManifestInUse, WithStrangeCompanionsLeavesAWorkingStore) { tryAll(strangers(), false); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
