#include "host/queues/SerialQueue.h"

#include <glog/logging.h>

#include <cstddef>
#include <exception>
#include <utility>

namespace velmora::mobile::xplat::cellar::host {

namespace {

// So that a queue keeps the memory of its usual work, but not that of a rush.
constexpr std::size_t kKeptCapacity = 256;

}  // namespace

SerialQueue::SerialQueue(std::string name, std::shared_ptr<ThreadPool> pool)
    : name_(std::move(name)), pool_(std::move(pool)) {}

bool SerialQueue::add(Task& task) {
  if (!pool_->admitTask()) return false;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    waiting_.push_back(std::move(task));
    if (std::exchange(isScheduled_, true)) return true;
  }
  pool_->schedule(shared_from_this());
  return true;
}

void SerialQueue::run() noexcept {
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    running_.swap(waiting_);
  }
  for (Task& task : running_) {
    runLogged(task);
    task = nullptr;  // its captures are destroyed before it counts as finished
    pool_->taskEnds();
  }
  running_.clear();
  if (running_.capacity() > kKeptCapacity) std::vector<Task>().swap(running_);  // assigning {} would keep its memory
  if (hasMore()) pool_->schedule(shared_from_this());
}

bool SerialQueue::hasMore() {
  const std::lock_guard<std::mutex> lock(mutex_);
  isScheduled_ = !waiting_.empty();
  return isScheduled_;
}

void SerialQueue::runLogged(const Task& task) const noexcept {
  try {
    task();
  } catch (const std::exception& exception) {
    LOG(ERROR) << "Task failed on queue " << name_ << ": " << exception.what();
  } catch (...) {
    LOG(ERROR) << "Task failed on queue " << name_ << ": unknown exception";
  }
}

}  // namespace velmora::mobile::xplat::cellar::host
