#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <ctime>
#include <exception>
#include <functional>
#include <future>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "DiskCacheManifest.h"
#include "Future.h"
#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "StoreOptions.h"
#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Bytes.h"
#include "support/FaultyManifest.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/MemoryPersistence.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {

using FetchResult = PersistentKeyValueStore::FetchResult;

// What an exception says; "" for none.
inline std::string whatOf(const std::exception_ptr& failure) {
  if (failure == nullptr) return "";
  try {
    std::rethrow_exception(failure);
  } catch (const std::exception& error) {
    return error.what();
  } catch (...) {
    return "something else";
  }
}

template <class Exception> bool isA(const std::exception_ptr& failure) {
  if (failure == nullptr) return false;
  try {
    std::rethrow_exception(failure);
  } catch (const Exception&) {
    return true;
  } catch (...) {
    return false;
  }
}

// Whether the exception has one of that type nested in it.
template <class Exception> bool hasNested(const std::exception_ptr& failure) {
  try {
    std::rethrow_exception(failure);
  } catch (const std::nested_exception& error) {
    return isA<Exception>(error.nested_ptr());
  } catch (...) {
    return false;
  }
}

// What has become of a future, told by its callback.
template <class T> struct Outcome {
  int completions = 0;
  std::exception_ptr failure;
  std::optional<T> value;

  bool isPending() const { return completions == 0; }
  bool hasSucceeded() const { return completions == 1 && failure == nullptr; }
};

struct Done {};
using Written = std::shared_ptr<Outcome<Done>>;
using Fetched = std::shared_ptr<Outcome<std::unique_ptr<FetchResult>>>;

inline Written watch(Future<void> future) {
  auto outcome = std::make_shared<Outcome<Done>>();
  future.then(nullptr, [outcome](std::future<void>& result) {
    ++outcome->completions;
    try {
      result.get();
      outcome->value = Done();
    } catch (...) {
      outcome->failure = std::current_exception();
    }
  });
  return outcome;
}

inline Fetched watch(Future<std::unique_ptr<FetchResult>> future) {
  auto outcome = std::make_shared<Outcome<std::unique_ptr<FetchResult>>>();
  future.then(nullptr, [outcome](std::future<std::unique_ptr<FetchResult>>& result) {
    ++outcome->completions;
    try {
      outcome->value = result.get();
    } catch (...) {
      outcome->failure = std::current_exception();
    }
  });
  return outcome;
}

// "<pending>", "<miss>", "<error>" with its text, or the value.
inline std::string told(const Fetched& fetched) {
  if (fetched->isPending()) return "<pending>";
  if (fetched->failure != nullptr) return "<error> " + whatOf(fetched->failure);
  const std::unique_ptr<FetchResult>& result = *fetched->value;
  return result == nullptr ? "<miss>" : textOf(result->value);
}

// "<pending>", "<done>" or "<error>" with its text.
inline std::string told(const Written& written) {
  if (written->isPending()) return "<pending>";
  return written->failure == nullptr ? "<done>" : "<error> " + whatOf(written->failure);
}

// What an operation of an invalidated store says.
inline const std::string kInvalid =
    "domain: QZInvalidatedExceptionErrorDomain; code: 0; description: Store has been invalidated. .";

// A store with everything around it under the test's control: its queues, its files, its collector and the time.
class KeyValueStoreFixture : public testing::Test {
 public:
  static constexpr std::time_t kStart = 1'000'000;

  KeyValueStoreFixture() {
    options.directory = storePath();
    options.temporaryDirectory = directory.file("temporary");
    options.name = "larder";
    options.staleAge = 1000;
    options.onSizeChanged = [this](unsigned int size) { sizes.push_back(size); };
  }

  // --- The store's life ---

  // Creates the store; its loading waits on the work queue.
  void openUnloaded() {
    if (isDiskCache) {
      store = DiskCache::create(options, services());
    } else {
      store = PersistentKeyValueStore::create(options, services());
    }
  }

  void open() {
    openUnloaded();
    settle();
  }

  // The store over a manifest that fails on demand and keeps its records in `medium`.
  void openWatched() {
    openWatchedUnloaded();
    settle();
    manifest->clearTrace();
    files->clearTrace();
  }

  void openWatchedUnloaded() {
    manifest = std::make_shared<FaultyManifest>(std::make_shared<DiskCacheManifest>(
        std::make_unique<MemoryPersistence>(medium), std::make_shared<ManualExecutor>(), nullptr));
    options.manifest = manifest;
    openUnloaded();
  }

  void close() {
    settle();
    store.reset();
    settle();
    options.manifest.reset();
    manifest.reset();
  }

  void reopen() {
    close();
    open();
  }

  void reopenWatched() {
    close();
    openWatched();
  }

  StoreServices services() const { return {queues, trash, files, reporter, incidents.reporter}; }

  // --- The queues of the latest store ---

  ManualExecutor& work() const { return *queues->workQueue(queues->workQueueCount() - 1); }
  ManualExecutor& file() const { return *queues->queue(queues->queueCount() - 1); }
  void settle() const { queues->runAll(); }
  bool fire(long seconds) const { return work().fireTimer(seconds * kSecond); }

  // --- What operations are given ---

  static PersistentKeyValueStore::Loader answering(const std::string& value) {
    return [value](const std::shared_ptr<const DiskCacheItem>&, const std::string&, Bytes& bytes) {
      bytes = bytesOf(value);
      return true;
    };
  }

  // Writes the text to the file it is told, and claims a size of its own.
  PersistentKeyValueStore::Writer writing(const std::string& value, unsigned int size) const {
    return [files = files, value, size](const std::string& path) {
      files->writeFile(path, bytesOf(value));
      return size;
    };
  }

  // How a batched deletion ends, in `ending`.
  std::function<void()> onSuccess() {
    return [this] { ending += "<done>"; };
  }
  std::function<void(const std::exception&)> onError() {
    return [this](const std::exception& error) { ending += std::string("<error> ") + error.what(); };
  }

  // --- Operations, to the end ---

  void put(const std::string& key, const std::string& value) {
    const Written written = watch(store->store(key, bytesOf(value)));
    settle();
    ASSERT_EQ(told(written), "<done>") << key;
  }

  std::string get(const std::string& key) {
    const Fetched fetched = watch(store->fetch(key));
    settle();
    return told(fetched);
  }

  void putMany(int count, const std::string& value = "v") {
    for (int i = 0; i < count; ++i) put("key" + std::to_string(i), value);
  }

  std::string drop(const std::string& key) {
    const Written removed = watch(store->removeItem(key));
    settle();
    return told(removed);
  }

  // How a clear ended.
  std::string clear() {
    ending.clear();
    store->clear(onSuccess(), onError());
    settle();
    return ending.empty() ? "<pending>" : ending;
  }

  // --- What is there ---

  std::string storePath() const { return directory.file("store"); }
  std::string pathOf(const std::string& key) const { return storePath() + "/" + key; }

  // The names of the value files.
  std::vector<std::string> valueFiles() const {
    std::vector<std::string> names = directory.names("store");
    const auto isManifest = [](const std::string& name) { return name.rfind("manifest_v1.sqlite", 0) == 0; };
    names.erase(std::remove_if(names.begin(), names.end(), isManifest), names.end());
    return names;
  }

  std::string valueFile(const std::string& key) const { return directory.read("store/" + key); }

  // Every key with what a fetch says of it.
  std::map<std::string, std::string> contents() {
    std::map<std::string, std::string> values;
    for (const std::string& key : store->getAllKeys()) values[key] = get(key);
    return values;
  }

  // The rows of the database, seen by a connection of the test's own: "key filename size inline date date data".
  std::vector<std::string> rowsOnDisk() const {
    sqlite3* database = nullptr;
    const std::string path = pathOf("manifest_v1.sqlite");
    EXPECT_EQ(sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK) << path;
    std::vector<std::string> rows;
    const auto collect = [](void* target, int, char** values, char**) {
      static_cast<std::vector<std::string>*>(target)->emplace_back(values[0]);
      return 0;
    };
    EXPECT_EQ(sqlite3_exec(database,
                           "SELECT key || ' ' || filename || ' ' || size || ' ' || has_inline_data || ' ' || "
                           "modification_date || ' ' || last_access_date || ' ' || ifnull(inline_data, '-') "
                           "FROM LarderManifest ORDER BY key",
                           collect, &rows, nullptr),
              SQLITE_OK);
    sqlite3_close(database);
    return rows;
  }

  std::vector<std::string> keysInMedium() const { return medium->keys(); }

  // From now on every call of the watched manifest and every change or reading of the store's files, in one order, in
  // `journal`.
  void keepJournal() {
    journal.clear();
    manifest->onCall = [this](ManifestCall, const std::string& text) { journal.push_back(text); };
    files->onCall = [this](Operation operation, const std::string& path) {
      static const std::map<Operation, std::string> names = {{Operation::ReadFile, "readFile"},
                                                             {Operation::WriteFile, "writeFile"},
                                                             {Operation::DeleteFile, "deleteFile"},
                                                             {Operation::CreateDirectory, "createDirectory"}};
      const auto name = names.find(operation);
      const bool isTheStores = path.rfind(storePath(), 0) == 0;
      if (name != names.end() && isTheStores) journal.push_back(name->second + " " + path.substr(path.rfind('/') + 1));
    };
  }

  std::vector<std::string> takeJournal() { return std::exchange(journal, {}); }

  static std::string purgeLine(const std::exception& error) {
    return std::string("Store \"larder\" purged due to corrupted manifest. ") + error.what();
  }

  static std::vector<std::string> errorLines(const LogCapture& log) {
    std::vector<std::string> messages;
    for (const LogLine& line : log.lines()) {
      if (line.severity == google::GLOG_ERROR) messages.push_back(line.message);
    }
    return messages;
  }

  // Each access event as "hit key age size".
  std::vector<std::string> accesses() const {
    std::vector<std::string> lines;
    for (const LoggedEvent& event : events->named("qzpkvs_access")) {
      const JsonValue json = event.json();
      EXPECT_EQ(json.at("store_name"), "larder");
      EXPECT_EQ(json.at("tag"), "");
      lines.push_back(json.at("hit").dump() + " " + json.at("key").get<std::string>() + " " +
                      json.at("itemAge").dump() + " " + json.at("size").dump());
    }
    return lines;
  }

  bool isDiskCache = false;  // the next store
  DiskCacheOptions options;  // of the next store
  ManualClock clock{kStart};
  TemporaryDirectory directory;
  std::shared_ptr<FaultyFileUtils> files = std::make_shared<FaultyFileUtils>();
  std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  std::shared_ptr<AnalyticsEventReporter> reporter = recordingReporter(events);
  IncidentLog incidents;
  std::shared_ptr<ManualQueueFactory> trashQueues = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<RecordingTrashCollector> trash = std::make_shared<RecordingTrashCollector>(
      directory.file("trash"), std::make_shared<FileUtils>(), nullptr, trashQueues);
  std::shared_ptr<MemoryMedium> medium = std::make_shared<MemoryMedium>();
  std::shared_ptr<FaultyManifest> manifest;
  std::vector<std::string> journal;
  std::string ending;               // of a batched deletion
  std::vector<unsigned int> sizes;  // what the size callback was told
  std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<PersistentKeyValueStore> store;

  const ManifestCorruptedException corrupted{"It is rotten.", 11};
  const ManifestPersistenceException unwritable{"The disk is full.", 13};
};

}  // namespace velmora::mobile::xplat::cellar::test
