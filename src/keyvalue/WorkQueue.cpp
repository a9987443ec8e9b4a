#include "keyvalue/WorkQueue.h"

#include <string>

#include "keyvalue/FileQueue.h"
#include "keyvalue/ReservedKeys.h"

namespace velmora::mobile::xplat::cellar {

// The chain is cut before, for a queue that runs the task at once; and after, for a change that has come in between.
void WorkQueue::dispatch(std::function<void()> task) {
  changes_.cut();
  context_.workQueue->dispatch(std::move(task));
  changes_.cut();
}

void WorkQueue::dispatchBehindAll(std::function<void()> task, std::function<void(const std::exception&)> onRefused) {
  if (ahead_.isEmpty()) return dispatch(std::move(task));
  detourTo(KeyRange(std::vector<std::string>()), task, [this, task, onRefused = std::move(onRefused)] {
    try {
      dispatch(task);
    } catch (const std::exception& error) {
      if (onRefused) onRefused(error);
    }
  });
}

void WorkQueue::append(const std::shared_ptr<ManifestChange>& change, std::function<void()> task) {
  changes_.append(change);
  context_.workQueue->dispatch(std::move(task));
  changes_.cutUnlessLast(change);
}

// A task finds out for itself that the store is gone.
void WorkQueue::detourTo(KeyRange keys, std::function<void()> task, std::function<void()> dispatchIt) {
  fileQueue_.dispatch([weakThis = context_.weak(*this), passage = ahead_.enter(keys), task = std::move(task),
                       dispatchIt = std::move(dispatchIt)] {
    if (const auto self = weakThis.lock()) {
      dispatchIt();
    } else {
      task();
    }
  });
}

void WorkQueue::throwIfRefused(KeyRange keys) const {
  context_.throwIfInvalid();
  if (context_.options.inlineData || context_.isSafe()) return;
  for (const std::string& key : keys) throwIfReserved(key);
}

}  // namespace velmora::mobile::xplat::cellar
