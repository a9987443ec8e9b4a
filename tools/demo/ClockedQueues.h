#pragma once

#include <chrono>
#include <memory>

#include "executor/TaskQueueFactory.h"
#include "host/ThreadQueueFactory.h"

namespace velmora::mobile::xplat::cellar::tools {

// Queues on threads whose timers go by a clock that stands still until somebody moves it on: an application's hours
// pass without anybody having to wait for them. Any thread may call.
class ClockedQueues : public TaskQueueFactory {
 public:
  ClockedQueues();
  ~ClockedQueues() override;

  std::shared_ptr<AsyncExecutor> createQueue() override;
  std::shared_ptr<AsyncExecutor> createWorkQueue() override;

  // Moves the clock on, and dispatches the tasks of the timers that are due then, the earliest first. A timer that one
  // of these tasks arms waits for the next call.
  void moveOn(std::chrono::seconds time);

  // As those of the threads' own factory.
  bool drain(std::chrono::milliseconds patience);
  void shutDown();

 private:
  class Clock;
  class Queue;

  const std::shared_ptr<Clock> clock_;
  host::ThreadQueueFactory threads_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
