#include "LazyDispatcher.h"

#include <cstdint>
#include <stdexcept>

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr std::uint64_t kNanosecondsPerSecond = 1'000'000'000;

std::int64_t nanoseconds(long seconds) {
  return static_cast<std::int64_t>(static_cast<std::uint64_t>(seconds) * kNanosecondsPerSecond);
}

}  // namespace

std::shared_ptr<LazyDispatcher> LazyDispatcher::createLazyDispatcher(
    const std::shared_ptr<TaskQueueFactory>& taskQueueFactory, long delaySeconds) {
  auto dispatcher = std::make_shared<LazyDispatcher>(taskQueueFactory);
  dispatcher->scheduleDispatch(delaySeconds);
  return dispatcher;
}

LazyDispatcher::LazyDispatcher(const std::shared_ptr<TaskQueueFactory>& taskQueueFactory)
    : queue_(taskQueueFactory->createWorkQueue()) {}

LazyDispatcher::~LazyDispatcher() = default;

void LazyDispatcher::addTask(const std::function<void()>& task, const std::shared_ptr<AsyncExecutor>& executor) {
  if (executor == nullptr) throw std::invalid_argument("Dispatch queue can not be null.");
  const std::lock_guard<std::mutex> lock(mutex_);
  if (dispatched_) {
    executor->dispatch(task);
  } else {
    tasks_.emplace_back(task, executor);
  }
}

void LazyDispatcher::scheduleDispatch(long delaySeconds) {
  const auto release = [weakThis = weak_from_this()] {
    if (const auto dispatcher = weakThis.lock()) dispatcher->dispatchNow();
  };
  replaceTimer(queue_->dispatchAfter(nanoseconds(delaySeconds), release, nullptr));
}

void LazyDispatcher::dispatchNow() {
  std::vector<Task> tasks;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    dispatched_ = true;
    tasks.swap(tasks_);
  }
  for (const auto& [task, executor] : tasks) {
    // The executor is kept until its task has run: nobody else may know it any more.
    executor->dispatch([task = task, executor = executor] { task(); });
  }
}

void LazyDispatcher::willBeTriggeredExternally() {
  const std::lock_guard<std::mutex> lock(mutex_);
  triggeredExternally_ = true;
  replaceTimer(nullptr);
}

void LazyDispatcher::replaceTimer(std::unique_ptr<AsyncTimer> timer) {
  {
    const std::lock_guard<std::mutex> lock(timerMutex_);
    timer_.swap(timer);
  }
}

}  // namespace velmora::mobile::xplat::cellar
