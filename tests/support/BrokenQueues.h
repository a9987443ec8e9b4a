#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "executor/AsyncExecutor.h"
#include "executor/TaskQueueFactory.h"
#include "host/ThreadQueueFactory.h"
#include "support/Barrier.h"

namespace velmora::mobile::xplat::cellar::test {

using Task = std::function<void()>;

// Passes everything on to a queue of the kit. Each queue below breaks one rule of the contract.
class PassingQueue : public AsyncExecutor {
 public:
  explicit PassingQueue(TaskQueueFactory& kit) : queue(kit.createQueue()) {}

  void dispatch(Task task) override { queue->dispatch(std::move(task)); }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delay, Task task, Task /*companion*/) override {
    return arm(delay, std::move(task));
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delay, Task task, Task /*companion*/) override {
    return arm(delay, std::move(task));
  }

 protected:
  virtual std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) {
    return queue->dispatchAfter(delay, std::move(task), nullptr);
  }

  const std::shared_ptr<AsyncExecutor> queue;
};

template <class Queue> class FactoryOf : public TaskQueueFactory {
 public:
  std::shared_ptr<AsyncExecutor> createQueue() override { return std::make_shared<Queue>(kit_); }
  std::shared_ptr<AsyncExecutor> createWorkQueue() override { return createQueue(); }

 private:
  host::ThreadQueueFactory kit_;
};

// A pool of two threads that take turns. A second task that is dispatched while the first one is held has run when its
// `dispatch` returns, so that they are sure to overlap.
class PooledQueue : public PassingQueue {
 public:
  explicit PooledQueue(TaskQueueFactory& kit) : PassingQueue(kit), other_(kit.createQueue()) {}

  void dispatch(Task task) override {
    const int number = ++count_;
    if (number == 1) {
      queue->dispatch([firstHasEnded = firstHasEnded_, task = std::move(task)] {
        task();
        *firstHasEnded = true;
      });
    } else if (number > 2 || *firstHasEnded_) {
      (number % 2 == 1 ? queue : other_)->dispatch(std::move(task));
    } else {
      Latch ended(1);
      other_->dispatch([&ended, task = std::move(task)] {
        task();
        ended.countDown();
      });
      ended.wait();
    }
  }

 private:
  const std::shared_ptr<AsyncExecutor> other_;
  const std::shared_ptr<std::atomic<bool>> firstHasEnded_ = std::make_shared<std::atomic<bool>>(false);
  std::atomic<int> count_{0};
};

// Runs the youngest task first.
class ReversingQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

  void dispatch(Task task) override {
    {
      const std::lock_guard<std::mutex> lock(stack_->mutex);
      stack_->tasks.push_back(std::move(task));
    }
    queue->dispatch([stack = stack_] {
      Task youngest;
      {
        const std::lock_guard<std::mutex> lock(stack->mutex);
        youngest = std::move(stack->tasks.back());
        stack->tasks.pop_back();
      }
      youngest();
    });
  }

 private:
  struct Stack {
    std::mutex mutex;
    std::vector<Task> tasks;
  };
  const std::shared_ptr<Stack> stack_ = std::make_shared<Stack>();
};

class InlineQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;
  void dispatch(Task task) override { task(); }
};

class RepeatingQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;
  void dispatch(Task task) override {
    queue->dispatch(task);
    queue->dispatch(std::move(task));
  }
};

// Loses each fifth task.
class ForgettingQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;
  void dispatch(Task task) override {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      if (++count_ % 5 == 0) return;
    }
    queue->dispatch(std::move(task));
  }

 private:
  std::mutex mutex_;
  int count_ = 0;
};

// Destroys no task before `letGo`.
class KeepingQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;
  void dispatch(Task task) override {
    {
      const std::lock_guard<std::mutex> lock(kept().mutex);
      kept().tasks.push_back(task);
    }
    queue->dispatch(std::move(task));
  }

  static void letGo() {
    std::vector<Task> released;
    const std::lock_guard<std::mutex> lock(kept().mutex);
    released.swap(kept().tasks);
  }

 private:
  struct Kept {
    std::mutex mutex;
    std::vector<Task> tasks;
  };
  static Kept& kept() {
    static Kept ofAll;
    return ofAll;
  }
};

class ImpatientTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t /*delay*/, Task task) override {
    return PassingQueue::arm(0, std::move(task));
  }
};

// Counts in milliseconds of 32 bits.
class NarrowTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
    const std::int64_t rounded = delay > 0 ? (delay - 1) / 1'000'000 + 1 : 0;
    return PassingQueue::arm(std::int64_t(static_cast<std::uint32_t>(rounded)) * 1'000'000, std::move(task));
  }
};

// Its handles cancel nothing.
class StubbornTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
    const std::lock_guard<std::mutex> lock(mutex_);
    timers_.push_back(PassingQueue::arm(delay, std::move(task)));
    return std::make_unique<AsyncTimer>();
  }

 private:
  std::mutex mutex_;
  std::vector<std::unique_ptr<AsyncTimer>> timers_;
};

// Timers that are due at once are handed to the queue at once, and cannot be cancelled from then on.
class HastyTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
    if (delay > 0) return PassingQueue::arm(delay, std::move(task));
    queue->dispatch(std::move(task));
    return std::make_unique<AsyncTimer>();
  }
};

// Timers that are due at once run at once, on a thread of their own.
class BesideTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
    if (delay > 0) return PassingQueue::arm(delay, std::move(task));
    std::thread(std::move(task)).join();
    return std::make_unique<AsyncTimer>();
  }
};

// Timers that are due at once never fire.
class UnpunctualTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
    return delay > 0 ? PassingQueue::arm(delay, std::move(task)) : std::make_unique<AsyncTimer>();
  }
};

// Stands for a lock that its own thread waits for, until the test ends all deadlocks: real ones would keep their
// threads forever.
class Deadlock {
 public:
  void lock() {
    std::unique_lock<std::mutex> lock(mutex());
    changed().wait(lock, [this] { return !isLocked_ || isOver(); });
    isLocked_ = true;
  }

  void unlock() {
    const std::lock_guard<std::mutex> lock(mutex());
    isLocked_ = false;
    changed().notify_all();
  }

  static void letAll(bool end) {
    const std::lock_guard<std::mutex> lock(mutex());
    isOver() = end;
    changed().notify_all();
  }

 private:
  static std::mutex& mutex() {  // guards the flags
    static std::mutex ofAll;
    return ofAll;
  }
  static std::condition_variable& changed() {
    static std::condition_variable ofAll;
    return ofAll;
  }
  static bool& isOver() {
    static bool ofAll = false;
    return ofAll;
  }

  bool isLocked_ = false;
};

// Destroys tasks under the lock that `dispatch` takes.
class LockingQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;
  void dispatch(Task task) override {
    lock_->lock();
    queue->dispatch([lock = lock_, task = std::make_shared<Task>(std::move(task))] {
      (*task)();
      lock->lock();
      *task = nullptr;
      lock->unlock();
    });
    lock_->unlock();
  }

 private:
  const std::shared_ptr<Deadlock> lock_ = std::make_shared<Deadlock>();
};

// Its handles wait for a run that is under way.
class WaitingTimersQueue : public PassingQueue {
 public:
  using PassingQueue::PassingQueue;

 protected:
  std::unique_ptr<AsyncTimer> arm(std::int64_t delay, Task task) override {
    const auto running = std::make_shared<Deadlock>();
    auto run = [running, task = std::move(task)] {
      running->lock();
      task();
      running->unlock();
    };
    return std::make_unique<Handle>(running, PassingQueue::arm(delay, std::move(run)));
  }

 private:
  struct Handle : AsyncTimer {
    Handle(std::shared_ptr<Deadlock> whenItRuns, std::unique_ptr<AsyncTimer> passed)
        : running(std::move(whenItRuns)), timer(std::move(passed)) {}
    ~Handle() override {
      timer.reset();
      running->lock();
      running->unlock();
    }
    const std::shared_ptr<Deadlock> running;
    std::unique_ptr<AsyncTimer> timer;
  };
};

}  // namespace velmora::mobile::xplat::cellar::test
