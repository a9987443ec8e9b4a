#include <stdexcept>

#include "host/testing/conformance/Trial.h"

namespace velmora::mobile::xplat::cellar::test::conformance {

namespace {

using Queue = Trial::Queue;
using Timer = std::unique_ptr<AsyncTimer>;

void throwingTasks(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  queue->dispatch([] { throw std::runtime_error("a task that fails on purpose"); });
  queue->dispatch([] { throw 7; });
  trial.finish(queue);
  const SharedSignal fired = newSignal();
  const Timer timer = queue->dispatchAfter(
      0,
      [fired] {
        fired->raise();
        throw std::runtime_error("a timer that fails on purpose");
      },
      nullptr);
  trial.expect(fired, 1, "timers fired");
  trial.waitForTimer(queue, kMillisecond);
  trial.finish(queue);
}

void releasedQueues(Trial& trial) {
  const SharedSignal ran = newSignal();
  Queue queue = trial.newFileQueue();
  const auto owner = std::make_shared<Queue>(queue);
  {
    const auto hold = trial.hold(queue);
    for (int i = 0; i < 10; ++i) queue->dispatch([ran] { ran->raise(); });
    queue->dispatch([owner] { owner->reset(); });
    for (int i = 0; i < 10; ++i) queue->dispatch([ran] { ran->raise(); });
    queue.reset();
  }
  trial.expect(ran, 20, "tasks of a released queue ran");
}

void scheduledTimers(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  const SharedSignal fired = newSignal();
  const Timer timer = queue->scheduleAfter(
      kMillisecond, [fired] { fired->raise(); }, nullptr);
  trial.expect(fired, 1, "timers fired");
  for (int i = 0; i < 3; ++i) trial.waitForTimer(queue, kMillisecond);
  trial.finish(queue);
  if (fired->count() == 1) return;
  trial.report("A timer of scheduleAfter fired " + std::to_string(fired->count()) + " times instead of once.");
}

// The held queue cannot begin the run of either timer.
void cancelledTasks(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  const auto hold = trial.hold(queue);
  for (const std::int64_t delay : {std::int64_t(0), kHour}) {
    const SharedSignal gone = newSignal();
    const auto sentinel = [gone] { gone->raise(); };
    Timer timer = queue->dispatchAfter(
        delay, [held = whenGone(sentinel)] {}, nullptr);
    timer.reset();
    if (gone->count() == 1) continue;
    trial.report("The task of a cancelled timer, due after " + std::to_string(delay) +
                 " ns, remained when its handle was destroyed.");
  }
}

void checkClosed(const Trial& trial, const Queue& queue) {
  const SharedSignal gone = newSignal();
  const SharedSignal ran = newSignal();
  queue->dispatch([ran, sentinel = whenGone([gone] { gone->raise(); })] { ran->raise(); });
  if (gone->count() == 0) trial.report("A task that was dispatched after closing was not destroyed by dispatch.");
  if (ran->count() > 0) trial.report("A task ran that was dispatched after closing.");
}

void closing(Trial& trial) {
  const std::vector<Queue> queues = {trial.newFileQueue(), trial.newWorkQueue()};
  const SharedSignal ran = newSignal();
  const SharedSignal fired = newSignal();
  const SharedSignal gone = newSignal();
  std::vector<Timer> timers;
  for (const Queue& queue : queues) {
    for (int i = 0; i < 10; ++i) queue->dispatch([ran] { ran->raise(); });
    timers.push_back(queue->dispatchAfter(
        kHour, [fired, sentinel = whenGone([gone] { gone->raise(); })] { fired->raise(); }, nullptr));
  }
  trial.releaseFactory();
  if (ran->count() != 20) trial.report("Tasks that were dispatched before closing did not run.");
  if (gone->count() != 2) trial.report("The task of a timer that had not fired remained after closing.");
  for (const Queue& queue : queues) checkClosed(trial, queue);
  const Timer late = queues[0]->dispatchAfter(
      0, [fired] { fired->raise(); }, nullptr);
  timers.clear();
  if (fired->count() > 0) trial.report("A timer fired after closing.");
}

}  // namespace

std::vector<Situation> situationsOfPromises(const QueueConformanceOptions& options) {
  std::vector<Situation> situations;
  if (options.continueAfterExceptions) situations.push_back({"Tasks that throw", throwingTasks});
  if (options.finishReleasedQueues) situations.push_back({"A queue that is released", releasedQueues});
  if (options.fireScheduledTimersOnce) situations.push_back({"A timer of scheduleAfter", scheduledTimers});
  if (options.destroyCancelledTasks) situations.push_back({"Timers that are cancelled", cancelledTasks});
  if (options.closeWithFactory) situations.push_back({"Queues whose factory is destroyed", closing});
  return situations;
}

}  // namespace velmora::mobile::xplat::cellar::test::conformance
