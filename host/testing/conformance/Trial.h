#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include <cellar/executor/AsyncExecutor.h>
#include <cellar/executor/TaskQueueFactory.h>
#include <cellar/host/testing/CheckedQueues.h>
#include <cellar/host/testing/QueueConformance.h>

namespace velmora::mobile::xplat::cellar::test::conformance {

// How long a task gives a faulty queue the opportunity to show it. A correct queue does not notice.
constexpr std::chrono::milliseconds kOpportunity{10};

constexpr std::int64_t kMillisecond = 1'000'000;
constexpr std::int64_t kHour = 3'600'000 * kMillisecond;

// Counts events, and lets others wait for them. Thread-safe; shared, because faulty queues run tasks at any time.
class Signal {
 public:
  void raise() {
    const std::lock_guard<std::mutex> lock(mutex_);
    ++count_;
    changed_.notify_all();
  }

  std::size_t count() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return count_;
  }

  // False if there are fewer events when the time is over.
  bool waitFor(std::size_t count, std::chrono::milliseconds time) {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, time, [&] { return count_ >= count; });
  }

 private:
  mutable std::mutex mutex_;  // guards the count
  std::condition_variable changed_;
  std::size_t count_ = 0;
};

using SharedSignal = std::shared_ptr<Signal>;

inline SharedSignal newSignal() { return std::make_shared<Signal>(); }

// Calls the function when its last copy is destroyed: put into a task, when that is gone.
inline std::shared_ptr<void> whenGone(std::function<void()> function) {
  return {nullptr, [function = std::move(function)](std::nullptr_t) { function(); }};
}

// Calls `function(i)` on `count` threads and waits for them. Throws again what leaves one of them.
void onThreads(std::size_t count, const std::function<void(std::size_t)>& function);

// What a situation is tried with: a new factory under checks, and where violations go. A situation that cannot go on
// throws `GivenUp`, after it has said why.
class Trial {
 public:
  struct GivenUp {};
  using Queue = std::shared_ptr<AsyncExecutor>;

  // The violations, shared with what outlives the trial.
  struct Findings {
    std::mutex mutex;  // guards the sentences
    std::vector<std::string> sentences;

    void add(const std::string& sentence) {
      const std::lock_guard<std::mutex> lock(mutex);
      if (sentences.size() < 10) sentences.push_back(sentence);
    }
  };

  // Keeps a queue busy until it is destroyed.
  class Hold {
   public:
    explicit Hold(SharedSignal end) : end_(std::move(end)) {}
    Hold(const Hold&) = delete;
    Hold& operator=(const Hold&) = delete;
    ~Hold() { end_->raise(); }

   private:
    const SharedSignal end_;
  };

  Trial(const std::function<std::shared_ptr<TaskQueueFactory>()>& make, std::chrono::milliseconds patience,
        std::shared_ptr<Findings> findings);

  // Gives up if the factory returns null.
  Queue newFileQueue() const;
  Queue newWorkQueue() const;

  const std::shared_ptr<CheckedQueues>& queues() const { return queues_; }

  void releaseFactory() { queues_.reset(); }

  void report(const std::string& violation) const { findings_->add(violation); }

  // Waits for that many events; reports how many of `what` there were, and gives up, if they do not come.
  void expect(const SharedSignal& signal, std::size_t count, const std::string& what) const;

  // Returns when the queue is in the midst of a task that lasts as long as the hold.
  [[nodiscard]] std::unique_ptr<Hold> hold(const Queue& queue) const;

  // Returns when a task that is dispatched now has run.
  void finish(const Queue& queue) const;

  // Returns when a timer that is armed now has fired.
  void waitForTimer(const Queue& queue, std::int64_t delay) const;

 private:
  const std::chrono::milliseconds patience_;
  const std::shared_ptr<Findings> findings_;
  std::shared_ptr<CheckedQueues> queues_;
};

struct Situation {
  const char* name;
  void (*attempt)(Trial& trial);
};

// A single task and a single timer. Queues that fail here are not tried any further.
void tryTheSimplest(Trial& trial);

std::vector<Situation> situationsOfTasks();
std::vector<Situation> situationsOfTimers();
std::vector<Situation> situationsOfLifetimes();
std::vector<Situation> situationsOfPromises(const QueueConformanceOptions& options);

}  // namespace velmora::mobile::xplat::cellar::test::conformance
