#include "host/ThreadQueueFactory.h"

#include <glog/logging.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <exception>
#include <functional>
#include <iterator>
#include <map>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#if defined(__linux__)
#include <pthread.h>
#include <sched.h>
#endif

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Task = std::function<void()>;
using Clock = std::chrono::steady_clock;

// No wait is longer, so that no deadline leaves the range of a 32-bit `time_t`.
constexpr std::chrono::hours kLongestWait(1);

Clock::time_point deadlineAfter(std::chrono::nanoseconds delay) {
  const Clock::time_point now = Clock::now();
  if (delay <= std::chrono::nanoseconds::zero()) return now;
  return delay < Clock::time_point::max() - now ? now + delay : Clock::time_point::max();
}

Clock::time_point nextLookAt(Clock::time_point deadline) { return std::min(deadline, Clock::now() + kLongestWait); }

std::chrono::nanoseconds inNanoseconds(std::chrono::milliseconds duration) {
  constexpr std::chrono::milliseconds longest = std::chrono::hours(24 * 365 * 100);
  return std::clamp(duration, std::chrono::milliseconds::zero(), longest);
}

// What all threads of one factory share: how many tasks are dispatched and not yet over.
class Group {
 public:
  void taskBegins() { ++unfinished_; }

  void taskEnds() {
    if (--unfinished_ > 0) return;
    const std::lock_guard<std::mutex> lock(mutex_);
    idle_.notify_all();
  }

  bool waitUntilIdle(Clock::time_point deadline) {
    std::unique_lock<std::mutex> lock(mutex_);
    while (unfinished_ > 0) {
      if (Clock::now() >= deadline) return false;
      idle_.wait_until(lock, nextLookAt(deadline));
    }
    return true;
  }

 private:
  std::atomic<std::size_t> unfinished_{0};
  std::mutex mutex_;  // so that the last task cannot end unnoticed between a waiter's look and its sleep
  std::condition_variable idle_;
};

// The group that this thread works for. Its threads keep a group alive, so no other can come to have its address.
thread_local const Group* currentGroup = nullptr;

// Work in the background must not be in the way of those who ask for it: as a batch thread it does not take the
// processor from another thread at the moment that wakes it. Not vital, so no matter if the system refuses.
void enterThread(const Group& group, const std::string& name) {
  currentGroup = &group;
#if defined(__linux__)
  const sched_param noPriority{};
  (void)pthread_setschedparam(pthread_self(), SCHED_BATCH, &noPriority);
  constexpr std::size_t longest = 15;  // bytes that the system has room for
  pthread_setname_np(pthread_self(), name.substr(0, longest).c_str());
#else
  static_cast<void>(name);
#endif
}

// The machine may have more than this thread may use.
unsigned int processorsOfThisThread() {
#if defined(__linux__)
  cpu_set_t processors;
  if (sched_getaffinity(0, sizeof(processors), &processors) == 0) {
    return static_cast<unsigned int>(CPU_COUNT(&processors));
  }
#endif
  return std::thread::hardware_concurrency();
}

// How long a queue's thread stays awake for the next task when it has nothing to do. To wake a thread takes some tens
// of microseconds, longer than many a task, so where one task follows the other it pays to look out for the next for a
// moment: longer than a small file and its record take, because in a chain of queues each waits for the other.
// Adaptive, to spare the battery: a sleep that was over so soon that it was not worth falling asleep makes the thread
// look out from then on, and looking out in vain, or being kept away meanwhile, ends that. With one processor nothing
// can come while one looks.
class Patience {
 public:
  void lookOutFor(const std::atomic<bool>& news) {
    if (!isAwake_) return;
    const Clock::time_point end = Clock::now() + kMoment;
    while (isAwake_ && !news.load(std::memory_order_acquire)) {
      std::this_thread::yield();  // others may need the processor to have news
      isAwake_ = Clock::now() < end;
    }
  }

  void hasSlept(Clock::duration duration) { isAwake_ = hasOtherProcessors_ && duration < kMoment; }

 private:
  static constexpr std::chrono::microseconds kMoment{200};

  const bool hasOtherProcessors_ = processorsOfThisThread() > 1;
  bool isAwake_ = false;
};

// The tasks of one queue, shared by the handle that users own, its thread and its timers. No task is ever run or
// destroyed under the lock.
class Queue {
 public:
  Queue(std::string name, std::shared_ptr<Group> group) : name_(std::move(name)), group_(std::move(group)) {}

  // Takes the task over, or leaves it as it is and answers false when the queue is closed, or to others and the caller
  // is not one of the factory's threads.
  bool add(Task& task) {
    bool isAsleep = false;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      if (closed_ || (closedToOthers_ && currentGroup != group_.get())) return false;
      tasks_.push_back(std::move(task));
      group_->taskBegins();
      hasNews_.store(true, std::memory_order_release);
      isAsleep = isAsleep_;
    }
    if (isAsleep) changed_.notify_one();
    return true;
  }

  void closeToOthers() {
    const std::lock_guard<std::mutex> lock(mutex_);
    closedToOthers_ = true;
  }

  void close() {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      closed_ = true;
      hasNews_.store(true, std::memory_order_release);
    }
    changed_.notify_one();
  }

  // The queue's thread: runs tasks until the queue is closed and empty.
  void run() {
    enterThread(*group_, name_);
    Patience patience;
    for (std::deque<Task> tasks; takeAll(tasks, patience);) {
      while (!tasks.empty()) {
        runLogged(tasks.front());
        tasks.pop_front();  // what the task holds goes before it counts as ended
        group_->taskEnds();
      }
    }
    finished_ = true;
  }

  // Whether the thread is about to end, with nothing left to run.
  bool finished() const { return finished_; }

 private:
  // All that waits, under one lock; false when nothing will come any more.
  bool takeAll(std::deque<Task>& tasks, Patience& patience) {
    patience.lookOutFor(hasNews_);
    std::unique_lock<std::mutex> lock(mutex_);
    if (!closed_ && tasks_.empty()) {
      const Clock::time_point since = Clock::now();
      isAsleep_ = true;
      changed_.wait(lock, [this] { return closed_ || !tasks_.empty(); });
      isAsleep_ = false;
      patience.hasSlept(Clock::now() - since);
    }
    hasNews_.store(closed_, std::memory_order_relaxed);
    tasks.swap(tasks_);
    return !tasks.empty();
  }

  void runLogged(const Task& task) const {
    try {
      task();
    } catch (const std::exception& exception) {
      LOG(ERROR) << "Task failed on queue " << name_ << ": " << exception.what();
    } catch (...) {
      LOG(ERROR) << "Task failed on queue " << name_ << ": unknown exception";
    }
  }

  const std::string name_;
  const std::shared_ptr<Group> group_;
  std::atomic<bool> finished_{false};
  std::atomic<bool> hasNews_{false};  // changed with the mutex held, looked out for without

  std::mutex mutex_;  // guards the four below
  std::deque<Task> tasks_;
  bool closed_ = false;
  bool closedToOthers_ = false;
  bool isAsleep_ = false;
  std::condition_variable changed_;
};

// A task that runs once or, if it is cancelled first, never.
class DelayedTask {
 public:
  explicit DelayedTask(Task task) : task_(std::move(task)) {}

  void run() {
    if (const Task task = take()) task();
  }

  // Destroys the task unless it has begun to run.
  void cancel() { take(); }

 private:
  Task take() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(task_, nullptr);
  }

  std::mutex mutex_;
  Task task_;
};

// The timers of all queues, in the order in which they are due. Hands due tasks to their queues and runs none itself.
class Timers {
 public:
  struct Entry {
    std::weak_ptr<Queue> queue;
    std::shared_ptr<DelayedTask> task;
  };
  using Key = std::pair<Clock::time_point, std::uint64_t>;  // due at; number, to keep those of one moment in order

  explicit Timers(std::shared_ptr<Group> group) : group_(std::move(group)) {}

  // No key when timers are not served any more; the task is cancelled then.
  std::optional<Key> add(Clock::time_point due, Entry entry) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (stopped_) {
      lock.unlock();
      entry.task->cancel();
      return std::nullopt;
    }
    const Key key(due, ++lastNumber_);
    const bool isNext = entries_.empty() || key < entries_.begin()->first;
    entries_.emplace(key, std::move(entry));
    lock.unlock();
    if (isNext) changed_.notify_one();
    return key;
  }

  void remove(const Key& key) {
    const std::lock_guard<std::mutex> lock(mutex_);
    entries_.erase(key);
  }

  // The timer thread.
  void run() {
    enterThread(*group_, "cellar-timer");
    while (std::optional<Entry> entry = next()) fire(*entry);
  }

  void stop() {
    std::map<Key, Entry> dropped;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      stopped_ = true;
      dropped.swap(entries_);
    }
    changed_.notify_one();
    for (auto& [key, entry] : dropped) entry.task->cancel();
  }

 private:
  // The next one that is due, when it is; none when timers are not served any more.
  std::optional<Entry> next() {
    std::unique_lock<std::mutex> lock(mutex_);
    while (!stopped_) {
      if (entries_.empty()) {
        changed_.wait(lock);
        continue;
      }
      const auto first = entries_.begin();
      const Clock::time_point due = first->first.first;
      if (due > Clock::now()) {
        changed_.wait_until(lock, nextLookAt(due));
        continue;
      }
      std::optional<Entry> entry(std::move(first->second));
      entries_.erase(first);
      return entry;
    }
    return std::nullopt;
  }

  static void fire(const Entry& entry) {
    Task task = [delayed = entry.task] { delayed->run(); };
    const std::shared_ptr<Queue> queue = entry.queue.lock();
    if (queue == nullptr || !queue->add(task)) entry.task->cancel();
  }

  const std::shared_ptr<Group> group_;

  std::mutex mutex_;  // guards the three below
  std::map<Key, Entry> entries_;
  std::uint64_t lastNumber_ = 0;
  bool stopped_ = false;
  std::condition_variable changed_;
};

class Timer : public AsyncTimer {
 public:
  Timer(std::shared_ptr<Timers> timers, Timers::Key key, std::shared_ptr<DelayedTask> task)
      : timers_(std::move(timers)), key_(key), task_(std::move(task)) {}
  Timer(const Timer&) = delete;
  Timer& operator=(const Timer&) = delete;
  ~Timer() override {
    timers_->remove(key_);
    task_->cancel();
  }

 private:
  const std::shared_ptr<Timers> timers_;
  const Timers::Key key_;
  const std::shared_ptr<DelayedTask> task_;
};

// What users own of a queue.
class ThreadQueue : public AsyncExecutor {
 public:
  ThreadQueue(std::shared_ptr<Queue> queue, std::shared_ptr<Timers> timers)
      : queue_(std::move(queue)), timers_(std::move(timers)) {}
  ThreadQueue(const ThreadQueue&) = delete;
  ThreadQueue& operator=(const ThreadQueue&) = delete;
  ~ThreadQueue() override { queue_->close(); }

  void dispatch(Task task) override { queue_->add(task); }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, Task task, Task /*companion*/) override {
    auto delayed = std::make_shared<DelayedTask>(std::move(task));
    const auto key = timers_->add(deadlineAfter(std::chrono::nanoseconds(delayNanoseconds)), {queue_, delayed});
    if (!key) return std::make_unique<AsyncTimer>();
    return std::make_unique<Timer>(timers_, *key, std::move(delayed));
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, Task task, Task companion) override {
    return dispatchAfter(delayNanoseconds, std::move(task), std::move(companion));
  }

 private:
  const std::shared_ptr<Queue> queue_;
  const std::shared_ptr<Timers> timers_;
};

}  // namespace

// The threads, and the lists of what they serve.
class ThreadQueueFactory::Threads {
 public:
  Threads()
      : group_(std::make_shared<Group>()),
        timers_(std::make_shared<Timers>(group_)),
        timerThread_([timers = timers_] { timers->run(); }) {}

  std::shared_ptr<AsyncExecutor> createQueue(const std::string& role) {
    joinFinished();
    const std::lock_guard<std::mutex> lock(mutex_);
    const std::string name = "cellar-" + role + "-" + std::to_string(++queuesOfRole_[role]);
    const auto queue = std::make_shared<Queue>(name, group_);
    auto handle = std::make_shared<ThreadQueue>(queue, timers_);
    if (closedToOthers_) queue->closeToOthers();
    if (closed_) {
      queue->close();
      return handle;
    }
    workers_.emplace_back();
    workers_.back().queue = queue;
    try {
      workers_.back().thread = std::thread([queue] { queue->run(); });
    } catch (...) {
      workers_.pop_back();
      throw;
    }
    return handle;
  }

  bool drain(std::chrono::milliseconds patience) {
    return !onOwnThread() && group_->waitUntilIdle(deadlineAfter(inNanoseconds(patience)));
  }

  void refuseNewWork() {
    timers_->stop();
    const std::lock_guard<std::mutex> lock(mutex_);
    closedToOthers_ = true;
    for (const Worker& worker : workers_) worker.queue->closeToOthers();
  }

  void shutDown() {
    close();
    if (onOwnThread()) return;
    const std::lock_guard<std::mutex> lock(joinMutex_);
    for (std::thread& thread : takeThreads()) thread.join();
  }

  void abandon() {
    close();
    for (std::thread& thread : takeThreads()) thread.detach();
  }

  bool onOwnThread() const { return currentGroup == group_.get(); }

 private:
  struct Worker {
    std::thread thread;
    std::shared_ptr<Queue> queue;
  };

  void close() {
    timers_->stop();
    const std::lock_guard<std::mutex> lock(mutex_);
    closed_ = true;
    for (const Worker& worker : workers_) worker.queue->close();
  }

  std::vector<std::thread> takeThreads() {
    const std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::thread> threads;
    for (Worker& worker : workers_) threads.push_back(std::move(worker.thread));
    if (timerThread_.joinable()) threads.push_back(std::move(timerThread_));
    workers_.clear();
    return threads;
  }

  // Gives back what the system keeps of threads whose queues were let go.
  void joinFinished() {
    std::vector<Worker> finished;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      const auto rest = std::partition(workers_.begin(), workers_.end(),
                                       [](const Worker& worker) { return !worker.queue->finished(); });
      std::move(rest, workers_.end(), std::back_inserter(finished));
      workers_.erase(rest, workers_.end());
    }
    for (Worker& worker : finished) worker.thread.join();
  }

  const std::shared_ptr<Group> group_;
  const std::shared_ptr<Timers> timers_;

  std::mutex
      joinMutex_;     // so that a second `shutDown` waits for the first; taken before the other, never by own threads
  std::mutex mutex_;  // guards the five below
  std::unordered_map<std::string, unsigned int> queuesOfRole_;
  std::vector<Worker> workers_;
  std::thread timerThread_;
  bool closed_ = false;
  bool closedToOthers_ = false;
};

ThreadQueueFactory::ThreadQueueFactory() : threads_(std::make_unique<Threads>()) {}

ThreadQueueFactory::~ThreadQueueFactory() {
  if (threads_->onOwnThread()) {
    threads_->abandon();
  } else {
    threads_->shutDown();
  }
}

std::shared_ptr<AsyncExecutor> ThreadQueueFactory::createQueue() { return threads_->createQueue("file"); }

std::shared_ptr<AsyncExecutor> ThreadQueueFactory::createWorkQueue() { return threads_->createQueue("work"); }

void ThreadQueueFactory::refuseOnQueueThread(const std::string& operation, const std::string& advice) {
  if (currentGroup == nullptr) return;
  throw std::logic_error(operation + " may wait for itself on a thread of the host kit's queues. " + advice);
}

bool ThreadQueueFactory::drain(std::chrono::milliseconds patience) { return threads_->drain(patience); }

void ThreadQueueFactory::refuseNewWork() { threads_->refuseNewWork(); }

void ThreadQueueFactory::shutDown() { threads_->shutDown(); }

void ThreadQueueFactory::abandon() { threads_->abandon(); }

}  // namespace velmora::mobile::xplat::cellar::host
