#pragma once

#include <memory>
#include <mutex>

namespace velmora::mobile::xplat::cellar {

// Which operation comes right behind which, so that whoever runs one of them can do work of the next ones as well. Any
// thread may call. Operations that threads hand over at the same time may stand on the queue in another order than here;
// those of one thread are in their order in both.
template <class Operation> class Chain {
 public:
  // What an operation derives from.
  class Link {
    friend class Chain;
    std::weak_ptr<Operation> previous_;
    std::weak_ptr<Operation> next_;
  };

  // To be called before the operation is handed to the queue.
  void append(const std::shared_ptr<Operation>& operation) {
    std::shared_ptr<Operation> last;  // released without the mutex
    const std::lock_guard<std::mutex> lock(mutex_);
    last = last_.lock();
    if (last != nullptr) {
      static_cast<Link&>(*last).next_ = operation;
      static_cast<Link&>(*operation).previous_ = last;
    }
    last_ = operation;
  }

  // What is appended from now on does not come right behind what is there.
  void cut() {
    const std::lock_guard<std::mutex> lock(mutex_);
    last_.reset();
  }

  // Null when there is none, or none any more.
  std::shared_ptr<Operation> before(const Operation& operation) {
    const std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<const Link&>(operation).previous_.lock();
  }
  std::shared_ptr<Operation> after(const Operation& operation) {
    const std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<const Link&>(operation).next_.lock();
  }

 private:
  std::mutex mutex_;  // guards the one below, and the links
  std::weak_ptr<Operation> last_;
};

}  // namespace velmora::mobile::xplat::cellar
