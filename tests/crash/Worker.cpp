#include "crash/Worker.h"

#include <sqlite3.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <exception>
#include <fstream>
#include <future>
#include <memory>
#include <mutex>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "FileUtils.h"
#include "TrashCollector.h"
#include "host/Host.h"
#include "host/ThreadQueueFactory.h"

namespace velmora::mobile::xplat::cellar::crash {

namespace {

constexpr std::size_t kThreads = 3;

// The sanitizers need descriptors of their own to look at memory.
#if defined(CELLAR_SANITIZES_ADDRESSES)
constexpr bool kCanGoWithoutDescriptors = false;
#else
constexpr bool kCanGoWithoutDescriptors = true;
#endif

// Lets a thread have a few operations on their way, and no more.
class Window {
 public:
  explicit Window(int most) : most_(most) {}

  void enter() {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return outstanding_ < most_; });
    ++outstanding_;
  }
  void leave() {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      --outstanding_;
    }
    changed_.notify_all();
  }
  void waitUntilEmpty() {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return outstanding_ == 0; });
  }

 private:
  const int most_;
  std::mutex mutex_;  // guards the number
  std::condition_variable changed_;
  int outstanding_ = 0;
};

// As a value that comes over a network is written: there is time to be killed in the midst of it.
PersistentKeyValueStore::Writer pieceByPiece(std::vector<unsigned char> value) {
  return [value = std::move(value)](const std::string& path) {
    constexpr std::size_t kPiece = 500;
    std::ofstream file(path, std::ios::binary | std::ios::trunc);
    for (std::size_t done = 0; done < value.size(); done += kPiece) {
      const std::string piece(value.begin() + static_cast<std::ptrdiff_t>(done),
                              value.begin() + static_cast<std::ptrdiff_t>(std::min(done + kPiece, value.size())));
      file << piece << std::flush;
    }
    if (!file) throw std::runtime_error("The file cannot be written.");
    return static_cast<unsigned int>(value.size());
  };
}

void tell(int pipe, const Record& record) {
  // Less than a pipe takes in one piece. A parent that has gone takes this process along.
  if (::write(pipe, &record, sizeof record) != static_cast<ssize_t>(sizeof record)) std::_Exit(3);
}

// Tells of each transaction of several statements, on every database that is opened from now on.
class GroupTeller {
 public:
  explicit GroupTeller(int pipe) {
    pipe_ = pipe;
    sqlite3_auto_extension(reinterpret_cast<void (*)()>(&watch));
  }

 private:
  static int watch(sqlite3* database, char** /*error*/, const sqlite3_api_routines* /*routines*/) {
    return sqlite3_trace_v2(database, SQLITE_TRACE_PROFILE, &statementHasRun, database);
  }

  static int statementHasRun(unsigned int /*kind*/, void* database, void* statement, void* /*nanoseconds*/) {
    const std::string text = sqlite3_sql(static_cast<sqlite3_stmt*>(statement));
    const bool isInTransaction = sqlite3_get_autocommit(static_cast<sqlite3*>(database)) == 0;
    Record record{};
    record.operation = Record::Operation::Group;
    if (text == "BEGIN IMMEDIATE;" && isInTransaction) {
      record.kind = Record::Kind::Begun;
      tell(pipe_, record);
    } else if ((text == "COMMIT;" || text == "ROLLBACK;") && !isInTransaction) {
      record.kind = Record::Kind::Done;
      tell(pipe_, record);
    }
    return 0;
  }

  static inline int pipe_ = -1;
};

bool hasOwnQueues(Ending ending) { return ending == Ending::ShutDown || ending == Ending::LetGo; }

std::unique_ptr<host::Host> startHost(const Task& task, std::shared_ptr<TaskQueueFactory> queues) {
  host::HostOptions options;
  options.configuration = configuration();
  options.root = task.root;
  options.taskQueueFactory = std::move(queues);
  if (task.ending == Ending::Impatient) options.shutDownPatience = std::chrono::seconds(0);
  return std::make_unique<host::Host>(std::move(options));
}

class Worker {
 public:
  explicit Worker(const Task& task)
      : task_(task),
        groups_(task.pipe),
        queues_(hasOwnQueues(task.ending) ? std::make_shared<host::ThreadQueueFactory>() : nullptr),
        host_(startHost(task, queues_)),
        trash_(host_->trash()),
        version_(task.firstVersion) {
    for (const StoreInfo& info : kStores) {
      stores_.push_back(host_->store<PersistentKeyValueStore>(info.identifier, kSession));
    }
    const int most = task.ending == Ending::Killed ? 8 : 32;
    for (std::size_t i = 0; i < kThreads; ++i) windows_.push_back(std::make_shared<Window>(most));
  }

  void start() {
    tell(Record{});
    for (std::size_t i = 0; i < kThreads; ++i) threads_.emplace_back([this, i] { run(i); });
  }

  void end() {
    const bool isBusy = !finishesAll(task_.ending);
    if (!isBusy) stopAsking();
    if (task_.ending == Ending::LetGo) stores_.clear();
    if (task_.ending == Ending::ShutDown) queues_->shutDown();
    host_.reset();
    if (isBusy) stopAsking();
    for (const auto& window : windows_) window->waitUntilEmpty();
    stores_.clear();
    queues_.reset();
  }

 private:
  void tell(const Record& record) const { crash::tell(task_.pipe, record); }

  void stopAsking() {
    stops_ = true;
    for (std::thread& thread : threads_) thread.join();
  }

  // Each thread has its own keys, so that the order of the operations on a key is known.
  void run(std::size_t thread) {
    std::mt19937_64 random(task_.seed + thread);
    const auto window = windows_[thread];
    while (!stops_) {
      const auto dice = random() % 1000;
      if (dice < 3) {
        housekeep(random());
        continue;
      }
      window->enter();
      operate(thread, random, dice, window);
    }
  }

  template <class T> void report(Future<T> future, Record record, std::shared_ptr<Window> window) {
    future.then(nullptr, [this, record, window = std::move(window)](std::future<T>& result) mutable {
      record.kind = Record::Kind::Done;
      try {
        result.get();
      } catch (const std::future_error&) {
        record.kind = Record::Kind::Dropped;
      } catch (const std::exception&) {
        record.kind = Record::Kind::Failed;
      }
      tell(record);
      window->leave();
    });
  }

  void operate(std::size_t thread, std::mt19937_64& random, std::uint64_t dice, const std::shared_ptr<Window>& window) {
    const auto number = static_cast<std::size_t>(random() % kStores.size());
    const StoreInfo& info = kStores.at(number);
    const auto slot = static_cast<std::size_t>(random() % (info.keys / kThreads));
    Record record{};
    record.kind = Record::Kind::Begun;
    record.store = static_cast<std::uint8_t>(number);
    record.key = static_cast<std::uint32_t>(slot * kThreads + thread);
    PersistentKeyValueStore& store = *stores_[number];
    if (dice < 200) {
      record.operation = Record::Operation::Fetch;
      tell(record);
      report(store.fetch(keyName(record.key)), record, window);
    } else if (dice < 350) {
      record.operation = Record::Operation::Remove;
      tell(record);
      report(store.removeItem(keyName(record.key)), record, window);
    } else {
      const bool isLarge = random() % 50 == 0;
      record.operation = Record::Operation::Store;
      record.version = ++version_;
      record.length = static_cast<std::uint32_t>(random() % (info.maxBytes * (isLarge ? 20U : 1U)));
      tell(record);
      auto value = valueOf(number, record.key, record.version, record.length);
      const bool isPiecemeal = !info.isInline && random() % 4 == 0;
      report(isPiecemeal ? store.store(keyName(record.key), nullptr, pieceByPiece(std::move(value)))
                         : store.store(keyName(record.key), value),
             record, window);
    }
  }

  // Limits are enforced, directories thrown away and descriptors used up in the midst of it all.
  void housekeep(std::uint64_t dice) {
    const auto done = [] {};
    const auto failed = [](const std::exception&) {};
    switch (dice % 6) {
      case 0:
        return stores_[3]->pruneBackToNormal(done, failed, false);
      case 1:
        return stores_[4]->pruneBackToNormal(done, failed, false);
      case 2:
        return stores_[3]->pruneBackToNormal(done, failed, true);
      case 3:
        return clear();
      case 4:
        return goWithoutDescriptors();
      default:
        return throwATreeAway(dice);
    }
  }

  void clear() {
    Record record{};
    record.kind = Record::Kind::Begun;
    record.operation = Record::Operation::Clear;
    record.store = kRecent;
    record.version = ++version_;
    tell(record);
    const auto telling = [this, record](Record::Kind kind) {
      Record ended = record;
      ended.kind = kind;
      tell(ended);
    };
    stores_[kRecent]->clear([telling] { telling(Record::Kind::Done); },
                            [telling](const std::exception&) { telling(Record::Kind::Failed); });
  }

  // For a moment nothing can be opened.
  void goWithoutDescriptors() {
    if (!kCanGoWithoutDescriptors) return;
    const std::lock_guard<std::mutex> lock(limitMutex_);
    rlimit before{};
    if (::getrlimit(RLIMIT_NOFILE, &before) != 0) return;
    Record shortage{};
    shortage.kind = Record::Kind::Begun;
    shortage.operation = Record::Operation::Shortage;
    tell(shortage);
    const rlimit none = {0, before.rlim_max};
    (void)::setrlimit(RLIMIT_NOFILE, &none);
    std::this_thread::sleep_for(std::chrono::microseconds(300));
    (void)::setrlimit(RLIMIT_NOFILE, &before);
    shortage.kind = Record::Kind::Done;
    tell(shortage);
  }

  void throwATreeAway(std::uint64_t dice) {
    FileUtils files;
    const std::string tree = task_.root + "/tree" + std::to_string(dice);
    try {
      files.createDirectory(tree + "/branch", true);
      for (int i = 0; i < 20; ++i) files.writeFile(tree + "/branch/" + std::to_string(i), {'x'});
    } catch (const std::exception&) {  // without descriptors
    }
    trash_->collectPath(tree);
  }

  const Task task_;
  const GroupTeller groups_;                          // before any database is opened
  std::shared_ptr<host::ThreadQueueFactory> queues_;  // the application's own, or null
  std::unique_ptr<host::Host> host_;
  const std::shared_ptr<TrashCollector> trash_;
  std::atomic<std::uint32_t> version_;
  std::atomic<bool> stops_{false};
  std::mutex limitMutex_;  // so that the limit that is found is the process's own
  std::vector<std::shared_ptr<PersistentKeyValueStore>> stores_;
  std::vector<std::shared_ptr<Window>> windows_;
  std::vector<std::thread> threads_;
};

}  // namespace

void work(const Task& task) {
  Worker worker(task);
  worker.start();
  char nothing = 0;
  while (::read(task.control, &nothing, 1) < 0) continue;
  worker.end();
  std::_Exit(0);  // threads that an impatient host has left behind may still be on their way out
}

}  // namespace velmora::mobile::xplat::cellar::crash
