// Random sequences of operations on stores, against plain models of what must come out. Every sequence follows from one
// number: CELLAR_MODEL_SEED=n repeats the sequence that failed, CELLAR_MODEL_RUNS=n sets how many are tried.

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <iterator>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <random>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "DiskCache.h"
#include "DiskCacheManifest.h"
#include "ExtendedMetadata.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "PruneStrategy.h"
#include "StoreOptions.h"
#include "TrashCollector.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/Bytes.h"
#include "support/FaultyManifest.h"
#include "support/GreedyDualSimulation.h"
#include "support/LogCapture.h"
#include "support/ManifestOnDisk.h"

namespace velmora::mobile::xplat::cellar {
namespace {

namespace fs = std::filesystem;

using test::Bytes;
using test::FaultyManifest;
using test::GreedyDualSimulation;
using test::kManifestName;
using test::kSecond;
using test::LogCapture;
using test::ManifestCall;
using test::ManifestOnDisk;
using test::ManualClock;
using test::ManualExecutor;
using test::ManualQueueFactory;
using test::valueFiles;

using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;
using ItemType = VideoDownloadExtendedMetadata::ItemType;

constexpr std::time_t kStart = 1'700'000'000;
const std::string kRefusal = "The queue takes no tasks.";

#if defined(CELLAR_RUNS_SLOWLY)
constexpr unsigned int kDefaultRuns = 40;  // each takes ten times as long there
#else
constexpr unsigned int kDefaultRuns = 1000;
#endif

std::optional<unsigned int> numberFromEnvironment(const char* name) {
  const char* const text = std::getenv(name);
  return text == nullptr ? std::nullopt : std::make_optional(static_cast<unsigned int>(std::stoul(text)));
}

// --- The disk ---

// A directory in memory where the system has that: thousands of databases are made here, and none needs to last.
class ScratchDirectory {
 public:
  ScratchDirectory() {
    const std::string parent = ::access("/dev/shm", W_OK) == 0 ? std::string("/dev/shm/") : testing::TempDir();
    std::string pattern = parent + "cellar-model-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("Cannot create " + pattern);
    path_ = pattern;
  }
  ScratchDirectory(const ScratchDirectory&) = delete;
  ScratchDirectory& operator=(const ScratchDirectory&) = delete;
  ~ScratchDirectory() {
    std::error_code ignored;
    fs::remove_all(path_, ignored);
  }
  std::string file(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// The real file system, which lets others do something in the middle of the operations that no lock is held around.
class InterruptedFileUtils final : public FileUtils {
 public:
  std::function<void()> interruption;

  Bytes readFile(const std::string& path) override {
    interrupt();
    return FileUtils::readFile(path);
  }
  void writeFile(const std::string& path, const Bytes& data) override {
    interrupt();
    if (interruption) {
      FileUtils::writeFile(path, {data.begin(), data.begin() + static_cast<std::ptrdiff_t>(data.size() / 2)});
      interrupt();
    }
    FileUtils::writeFile(path, data);
    interrupt();
  }
  void deleteFile(const std::string& path) override {
    interrupt();
    FileUtils::deleteFile(path);
    interrupt();
  }

 private:
  void interrupt() const {
    if (interruption) interruption();
  }
};

// --- The store under test ---

struct Setup : DiskCacheOptions {
  Setup() {
    name = "model";
    staleAge = 1000;
    normalSize = 60;
    survivalSize = 20;
  }

  bool isDiskCache = false;
  PruneStrategyIdentifier strategy = PruneStrategyIdentifier::LRU;

  std::string describe() const {
    std::ostringstream text;
    text << (isDiskCache ? "disk cache" : "key-value store") << (inlineData ? ", inline" : ", files") << ", capacity "
         << (capacity ? std::to_string(*capacity) : "none") << ", strategy " << static_cast<int>(strategy) << ", batch "
         << batchSize << ", stale " << staleAge << ", sizes " << normalSize << "/" << survivalSize;
    return text.str();
  }
};

// One life of a store: from opening a directory to letting it go.
class Session {
 public:
  Session(const std::string& storePath, const std::string& trashPath, Setup setup, bool canBeCorrupted)
      : files(std::make_shared<InterruptedFileUtils>()),
        trash_(std::make_shared<TrashCollector>(trashPath, std::make_shared<FileUtils>(), nullptr, trashQueues_)) {
    setup.directory = storePath;
    setup.onSizeChanged = [this](unsigned int size) { lastReportedSize = size; };
    if (canBeCorrupted) setup.manifest = corruptible(setup);
    const StoreServices services{queues_, trash_, files, nullptr};
    if (setup.isDiskCache) {
      setup.extendedMetadataFactory = metadata_;
      setup.pruneStrategy = PruneStrategyFactory(setup.strategy);
      store = cache = DiskCache::create(setup, services);
    } else {
      store = PersistentKeyValueStore::create(setup, services);
    }
  }

  // After so many calls that touch the disk, one finds the manifest damaged.
  void corruptAfter(unsigned int calls) { *callsUntilCorrupt_ = calls; }
  void heal() { callsUntilCorrupt_->reset(); }

  static constexpr int kFileQueue = 0;
  static constexpr int kWorkQueue = 1;

  ManualExecutor& queue(int index) const { return index == kFileQueue ? *queues_->queue(0) : *queues_->workQueue(0); }

  // Runs the next task of a queue; false when it has none, or runs one already: the queues are serial.
  bool runNext(int index) {
    if (isBusy_[index]) return false;
    isBusy_[index] = true;
    const bool ran = queue(index).runNext();
    isBusy_[index] = false;
    return ran;
  }

  void drain() {
    for (bool ran = true; ran;) {
      const bool ranFile = runNext(kFileQueue);
      const bool ranWork = runNext(kWorkQueue);
      ran = ranFile || ranWork;
    }
    trashQueues_->runAll();
  }

  bool fireTimer(std::int64_t seconds) const { return queue(kWorkQueue).fireTimer(seconds * kSecond); }

  std::shared_ptr<ManualQueueFactory> queues() const { return queues_; }

  // Lets go of the store; the queues keep what waits.
  void drop() {
    cache.reset();
    store.reset();
  }

  std::shared_ptr<InterruptedFileUtils> files;
  std::shared_ptr<PersistentKeyValueStore> store;
  std::shared_ptr<DiskCache> cache;  // the same, or null
  std::optional<unsigned int> lastReportedSize;

 private:
  std::shared_ptr<FaultyManifest> corruptible(const Setup& setup) const {
    auto manifest =
        std::make_shared<FaultyManifest>([queues = queues_, path = setup.directory + "/" + kManifestName,
                                          metadata = metadata_, strategy = PruneStrategyFactory(setup.strategy)] {
          return DiskCacheManifest::createDiskCacheManifest(path, queues->workQueue(0), metadata, strategy);
        });
    manifest->onCall = [calls = callsUntilCorrupt_](ManifestCall call, const std::string&) {
      if (call == ManifestCall::GetAllKeys || call == ManifestCall::Invalidate) return;
      if (call != ManifestCall::Clear && (!*calls || (**calls)-- > 0)) return;
      calls->reset();
      if (call != ManifestCall::Clear) throw ManifestCorruptedException("Damaged for the test.", SQLITE_CORRUPT);
    };
    return manifest;
  }

  std::shared_ptr<ManualQueueFactory> queues_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<std::optional<unsigned int>> callsUntilCorrupt_ =
      std::make_shared<std::optional<unsigned int>>();  // empty: the manifest is whole
  std::shared_ptr<VideoDownloadExtendedMetadataFactory> metadata_ =
      std::make_shared<VideoDownloadExtendedMetadataFactory>();
  std::shared_ptr<ManualQueueFactory> trashQueues_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<TrashCollector> trash_;
  bool isBusy_[2] = {false, false};
};

// --- What comes out of a call ---

struct Outcome {
  bool isDone = false;
  std::exception_ptr error;
  Fetched result;

  template <class Exception> bool failedWith() const {
    if (error == nullptr) return false;
    try {
      std::rethrow_exception(error);
    } catch (const Exception&) {
      return true;
    } catch (...) {
      return false;
    }
  }
  std::string what() const {
    if (error == nullptr) return "no error";
    try {
      std::rethrow_exception(error);
    } catch (const std::exception& exception) {
      return exception.what();
    }
  }
};

using OnDone = std::function<void(const Outcome&)>;

template <class T> std::shared_ptr<Outcome> watch(Future<T> future, OnDone onDone = nullptr) {
  const auto outcome = std::make_shared<Outcome>();
  future.then(nullptr, [outcome, onDone = std::move(onDone)](std::future<T>& value) {
    EXPECT_FALSE(outcome->isDone);
    outcome->isDone = true;
    try {
      if constexpr (std::is_void_v<T>) {
        value.get();
      } else {
        outcome->result = value.get();
      }
    } catch (...) {
      outcome->error = std::current_exception();
    }
    if (onDone) onDone(*outcome);
  });
  return outcome;
}

struct WriterFailed : std::runtime_error {
  WriterFailed() : std::runtime_error("The writer gave up.") {}
};

// --- A sequence ---

// The random numbers of one sequence, and what it has done so far in words.
class Script {
 public:
  explicit Script(unsigned int seed) : random_(seed) {}

  unsigned int below(unsigned int limit) { return static_cast<unsigned int>(random_() % limit); }
  bool oneIn(unsigned int n) { return below(n) == 0; }

  std::string key() { return std::string(1, static_cast<char>('a' + below(6))); }

  // A value that no other of this run equals, unless it is empty.
  Bytes value() {
    if (oneIn(12)) return {};
    const std::string text = std::to_string(++valueCount_) + std::string(1, '\0') + std::string(below(30), 'x');
    return {text.begin(), text.end()};
  }

  Setup setup() {
    Setup setup;
    setup.inlineData = oneIn(2);
    setup.isDiskCache = !oneIn(3);
    if (oneIn(2)) setup.capacity = 1 + below(4);
    const PruneStrategyIdentifier strategies[] = {PruneStrategyIdentifier::LRU, PruneStrategyIdentifier::Null,
                                                  PruneStrategyIdentifier::VideoDownload,
                                                  PruneStrategyIdentifier::GreedyDual};
    setup.strategy = strategies[below(4)];
    setup.batchSize = oneIn(3) ? 50 : 1 + below(3);
    setup.normalSize = below(100);
    setup.survivalSize = below(40);
    say(setup.describe());
    return setup;
  }

  void say(const std::string& text) { story_ += text + "\n"; }
  const std::string& story() const { return story_; }

 private:
  std::mt19937 random_;
  unsigned int valueCount_ = 0;
  std::string story_;
};

// Runs sequences until one fails, and says which.
class StoreModel : public testing::Test {
 protected:
  void SetUp() override {
    VideoDownloadPruneStrategy::priorityWeight = 101;  // odd, and all dates are even: no two weighted dates are equal
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 5;
  }
  void TearDown() override {
    VideoDownloadPruneStrategy::priorityWeight = 0;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 0;
  }

  template <class Sequence> static void runAll() {
    const auto chosen = numberFromEnvironment("CELLAR_MODEL_SEED");
    const unsigned int runs = numberFromEnvironment("CELLAR_MODEL_RUNS").value_or(chosen ? 1 : kDefaultRuns);
    const unsigned int first = chosen.value_or(1);
    for (unsigned int seed = first; seed < first + runs; ++seed) {
      Script script(seed);
      try {
        Sequence(script).play();
      } catch (const std::exception& error) {
        ADD_FAILURE() << "Something left the store: " << error.what();
      }
      if (HasFailure()) {
        ADD_FAILURE() << "CELLAR_MODEL_SEED=" << seed << "\n" << script.story();
        return;
      }
    }
  }
};

std::shared_ptr<VideoDownloadExtendedMetadata> metadata(int second) {
  return std::make_shared<VideoDownloadExtendedMetadata>(second, ItemType::VideoChunk);
}

// --- One call after the other: everything is known exactly ---

class SettledSequence {
 public:
  explicit SettledSequence(Script& script) : script_(script), setup_(script.setup()) {}

  void play() {
    open();
    const unsigned int steps = 10 + script_.below(30);
    for (unsigned int i = 0; i < steps && !testing::Test::HasFailure(); ++i) {
      clock_.advance(2);
      now_ += 2;
      step();
      session_->drain();
      if (script_.oneIn(4)) verify();
    }
    verify();
    restart();
    verify();
  }

 private:
  struct Item {
    Bytes value;
    std::int64_t modificationDate;
    std::int64_t lastAccessDate;
    int second;  // of the video
  };

  void open() {
    session_ = std::make_unique<Session>(directory_.file("store"), directory_.file("trash"), setup_, false);
    session_->drain();
    loadGreedyDual();
  }

  void close() {
    session_->drain();
    session_->drop();
    EXPECT_EQ(session_->queue(Session::kFileQueue).armedDelays().size(), 0U);
    EXPECT_EQ(session_->queue(Session::kWorkQueue).armedDelays().size(), 0U) << "a timer is left behind";
    session_.reset();
  }

  void restart() {
    close();
    open();
  }

  // Access dates are written at the end, as they are by `close`.
  void restartWithoutWaiting() {
    session_->drop();
    session_->drain();
    session_.reset();
    open();
  }

  void step() {
    const std::string key = script_.key();
    switch (script_.below(19)) {
      case 0:
      case 1:
      case 2:
      case 3:
      case 4:
        return storeValue(key);
      case 5:
        return script_.oneIn(2) ? storeWithFailingWriter(key) : storeInVain(key);
      case 6:
      case 7:
        return fetch(key);
      case 8:
        return fetchFirst();
      case 9:
      case 10:
        return remove(key);
      case 11:
        return use(key);
      case 12:
        return prune();
      case 13:
        return expire();
      case 14:
        return clear();
      case 15:
        return datesChangeWhileClosed();
      case 16:
        return flushDates();
      case 17:
        return script_.oneIn(3) ? manifestIsDamagedWhileClosed() : restartAloud();
      default:
        return script_.oneIn(2) ? invalidate() : reservedKey();
    }
  }

  // --- Operations, each with what it does to the model ---

  void evictForOne() {
    if (!setup_.capacity || items_.size() < *setup_.capacity || items_.empty()) return;
    erase(oldest()->first);
  }

  void erase(const std::string& key) {
    greedyDual_.remove(key);
    items_.erase(key);  // last: the key may be the item's own
  }

  // What a start knows: sizes and dates of use.
  void loadGreedyDual() {
    std::map<std::int64_t, std::string> keys;  // no two dates are equal
    for (const auto& [key, item] : items_) keys[item.lastAccessDate] = key;
    EXPECT_EQ(keys.size(), items_.size());
    greedyDual_ = {};
    for (const auto& [date, key] : keys) greedyDual_.store(key, sizeOf(items_.at(key)), date);
    greedyDual_.restart();
  }

  static std::uint32_t sizeOf(const Item& item) { return static_cast<std::uint32_t>(item.value.size()); }

  void markUsed(const std::string& key) {
    items_.at(key).lastAccessDate = now_;
    greedyDual_.use(key, now_);
  }

  void storeValue(const std::string& key) {
    const Bytes value = script_.value();
    const int second = static_cast<int>(script_.below(10));
    script_.say("store " + key);
    const auto outcome = watch(session_->store->store(key, value, metadata(second)));
    session_->drain();
    expectFulfilled(*outcome);
    evictForOne();
    items_[key] = {value, now_, now_, second};
    greedyDual_.store(key, sizeOf(items_[key]), now_);
    expectReported();
  }

  void storeWithFailingWriter(const std::string& key) {
    script_.say("store " + key + " with a writer that fails");
    const auto outcome = watch(session_->store->store(key, nullptr, [](const std::string& path) -> unsigned int {
      std::ofstream(path) << "half";
      throw WriterFailed();
    }));
    session_->drain();
    ASSERT_TRUE(outcome->isDone);
    if (setup_.inlineData) {
      EXPECT_EQ(outcome->what(), "Write callback not supported by inline store.");
      return;
    }
    EXPECT_TRUE(outcome->failedWith<WriterFailed>()) << outcome->what();
    evictForOne();
    erase(key);
  }

  // Writes whose writer is never called: the file queue refuses or drops its task, or the store is released before.
  // Where the second of them would evict another item, none is tried.
  void storeInVain(const std::string& key) {
    if (setup_.inlineData || (setup_.capacity && items_.size() + 1 >= *setup_.capacity)) return;
    const unsigned int kind = script_.below(3);
    script_.say("store " + key + " in vain, in way " + std::to_string(kind));
    ManualExecutor& files = session_->queue(Session::kFileQueue);
    files.throwOnDispatch(kind == 0);
    const auto first = watch(session_->store->store(key, script_.value(), metadata(0)));
    const auto second = watch(session_->store->store(key, script_.value(), metadata(0)));
    session_->queue(Session::kWorkQueue).runAll();
    files.throwOnDispatch(false);
    if (kind == 1) files.dropAll();
    if (kind == 2) restartWithoutWaiting();
    EXPECT_TRUE(first->isDone && second->isDone);
    EXPECT_TRUE(kind == 2 || (first->error != nullptr && second->error != nullptr));
  }

  void fetch(const std::string& key) {
    script_.say("fetch " + key);
    const auto outcome = watch(session_->store->fetch(key));
    session_->drain();
    expectFulfilled(*outcome);
    const auto date = session_->store->fetchModificationDate(key);
    expectFetched(*outcome, items_.count(key) > 0 ? key : "");
    EXPECT_EQ(date.has_value(), items_.count(key) > 0);
    if (date) {
      EXPECT_EQ(*date, items_.at(key).modificationDate);
    }
  }

  void fetchFirst() {
    std::vector<std::string> keys;
    for (unsigned int i = script_.below(4); i > 0; --i) keys.push_back(script_.key());
    std::string expected;
    std::string said = "fetch the first of";
    for (const std::string& key : keys) {
      said += " " + key;
      if (expected.empty() && items_.count(key) > 0) expected = key;
    }
    script_.say(said);
    const auto outcome = watch(session_->store->fetchFirst(
        keys, [&](std::shared_ptr<const DiskCacheItem> item, const std::string& path, Bytes& value) {
          return session_->store->readValue(std::move(item), path, value);
        }));
    session_->drain();
    expectFulfilled(*outcome);
    expectFetched(*outcome, expected);
  }

  void expectFetched(const Outcome& outcome, const std::string& key) {
    if (key.empty()) {
      EXPECT_EQ(outcome.result, nullptr);
      return;
    }
    ASSERT_NE(outcome.result, nullptr) << key;
    EXPECT_EQ(outcome.result->key, key);
    EXPECT_EQ(outcome.result->value, items_.at(key).value);
    EXPECT_EQ(outcome.result->modificationDate, items_.at(key).modificationDate);
    markUsed(key);
  }

  void remove(const std::string& key) {
    script_.say("remove " + key);
    const auto outcome = watch(session_->store->removeItem(key));
    session_->drain();
    expectFulfilled(*outcome);
    erase(key);
  }

  void use(const std::string& key) {
    script_.say("use " + key);
    const auto outcome = watch(session_->store->updateLastAccessDate(key));
    session_->drain();
    expectFulfilled(*outcome);
    if (items_.count(key) > 0) markUsed(key);
  }

  void prune() {
    if (!setup_.isDiskCache) return;
    if (script_.oneIn(2)) {
      setup_.normalSize = script_.below(100);
      session_->cache->overrideConfiguration(setup_.staleAge, setup_.normalSize);
    }
    const bool survival = script_.oneIn(3);
    const unsigned int target = survival ? setup_.survivalSize : setup_.normalSize;
    script_.say("prune to " + std::to_string(target));
    expectSuccess(
        [&](auto onSuccess, auto onError) { session_->cache->pruneBackToNormal(onSuccess, onError, survival); });
    pruneModel(target);
    expectReported();
  }

  void pruneModel(unsigned int target) {
    if (setup_.strategy != PruneStrategyIdentifier::GreedyDual) {
      while (total() > target) erase(firstToGo()->first);
      return;
    }
    GreedyDualSimulation pruned = greedyDual_;
    const std::vector<std::string> evicted = pruned.prune(target);
    if (target != 0) greedyDual_ = pruned;  // of a prune to nothing, nothing is learnt
    for (const std::string& key : evicted) erase(key);
  }

  void expire() {
    if (script_.oneIn(3) && !items_.empty()) {  // to the second: what was used at that very second stays
      setup_.staleAge = static_cast<long>(
          now_ - std::next(items_.begin(), static_cast<std::ptrdiff_t>(script_.below(items())))->second.lastAccessDate);
    } else if (script_.oneIn(3)) {
      setup_.staleAge = script_.oneIn(2) ? std::numeric_limits<long>::max() : static_cast<long>(script_.below(60));
    }
    script_.say("expire what is older than " + std::to_string(setup_.staleAge));
    session_->store->overrideConfiguration(setup_.staleAge);
    EXPECT_TRUE(session_->fireTimer(300) || session_->fireTimer(3600));
    session_->drain();
    EXPECT_FALSE(session_->queue(Session::kWorkQueue).armedDelays().empty());
    const std::int64_t cutoff = setup_.staleAge > now_ ? 0 : now_ - setup_.staleAge;
    for (auto it = items_.begin(); it != items_.end();) {
      const auto item = it++;
      if (item->second.lastAccessDate < cutoff) erase(item->first);
    }
    expectReported();
  }

  void clear() {
    script_.say("clear");
    expectSuccess([&](auto onSuccess, auto onError) { session_->store->clear(onSuccess, onError); });
    items_.clear();
    greedyDual_.clear();
    expectReported();
  }

  void flushDates() {
    script_.say("write access dates");
    EXPECT_TRUE(session_->fireTimer(120));
    session_->drain();
    for (const auto& [key, row] : ManifestOnDisk(storePath()).rows()) {
      EXPECT_EQ(row.lastAccessDate, items_.at(key).lastAccessDate) << key;
    }
  }

  void restartAloud() {
    script_.say("restart");
    restart();
  }

  void datesChangeWhileClosed() {
    script_.say("restart with other dates");
    close();
    {
      const ManifestOnDisk manifest(storePath());
      for (auto& [key, item] : items_) {
        if (script_.oneIn(2)) continue;
        item.lastAccessDate = (lastInventedDate_ -= 2);
        manifest.setLastAccessDate(key, item.lastAccessDate);
      }
    }
    open();
  }

  void manifestIsDamagedWhileClosed() {
    script_.say("restart with a damaged manifest");
    close();
    std::fstream file(storePath() + "/" + kManifestName, std::ios::binary | std::ios::in | std::ios::out);
    file << "This is not a database.";
    file.close();
    items_.clear();
    const LogCapture log;
    open();
  }

  void invalidate() {
    script_.say("invalidate and restart");
    session_->store->invalidateSoon();
    session_->drain();
    const auto store = watch(session_->store->store("a", {1}));
    const auto fetch = watch(session_->store->fetch("a"));
    const auto remove = watch(session_->store->removeItem("a"));
    session_->drain();
    EXPECT_TRUE(store->failedWith<InvalidatedException>());
    EXPECT_TRUE(fetch->failedWith<InvalidatedException>());
    EXPECT_TRUE(remove->failedWith<InvalidatedException>());
    close();
    // Access dates that had not been written are lost with the manifest that was silenced.
    for (const auto& [key, row] : ManifestOnDisk(storePath()).rows()) {
      EXPECT_LE(row.lastAccessDate, items_.at(key).lastAccessDate) << key;
      items_.at(key).lastAccessDate = row.lastAccessDate;
    }
    open();
  }

  void reservedKey() {
    if (setup_.inlineData) return;
    script_.say("use the manifest's name as a key");
    const auto store = watch(session_->store->store(kManifestName, {1}));
    const auto remove = watch(session_->store->removeItem(kManifestName + "-wal"));
    session_->drain();
    EXPECT_TRUE(store->failedWith<std::invalid_argument>());
    EXPECT_TRUE(remove->failedWith<std::invalid_argument>());
  }

  // --- The model's answers ---

  unsigned int items() const { return static_cast<unsigned int>(items_.size()); }

  std::uint32_t total() const {
    std::size_t sum = 0;
    for (const auto& item : items_) sum += item.second.value.size();
    return static_cast<std::uint32_t>(sum);
  }

  using Items = std::map<std::string, Item>;

  Items::iterator oldest() {
    return std::min_element(items_.begin(), items_.end(), [](const auto& a, const auto& b) {
      return a.second.lastAccessDate < b.second.lastAccessDate;
    });
  }

  std::int64_t rank(const Item& item) const {
    const bool counts = setup_.strategy == PruneStrategyIdentifier::VideoDownload && item.second <= 5;
    return item.lastAccessDate + (counts ? 101 : 0);
  }
  Items::iterator firstToGo() {
    return std::min_element(items_.begin(), items_.end(),
                            [&](const auto& a, const auto& b) { return rank(a.second) < rank(b.second); });
  }

  // --- Comparing ---

  static void expectFulfilled(const Outcome& outcome) {
    EXPECT_TRUE(outcome.isDone);
    EXPECT_EQ(outcome.error, nullptr) << outcome.what();
  }

  void expectReported() const { EXPECT_EQ(session_->lastReportedSize, std::make_optional(total())); }

  template <class Start> void expectSuccess(Start start) {
    int successes = 0;
    int failures = 0;
    start([&] { ++successes; },
          [&](const std::exception& error) {
            ++failures;
            ADD_FAILURE() << error.what();
          });
    session_->drain();
    EXPECT_EQ(successes, 1);
    EXPECT_EQ(failures, 0);
  }

  void verify() {
    std::set<std::string> expected;
    for (const auto& item : items_) expected.insert(item.first);
    const auto keys = session_->store->getAllKeys();
    EXPECT_EQ(std::set<std::string>(keys.begin(), keys.end()), expected);
    EXPECT_EQ(session_->store->getManifest()->count(), items_.size());
    EXPECT_EQ(session_->store->getManifest()->size(), total());

    const auto rows = ManifestOnDisk(storePath()).rows();
    EXPECT_EQ(rows.size(), items_.size());
    for (const auto& [key, item] : items_) {
      const auto inMemory = session_->store->getManifest()->getItem(key);
      ASSERT_NE(inMemory, nullptr) << key;
      EXPECT_EQ(inMemory->lastAccessDate, item.lastAccessDate) << key;
      EXPECT_EQ(inMemory->hasInlineData, setup_.inlineData) << key;
      ASSERT_EQ(rows.count(key), 1U) << key;
      const auto& row = rows.at(key);
      EXPECT_EQ(row.filename, key);
      EXPECT_EQ(row.size, item.value.size()) << key;
      EXPECT_EQ(row.modificationDate, item.modificationDate) << key;
      EXPECT_EQ(row.isInline, setup_.inlineData) << key;
      EXPECT_EQ(row.inlineData, setup_.inlineData ? item.value : Bytes()) << key;
    }

    std::map<std::string, Bytes> expectedFiles;
    if (!setup_.inlineData) {
      for (const auto& [key, item] : items_) expectedFiles[key] = item.value;
    }
    EXPECT_EQ(valueFiles(storePath()), expectedFiles);
  }

  std::string storePath() const { return directory_.file("store"); }

  Script& script_;
  Setup setup_;
  ScratchDirectory directory_;
  ManualClock clock_{kStart};
  std::int64_t now_ = kStart;
  std::int64_t lastInventedDate_ = 500'000'000;
  Items items_;
  GreedyDualSimulation greedyDual_;  // follows all operations, whatever the strategy
  std::unique_ptr<Session> session_;
};

TEST_F(StoreModel, WhatIsDoneOneCallAfterTheOtherComesOutExactly) { runAll<SettledSequence>(); }

// --- Many calls under way at once, their tasks interleaved at random, also in the middle of file operations ---

class InterleavedSequence {
 public:
  explicit InterleavedSequence(Script& script)
      : script_(script), setup_(script.setup()), isCorrupted_(script.oneIn(3)) {
    if (isCorrupted_) script_.say("with a manifest that is damaged now and then");
  }

  void play() {
    const LogCapture log;  // what purges and lost files have to say is not looked at here
    open();
    const unsigned int steps = 15 + script_.below(40);
    for (unsigned int i = 0; i < steps && !testing::Test::HasFailure(); ++i) {
      clock_.advance(static_cast<std::time_t>(script_.below(3)));
      call();
      pump(script_.below(4));
      if (script_.oneIn(12)) settle();
      if (script_.oneIn(15)) killAndLookAtWhatIsLeft();
      if (script_.oneIn(20)) restart();
    }
    settle();
    restart();
    settle();
  }

 private:
  // What has been asked of one key. Each call makes the next state, and they take effect in that order.
  struct History {
    std::vector<std::optional<Bytes>> states{std::nullopt};
    std::size_t acknowledged = 0;  // the latest state that has taken effect for certain
    unsigned int removals = 0;     // calls that take the key away
    unsigned int underWay = 0;     // calls that have not completed

    const std::optional<Bytes>& last() const { return states.back(); }
    std::size_t lastState() const { return states.size() - 1; }

    // Whether it may be in that state when what is under way may have begun or not.
    bool mayBe(const std::optional<Bytes>& state) const {
      const auto earliest = states.begin() + static_cast<std::ptrdiff_t>(acknowledged);
      return std::find(earliest, states.end(), state) != states.end();
    }
  };

  void open() {
    session_ = std::make_unique<Session>(storePath(), directory_.file("trash"), setup_, isCorrupted_);
    session_->files->interruption = [this] {
      if (script_.oneIn(4)) pump(1 + script_.below(3));
      if (script_.oneIn(80)) killAndLookAtWhatIsLeft();
    };
  }

  // Runs some of the tasks that wait, of either queue.
  void pump(unsigned int count) {
    for (; count > 0; --count) {
      const int first = static_cast<int>(script_.below(2));
      if (!session_->runNext(first)) session_->runNext(1 - first);
    }
  }

  void call() {
    const std::string key = script_.key();
    switch (script_.below(16)) {
      case 0:
      case 1:
      case 2:
      case 3:
      case 4:
        return storeValue(key);
      case 5:
        return storeWithFailingWriter(key);
      case 6:
      case 7:
      case 8:
        return fetch(key);
      case 9:
      case 10:
        return remove(key);
      case 11:
        return use(key);
      case 12:
        return prune();
      case 13:
        return expire();
      case 14:
        return clear();
      default:
        if (isCorrupted_ && script_.oneIn(2)) return corrupt();
        return script_.oneIn(4) ? failFileQueue() : fetchFirst();
    }
  }

  // --- Calls ---

  void becomes(const std::string& key, const std::optional<Bytes>& value) {
    History& history = histories_[key];
    history.states.push_back(value);
    if (!value) ++history.removals;
  }

  // A store that is going answers without having done anything.
  void acknowledge(const std::string& key, std::size_t state) {
    if (isEnding_) return;
    std::size_t& acknowledged = histories_[key].acknowledged;
    acknowledged = std::max(acknowledged, state);
  }

  // Calls may fail when their store is going, or when the file queue has not done its part.
  bool mayFail(const Outcome& outcome) const {
    return isEnding_ || (hasFailedQueue_ && (outcome.failedWith<std::future_error>() || outcome.what() == kRefusal));
  }

  // Follows a call on the key. What changes it has made the latest state.
  OnDone completing(const std::string& call, const std::string& key,
                    std::function<bool(const Outcome&)> mayEndThus = nullptr) {
    ++histories_[key].underWay;
    ++underWay_;
    return [this, call, key, state = histories_[key].lastState(), mayEndThus](const Outcome& outcome) {
      --histories_[key].underWay;
      --underWay_;
      const bool isFine = outcome.error == nullptr || (mayEndThus && mayEndThus(outcome));
      EXPECT_TRUE(isFine || mayFail(outcome)) << call << " " << key << ": " << outcome.what();
      if (isFine && call != "use") acknowledge(key, state);
    };
  }

  void storeValue(const std::string& key) {
    const Bytes value = script_.value();
    script_.say("store " + key + " (" + std::to_string(value.size()) + " bytes)");
    isLossy_ = isLossy_ || setup_.capacity.has_value();
    becomes(key, value);
    watch(session_->store->store(key, value, metadata(static_cast<int>(script_.below(10)))), completing("store", key));
  }

  // Half a file, and then an exception.
  void storeWithFailingWriter(const std::string& key) {
    if (setup_.inlineData || isCorrupted_) return;  // a record that cannot be taken back is a matter of its own
    script_.say("store " + key + " with a writer that fails");
    isLossy_ = isLossy_ || setup_.capacity.has_value();
    becomes(key, std::nullopt);
    const auto writer = [files = session_->files](const std::string& path) -> unsigned int {
      files->writeFile(path, {'h', 'a', 'l', 'f'});
      throw WriterFailed();
    };
    // One that was revoked before it began has not failed.
    const auto isTheWriters = [](const Outcome& outcome) { return outcome.failedWith<WriterFailed>(); };
    watch(session_->store->store(key, nullptr, writer), completing("store in vain", key, isTheWriters));
  }

  void remove(const std::string& key) {
    script_.say("remove " + key);
    becomes(key, std::nullopt);
    // A purge on the other queue may take the file away just before the removal does.
    const auto missesItsFile = [this](const Outcome& outcome) {
      return wasCorrupted_ && outcome.failedWith<FileUtilsIoException>();
    };
    watch(session_->store->removeItem(key), completing("remove", key, missesItsFile));
  }

  void use(const std::string& key) {
    script_.say("use " + key);
    watch(session_->store->updateLastAccessDate(key), completing("use", key));
  }

  void fetch(const std::string& key) {
    script_.say("fetch " + key);
    const std::size_t state = histories_[key].states.size() - 1;
    const unsigned int removals = histories_[key].removals;
    const bool isBeingCleared = deletionsUnderWay_ > 0;
    ++underWay_;
    watch(session_->store->fetch(key), [=](const Outcome& outcome) {
      --underWay_;
      if (isEnding_ || hasFailedQueue_) return;
      EXPECT_EQ(outcome.error, nullptr) << "fetch " << key << ": " << outcome.what();
      expectSeen(outcome, key, state, removals, isBeingCleared);
    });
  }

  void expectSeen(const Outcome& outcome, const std::string& key, std::size_t state, unsigned int removals,
                  bool isBeingCleared) {
    const History& history = histories_[key];
    const std::optional<Bytes>& atCall = history.states[state];
    if (outcome.result == nullptr) {
      EXPECT_TRUE(!atCall || isLossy_ || history.removals > removals) << "fetch " << key << " is a miss";
      return;
    }
    EXPECT_EQ(outcome.result->key, key);
    if (atCall && outcome.result->value == *atCall) return;
    // An inline value is read when its turn comes, and may be a later one by then. A clear goes from batch to batch.
    const auto earliest = history.states.begin() + static_cast<std::ptrdiff_t>(isBeingCleared ? 0 : state);
    const bool wasStored =
        std::find(earliest, history.states.end(), std::make_optional(outcome.result->value)) != history.states.end();
    EXPECT_TRUE(wasStored && (isBeingCleared || (setup_.inlineData && atCall)))
        << "fetch " << key << " got " << std::string(outcome.result->value.begin(), outcome.result->value.end());
  }

  void fetchFirst() {
    const std::vector<std::string> keys = {script_.key(), script_.key()};
    script_.say("fetch the first of " + keys[0] + " " + keys[1]);
    std::string expected;
    bool mayMiss = false;  // an earlier key is found and lost again when its write fails
    for (const std::string& key : keys) {
      if (!expected.empty()) break;
      if (histories_[key].last()) {
        expected = key;
      } else {
        mayMiss = mayMiss || histories_[key].underWay > 0;
      }
    }
    const std::size_t state = expected.empty() ? 0 : histories_[expected].states.size() - 1;
    const unsigned int removals = expected.empty() ? 0 : histories_[expected].removals;
    const bool isBeingCleared = deletionsUnderWay_ > 0;
    ++underWay_;
    const auto loader = [store = std::weak_ptr<PersistentKeyValueStore>(session_->store)](
                            std::shared_ptr<const DiskCacheItem> item, const std::string& path, Bytes& value) {
      return store.lock()->readValue(std::move(item), path, value);
    };
    watch(session_->store->fetchFirst(keys, loader), [=](const Outcome& outcome) {
      --underWay_;
      if (isEnding_ || isLossy_ || isBeingCleared || hasFailedQueue_) return;
      EXPECT_EQ(outcome.error, nullptr) << outcome.what();
      if (expected.empty()) {
        EXPECT_EQ(outcome.result, nullptr);
      } else if (outcome.result != nullptr || !mayMiss) {
        expectSeen(outcome, expected, state, removals, false);
      }
    });
  }

  void clear() {
    script_.say("clear");
    std::map<std::string, std::size_t> cleared;
    for (auto& [key, history] : histories_) {
      becomes(key, std::nullopt);
      cleared[key] = history.lastState();
    }
    start([&](auto onSuccess, auto onError) { session_->store->clear(onSuccess, onError); },
          [this, cleared] { expectCleared(cleared); });
  }

  void expectCleared(const std::map<std::string, std::size_t>& cleared) {
    for (const auto& [key, state] : cleared) {
      acknowledge(key, state);
      const bool isStoredSince = histories_[key].lastState() > state;
      const bool hasFile = !setup_.inlineData && fs::exists(storePath() + "/" + key);
      EXPECT_TRUE(isEnding_ || isStoredSince || mayLeaveFiles_ || !hasFile) << key << " is cleared, its file is there";
    }
  }

  // What waits for the file queue never runs, or what is asked of it now is refused.
  void failFileQueue() {
    hasFailedQueue_ = true;
    mayLeaveFiles_ = true;
    ManualExecutor& files = session_->queue(Session::kFileQueue);
    if (script_.oneIn(2)) {
      script_.say("the file queue drops what waits");
      return files.dropAll();
    }
    script_.say("the file queue refuses for a while");
    files.throwOnDispatch(true);
    const auto interruption = std::exchange(session_->files->interruption, nullptr);  // deletions hold a lock now
    pump(1 + script_.below(3));
    session_->files->interruption = interruption;
    files.throwOnDispatch(false);
  }

  void prune() {
    if (!setup_.isDiskCache) return;
    script_.say("prune");
    isLossy_ = true;
    start([&](auto onSuccess, auto onError) {
      session_->cache->pruneBackToNormal(onSuccess, onError, script_.oneIn(2));
    });
  }

  void expire() {
    script_.say("expire");
    isLossy_ = true;
    session_->store->overrideConfiguration(static_cast<long>(script_.below(30)));
    session_->store->startStaleItemRemoval();
  }

  void corrupt() {
    script_.say("damage the manifest");
    isLossy_ = true;
    wasCorrupted_ = true;
    session_->corruptAfter(script_.below(4));
  }

  // Exactly one of the callbacks is called, and it is the first; none, when the store goes meanwhile.
  template <class Start> void start(Start startNow, std::function<void()> onSuccess = nullptr) {
    ++deletionsUnderWay_;
    startNow(
        [this, onSuccess] {
          --deletionsUnderWay_;
          if (onSuccess) onSuccess();
        },
        [this](const std::exception& error) {
          --deletionsUnderWay_;
          if (!isEnding_ && !hasFailedQueue_) ADD_FAILURE() << error.what();
        });
  }

  // --- Ends ---

  void restart() {
    isEnding_ = true;
    // A manifest that is damaged would be found out when it is next opened; this one is not.
    session_->heal();
    const unsigned int kind = script_.below(4);
    if (kind == 0) {
      script_.say("restart when all is done");
      session_->drain();
      session_->drop();
    } else if (kind == 1) {
      script_.say("let the store go in the middle");
      session_->drop();
      session_->drain();
    } else if (kind == 2) {
      script_.say("let store and queues go in the middle");
      session_->drop();
      session_->queue(Session::kFileQueue).dropAll();
      session_->queue(Session::kWorkQueue).dropAll();
      session_->drain();
    } else {
      script_.say("invalidate in the middle");
      session_->store->invalidateSoon();
      session_->drain();
      session_->drop();
    }
    EXPECT_EQ(underWay_, 0U) << "calls that never completed";
    mayLeaveFiles_ = mayLeaveFiles_ || kind == 1 || kind == 2;  // whose deletion was waiting
    session_.reset();
    isEnding_ = false;
    deletionsUnderWay_ = 0;
    takeOver();
    open();
    session_->drain();
    verify();
  }

  // After an end in the middle each key is in one of the states that it has been asked to take since the last that was
  // acknowledged.
  void takeOver() {
    const auto rows = ManifestOnDisk(storePath()).rows();
    const auto files = valueFiles(storePath());
    for (const auto& [key, row] : rows) {
      ASSERT_TRUE(setup_.inlineData || files.count(key) > 0) << "record without a file: " << key;
      EXPECT_EQ(row.size, (setup_.inlineData ? row.inlineData : files.at(key)).size()) << key;
    }
    for (const auto& file : files) {
      if (rows.count(file.first) > 0) continue;
      EXPECT_TRUE(mayLeaveFiles_) << "file without a record: " << file.first;
      fs::remove(storePath() + "/" + file.first);
    }
    for (auto& [key, history] : histories_) {
      const auto row = rows.find(key);
      std::optional<Bytes> state;
      if (row != rows.end()) state = setup_.inlineData ? row->second.inlineData : files.at(key);
      expectPossible(key, state);
      rest(history, state);
    }
    isLossy_ = hasFailedQueue_ = mayLeaveFiles_ = false;
  }

  void expectPossible(const std::string& key, const std::optional<Bytes>& state) {
    const bool isPossible = histories_[key].mayBe(state) || (!state && isLossy_);
    EXPECT_TRUE(isPossible) << key << " holds what was never stored or is long gone: "
                            << (state ? std::string(state->begin(), state->end()) : "nothing");
  }

  static void rest(History& history, const std::optional<Bytes>& state) {
    history = History();
    history.states.back() = state;
  }

  // Runs everything, compares, and takes what has been lost where something may be lost for the new beginning.
  void settle() {
    session_->drain();
    EXPECT_EQ(underWay_, 0U) << "calls that never completed";
    EXPECT_EQ(deletionsUnderWay_, 0U) << "a clear or prune that called nobody back";
    verify();
    const auto rows = ManifestOnDisk(storePath()).rows();
    const auto files = valueFiles(storePath());
    for (auto& [key, history] : histories_) {
      const auto row = rows.find(key);
      std::optional<Bytes> state;
      if (row != rows.end()) state = setup_.inlineData ? row->second.inlineData : files.at(key);
      rest(history, state);
    }
    isLossy_ = hasFailedQueue_ = false;
  }

  // All is done: files, records on disk and records in memory say the same, and it is what the calls asked for.
  void verify() {
    session_->heal();  // nobody has met it
    const auto manifest = session_->store->getManifest();
    const auto rows = ManifestOnDisk(storePath()).rows();
    const auto files = valueFiles(storePath());
    const auto keys = manifest->getAllKeys();
    std::uint32_t total = 0;
    EXPECT_EQ(rows.size(), keys.size());
    for (const std::string& key : keys) {
      const auto item = manifest->getItem(key);
      ASSERT_NE(item, nullptr) << key;
      total += item->size;
      ASSERT_EQ(rows.count(key), 1U) << key;
      const auto& row = rows.at(key);
      EXPECT_EQ(row.size, item->size) << key;
      EXPECT_EQ(row.modificationDate, item->modificationDate) << key;
      EXPECT_EQ(row.isInline, setup_.inlineData) << key;
      EXPECT_EQ(item->hasInlineData, setup_.inlineData) << key;
      ASSERT_TRUE(setup_.inlineData || files.count(key) > 0) << "record without a file: " << key;
      const Bytes& value = setup_.inlineData ? row.inlineData : files.at(key);
      EXPECT_EQ(row.size, value.size()) << key;
      expectAtRest(key, value);
    }
    for (const auto& file : files) {
      EXPECT_TRUE(rows.count(file.first) == 1 || mayLeaveFiles_) << "file without a record: " << file.first;
    }
    for (const auto& history : histories_) {
      if (rows.count(history.first) == 0) expectAtRest(history.first, std::nullopt);
    }
    EXPECT_EQ(manifest->size(), total);
    if (setup_.capacity && !wasCorrupted_) {
      EXPECT_LE(manifest->count(), *setup_.capacity);
    }
  }

  // The last call has decided, unless the file queue has not done its part in that.
  void expectAtRest(const std::string& key, const std::optional<Bytes>& state) {
    if (hasFailedQueue_) return expectPossible(key, state);
    EXPECT_TRUE(state == histories_[key].last() || (!state && isLossy_))
        << key << (state ? " came back or is not the last" : " is lost");
  }

  // The files as they are at this moment, seen by the next process.
  void killAndLookAtWhatIsLeft() {
    if (testing::Test::HasFailure() || isEnding_) return;
    script_.say("killed");
    const std::string copy = directory_.file("copy");
    fs::copy(storePath(), copy);
    {
      Session next(copy, directory_.file("copy trash"), setup_, false);
      next.drain();
      for (const auto& [key, history] : histories_) {
        const auto outcome = watch(next.store->fetch(key));
        next.drain();
        EXPECT_TRUE(outcome->isDone);
        if (history.underWay > 0 || deletionsUnderWay_ > 0 || hasFailedQueue_) continue;  // old, new or a part
        expectLeft(*outcome, key, history);
      }
    }
    fs::remove_all(copy);
  }

  void expectLeft(const Outcome& outcome, const std::string& key, const History& history) {
    if (isLossy_ && outcome.error != nullptr) return;  // its file was just about to follow its record
    EXPECT_EQ(outcome.error, nullptr) << key << ": " << outcome.what();
    if (outcome.result == nullptr) {
      EXPECT_TRUE(!history.last() || isLossy_) << key << " did not survive";
      return;
    }
    ASSERT_TRUE(history.last()) << key << " came back after the process was killed";
    EXPECT_EQ(outcome.result->value, *history.last()) << key;
  }

  std::string storePath() const { return directory_.file("store"); }

  Script& script_;
  const Setup setup_;
  const bool isCorrupted_;
  ScratchDirectory directory_;
  ManualClock clock_{kStart};
  std::map<std::string, History> histories_;
  unsigned int underWay_ = 0;
  unsigned int deletionsUnderWay_ = 0;
  bool isLossy_ = false;         // since the last rest something may have taken any item away
  bool wasCorrupted_ = false;    // writes that were queued beside a purge may have gone past the capacity
  bool hasFailedQueue_ = false;  // since the last rest some calls have not been carried out
  bool mayLeaveFiles_ = false;   // since the last beginning a deletion may have been dropped
  bool isEnding_ = false;        // calls may fail now
  std::unique_ptr<Session> session_;
};

TEST_F(StoreModel, WhatIsDoneAllAtOnceTakesEffectInTheOrderOfTheCalls) { runAll<InterleavedSequence>(); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
