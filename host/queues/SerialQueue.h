#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "host/queues/ThreadPool.h"

namespace velmora::mobile::xplat::cellar::host {

// The tasks of one queue, which run one at a time on the threads of a pool. Tasks are neither run nor destroyed under
// the lock.
class SerialQueue : public ThreadPool::Work, public std::enable_shared_from_this<SerialQueue> {
 public:
  using Task = std::function<void()>;

  SerialQueue(std::string name, std::shared_ptr<ThreadPool> pool);

  // Moves the task into the queue. Returns false and leaves the task unchanged if the pool refuses it.
  bool add(Task& task);

  // Runs the tasks that wait at this moment. Those that come meanwhile have to stand in line with other queues.
  void run() noexcept override;

 private:
  void runLogged(const Task& task) const noexcept;
  bool hasMore();

  const std::string name_;
  const std::shared_ptr<ThreadPool> pool_;
  std::vector<Task> running_;  // used by `run` only

  std::mutex mutex_;  // guards the two below
  std::vector<Task> waiting_;
  bool isScheduled_ = false;
};

}  // namespace velmora::mobile::xplat::cellar::host
