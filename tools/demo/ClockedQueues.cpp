#include "demo/ClockedQueues.h"

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <utility>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// What is to run at its time. Its handle owns it: without the handle it never runs.
struct Alarm {
  std::weak_ptr<AsyncExecutor> queue;
  std::function<void()> task;
};

class Handle : public AsyncTimer {
 public:
  explicit Handle(std::shared_ptr<Alarm> alarm) : alarm_(std::move(alarm)) {}

 private:
  const std::shared_ptr<Alarm> alarm_;
};

void dispatch(const std::weak_ptr<Alarm>& due) {
  const auto alarm = due.lock();
  const auto queue = alarm == nullptr ? nullptr : alarm->queue.lock();
  if (queue == nullptr) return;
  queue->dispatch([due] {
    if (const auto stillWanted = due.lock()) stillWanted->task();
  });
}

}  // namespace

class ClockedQueues::Clock {
 public:
  void add(std::int64_t delay, const std::shared_ptr<Alarm>& alarm) {
    const std::lock_guard<std::mutex> lock(mutex_);
    alarms_.emplace(now_ + delay, alarm);
  }

  std::vector<std::weak_ptr<Alarm>> moveOn(std::chrono::nanoseconds time) {
    const std::lock_guard<std::mutex> lock(mutex_);
    now_ += time.count();
    std::vector<std::weak_ptr<Alarm>> due;
    for (const auto end = alarms_.upper_bound(now_); alarms_.begin() != end;) {
      due.push_back(std::move(alarms_.begin()->second));
      alarms_.erase(alarms_.begin());
    }
    return due;
  }

 private:
  std::mutex mutex_;      // guards the two below
  std::int64_t now_ = 0;  // nanoseconds
  std::multimap<std::int64_t, std::weak_ptr<Alarm>> alarms_;
};

class ClockedQueues::Queue : public AsyncExecutor {
 public:
  Queue(std::shared_ptr<AsyncExecutor> thread, std::shared_ptr<Clock> clock)
      : thread_(std::move(thread)), clock_(std::move(clock)) {}

  void dispatch(std::function<void()> task) override { thread_->dispatch(std::move(task)); }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> /*companion*/) override {
    auto alarm = std::make_shared<Alarm>(Alarm{thread_, std::move(task)});
    clock_->add(delayNanoseconds, alarm);
    return std::make_unique<Handle>(std::move(alarm));
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> companion) override {
    return dispatchAfter(delayNanoseconds, std::move(task), std::move(companion));
  }

 private:
  const std::shared_ptr<AsyncExecutor> thread_;
  const std::shared_ptr<Clock> clock_;
};

ClockedQueues::ClockedQueues() : clock_(std::make_shared<Clock>()) {}

ClockedQueues::~ClockedQueues() = default;

std::shared_ptr<AsyncExecutor> ClockedQueues::createQueue() {
  return std::make_shared<Queue>(threads_.createQueue(), clock_);
}

std::shared_ptr<AsyncExecutor> ClockedQueues::createWorkQueue() {
  return std::make_shared<Queue>(threads_.createWorkQueue(), clock_);
}

void ClockedQueues::moveOn(std::chrono::seconds time) {
  for (const auto& alarm : clock_->moveOn(time)) tools::dispatch(alarm);
}

bool ClockedQueues::drain(std::chrono::milliseconds patience) { return threads_.drain(patience); }

void ClockedQueues::shutDown() { threads_.shutDown(); }

}  // namespace velmora::mobile::xplat::cellar::tools
