#include "keyvalue/WorkQueue.h"

#include <string>

#include "keyvalue/ReservedKeys.h"

namespace velmora::mobile::xplat::cellar {

// The chain is cut before, for a queue that runs the task at once; and after, for a change that has come in between.
void WorkQueue::dispatch(std::function<void()> task) {
  changes_.cut();
  context_.workQueue->dispatch(std::move(task));
  changes_.cut();
}

void WorkQueue::throwIfRefused(KeyRange keys) const {
  context_.throwIfInvalid();
  if (context_.options.inlineData) return;
  for (const std::string& key : keys) throwIfReserved(key);
}

}  // namespace velmora::mobile::xplat::cellar
