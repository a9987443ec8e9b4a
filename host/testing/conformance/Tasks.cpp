#include <array>

#include "host/testing/conformance/Trial.h"

namespace velmora::mobile::xplat::cellar::test::conformance {

namespace {

using Queue = Trial::Queue;

void severalThreads(Trial& trial) {
  constexpr std::size_t threads = 4;
  constexpr std::size_t tasks = 200;  // of each thread
  const Queue queue = trial.newWorkQueue();
  const SharedSignal ran = newSignal();
  onThreads(threads, [&](std::size_t) {
    for (std::size_t i = 0; i < tasks; ++i) queue->dispatch([ran] { ran->raise(); });
  });
  trial.expect(ran, threads * tasks, "tasks ran");
  trial.finish(queue);
}

// The checks see what overlaps; the task only lasts long enough for others to begin.
void longTaskOn(const Trial& trial, const Queue& queue) {
  const SharedSignal others = newSignal();
  const SharedSignal ended = newSignal();
  auto hold = trial.hold(queue);
  queue->dispatch([others, ended] {
    others->waitFor(1, kOpportunity);
    ended->raise();
  });
  for (int i = 0; i < 8; ++i) queue->dispatch([others] { others->raise(); });
  hold.reset();
  trial.expect(ended, 1, "tasks ended");
  trial.expect(others, 8, "tasks ran");
}

void longTask(Trial& trial) {
  longTaskOn(trial, trial.newFileQueue());
  longTaskOn(trial, trial.newWorkQueue());
}

void backlog(Trial& trial) {
  const Queue queue = trial.newFileQueue();
  const SharedSignal ran = newSignal();
  auto hold = trial.hold(queue);
  for (int i = 0; i < 100; ++i) queue->dispatch([ran] { ran->raise(); });
  hold.reset();
  trial.expect(ran, 100, "tasks ran");
}

void fromTasks(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  const SharedSignal ran = newSignal();
  queue->dispatch([ran, weakQueue = std::weak_ptr<AsyncExecutor>(queue)] {
    const Queue own = weakQueue.lock();
    for (int i = 0; i < 3 && own != nullptr; ++i) own->dispatch([ran] { ran->raise(); });
    ran->waitFor(1, kOpportunity);
  });
  trial.expect(ran, 3, "tasks ran that a task of their queue dispatched");
}

// A chain of tasks that takes turns between two queues.
struct Hops : std::enable_shared_from_this<Hops> {
  explicit Hops(std::vector<Queue> ofQueues) : queues(std::move(ofQueues)) {}

  void go(std::size_t rest) {
    if (rest == 0) return;
    queues[rest % queues.size()]->dispatch([self = shared_from_this(), rest] {
      self->done->raise();
      self->go(rest - 1);
    });
  }

  const std::vector<Queue> queues;
  const SharedSignal done = newSignal();
};

void fromQueueToQueue(Trial& trial) {
  const auto hops = std::make_shared<Hops>(std::vector<Queue>{trial.newFileQueue(), trial.newWorkQueue()});
  hops->go(100);
  trial.expect(hops->done, 100, "tasks ran that a task of another queue dispatched");
  for (const Queue& queue : hops->queues) trial.finish(queue);
}

void destruction(Trial& trial) {
  const Queue queue = trial.newFileQueue();
  const SharedSignal gone = newSignal();
  queue->dispatch([gone, sentinel = whenGone([gone] { gone->raise(); })] {});
  trial.expect(gone, 1, "tasks were destroyed after they had run");
}

void dispatchingDestruction(Trial& trial) {
  const Queue queue = trial.newWorkQueue();
  const SharedSignal ran = newSignal();
  const auto dispatchAnother = [ran, weakQueue = std::weak_ptr<AsyncExecutor>(queue)] {
    if (const Queue own = weakQueue.lock()) own->dispatch([ran] { ran->raise(); });
  };
  // All of one task: a queue that destroys it under its lock never returns from a later call of dispatch.
  queue->dispatch(
      [first = whenGone(dispatchAnother), second = whenGone(dispatchAnother), third = whenGone(dispatchAnother)] {});
  trial.expect(ran, 3, "tasks ran that the destruction of a task dispatched");
  trial.finish(queue);
}

void manyQueues(Trial& trial) {
  const SharedSignal ran = newSignal();
  std::array<std::vector<Queue>, 2> queues;
  onThreads(queues.size(), [&](std::size_t thread) {
    for (int i = 0; i < 4; ++i) {
      queues[thread].push_back(thread == 0 ? trial.newFileQueue() : trial.newWorkQueue());
      queues[thread].back()->dispatch([ran] { ran->raise(); });
    }
  });
  trial.expect(ran, 8, "tasks ran");
}

void queuesFromTasks(Trial& trial) {
  const Queue queue = trial.newFileQueue();
  const SharedSignal ran = newSignal();
  const auto created = std::make_shared<Queue>();
  queue->dispatch([ran, created, weakQueues = std::weak_ptr<CheckedQueues>(trial.queues())] {
    if (const std::shared_ptr<CheckedQueues> queues = weakQueues.lock()) *created = queues->createWorkQueue();
    if (*created != nullptr) (*created)->dispatch([ran] { ran->raise(); });
  });
  trial.expect(ran, 1, "tasks ran on a queue that a task created");
  trial.finish(queue);
}

}  // namespace

void tryTheSimplest(Trial& trial) {
  for (const Queue& queue : {trial.newFileQueue(), trial.newWorkQueue()}) {
    trial.finish(queue);
    trial.waitForTimer(queue, kMillisecond);
  }
}

std::vector<Situation> situationsOfTasks() {
  return {{"Tasks of several threads", severalThreads},
          {"A long task", longTask},
          {"A backlog of tasks", backlog},
          {"Tasks from a task of their queue", fromTasks},
          {"Tasks that pass from queue to queue", fromQueueToQueue},
          {"The destruction of a task", destruction},
          {"Tasks from the destruction of a task", dispatchingDestruction},
          {"Queues created by several threads", manyQueues},
          {"A queue created by a task", queuesFromTasks}};
}

}  // namespace velmora::mobile::xplat::cellar::test::conformance
