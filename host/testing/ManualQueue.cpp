#include "host/testing/ManualQueue.h"

#include <condition_variable>
#include <deque>
#include <stdexcept>
#include <thread>
#include <utility>

namespace velmora::mobile::xplat::cellar::test {

struct ManualExecutor::Entry {
  TimerInfo info;
  std::function<void()> task;

  bool isArmed() const { return !info.cancelled && !info.fired; }

  // Returns the task, so that the caller destroys it after unlocking.
  std::function<void()> cancel() {
    if (!isArmed()) return nullptr;
    info.cancelled = true;
    return std::exchange(task, nullptr);
  }
};

struct ManualExecutor::State {
  std::mutex mutex;
  std::condition_variable idle;
  std::thread::id runner;  // the thread that runs a task
  int depth = 0;           // the number of nested tasks that it runs
  std::deque<std::function<void()>> tasks;
  std::vector<std::shared_ptr<Entry>> timers;
  std::size_t companions = 0;
  bool throwsOnDispatch = false;

  std::shared_ptr<Entry> armed(std::int64_t delayNanoseconds) const {
    for (const std::shared_ptr<Entry>& entry : timers) {
      if (entry->info.delayNanoseconds == delayNanoseconds && entry->isArmed()) return entry;
    }
    return nullptr;
  }
};

// The right to run a task: one thread at a time. No lock is held while it runs, so the task may use the queue.
class ManualExecutor::Turn {
 public:
  explicit Turn(std::shared_ptr<State> state) : state_(std::move(state)) {
    std::unique_lock<std::mutex> lock(state_->mutex);
    const std::thread::id self = std::this_thread::get_id();
    state_->idle.wait(lock, [&] { return state_->depth == 0 || state_->runner == self; });
    state_->runner = self;
    ++state_->depth;
  }
  Turn(const Turn&) = delete;
  Turn& operator=(const Turn&) = delete;
  ~Turn() {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    if (--state_->depth == 0) state_->idle.notify_all();
  }

 private:
  std::shared_ptr<State> state_;  // the task may release the queue itself
};

// The handle. It may outlive the queue.
class ManualExecutor::Timer : public AsyncTimer {
 public:
  Timer(std::shared_ptr<State> state, std::shared_ptr<Entry> entry)
      : state_(std::move(state)), entry_(std::move(entry)) {}
  Timer(const Timer&) = delete;
  Timer& operator=(const Timer&) = delete;
  ~Timer() override {
    std::function<void()> dropped;
    const std::lock_guard<std::mutex> lock(state_->mutex);
    dropped = entry_->cancel();
  }

 private:
  std::shared_ptr<State> state_;
  std::shared_ptr<Entry> entry_;
};

ManualExecutor::ManualExecutor() : state_(std::make_shared<State>()) {}

ManualExecutor::~ManualExecutor() {
  dropAll();
  dropTimers();
}

void ManualExecutor::dispatch(std::function<void()> task) {
  if (beforeDispatch) beforeDispatch();
  {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    if (state_->throwsOnDispatch) throw std::runtime_error("The queue takes no tasks.");
    state_->tasks.push_back(std::move(task));
  }
  if (onDispatch) onDispatch();
}

std::unique_ptr<AsyncTimer> ManualExecutor::dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                                          std::function<void()> companion) {
  return arm({delayNanoseconds, false, false, false}, std::move(task), companion);
}

std::unique_ptr<AsyncTimer> ManualExecutor::scheduleAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                                          std::function<void()> companion) {
  return arm({delayNanoseconds, true, false, false}, std::move(task), companion);
}

std::unique_ptr<AsyncTimer> ManualExecutor::arm(const TimerInfo& info, std::function<void()> task,
                                                const std::function<void()>& companion) {
  const auto entry = std::make_shared<Entry>(Entry{info, std::move(task)});
  const std::lock_guard<std::mutex> lock(state_->mutex);
  if (companion) ++state_->companions;
  state_->timers.push_back(entry);
  return std::make_unique<Timer>(state_, entry);
}

std::size_t ManualExecutor::pending() const {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->tasks.size();
}

bool ManualExecutor::runNext() {
  const Turn turn(state_);
  std::function<void()> task;
  {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    if (state_->tasks.empty()) return false;
    task = std::move(state_->tasks.front());
    state_->tasks.pop_front();
  }
  task();
  return true;
}

std::size_t ManualExecutor::runAll() {
  std::size_t count = 0;
  while (runNext()) ++count;
  return count;
}

void ManualExecutor::dropAll() {
  std::deque<std::function<void()>> dropped;  // destroyed after the lock: a task's destructor may use the queue
  const std::lock_guard<std::mutex> lock(state_->mutex);
  dropped.swap(state_->tasks);
}

std::vector<TimerInfo> ManualExecutor::timers() const {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  std::vector<TimerInfo> infos;
  for (const std::shared_ptr<Entry>& entry : state_->timers) infos.push_back(entry->info);
  return infos;
}

std::vector<std::int64_t> ManualExecutor::armedDelays() const {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  std::vector<std::int64_t> delays;
  for (const std::shared_ptr<Entry>& entry : state_->timers) {
    if (entry->isArmed()) delays.push_back(entry->info.delayNanoseconds);
  }
  return delays;
}

bool ManualExecutor::fireTimer(std::int64_t delayNanoseconds) {
  const Turn turn(state_);
  std::function<void()> task;
  {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    const std::shared_ptr<Entry> entry = state_->armed(delayNanoseconds);
    if (!entry) return false;
    entry->info.fired = true;
    task = std::exchange(entry->task, nullptr);
  }
  task();
  return true;
}

void ManualExecutor::dropTimers() {
  std::vector<std::function<void()>> dropped;
  const std::lock_guard<std::mutex> lock(state_->mutex);
  for (const std::shared_ptr<Entry>& entry : state_->timers) dropped.push_back(entry->cancel());
}

void ManualExecutor::throwOnDispatch(bool throws) {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  state_->throwsOnDispatch = throws;
}

std::size_t ManualExecutor::companions() const {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->companions;
}

ManualQueueFactory::ManualQueueFactory() = default;

ManualQueueFactory::~ManualQueueFactory() {
  for (const std::shared_ptr<ManualExecutor>& executor : all()) {
    executor->dropAll();
    executor->dropTimers();
  }
}

std::shared_ptr<AsyncExecutor> ManualQueueFactory::createQueue() { return create(queues_); }

std::shared_ptr<AsyncExecutor> ManualQueueFactory::createWorkQueue() { return create(workQueues_); }

std::shared_ptr<AsyncExecutor> ManualQueueFactory::create(Executors& executors) {
  const std::lock_guard<std::mutex> lock(mutex_);
  executors.push_back(std::make_shared<ManualExecutor>());
  return executors.back();
}

std::shared_ptr<ManualExecutor> ManualQueueFactory::queue(std::size_t i) const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return queues_.at(i);
}

std::shared_ptr<ManualExecutor> ManualQueueFactory::workQueue(std::size_t i) const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return workQueues_.at(i);
}

std::size_t ManualQueueFactory::queueCount() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return queues_.size();
}

std::size_t ManualQueueFactory::workQueueCount() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return workQueues_.size();
}

std::vector<std::shared_ptr<ManualExecutor>> ManualQueueFactory::all() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  Executors executors = queues_;
  executors.insert(executors.end(), workQueues_.begin(), workQueues_.end());
  return executors;
}

std::size_t ManualQueueFactory::runAll() {
  std::size_t count = 0;
  for (std::size_t ran = 1; ran > 0; count += ran) {
    ran = 0;
    for (const std::shared_ptr<ManualExecutor>& executor : all()) {
      if (executor->runNext()) ++ran;
    }
  }
  return count;
}

}  // namespace velmora::mobile::xplat::cellar::test
