#include "host/queues/Timers.h"

#include "host/queues/Deadline.h"

namespace velmora::mobile::xplat::cellar::host {

// A task that runs once, or never if it is cancelled first.
class Timers::DelayedTask {
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

class Timers::Handle : public executor::AsyncTimer {
 public:
  Handle(std::shared_ptr<Timers> timers, Key key, std::shared_ptr<DelayedTask> task)
      : timers_(std::move(timers)), key_(key), task_(std::move(task)) {}
  ~Handle() override {
    timers_->remove(key_);
    task_->cancel();
  }
  Handle(const Handle&) = delete;
  Handle& operator=(const Handle&) = delete;

 private:
  const std::shared_ptr<Timers> timers_;
  const Key key_;
  const std::shared_ptr<DelayedTask> task_;
};

std::unique_ptr<executor::AsyncTimer> Timers::arm(std::chrono::nanoseconds delay, Task task, AddToQueue addToQueue) {
  auto delayed = std::make_shared<DelayedTask>(std::move(task));
  Key key(deadlineAfter(delay), 0);
  if (!add(key, {std::move(addToQueue), delayed})) {
    delayed->cancel();
    return std::make_unique<executor::AsyncTimer>();
  }
  return std::make_unique<Handle>(shared_from_this(), key, std::move(delayed));
}

// Numbers the key. False if the timers have been stopped.
bool Timers::add(Key& key, Entry entry) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (isStopped_) return false;
  key.second = ++lastNumber_;
  const bool isNext = entries_.empty() || key < entries_.begin()->first;
  entries_.emplace(key, std::move(entry));
  lock.unlock();
  if (isNext) changed_.notify_one();
  return true;
}

void Timers::remove(const Key& key) {
  const std::lock_guard<std::mutex> lock(mutex_);
  entries_.erase(key);
}

void Timers::run() {
  for (Entry entry; takeDue(entry); entry = {}) {
    Task task = [delayed = entry.task] { delayed->run(); };
    if (!entry.addToQueue(task)) entry.task->cancel();
  }
}

// Waits for the next timer to be due; false when the timers have been stopped.
bool Timers::takeDue(Entry& entry) {
  std::unique_lock<std::mutex> lock(mutex_);
  while (!isStopped_) {
    const auto first = entries_.begin();
    if (first == entries_.end()) {
      changed_.wait(lock);
    } else if (const auto due = first->first.first; due > std::chrono::steady_clock::now()) {
      changed_.wait_until(lock, cappedDeadline(due));
    } else {
      entry = std::move(first->second);
      entries_.erase(first);
      return true;
    }
  }
  return false;
}

void Timers::stop() {
  std::map<Key, Entry> dropped;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    isStopped_ = true;
    dropped.swap(entries_);
  }
  changed_.notify_one();
  for (auto& [key, entry] : dropped) entry.task->cancel();
}

}  // namespace velmora::mobile::xplat::cellar::host
