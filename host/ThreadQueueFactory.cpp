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

// The longest single wait, so that no deadline leaves the range of a 32-bit `time_t`.
constexpr std::chrono::hours kLongestWait(1);

Clock::time_point deadlineAfter(std::chrono::nanoseconds delay) {
  const Clock::time_point now = Clock::now();
  if (delay <= std::chrono::nanoseconds::zero()) return now;
  return delay < Clock::time_point::max() - now ? now + delay : Clock::time_point::max();
}

Clock::time_point cappedDeadline(Clock::time_point deadline) { return std::min(deadline, Clock::now() + kLongestWait); }

std::chrono::nanoseconds inNanoseconds(std::chrono::milliseconds duration) {
  constexpr std::chrono::milliseconds longest = std::chrono::hours(24 * 365 * 100);
  return std::clamp(duration, std::chrono::milliseconds::zero(), longest);
}

// Shared by all threads of one factory: the number of tasks that are dispatched and not finished.
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
      idle_.wait_until(lock, cappedDeadline(deadline));
    }
    return true;
  }

 private:
  std::atomic<std::size_t> unfinished_{0};
  std::mutex mutex_;  // so that a waiter does not miss the end of the last task between its check and its sleep
  std::condition_variable idle_;
};

// The group that this thread works for. Its threads keep a group alive, so its address cannot be reused meanwhile.
thread_local const Group* currentGroup = nullptr;

// Background work must not delay its callers: a batch thread does not preempt the thread that wakes it. If the system
// refuses, that is ignored.
void enterThread(const Group& group, const std::string& name) {
  currentGroup = &group;
#if defined(__linux__)
  const sched_param noPriority{};
  (void)pthread_setschedparam(pthread_self(), SCHED_BATCH, &noPriority);
  constexpr std::size_t longest = 15;  // bytes that the system allows
  pthread_setname_np(pthread_self(), name.substr(0, longest).c_str());
#else
  static_cast<void>(name);
#endif
}

// The number of processors that this thread may use; the machine may have more.
unsigned int processorsOfThisThread() {
#if defined(__linux__)
  cpu_set_t processors;
  if (sched_getaffinity(0, sizeof(processors), &processors) == 0) {
    return static_cast<unsigned int>(CPU_COUNT(&processors));
  }
#endif
  return std::thread::hardware_concurrency();
}

// Whether a queue's thread spins for the next task before it sleeps. Waking a thread takes some tens of microseconds,
// longer than many tasks. The time to spin is longer than writing a small file and its record, because in a chain of
// queues each waits for the other. Adaptive, to save power: a sleep that ended almost at once switches spinning on; a
// spin that found nothing, or was preempted, switches it off. Off with a single processor.
class AdaptiveSpin {
 public:
  void spinUntil(const std::atomic<bool>& news) {
    if (!spins_) return;
    const Clock::time_point end = Clock::now() + kLongestSpin;
    while (spins_ && !news.load(std::memory_order_acquire)) {
      std::this_thread::yield();  // the thread that dispatches may need the processor
      spins_ = Clock::now() < end;
    }
  }

  void hasSlept(Clock::duration duration) { spins_ = hasOtherProcessors_ && duration < kLongestSpin; }

 private:
  static constexpr std::chrono::microseconds kLongestSpin{200};

  const bool hasOtherProcessors_ = processorsOfThisThread() > 1;
  bool spins_ = false;
};

// The tasks of one queue, shared by the handle that users own, its thread and its timers. Tasks are neither run nor
// destroyed under the lock.
class Queue {
 public:
  Queue(std::string name, std::shared_ptr<Group> group) : name_(std::move(name)), group_(std::move(group)) {}

  // Moves the task into the queue. Returns false and leaves the task unchanged if the queue is closed, or if it is
  // closed to others and the caller is not one of the factory's threads.
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
    AdaptiveSpin spin;
    for (std::deque<Task> tasks; takeAll(tasks, spin);) {
      while (!tasks.empty()) {
        runLogged(tasks.front());
        tasks.pop_front();  // its captures are destroyed before it counts as finished
        group_->taskEnds();
      }
    }
    finished_ = true;
  }

  // Whether the thread has run everything and is about to end.
  bool finished() const { return finished_; }

 private:
  // Moves out all waiting tasks, under one lock; waits for the first. False when the queue is closed and empty.
  bool takeAll(std::deque<Task>& tasks, AdaptiveSpin& spin) {
    spin.spinUntil(hasNews_);
    std::unique_lock<std::mutex> lock(mutex_);
    if (!closed_ && tasks_.empty()) {
      const Clock::time_point since = Clock::now();
      isAsleep_ = true;
      changed_.wait(lock, [this] { return closed_ || !tasks_.empty(); });
      isAsleep_ = false;
      spin.hasSlept(Clock::now() - since);
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
  std::atomic<bool> hasNews_{false};  // changed with the mutex held, read without it

  std::mutex mutex_;  // guards the four below
  std::deque<Task> tasks_;
  bool closed_ = false;
  bool closedToOthers_ = false;
  bool isAsleep_ = false;
  std::condition_variable changed_;
};

// A task that runs once, or never if it is cancelled first.
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

// The timers of all queues, in the order in which they are due. Dispatches due tasks to their queues.
class Timers {
 public:
  struct Entry {
    std::weak_ptr<Queue> queue;
    std::shared_ptr<DelayedTask> task;
  };
  using Key = std::pair<Clock::time_point,
                        std::uint64_t>;  // due time; number, to keep the order of timers that are due at the same time

  explicit Timers(std::shared_ptr<Group> group) : group_(std::move(group)) {}

  // No key if the timers have been stopped; the task is cancelled then.
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
  // Waits for the next due timer; none when the timers have been stopped.
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
        changed_.wait_until(lock, cappedDeadline(due));
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

// The handle of a queue that users own.
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

// The threads, with their queues and timers.
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

  // Joins the threads of queues that have been released, to free their system resources.
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

  // So that a second `shutDown` waits for the first. Locked before `mutex_`, never by the factory's own threads.
  std::mutex joinMutex_;
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
  throw std::logic_error(operation + " may deadlock on a thread of the host kit's queues. " + advice);
}

bool ThreadQueueFactory::drain(std::chrono::milliseconds patience) { return threads_->drain(patience); }

void ThreadQueueFactory::refuseNewWork() { threads_->refuseNewWork(); }

void ThreadQueueFactory::shutDown() { threads_->shutDown(); }

void ThreadQueueFactory::abandon() { threads_->abandon(); }

}  // namespace velmora::mobile::xplat::cellar::host
