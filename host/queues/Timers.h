#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <utility>

#include <cellar/executor/AsyncTimer.h>

namespace velmora::mobile::xplat::cellar::host {

// The timers of all queues of one factory, in the order in which they are due. Hands due tasks to their queues.
class Timers : public std::enable_shared_from_this<Timers> {
 public:
  using Task = std::function<void()>;

  // Adds a task to a queue; false, with the task unchanged, if that refuses it.
  using AddToQueue = std::function<bool(Task&)>;

  // Destroying the handle cancels the task and destroys its captures, unless it has begun to run. Once the timers have
  // been stopped, the task is destroyed at once.
  std::unique_ptr<executor::AsyncTimer> arm(std::chrono::nanoseconds delay, Task task, AddToQueue add);

  // The thread of the timers: returns when they have been stopped.
  void run();

  // Cancels all timers that have not fired.
  void stop();

 private:
  class DelayedTask;
  class Handle;
  struct Entry {
    AddToQueue addToQueue;
    std::shared_ptr<DelayedTask> task;
  };
  // When it is due, and a number to keep the order of timers that are due at the same time.
  using Key = std::pair<std::chrono::steady_clock::time_point, std::uint64_t>;

  bool add(Key& key, Entry entry);
  void remove(const Key& key);
  bool takeDue(Entry& entry);

  std::mutex mutex_;  // guards the three below
  std::map<Key, Entry> entries_;
  std::uint64_t lastNumber_ = 0;
  bool isStopped_ = false;
  std::condition_variable changed_;
};

}  // namespace velmora::mobile::xplat::cellar::host
