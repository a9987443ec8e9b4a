// The same storage on the bare library, with queues and services of its own. usage: without-kit NEW-DIRECTORY
#include "application.h"

#include "configuration.h"

// BARE: begin
#include <cellar/Cellar.h>

#include <chrono>
#include <condition_variable>
#include <future>
#include <map>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <thread>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may
using Bytes = std::vector<unsigned char>;
using Task = std::function<void()>;

// Of all queues: how many tasks are accepted and not over.
class Outstanding {
 public:
  void add(int count) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if ((count_ += count) == 0) isIdle_.notify_all();
  }
  void wait() {
    std::unique_lock<std::mutex> lock(mutex_);
    isIdle_.wait(lock, [this] { return count_ == 0; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable isIdle_;
  int count_ = 0;
};

// A thread that runs tasks in their order, and those of timers when they are due. Must not be destroyed by a task of
// its own.
class Queue : public AsyncExecutor {
  using Instant = std::chrono::steady_clock::time_point;
  struct Timer : AsyncTimer {
    std::shared_ptr<Task> task;  // the queue runs it as long as this exists
  };

 public:
  explicit Queue(std::shared_ptr<Outstanding> outstanding) : outstanding_(std::move(outstanding)) {}
  ~Queue() override {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      isEnding_ = true;
    }
    hasWork_.notify_all();
    thread_.join();
  }

  void dispatch(Task task) override {
    outstanding_->add(1);
    enqueue(Instant::min(), [task = std::move(task), outstanding = outstanding_]() mutable {
      run(task);
      task = nullptr;  // what it holds is released before it counts as over
      outstanding->add(-1);
    });
  }
  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t nanoseconds, Task task, Task) override {
    auto timer = std::make_unique<Timer>();
    timer->task = std::make_shared<Task>(std::move(task));
    enqueue(std::chrono::steady_clock::now() + std::chrono::nanoseconds(nanoseconds),
            [weakTask = std::weak_ptr<Task>(timer->task)] {
              if (const auto due = weakTask.lock()) run(*due);
            });
    return timer;
  }
  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t nanoseconds, Task task, Task companion) override {
    return dispatchAfter(nanoseconds, std::move(task), std::move(companion));
  }

 private:
  static void run(const Task& task) {
    try {
      task();
    } catch (const std::exception& error) {
      std::cerr << "A task has failed: " << error.what() << "\n";
    }
  }

  void enqueue(Instant due, Task task) {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      tasks_.emplace(due, std::move(task));
    }
    hasWork_.notify_one();
  }

  void work() {
    std::unique_lock<std::mutex> lock(mutex_);
    while (!isEnding_) {
      if (tasks_.empty()) {
        hasWork_.wait(lock);
      } else if (const Instant due = tasks_.begin()->first; due > std::chrono::steady_clock::now()) {
        hasWork_.wait_until(lock, due);
      } else {
        Task task = std::move(tasks_.extract(tasks_.begin()).mapped());
        lock.unlock();
        task();
        task = nullptr;
        lock.lock();
      }
    }
  }

  const std::shared_ptr<Outstanding> outstanding_;
  std::mutex mutex_;
  std::condition_variable hasWork_;
  std::multimap<Instant, Task> tasks_;
  bool isEnding_ = false;
  std::thread thread_{[this] { work(); }};
};

// Keeps the queues until the end, so that no task of theirs lets one go.
class Queues : public TaskQueueFactory {
 public:
  std::shared_ptr<AsyncExecutor> createQueue() override {
    const std::lock_guard<std::mutex> lock(mutex_);
    queues_.push_back(std::make_shared<Queue>(outstanding_));
    return queues_.back();
  }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return createQueue(); }
  void waitUntilIdle() { outstanding_->wait(); }

 private:
  const std::shared_ptr<Outstanding> outstanding_ = std::make_shared<Outstanding>();
  std::mutex mutex_;
  std::vector<std::shared_ptr<Queue>> queues_;
};

class Areas : public PathLocations {
 public:
  explicit Areas(std::string root) : root_(std::move(root)) {}
  std::string pathForArea(Area area, const std::string&) override {
    return root_ + (area == Area::Caches ? "/caches" : area == Area::Documents ? "/documents" : "/shared");
  }

 private:
  const std::string root_;
};

template <class T> T await(Future<T> future) {
  const auto promise = std::make_shared<std::promise<T>>();
  auto result = promise->get_future();
  future.then([promise](std::future<T>& ready) {
    try {
      promise->set_value(ready.get());
    } catch (...) {
      promise->set_exception(std::current_exception());
    }
  });
  return result.get();
}

class Storage {
 public:
  explicit Storage(const std::string& directory)
      : trash_(std::make_shared<TrashCollector>(directory + "/trash", files_, nullptr, queues_)),
        areas_(std::make_shared<Areas>(directory)),
        everybodys_(factory(false)) {
    const auto media = managerOf("media", *everybodys_, "");
    thumbnails_ = found(media->getStore<DiskCache>("thumbnails"));
    web_ = found(media->getStore<UnmanagedStore>("web"));
    sizes_->exclude(AttributeStore::fileName);
    lazyWork_->addTask([sizes = sizes_] { sizes->startDiskSizeCalculation(); }, queues_->createQueue());
  }

  ~Storage() {
    lazyWork_->willBeTriggeredExternally();
    queues_->waitUntilIdle();
  }

  void logIn(const std::string& user) {
    session_ = factory(true);
    drafts_ = found(managerOf("letters", *session_, user)->getStore<PersistentKeyValueStore>("drafts"));
  }

  void logOut() {
    session_->invalidate();
    drafts_ = nullptr;
    session_ = nullptr;
  }

  void keepDraft(const std::string& name, const std::string& text) {
    drafts_->store(name, Bytes(text.begin(), text.end())).get();
  }

  std::optional<std::string> draft(const std::string& name) {
    const auto found = await(drafts_->fetch(name));
    if (found == nullptr) return std::nullopt;
    return std::string(found->value.begin(), found->value.end());
  }

  void keepThumbnail(const std::string& url, const Bytes& jpeg) { thumbnails_->store(encodeFileName(url), jpeg); }

  std::optional<Bytes> thumbnail(const std::string& url) {
    auto found = await(thumbnails_->fetch(encodeFileName(url)));
    if (found == nullptr) return std::nullopt;
    return std::move(found->value);
  }

  std::string webFolder() { return web_->path; }

 private:
  std::unique_ptr<StoreManagerFactory> factory(bool forSessions) {
    return std::make_unique<StoreManagerFactory>(forSessions, nullptr, attributes_, configuration_, sizes_, files_,
                                                 lazyWork_, areas_, names_, queues_, trash_, encodeFileName);
  }

  static std::shared_ptr<StoreManager> managerOf(const std::string& name, StoreManagerFactory& factory,
                                                 const std::string& user) {
    auto manager = found(factory.managerForIdentifier(name, user, true));
    manager->retryFailedCreations();
    return manager;
  }

  template <class T> static std::shared_ptr<T> found(std::shared_ptr<T> object) {
    if (object == nullptr) throw std::runtime_error("The storage is not available.");
    return object;
  }

  const std::shared_ptr<Queues> queues_ = std::make_shared<Queues>();
  const std::shared_ptr<const Configuration> configuration_ = std::make_shared<Configuration>(kConfiguration);
  const std::shared_ptr<FileUtils> files_ = std::make_shared<FileUtils>();
  const std::shared_ptr<StoreDirectoryNameBuilderFactory> names_ =
      std::make_shared<StoreDirectoryNameBuilderFactory>("", "", "");
  const std::shared_ptr<AttributeStore> attributes_ = std::make_shared<AttributeStore>(files_);
  const std::shared_ptr<DiskSizeCalculator> sizes_ = std::make_shared<DiskSizeCalculator>(files_, attributes_, nullptr);
  const std::shared_ptr<LazyDispatcher> lazyWork_ = LazyDispatcher::createLazyDispatcher(queues_, 10);
  const std::shared_ptr<TrashCollector> trash_;
  const std::shared_ptr<Areas> areas_;
  const std::unique_ptr<StoreManagerFactory> everybodys_;
  std::unique_ptr<StoreManagerFactory> session_;
  std::shared_ptr<DiskCache> thumbnails_;
  std::shared_ptr<UnmanagedStore> web_;
  std::shared_ptr<PersistentKeyValueStore> drafts_;
};
// BARE: end

int main(int argc, char** argv) { return runApplication<Storage>(argc, argv); }
