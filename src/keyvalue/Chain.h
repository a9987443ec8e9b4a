#pragma once

#include <memory>
#include <mutex>

namespace velmora::mobile::xplat::cellar {

// Which operation comes right behind which on a queue, so that whoever runs one of them can do work of the next ones as
// well. Any thread may call.
template <class Operation> class Chain {
 public:
  // What an operation derives from.
  class Link {
    friend class Chain;
    std::weak_ptr<Operation> next_;
  };

  // To be called before the operation is handed to the queue, and `cutUnlessLast` afterwards.
  void append(const std::shared_ptr<Operation>& operation) {
    std::shared_ptr<Operation> last;  // released without the mutex
    const std::lock_guard<std::mutex> lock(mutex_);
    last = last_.lock();
    if (last != nullptr) static_cast<Link&>(*last).next_ = operation;
    last_ = operation;
  }

  // What is appended from now on does not come right behind what is there.
  void cut() {
    const std::lock_guard<std::mutex> lock(mutex_);
    last_.reset();
  }

  // The same when something else came after the operation while it was being handed to the queue, where it may stand
  // behind that now: what is appended later must not be done before it.
  void cutUnlessLast(const std::shared_ptr<Operation>& operation) {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (last_.lock() != operation) last_.reset();
  }

  // Null when there is none.
  std::shared_ptr<Operation> after(const Operation& operation) {
    const std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<const Link&>(operation).next_.lock();
  }

 private:
  std::mutex mutex_;  // guards the one below, and the links
  std::weak_ptr<Operation> last_;
};

}  // namespace velmora::mobile::xplat::cellar
