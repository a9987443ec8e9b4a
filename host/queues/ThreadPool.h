#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace velmora::mobile::xplat::cellar::host {

// The threads of one factory, whatever the number of its queues: one for each processor, one more because tasks wait
// for the disk, and the one of the timers. They keep the pool alive until they end. Counts the tasks of its queues from
// their admission until they are destroyed.
class ThreadPool : public std::enable_shared_from_this<ThreadPool> {
 public:
  // What the pool runs for a queue.
  class Work {
   public:
    virtual ~Work() = default;
    virtual void run() noexcept = 0;
  };

  // Starts the threads that run work, and one for `timers`. Throws `std::system_error` if the system cannot start one.
  static std::shared_ptr<ThreadPool> start(const std::function<void()>& timers);
  ~ThreadPool() = default;
  ThreadPool(const ThreadPool&) = delete;
  ThreadPool& operator=(const ThreadPool&) = delete;

  // Counts one more task. Not if the pool is closed, or closed to others and this is not one of its threads.
  bool admitTask();
  void taskEnds();

  // Has a thread run the work once.
  void schedule(std::shared_ptr<Work> work);

  bool isOwnThread() const;
  static bool isThreadOfAnyPool();

  struct Load {
    std::size_t waiting;
    std::size_t running;
  };

  // The tasks at this moment. A thread on its way to sleep counts as one that runs a task.
  Load load();

  // False if that takes longer.
  bool waitUntilIdle(std::chrono::steady_clock::time_point deadline);

  void closeToOthers() { isClosedToOthers_ = true; }

  // The threads that run work end when all tasks have run.
  void close();
  void join();
  void detach();

 private:
  ThreadPool();
  bool takesTasks() const;
  void startThread(std::string name, std::function<void()> function);
  void runWork();
  std::shared_ptr<Work> take();
  void search();
  void wakeOne(std::unique_lock<std::mutex>& lock);
  void stopIfIdle();
  std::vector<std::thread> takeThreads();

  const bool hasOtherProcessors_;

  // A task is counted before the flags are read: either it is refused, or who sets a flag finds it counted.
  std::atomic<std::size_t> unfinishedTasks_{0};
  std::atomic<bool> isClosed_{false};
  std::atomic<bool> isClosedToOthers_{false};
  std::mutex idleMutex_;  // so that a waiter does not miss the end of the last task between its check and its sleep
  std::condition_variable idle_;

  std::atomic<bool> hasReadyWork_{false};  // changed with the mutex held, read without it
  std::atomic<bool> isSearching_{false};   // one of the threads is
  std::atomic<bool> searchPays_{false};

  std::mutex mutex_;  // guards the four below
  std::deque<std::shared_ptr<Work>> ready_;
  std::size_t sleepers_ = 0;
  std::chrono::steady_clock::time_point fellAsleep_;  // the last one that did
  bool isStopped_ = false;
  std::condition_variable changed_;

  std::mutex joinMutex_;       // so that a second `join` waits for the first; never locked by the pool's threads
  const std::size_t workers_;  // threads that run work
  std::mutex threadsMutex_;
  std::vector<std::thread> threads_;
};

}  // namespace velmora::mobile::xplat::cellar::host
