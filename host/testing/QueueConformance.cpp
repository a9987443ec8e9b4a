#include "host/testing/QueueConformance.h"

#include <algorithm>
#include <exception>
#include <future>
#include <stdexcept>
#include <thread>
#include <utility>

#include "host/testing/conformance/Trial.h"

namespace velmora::mobile::xplat::cellar::test {

namespace conformance {

namespace {

std::shared_ptr<TaskQueueFactory> notNull(std::shared_ptr<TaskQueueFactory> queues) {
  if (queues == nullptr) throw std::invalid_argument("there is no factory");
  return queues;
}

CheckedQueuesOptions reportTo(std::shared_ptr<Trial::Findings> findings) {
  CheckedQueuesOptions options;
  options.onViolation = [findings = std::move(findings)](const std::string& violation) { findings->add(violation); };
  return options;
}

Trial::Queue orGivenUp(Trial::Queue queue) {
  if (queue == nullptr) throw Trial::GivenUp();
  return queue;
}

}  // namespace

void onThreads(std::size_t count, const std::function<void(std::size_t)>& function) {
  std::vector<std::future<void>> threads;
  for (std::size_t i = 0; i < count; ++i) threads.push_back(std::async(std::launch::async, function, i));
  for (std::future<void>& thread : threads) thread.get();
}

Trial::Trial(const std::function<std::shared_ptr<TaskQueueFactory>()>& make, std::chrono::milliseconds patience,
             std::shared_ptr<Findings> findings)
    : patience_(patience),
      findings_(std::move(findings)),
      queues_(std::make_shared<CheckedQueues>(notNull(make()), reportTo(findings_))) {}

Trial::Queue Trial::newFileQueue() const { return orGivenUp(queues_->createQueue()); }

Trial::Queue Trial::newWorkQueue() const { return orGivenUp(queues_->createWorkQueue()); }

void Trial::expect(const SharedSignal& signal, std::size_t count, const std::string& what) const {
  if (signal->waitFor(count, patience_)) return;
  report(std::to_string(signal->count()) + " of " + std::to_string(count) + " " + what + " within " +
         std::to_string(patience_.count()) + " ms.");
  throw GivenUp();
}

std::unique_ptr<Trial::Hold> Trial::hold(const Queue& queue) const {
  const SharedSignal begun = newSignal();
  const SharedSignal end = newSignal();
  auto held = std::make_unique<Hold>(end);
  queue->dispatch([begun, end, patience = patience_] {
    begun->raise();
    end->waitFor(1, patience);
  });
  expect(begun, 1, "tasks ran");
  return held;
}

void Trial::finish(const Queue& queue) const {
  const SharedSignal ran = newSignal();
  queue->dispatch([ran] { ran->raise(); });
  expect(ran, 1, "tasks ran");
}

void Trial::waitForTimer(const Queue& queue, std::int64_t delay) const {
  const SharedSignal fired = newSignal();
  const auto timer = queue->dispatchAfter(
      delay, [fired] { fired->raise(); }, nullptr);
  expect(fired, 1, "timers fired");
}

}  // namespace conformance

namespace {

using conformance::Situation;
using conformance::Trial;

class ConformanceCheck {
 public:
  ConformanceCheck(std::function<std::shared_ptr<TaskQueueFactory>()> make, std::chrono::milliseconds patience)
      : make_(std::move(make)),
        patience_(
            std::clamp<std::chrono::milliseconds>(patience, std::chrono::milliseconds(0), std::chrono::hours(1))) {}

  void attempt(const std::vector<Situation>& situations) {
    for (const Situation& situation : situations) attempt(situation);
  }

  bool foundNothing() const { return violations_.empty(); }
  std::vector<std::string> violations() { return std::move(violations_); }

 private:
  // On a thread of its own, which a call that never returns can keep.
  void attempt(const Situation& situation) {
    const auto findings = std::make_shared<Trial::Findings>();
    const auto ended = conformance::newSignal();
    std::thread thread([make = make_, patience = patience_, attempt = situation.attempt, findings, ended] {
      attemptOn(make, patience, attempt, findings);
      ended->raise();
    });
    if (ended->waitFor(1, 3 * patience_)) {  // a situation gives up after one patience, and holds a queue for another
      thread.join();
    } else {
      thread.detach();
      findings->add("A call of the factory, of a queue or of a handle did not return.");
    }
    const std::lock_guard<std::mutex> lock(findings->mutex);
    for (const std::string& sentence : findings->sentences) violations_.push_back(situation.name + (": " + sentence));
  }

  static void attemptOn(const std::function<std::shared_ptr<TaskQueueFactory>()>& make,
                        std::chrono::milliseconds patience, void (*attempt)(Trial&),
                        const std::shared_ptr<Trial::Findings>& findings) {
    try {
      Trial trial(make, patience, findings);
      attempt(trial);
    } catch (const Trial::GivenUp&) {  // NOLINT(bugprone-empty-catch): it has been reported
    } catch (const std::exception& error) {
      findings->add(std::string("The factory, a queue or a handle threw: ") + error.what());
    } catch (...) {
      findings->add("The factory, a queue or a handle threw what is not an exception.");
    }
  }

  const std::function<std::shared_ptr<TaskQueueFactory>()> make_;
  const std::chrono::milliseconds patience_;
  std::vector<std::string> violations_;
};

}  // namespace

std::vector<std::string> checkConformance(const std::function<std::shared_ptr<TaskQueueFactory>()>& make,
                                          const QueueConformanceOptions& options) {
  ConformanceCheck check(make, options.patience);
  check.attempt({{"A task and a timer", conformance::tryTheSimplest}});
  if (check.foundNothing()) {
    check.attempt(conformance::situationsOfTasks());
    check.attempt(conformance::situationsOfTimers());
    check.attempt(conformance::situationsOfLifetimes());
    check.attempt(conformance::situationsOfPromises(options));
  }
  return check.violations();
}

}  // namespace velmora::mobile::xplat::cellar::test
