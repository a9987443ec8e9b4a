#include "host/testing/conformance/Trial.h"

namespace velmora::mobile::xplat::cellar::test::conformance {

namespace {

using Queue = Trial::Queue;
using Timer = std::unique_ptr<AsyncTimer>;

std::shared_ptr<void> raiseWhenGone(const SharedSignal& signal) {
  return whenGone([signal] { signal->raise(); });
}

// Releases the queue itself while it runs; what waits behind it may run or be dropped.
void releasedByTask(Trial& trial) {
  Queue queue = trial.newFileQueue();
  const SharedSignal released = newSignal();
  const SharedSignal gone = newSignal();
  const auto owner = std::make_shared<Queue>(queue);
  {
    const auto hold = trial.hold(queue);
    queue->dispatch([owner, released] {
      owner->reset();
      released->raise();
    });
    queue->dispatch([sentinel = raiseWhenGone(gone)] {});
    queue.reset();
  }
  trial.expect(released, 1, "tasks ended that release their own queue");
  trial.expect(gone, 1, "tasks behind it ran or were dropped");
}

// The task is the last to hold the queue; the queue goes with it.
void releasedWithTask(Trial& trial) {
  const SharedSignal gone = newSignal();
  Queue queue = trial.newWorkQueue();
  {
    const auto hold = trial.hold(queue);
    AsyncExecutor& executor = *queue;
    executor.dispatch([queue = std::move(queue), sentinel = raiseWhenGone(gone)] {});
  }
  trial.expect(gone, 1, "tasks were destroyed that own their queue");
}

void releasedWithTasks(Trial& trial) {
  const SharedSignal gone = newSignal();
  Queue queue = trial.newFileQueue();
  {
    const auto hold = trial.hold(queue);
    for (int i = 0; i < 20; ++i) queue->dispatch([sentinel = raiseWhenGone(gone)] {});
    queue.reset();
  }
  trial.expect(gone, 20, "tasks of a released queue ran or were dropped");
}

void shortLived(Trial& trial) {
  const SharedSignal gone = newSignal();
  for (int i = 0; i < 25; ++i) {
    trial.newFileQueue()->dispatch([sentinel = raiseWhenGone(gone)] {});
    trial.newWorkQueue()->dispatch([sentinel = raiseWhenGone(gone)] {});
  }
  trial.expect(gone, 50, "tasks of released queues ran or were dropped");
}

void handleAfterQueue(Trial& trial) {
  const SharedSignal gone = newSignal();
  for (const std::int64_t delay : {std::int64_t(0), kMillisecond / 2, kHour}) {
    Queue queue = trial.newWorkQueue();
    std::vector<Timer> timers;
    timers.push_back(queue->dispatchAfter(
        delay, [sentinel = raiseWhenGone(gone)] {}, nullptr));
    timers.push_back(queue->scheduleAfter(
        delay, [sentinel = raiseWhenGone(gone)] {}, nullptr));
    trial.waitForTimer(queue, kMillisecond);
    queue.reset();
    timers.clear();
  }
  trial.expect(gone, 4, "tasks of timers that were due were destroyed with their queue");
}

void handleReleasesQueue(Trial& trial) {
  Queue queue = trial.newFileQueue();
  const SharedSignal returned = newSignal();
  const auto timer = std::make_shared<Timer>();
  const auto owner = std::make_shared<Queue>(queue);
  {
    const auto hold = trial.hold(queue);
    *timer = queue->dispatchAfter(
        0,
        [timer, owner, returned] {
          timer->reset();
          owner->reset();
          returned->raise();
        },
        nullptr);
    queue.reset();
  }
  trial.expect(returned, 1, "timers fired that destroy their handle and release their queue");
}

}  // namespace

std::vector<Situation> situationsOfLifetimes() {
  return {{"A queue that its own task releases", releasedByTask},
          {"A queue that its own task owns", releasedWithTask},
          {"A queue that is released with tasks on it", releasedWithTasks},
          {"Many queues that are released at once", shortLived},
          {"A handle that is destroyed after its queue", handleAfterQueue},
          {"A queue that its own timer releases", handleReleasesQueue}};
}

}  // namespace velmora::mobile::xplat::cellar::test::conformance
