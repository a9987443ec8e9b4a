#include "host/testing/CheckedQueues.h"

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <map>
#include <mutex>
#include <thread>
#include <utility>

#include "host/QueueThreadMark.h"

namespace velmora::mobile::xplat::cellar::test {

namespace {

using Clock = std::chrono::steady_clock;
using Sentences = std::vector<std::string>;
using Report = std::function<void(const std::string& violation)>;

enum class Call : std::uint8_t { Dispatch, DispatchAfter, ScheduleAfter };

const char* nameOf(Call call) {
  switch (call) {
    case Call::Dispatch:
      return "dispatch";
    case Call::DispatchAfter:
      return "dispatchAfter";
    case Call::ScheduleAfter:
      return "scheduleAfter";
  }
  return "";
}

Clock::time_point dueAfter(std::int64_t delayNanoseconds) {
  const Clock::time_point now = Clock::now();
  const std::chrono::nanoseconds delay(std::max<std::int64_t>(delayNanoseconds, 0));
  return delay < Clock::time_point::max() - now ? now + delay : Clock::time_point::max();
}

class QueueChecks;

// One dispatched task or armed timer, without the function to run. Shared by all copies of what the host holds, and by
// the handle of the timer. What is not constant is guarded by the mutex of the queue's checks.
struct Task {
  Task(std::shared_ptr<QueueChecks> ofQueue, Call byCall, std::uint64_t itsNumber, Clock::time_point itsDue,
       std::uint64_t itsCallTime)
      : queue(std::move(ofQueue)), call(byCall), number(itsNumber), due(itsDue), calledAt(itsCallTime) {}
  Task(const Task&) = delete;
  Task& operator=(const Task&) = delete;
  ~Task();

  std::string name() const { return (call == Call::Dispatch ? "task " : "timer ") + std::to_string(number); }

  const std::shared_ptr<QueueChecks> queue;
  const Call call;
  const std::uint64_t number;
  const Clock::time_point due;   // of a timer
  const std::uint64_t calledAt;  // by the queue's own count of events
  std::uint64_t returnedAt = 0;  // when `dispatch` had returned and the task had not begun; 0: not yet
  bool hasBegun = false;

  bool handleIsGone = false;
  bool mustNotBegin = false;      // it had certainly not begun when its handle was destroyed
  std::uint64_t begunBefore = 0;  // the number of runs of the queue that had begun by then
};

// A call that is under way on this thread. It knows the task by its number, because the task may be gone already.
struct CallUnderWay {
  const QueueChecks* queue;
  bool isTimer;
  std::uint64_t number;
  const CallUnderWay* outer;
};
thread_local const CallUnderWay* innermostCall = nullptr;

class CallMark {
 public:
  explicit CallMark(const Task& task)
      : call_{task.queue.get(), task.call != Call::Dispatch, task.number, std::exchange(innermostCall, &call_)} {}
  CallMark(const CallMark&) = delete;
  CallMark& operator=(const CallMark&) = delete;
  ~CallMark() { innermostCall = call_.outer; }

  static bool isWithinCallOf(const Task& task) {
    for (const CallUnderWay* call = innermostCall; call != nullptr; call = call->outer) {
      const bool isTimer = task.call != Call::Dispatch;
      if (call->queue == task.queue.get() && call->isTimer == isTimer && call->number == task.number) return true;
    }
    return false;
  }

 private:
  const CallUnderWay call_;
};

// What is known of one queue. Violations are reported without the mutex.
class QueueChecks : public std::enable_shared_from_this<QueueChecks> {
 public:
  QueueChecks(std::string name, const CheckedQueuesOptions& options, Report report)
      : name_(std::move(name)),
        allowInline_(options.allowInline),
        allowEarlyTimers_(options.allowEarlyTimers),
        report_(std::move(report)) {}

  std::shared_ptr<Task> newTask(Call call, std::int64_t delayNanoseconds) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const std::uint64_t number = call == Call::Dispatch ? ++tasks_ : ++timers_;
    return std::make_shared<Task>(shared_from_this(), call, number, dueAfter(delayNanoseconds), ++events_);
  }

  void dispatchReturned(Task& task) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (task.hasBegun) return;
    task.returnedAt = ++events_;
    waiting_.emplace(task.returnedAt, task.number);
  }

  void isGone(const Task& task) {
    const std::lock_guard<std::mutex> lock(mutex_);
    waiting_.erase(task.returnedAt);
  }

  void handleDestroyed(Task& task) {
    const std::lock_guard<std::mutex> lock(mutex_);
    task.handleIsGone = true;
    task.begunBefore = begun_;
    const auto isRunning = [this](const Running& run) {
      return !allowInline_ || run.thread == std::this_thread::get_id();  // inline runs of other threads may nest
    };
    task.mustNotBegin =
        (!allowEarlyTimers_ && Clock::now() < task.due) || std::any_of(running_.begin(), running_.end(), isRunning);
  }

  void begin(Task& task) {
    Sentences violations;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      const bool isInline = CallMark::isWithinCallOf(task);
      if (isInline && !allowInline_) violations.push_back(ranInline(task));
      checkOverlap(task, isInline, violations);
      waiting_.erase(task.returnedAt);
      if (task.hasBegun) {
        checkRepetition(task, violations);
      } else if (task.call == Call::Dispatch) {
        checkOrder(task, violations);
      }
      if (task.call != Call::Dispatch) checkTimer(task, violations);
      task.hasBegun = true;
      ++begun_;
      running_.push_back({&task, std::this_thread::get_id()});
    }
    for (const std::string& violation : violations) report(violation);
  }

  void end(const Task& task) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto isIt = [&](const Running& run) { return run.task == &task && run.thread == std::this_thread::get_id(); };
    running_.erase(std::find_if(running_.begin(), running_.end(), isIt));
  }

  void refused(const Task& task, const std::string& operation) const {
    report(operation + " was called in " + task.name() + ". Waiting on a queue's own thread may deadlock.");
  }

 private:
  struct Running {
    const Task* task;
    std::thread::id thread;
  };

  void report(const std::string& violation) const { report_(name_ + ": " + violation); }

  static std::string ranInline(const Task& task) {
    return task.name() + " ran inside " + nameOf(task.call) + ", on the thread that called it. Tasks run later.";
  }

  void checkOverlap(const Task& task, bool isInline, Sentences& violations) const {
    for (const Running& run : running_) {
      const bool isNested = run.thread == std::this_thread::get_id();
      if (isNested && (allowInline_ || isInline)) continue;
      violations.push_back(task.name() + " began before " + run.task->name() + " had ended, on " +
                           (isNested ? "the same" : "another") + " thread. Tasks of a queue run one at a time.");
      return;
    }
  }

  // Reports each task once that is overtaken.
  void checkOrder(const Task& task, Sentences& violations) {
    const auto rest = waiting_.lower_bound(task.calledAt);
    if (waiting_.begin() == rest) return;
    const auto others = std::distance(waiting_.begin(), rest) - 1;
    violations.push_back(task.name() + " began before task " + std::to_string(waiting_.begin()->second) +
                         (others > 0 ? " and " + std::to_string(others) + " more" : "") +
                         ", dispatched earlier. Tasks of a queue run in the order of dispatch.");
    waiting_.erase(waiting_.begin(), rest);
  }

  static void checkRepetition(const Task& task, Sentences& violations) {
    if (task.call == Call::ScheduleAfter) return;
    violations.push_back(task.name() + " ran again. What is given to " + nameOf(task.call) + " runs once.");
  }

  void checkTimer(const Task& task, Sentences& violations) const {
    const auto early = std::chrono::duration_cast<std::chrono::nanoseconds>(task.due - Clock::now()).count();
    if (!allowEarlyTimers_ && early > 0) {
      violations.push_back(task.name() + " began " + std::to_string(early) +
                           " ns before it was due. A timer fires after its delay.");
    }
    if (task.handleIsGone && (task.mustNotBegin || begun_ > task.begunBefore)) {
      violations.push_back(task.name() + " began after its handle was destroyed. That cancels what has not begun.");
    }
  }

  const std::string name_;
  const bool allowInline_;
  const bool allowEarlyTimers_;
  const Report report_;

  std::mutex mutex_;  // guards all below
  std::uint64_t tasks_ = 0;
  std::uint64_t timers_ = 0;
  std::uint64_t events_ = 0;
  std::uint64_t begun_ = 0;
  std::map<std::uint64_t, std::uint64_t> waiting_;  // tasks that have not begun, by when their `dispatch` had returned
  std::vector<Running> running_;
};

Task::~Task() { queue->isGone(*this); }

// One run of a task.
class Run {
 public:
  explicit Run(std::shared_ptr<Task> task)
      : task_(std::move(task)),
        mark_([this](const std::string& operation) { task_->queue->refused(*task_, operation); }) {
    task_->queue->begin(*task_);
  }
  Run(const Run&) = delete;
  Run& operator=(const Run&) = delete;
  ~Run() { task_->queue->end(*task_); }

 private:
  const std::shared_ptr<Task> task_;
  const host::QueueThreadMark mark_;
};

class CheckedTimer : public AsyncTimer {
 public:
  CheckedTimer(std::shared_ptr<Task> task, std::unique_ptr<AsyncTimer> timer)
      : task_(std::move(task)), timer_(std::move(timer)) {}
  CheckedTimer(const CheckedTimer&) = delete;
  CheckedTimer& operator=(const CheckedTimer&) = delete;
  ~CheckedTimer() override {
    timer_.reset();
    task_->queue->handleDestroyed(*task_);
  }

 private:
  const std::shared_ptr<Task> task_;
  std::unique_ptr<AsyncTimer> timer_;
};

class CheckedQueue : public AsyncExecutor {
 public:
  CheckedQueue(std::shared_ptr<AsyncExecutor> queue, std::shared_ptr<QueueChecks> checks)
      : queue_(std::move(queue)), checks_(std::move(checks)) {}

  void dispatch(std::function<void()> task) override {
    const std::shared_ptr<QueueChecks> checks = checks_;  // a task may release this queue before the call returns
    std::shared_ptr<Task> checked = checks->newTask(Call::Dispatch, 0);
    const std::weak_ptr<Task> weakTask = checked;
    {
      const CallMark mark(*checked);
      queue_->dispatch(wrapped(std::move(checked), std::move(task)));
    }
    if (const std::shared_ptr<Task> rest = weakTask.lock()) checks->dispatchReturned(*rest);
  }

  std::unique_ptr<AsyncTimer> dispatchAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> companion) override {
    const std::shared_ptr<Task> checked = checks_->newTask(Call::DispatchAfter, delayNanoseconds);
    const CallMark mark(*checked);
    return std::make_unique<CheckedTimer>(
        checked, queue_->dispatchAfter(delayNanoseconds, wrapped(checked, std::move(task)), std::move(companion)));
  }

  std::unique_ptr<AsyncTimer> scheduleAfter(std::int64_t delayNanoseconds, std::function<void()> task,
                                            std::function<void()> companion) override {
    const std::shared_ptr<Task> checked = checks_->newTask(Call::ScheduleAfter, delayNanoseconds);
    const CallMark mark(*checked);
    return std::make_unique<CheckedTimer>(
        checked, queue_->scheduleAfter(delayNanoseconds, wrapped(checked, std::move(task)), std::move(companion)));
  }

 private:
  static std::function<void()> wrapped(std::shared_ptr<Task> checked, std::function<void()> task) {
    return [checked = std::move(checked), task = std::move(task)] {
      const Run run(checked);
      task();
    };
  }

  const std::shared_ptr<AsyncExecutor> queue_;
  const std::shared_ptr<QueueChecks> checks_;
};

}  // namespace

// The violations of all queues of a factory.
class CheckedQueues::Log {
 public:
  explicit Log(CheckedQueuesOptions options) : options_(std::move(options)) {}

  void add(const std::string& violation) {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      if (violations_.size() < kMost) violations_.push_back(violation);
    }
    if (!options_.onViolation) return;
    try {
      options_.onViolation(violation);
    } catch (...) {  // NOLINT(bugprone-empty-catch): the queue that is checked must not see it
    }
  }

  Sentences violations() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return violations_;
  }

  // The queue with its checks; null, with a violation, for a null pointer.
  static std::shared_ptr<AsyncExecutor> checked(const std::shared_ptr<Log>& self, std::shared_ptr<AsyncExecutor> queue,
                                                const std::string& role) {
    const std::string name = role + " queue " + std::to_string(self->nextNumber(role));
    if (queue == nullptr) {
      self->add(name + ": the factory returned null. A factory returns a queue.");
      return nullptr;
    }
    auto report = [self](const std::string& violation) { self->add(violation); };
    return std::make_shared<CheckedQueue>(std::move(queue),
                                          std::make_shared<QueueChecks>(name, self->options_, std::move(report)));
  }

 private:
  static constexpr std::size_t kMost = 100;

  std::uint64_t nextNumber(const std::string& role) {
    const std::lock_guard<std::mutex> lock(mutex_);
    return ++queues_[role];
  }

  const CheckedQueuesOptions options_;

  mutable std::mutex mutex_;  // guards the two below
  Sentences violations_;
  std::map<std::string, std::uint64_t> queues_;  // of each role
};

CheckedQueues::CheckedQueues(std::shared_ptr<TaskQueueFactory> queues, CheckedQueuesOptions options)
    : queues_(std::move(queues)), log_(std::make_shared<Log>(std::move(options))) {}

CheckedQueues::~CheckedQueues() = default;

std::shared_ptr<AsyncExecutor> CheckedQueues::createQueue() {
  return Log::checked(log_, queues_->createQueue(), "File");
}

std::shared_ptr<AsyncExecutor> CheckedQueues::createWorkQueue() {
  return Log::checked(log_, queues_->createWorkQueue(), "Work");
}

std::vector<std::string> CheckedQueues::violations() const { return log_->violations(); }

}  // namespace velmora::mobile::xplat::cellar::test
