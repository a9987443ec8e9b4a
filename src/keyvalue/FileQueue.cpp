#include "keyvalue/FileQueue.h"

#include <algorithm>
#include <utility>

#include "keyvalue/FileWrite.h"

namespace velmora::mobile::xplat::cellar {

// Before, for a queue that runs the task at once; and after, for a write that has come in between.
void FileQueue::dispatch(std::function<void()> task) {
  closeGroup();
  queue_->dispatch(std::move(task));
  closeGroup();
}

Future<void> FileQueue::run(std::function<void()> task) {
  closeGroup();
  auto future = dispatchTask<void>(queue_, std::move(task));
  closeGroup();
  return future;
}

void FileQueue::dispatchWrite(const std::shared_ptr<FileWrite>& write, std::function<void()> task) {
  append(write);
  queue_->dispatch(std::move(task));
}

void FileQueue::closeGroup() {
  const std::lock_guard<std::mutex> lock(mutex_);
  last_.reset();
}

// Returns the write before, to be released without the mutex.
std::shared_ptr<FileWrite> FileQueue::append(const std::shared_ptr<FileWrite>& write) {
  const std::lock_guard<std::mutex> lock(mutex_);
  auto last = last_.lock();
  if (last != nullptr) last->next = write;
  last_ = write;
  return last;
}

std::shared_ptr<FileWrite> FileQueue::next(const std::vector<std::shared_ptr<FileWrite>>& group) {
  std::shared_ptr<FileWrite> write;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    write = group.back()->next.lock();
  }
  if (write == nullptr || !write->isGroupable) return nullptr;
  const auto hasItsKey = [&](const std::shared_ptr<FileWrite>& other) { return other->key == write->key; };
  return std::none_of(group.begin(), group.end(), hasItsKey) ? write : nullptr;
}

}  // namespace velmora::mobile::xplat::cellar
