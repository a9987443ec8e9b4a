#include "host/ThreadQueueFactory.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <stdexcept>
#include <string>
#include <utility>

#include "host/QueueThreadMark.h"
#include "host/queues/Deadline.h"
#include "host/queues/SerialQueue.h"
#include "host/queues/ThreadPool.h"
#include "host/queues/Timers.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Task = std::function<void()>;

// The handle of a queue that users own. The queue itself lives until its tasks have run.
class QueueHandle : public AsyncExecutor, public std::enable_shared_from_this<QueueHandle> {
 public:
  QueueHandle(std::shared_ptr<SerialQueue> queue, std::shared_ptr<Timers> timers)
      : queue_(std::move(queue)), timers_(std::move(timers)) {}

  void dispatch(Task task) override { queue_->add(task); }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, Task task, Task /*companion*/) override {
    return timers_->arm(std::chrono::nanoseconds(delayNanoseconds), std::move(task),
                        [weak = weak_from_this()](Task& due) {
                          const std::shared_ptr<QueueHandle> handle = weak.lock();
                          return handle != nullptr && handle->queue_->add(due);
                        });
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, Task task, Task companion) override {
    return dispatchAfter(delayNanoseconds, std::move(task), std::move(companion));
  }

 private:
  const std::shared_ptr<SerialQueue> queue_;
  const std::shared_ptr<Timers> timers_;
};

}  // namespace

class ThreadQueueFactory::Threads {
 public:
  std::shared_ptr<AsyncExecutor> createQueue(const std::string& role, std::atomic<unsigned int>& queuesOfRole) const {
    auto name = "cellar-" + role + "-" + std::to_string(++queuesOfRole);
    return std::make_shared<QueueHandle>(std::make_shared<SerialQueue>(std::move(name), pool), timers);
  }

  void close() const {
    timers->stop();
    pool->close();
  }

  const std::shared_ptr<Timers> timers = std::make_shared<Timers>();
  const std::shared_ptr<ThreadPool> pool = ThreadPool::start([timers = timers] { timers->run(); });
  std::atomic<unsigned int> fileQueues{0};
  std::atomic<unsigned int> workQueues{0};
};

ThreadQueueFactory::ThreadQueueFactory() : threads_(std::make_unique<Threads>()) {}

ThreadQueueFactory::~ThreadQueueFactory() {
  if (isOwnThread()) {
    abandon();
  } else {
    shutDown();
  }
}

std::shared_ptr<AsyncExecutor> ThreadQueueFactory::createQueue() {
  return threads_->createQueue("file", threads_->fileQueues);
}

std::shared_ptr<AsyncExecutor> ThreadQueueFactory::createWorkQueue() {
  return threads_->createQueue("work", threads_->workQueues);
}

bool ThreadQueueFactory::isOwnThread() const { return threads_->pool->isOwnThread(); }

void ThreadQueueFactory::refuseOnQueueThread(const std::string& operation, const std::string& advice) {
  const bool isMarked = QueueThreadMark::tell(operation);
  if (ThreadPool::isThreadOfAnyPool()) {
    throw std::logic_error(operation + " may deadlock on a thread of the host kit's queues. " + advice);
  }
  if (isMarked) throw std::logic_error(operation + " may deadlock in a task of a queue. " + advice);
}

ThreadQueueFactory::Load ThreadQueueFactory::load() const {
  const ThreadPool::Load load = threads_->pool->load();
  return {load.waiting, load.running};
}

bool ThreadQueueFactory::drain(std::chrono::milliseconds patience) {
  return !isOwnThread() && threads_->pool->waitUntilIdle(deadlineAfter(detail::inMilliseconds(patience)));
}

void ThreadQueueFactory::refuseNewWork() {
  threads_->timers->stop();
  threads_->pool->closeToOthers();
}

void ThreadQueueFactory::shutDown() {
  threads_->close();
  if (!isOwnThread()) threads_->pool->join();
}

void ThreadQueueFactory::abandon() {
  threads_->close();
  threads_->pool->detach();
}

}  // namespace velmora::mobile::xplat::cellar::host
