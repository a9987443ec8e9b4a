#include "crash/Worker.h"

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <fstream>
#include <future>
#include <memory>
#include <mutex>
#include <random>
#include <thread>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "FileUtils.h"
#include "TrashCollector.h"
#include "crash/Protocol.h"
#include "host/Host.h"

namespace velmora::mobile::xplat::cellar::crash {

namespace {

constexpr std::size_t kThreads = 3;
constexpr int kMaxOutstanding = 8;  // for each thread

// Lets a thread have a few operations on their way, and no more.
class Window {
 public:
  void enter() {
    std::unique_lock<std::mutex> lock(mutex_);
    room_.wait(lock, [this] { return outstanding_ < kMaxOutstanding; });
    ++outstanding_;
  }
  void leave() {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      --outstanding_;
    }
    room_.notify_one();
  }

 private:
  std::mutex mutex_;  // guards the number
  std::condition_variable room_;
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
    return static_cast<unsigned int>(value.size());
  };
}

class Worker {
 public:
  Worker(const std::string& root, std::uint32_t firstVersion, int pipe)
      : root_(root), host_(kConfiguration, root), pipe_(pipe), version_(firstVersion) {
    for (const StoreInfo& info : kStores) stores_.push_back(host_.store<PersistentKeyValueStore>(info.identifier));
  }

  void tell(const Record& record) const {
    // Less than a pipe takes in one piece. A parent that has gone takes this process along.
    if (::write(pipe_, &record, sizeof record) != static_cast<ssize_t>(sizeof record)) std::_Exit(3);
  }

  // Each thread has its own keys, so that the order of the operations on a key is known.
  void run(std::size_t thread, std::uint64_t seed) {
    std::mt19937_64 random(seed);
    const auto window = std::make_shared<Window>();
    while (true) {
      const auto dice = random() % 1000;
      if (dice < 3) {
        housekeep(random());
        continue;
      }
      window->enter();
      operate(thread, random, dice, window);
    }
  }

 private:
  template <class T> void report(Future<T> future, Record record, std::shared_ptr<Window> window) {
    future.then(nullptr, [this, record, window = std::move(window)](std::future<T>& result) mutable {
      record.kind = Record::Kind::Done;
      try {
        result.get();
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

  // Limits are enforced and directories thrown away in the midst of it all.
  void housekeep(std::uint64_t dice) {
    const auto done = [] {};
    const auto failed = [](const std::exception&) {};
    switch (dice % 5) {
      case 0:
        return stores_[3]->pruneBackToNormal(done, failed, false);
      case 1:
        return stores_[4]->pruneBackToNormal(done, failed, false);
      case 2:
        return stores_[3]->pruneBackToNormal(done, failed, true);
      case 3:
        return stores_[2]->clear(done, failed);
      default:
        return throwATreeAway(dice);
    }
  }

  void throwATreeAway(std::uint64_t dice) {
    FileUtils files;
    const std::string tree = root_ + "/tree" + std::to_string(dice);
    files.createDirectory(tree + "/branch", true);
    for (int i = 0; i < 20; ++i) files.writeFile(tree + "/branch/" + std::to_string(i), {'x'});
    host_.trash()->collectPath(tree);
  }

  const std::string root_;
  host::Host host_;
  const int pipe_;
  std::atomic<std::uint32_t> version_;
  std::vector<std::shared_ptr<PersistentKeyValueStore>> stores_;
};

}  // namespace

void work(const std::string& root, std::uint64_t seed, std::uint32_t firstVersion, int pipe) {
  Worker worker(root, firstVersion, pipe);
  worker.tell(Record{});
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < kThreads; ++i) threads.emplace_back([&, i] { worker.run(i, seed + i); });
  for (std::thread& thread : threads) thread.join();
}

}  // namespace velmora::mobile::xplat::cellar::crash
