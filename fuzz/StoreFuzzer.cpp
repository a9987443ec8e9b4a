// A store's directory made of the input, opened as a key-value store or a disk cache, used, closed and opened again.
// Whatever lies there: every operation ends once and as described, a value that was stored is delivered as it is or not
// at all, and afterwards the store works.

#include <cstdint>
#include <filesystem>
#include <functional>
#include <future>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "AttributeStore.h"
#include "DiskCache.h"
#include "DiskSizeCalculator.h"
#include "ExtendedMetadata.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "PruneStrategy.h"
#include "TrashCollector.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"
#include "harness/Scratch.h"
#include "harness/StoreDirectory.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

using FetchResult = PersistentKeyValueStore::FetchResult;

constexpr std::time_t kNow = 1'700'000'000;
constexpr int kMostOperations = 48;

// What an application's sandbox is on a device: nothing outside the scratch directory can be touched, whatever a key or
// a planted record says.
class Sandbox final : public FileUtils {
 public:
  explicit Sandbox(std::string root) : root_(std::move(root)) {}

  std::vector<unsigned char> readFile(const std::string& path) override { return FileUtils::readFile(inside(path)); }
  void writeFile(const std::string& path, const std::vector<unsigned char>& data) override {
    FileUtils::writeFile(inside(path), data);
  }
  void deleteFile(const std::string& path) override { FileUtils::deleteFile(inside(path)); }

 private:
  const std::string& inside(const std::string& path) const {
    const std::string plain = std::filesystem::path(path).lexically_normal().string();
    if (plain.rfind(root_ + "/", 0) != 0) throw FileUtilsIoException(EACCES, "Outside the sandbox");
    return path;
  }

  const std::string root_;
};

class CountingTrash final : public TrashCollector {
 public:
  using TrashCollector::TrashCollector;
  bool collectPath(const std::string& path) override {
    ++count;
    return TrashCollector::collectPath(path);
  }
  int count = 0;
};

struct Options {
  explicit Options(ByteReader& input) {
    const std::uint8_t flags = input.byte();
    isDiskCache = (flags & 1U) != 0;
    inlineData = (flags & 2U) != 0;
    hasMetadata = (flags & 4U) != 0;
    if ((flags & 8U) != 0) capacity = (flags >> 5U) + 1U;
    if ((flags & 16U) != 0) staleAge = 60;
  }

  bool isDiskCache;
  bool inlineData;
  bool hasMetadata;
  std::optional<std::uint64_t> capacity;
  long staleAge = 1'000'000'000;
};

// How an operation ended.
struct Ending {
  int completions = 0;
  std::string failure;                 // "" for none
  std::unique_ptr<FetchResult> value;  // of a fetch
};

template <class T> std::shared_ptr<Ending> watch(Future<T> future) {
  auto ending = std::make_shared<Ending>();
  future.then(nullptr, [ending](std::future<T>& result) {
    ++ending->completions;
    try {
      if constexpr (std::is_void_v<T>) {
        result.get();
      } else {
        ending->value = result.get();
      }
    } catch (const LarderException& error) {
      ending->failure = error.what();
    } catch (const std::invalid_argument& error) {  // a reserved key
      ending->failure = error.what();
    }
  });
  return ending;
}

class StoreUse {
 public:
  StoreUse(const Scratch& scratch, const Options& options, StoreDirectory directory)
      : options_(options),
        directory_(std::move(directory)),
        files_(std::make_shared<Sandbox>(scratch.path())),
        trash_(std::make_shared<CountingTrash>(scratch.file("trash"), files_, nullptr, nullptr)),
        isStrict_(directory_.isSound && directory_.namesAgree) {}

  void open() {
    queues_ = std::make_shared<test::ManualQueueFactory>();
    const auto onSize = [this](unsigned int size) { lastSize_ = size; };
    const std::string temporary = directory_.path + "-temporary";
    if (options_.isDiskCache) {
      cache_ = DiskCache::createDiskCache(
          directory_.path, temporary, "store", options_.capacity, options_.staleAge, 1000, 10, options_.inlineData,
          queues_, options_.hasMetadata ? std::make_shared<VideoDownloadExtendedMetadataFactory>() : nullptr, trash_,
          options_.hasMetadata ? PruneStrategyFactory(static_cast<PruneStrategyIdentifier>(2)) : nullptr, nullptr,
          nullptr, files_, onSize, 3);
      store_ = cache_;
    } else {
      store_ = PersistentKeyValueStore::createPersistentKeyValueStore(
          directory_.path, temporary, "store", options_.capacity, options_.staleAge, options_.inlineData, queues_,
          trash_, nullptr, nullptr, files_, onSize, 3);
    }
    settle();
  }

  void close() {
    settle();
    store_.reset();
    cache_.reset();
    queues_.reset();
  }

  // Runs the queues until nothing is left. What the description lets out of a task may come out.
  void settle() {
    for (bool done = false; !done;) {
      try {
        queues_->runAll();
        done = true;
      } catch (const ManifestPersistenceException&) {
      } catch (const FileUtilsIoException&) {
      }
    }
    notePurges();
  }

  void store(const std::string& key, const std::string& value) {
    const auto ending = finished(store_->store(key, bytesOf(value)));
    expected_.erase(key);
    if (ending->failure.empty()) expected_[key] = value;
    notePurges();
  }

  std::optional<std::string> fetch(const std::string& key) {
    const auto ending = finished(store_->fetch(key));
    notePurges();
    const auto known = expected_.find(key);
    if (ending->value == nullptr) {
      const bool mayFail = known == expected_.end() || !isStrict_;
      check(ending->failure.empty() || mayFail, "a value that was stored can be read", ending->failure);
      return std::nullopt;
    }
    const std::string value(ending->value->value.begin(), ending->value->value.end());
    const bool isBeyondDoubt = isStrict_ || !options_.inlineData;
    if (known != expected_.end() && isBeyondDoubt) check(value == known->second, "a value is its own key's", key);
    check(ending->value->key == key, "a value comes with its key", key);
    return value;
  }

  void remove(const std::string& key) {
    const bool removed = finished(store_->removeItem(key))->failure.empty();
    notePurges();
    if (expected_.erase(key) > 0 && removed) checkLeavesNoFile(key);
    check(finished(store_->fetch(key))->value == nullptr, "what was removed is a miss", key);
  }

  void touch(const std::string& key) { (void)finished(store_->updateLastAccessDate(key)); }

  void clear() {
    const bool failed = runToTheEnd([this](auto onSuccess, auto onError) { store_->clear(onSuccess, onError); });
    for (const auto& [key, value] : std::exchange(expected_, {})) {
      if (!failed && isStrict_) checkLeavesNoFile(key);
    }
  }

  void prune(bool survival) {
    if (cache_ == nullptr) return;
    const auto error = runToTheEnd(
        [this, survival](auto onSuccess, auto onError) { cache_->pruneBackToNormal(onSuccess, onError, survival); });
    if (!error) check(lastSize_ <= (survival ? 10U : 1000U), "a cache that was pruned is within its size");
  }

  void expire() {
    for (const long seconds : {300L, 3600L}) {
      bool fired = false;
      try {
        fired = workQueue().fireTimer(seconds * 1'000'000'000);
      } catch (const ManifestPersistenceException&) {
      }
      if (fired) break;
    }
    settle();
    check(!workQueue().armedDelays().empty(), "the next expiry is armed");
  }

  void list() {
    try {
      const auto keys = store_->getAllKeys();
      check(std::set<std::string>(keys.begin(), keys.end()).size() == keys.size(), "a key is listed once");
      for (const std::string& key : keys) {
        if (key.find('\0') == std::string::npos && !isReserved(key)) (void)store_->fetchModificationDate(key);
      }
    } catch (const DiskCacheManifestException&) {  // it could not be loaded
    } catch (const ManifestPersistenceException&) {
    }
    notePurges();
  }

  void measure() {
    const auto attributes = std::make_shared<AttributeStore>(files_);
    DiskSizeCalculator sizes(files_, attributes, nullptr);
    (void)sizes.calculateDirectorySize(directory_.path);
    (void)sizes.fetchDirectorySize(directory_.path);
    attributes->remove(directory_.path);
  }

  // Everything that was known is there after a restart, or a miss where something took it.
  void reopen() {
    std::set<std::string> there;
    for (const auto& [key, value] : std::map<std::string, std::string>(expected_)) {
      if (fetch(key)) there.insert(key);
    }
    const int purges = trash_->count;
    close();
    open();
    for (const std::string& key : there) {
      const bool found = fetch(key).has_value();
      check(found || !isStrict_ || trash_->count > purges, "a restart loses nothing", key);
    }
  }

  // A manifest that cannot be opened fails each operation for as long as that is so. A link to one that can is in use.
  void clearTheManifestsPlace() {
    for (const char* companion : {"", "-wal", "-shm", "-journal"}) {
      const std::filesystem::path path = directory_.path + "/manifest_v1.sqlite" + companion;
      if (!std::filesystem::is_regular_file(path)) std::filesystem::remove_all(path);
    }
  }

  // The damage may be met only now, and purge the store; after that nothing is in its way.
  void checkWorks() {
    clearTheManifestsPlace();
    const std::string key = "a key that no input can make, longer than " + std::string(150, 'k');
    for (int attempt = 1; attempt <= 3; ++attempt) {
      store(key, "works");
      if (fetch(key) == "works") {
        remove(key);
        return;
      }
    }
    check(!isStrict_ && options_.inlineData, "a store works whatever it was opened on");
  }

  const std::vector<std::string>& names() const { return directory_.names; }

 private:
  test::ManualExecutor& workQueue() const { return *queues_->workQueue(0); }

  template <class T> std::shared_ptr<Ending> finished(Future<T> future) {
    auto ending = watch(std::move(future));
    settle();
    check(ending->completions == 1, "an operation ends once");
    return ending;
  }

  // Whether it ended in an error.
  bool runToTheEnd(
      const std::function<void(std::function<void()>, std::function<void(const std::exception&)>)>& begin) {
    int successes = 0;
    int errors = 0;
    begin([&] { ++successes; }, [&](const std::exception&) { ++errors; });
    settle();
    check(successes + errors == 1, "a run of deletions ends once");
    return errors == 1;
  }

  void checkLeavesNoFile(const std::string& key) const {
    check(options_.inlineData || !files_->pathExists(directory_.path + "/" + key), "what was removed has no file", key);
  }

  static bool isReserved(const std::string& key) {
    return key.find("manifest_v1") != std::string::npos || key.find("_cellar") != std::string::npos;
  }

  // A purge takes every value, and whatever was wrong with the manifest.
  void notePurges() {
    if (trash_->count == purges_) return;
    purges_ = trash_->count;
    expected_.clear();
    isStrict_ = false;  // the operation under way may have come after it
  }

  const Options options_;
  const StoreDirectory directory_;
  const std::shared_ptr<Sandbox> files_;
  const std::shared_ptr<CountingTrash> trash_;
  std::shared_ptr<test::ManualQueueFactory> queues_;
  std::shared_ptr<PersistentKeyValueStore> store_;
  std::shared_ptr<DiskCache> cache_;
  std::map<std::string, std::string> expected_;  // what was stored and not removed since
  bool isStrict_;
  int purges_ = 0;
  unsigned int lastSize_ = 0;
};

std::string keyFrom(ByteReader& input, const std::vector<std::string>& names) {
  static const std::vector<std::string> known = {
      "a", "b", "c", "d", "", ".", "..", "in/a directory", "manifest_v1.sqlite", std::string("z\0z", 3)};
  const std::size_t number = input.byte() % (known.size() + names.size());
  const std::string& key = number < known.size() ? known[number] : names[number - known.size()];
  return key.find("..") == std::string::npos || key == ".." ? key : "a";  // stays near
}

void operate(StoreUse& use, ByteReader& input, test::ManualClock& clock) {
  const std::uint8_t operation = input.byte();
  switch (operation % 12) {
    case 0:
    case 1:
    case 2: {
      const std::string key = keyFrom(input, use.names());
      return use.store(key, key + " " + input.text());
    }
    case 3:
    case 4:
      (void)use.fetch(keyFrom(input, use.names()));
      return;
    case 5:
      return use.remove(keyFrom(input, use.names()));
    case 6:
      return use.touch(keyFrom(input, use.names()));
    case 7:
      return use.prune(operation >= 128);
    case 8:
      return use.expire();
    case 9:
      return operation >= 192 ? use.clear() : use.list();
    case 10:
      return operation >= 128 ? use.reopen() : use.measure();
    default:
      clock.advance(input.byte());
  }
}

void run(ByteReader input) {
  test::ManualClock clock(kNow);
  const Scratch scratch;
  const Options options(input);
  StoreUse use(scratch, options, buildStoreDirectory(scratch, input));
  use.open();
  for (int i = 0; i < kMostOperations && !input.atEnd(); ++i) operate(use, input, clock);
  use.list();
  use.reopen();
  use.checkWorks();
  use.reopen();
  use.checkWorks();
  use.close();
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
