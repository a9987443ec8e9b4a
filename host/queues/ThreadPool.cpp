#include "host/queues/ThreadPool.h"

#include <algorithm>
#include <utility>

#include "host/queues/Deadline.h"

#if defined(__linux__)
#include <pthread.h>
#include <sched.h>
#endif

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Clock = std::chrono::steady_clock;

// The pool that this thread works for. Its threads keep a pool alive, so its address cannot be reused meanwhile.
thread_local const ThreadPool* currentPool = nullptr;
thread_local bool handsOutTimers = false;

// Background work must not delay its callers: a batch thread does not preempt the thread that wakes it. If the system
// refuses, that is ignored.
void becomeBackgroundThread(const std::string& name) {
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
std::size_t processorsOfThisThread() {
#if defined(__linux__)
  cpu_set_t processors;
  if (sched_getaffinity(0, sizeof(processors), &processors) == 0) {
    return static_cast<std::size_t>(CPU_COUNT(&processors));
  }
#endif
  return std::max(std::thread::hardware_concurrency(), 1U);
}

}  // namespace

ThreadPool::ThreadPool() : hasOtherProcessors_(processorsOfThisThread() > 1), workers_(processorsOfThisThread() + 1) {}

std::shared_ptr<ThreadPool> ThreadPool::start(const std::function<void()>& timers) {
  std::shared_ptr<ThreadPool> pool(new ThreadPool());
  try {
    for (std::size_t number = 1; number <= pool->workers_; ++number) {
      pool->startThread("cellar-" + std::to_string(number), [&pool = *pool] { pool.runWork(); });
    }
    pool->startThread("cellar-timer", [timers] {
      handsOutTimers = true;
      timers();
    });
  } catch (...) {
    pool->close();
    pool->join();
    throw;
  }
  return pool;
}

void ThreadPool::startThread(std::string name, std::function<void()> function) {
  threads_.emplace_back([pool = shared_from_this(), name = std::move(name), function = std::move(function)] {
    currentPool = pool.get();
    becomeBackgroundThread(name);
    function();
  });
}

// ---- tasks

bool ThreadPool::admitTask() {
  if (!takesTasks()) return false;  // so that those who go on dispatching do not disturb the count
  ++unfinishedTasks_;
  if (takesTasks()) return true;
  taskEnds();
  return false;
}

// A timer that is due just then is new work, though a thread of the pool hands it out.
bool ThreadPool::takesTasks() const { return !isClosed_ && (!isClosedToOthers_ || (isOwnThread() && !handsOutTimers)); }

void ThreadPool::taskEnds() {
  if (--unfinishedTasks_ > 0) return;
  stopIfIdle();
  const std::lock_guard<std::mutex> lock(idleMutex_);
  idle_.notify_all();
}

bool ThreadPool::waitUntilIdle(Clock::time_point deadline) {
  std::unique_lock<std::mutex> lock(idleMutex_);
  while (unfinishedTasks_ > 0) {
    if (Clock::now() >= deadline) return false;
    idle_.wait_until(lock, cappedDeadline(deadline));
  }
  return true;
}

ThreadPool::Load ThreadPool::load() {
  std::size_t idle = isSearching_ ? 1 : 0;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    idle += sleepers_;
  }
  const std::size_t unfinished = unfinishedTasks_;
  const std::size_t running = std::min(unfinished, workers_ - std::min(idle, workers_));
  return {unfinished - running, running};
}

bool ThreadPool::isOwnThread() const { return currentPool == this; }

bool ThreadPool::isThreadOfAnyPool() { return currentPool != nullptr; }

// ---- work

void ThreadPool::schedule(std::shared_ptr<Work> work) {
  std::unique_lock<std::mutex> lock(mutex_);
  ready_.push_back(std::move(work));
  hasReadyWork_ = true;
  if (!isSearching_) wakeOne(lock);
}

// Releases the lock.
void ThreadPool::wakeOne(std::unique_lock<std::mutex>& lock) {
  if (sleepers_ == 0) return lock.unlock();
  searchPays_ = hasOtherProcessors_ && Clock::now() - fellAsleep_ < kLongestLookout;
  lock.unlock();
  changed_.notify_one();
}

void ThreadPool::runWork() {
  while (const std::shared_ptr<Work> work = take()) work->run();
}

// Waits for work. Null when the pool has stopped.
std::shared_ptr<ThreadPool::Work> ThreadPool::take() {
  search();
  std::unique_lock<std::mutex> lock(mutex_);
  while (ready_.empty()) {
    if (isStopped_) return nullptr;
    ++sleepers_;
    fellAsleep_ = Clock::now();
    changed_.wait(lock);
    --sleepers_;
  }
  std::shared_ptr<Work> work = std::move(ready_.front());
  ready_.pop_front();
  hasReadyWork_ = !ready_.empty();
  // Whoever scheduled the rest may have left it to this thread's search.
  if (hasReadyWork_) wakeOne(lock);
  return work;
}

// One thread at a time looks out for work a little longer before it sleeps, as long as that is found to pay. No other
// thread is woken meanwhile: what goes from queue to queue, or comes right behind, finds this one.
void ThreadPool::search() {
  if (!searchPays_ || hasReadyWork_ || isSearching_.exchange(true)) return;
  const Clock::time_point end = Clock::now() + kLongestLookout;
  while (!hasReadyWork_ && searchPays_) {
    std::this_thread::yield();  // the thread that will schedule may need the processor
    if (Clock::now() >= end) searchPays_ = false;
  }
  isSearching_ = false;
}

// ---- closing

void ThreadPool::close() {
  isClosed_ = true;
  stopIfIdle();
}

void ThreadPool::stopIfIdle() {
  if (!isClosed_ || unfinishedTasks_ > 0) return;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    isStopped_ = true;
    searchPays_ = false;
  }
  changed_.notify_all();
}

void ThreadPool::join() {
  const std::lock_guard<std::mutex> lock(joinMutex_);
  for (std::thread& thread : takeThreads()) thread.join();
}

void ThreadPool::detach() {
  for (std::thread& thread : takeThreads()) thread.detach();
}

std::vector<std::thread> ThreadPool::takeThreads() {
  const std::lock_guard<std::mutex> lock(threadsMutex_);
  return std::exchange(threads_, {});
}

}  // namespace velmora::mobile::xplat::cellar::host
