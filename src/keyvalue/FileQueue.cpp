#include "keyvalue/FileQueue.h"

#include <algorithm>
#include <utility>

#include "keyvalue/FileWrite.h"

namespace velmora::mobile::xplat::cellar {

// The chain is cut before, for a queue that runs the task at once; and after, for a write that has come in between.
void FileQueue::dispatch(std::function<void()> task) {
  writes_.cut();
  queue_->dispatch(std::move(task));
  writes_.cut();
}

Future<void> FileQueue::run(std::function<void()> task) {
  writes_.cut();
  auto future = dispatchTask<void>(queue_, std::move(task));
  writes_.cut();
  return future;
}

void FileQueue::dispatchWrite(const std::shared_ptr<FileWrite>& write, std::function<void()> task) {
  writes_.append(write);
  queue_->dispatch(std::move(task));
  writes_.cutUnlessLast(write);
}

std::shared_ptr<FileWrite> FileQueue::next(const std::vector<std::shared_ptr<FileWrite>>& group) {
  auto write = writes_.after(*group.back());
  if (write == nullptr || !write->isGroupable) return nullptr;
  const auto hasItsKey = [&](const std::shared_ptr<FileWrite>& other) { return other->key == write->key; };
  return std::none_of(group.begin(), group.end(), hasItsKey) ? write : nullptr;
}

}  // namespace velmora::mobile::xplat::cellar
