#pragma once

#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "Future.h"
#include "executor/AsyncExecutor.h"
#include "keyvalue/Chain.h"

namespace velmora::mobile::xplat::cellar {

struct FileWrite;

// The file queue of a store, which remembers of each write which one comes right behind it: a task that has to wait
// for the manifest anyway writes their files meanwhile. No other task is overtaken by a write of a key that it is
// about. Any thread may call.
class FileQueue {
 public:
  explicit FileQueue(std::shared_ptr<AsyncExecutor> queue) : queue_(std::move(queue)) {}

  // Throws what the host's queue throws. No lock of the store's may be held unless the task does not mind it: a queue
  // may run it at once.
  void dispatch(std::function<void()> task);
  Future<void> run(std::function<void()> task);  // fulfilled with what the task does or throws
  void dispatchWrite(const std::shared_ptr<FileWrite>& write, std::function<void()> task);

  // The write right behind the last of the group; null when there is none, when it may not be written early, or when
  // its key is one of theirs, for which each write has to be over before the next begins.
  std::shared_ptr<FileWrite> next(const std::vector<std::shared_ptr<FileWrite>>& group);

 private:
  const std::shared_ptr<AsyncExecutor> queue_;
  Chain<FileWrite> writes_;
};

}  // namespace velmora::mobile::xplat::cellar
