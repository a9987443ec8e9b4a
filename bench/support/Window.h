#pragma once

#include <condition_variable>
#include <cstddef>
#include <exception>
#include <functional>
#include <future>
#include <mutex>
#include <utility>

#include <cellar/Future.h>

namespace velmora::mobile::xplat::cellar::bench {

// Keeps up to `most` operations under way. When all are, the caller sleeps until half of them have completed, as one
// does that fills a queue in batches: the queues never run dry and nobody is woken for each single one.
class Window {
 public:
  explicit Window(std::size_t most) : most_(most) {}

  // `onResult` is called on the thread that completes the operation; what it throws fails the whole.
  template <class T> void add(Future<T> future, std::function<void(T)> onResult) {
    makeRoom();
    future.then(nullptr, [this, onResult = std::move(onResult)](std::future<T>& result) {
      complete([&] { onResult(result.get()); });
    });
  }
  void add(Future<void> future) {
    makeRoom();
    future.then(nullptr, [this](std::future<void>& result) { complete([&] { result.get(); }); });
  }

  // Waits for all of them; throws what the first that failed threw.
  void finish() {
    std::unique_lock<std::mutex> lock(mutex_);
    waitUntilAtMost(0, lock);
    if (failure_ != nullptr) std::rethrow_exception(failure_);
  }

 private:
  void makeRoom() {
    std::unique_lock<std::mutex> lock(mutex_);
    if (underWay_ == most_) waitUntilAtMost(most_ / 2, lock);
    ++underWay_;
  }

  void waitUntilAtMost(std::size_t count, std::unique_lock<std::mutex>& lock) {
    wakeAt_ = count;
    room_.wait(lock, [&] { return underWay_ <= count; });
    wakeAt_ = none;
  }

  template <class TakeResult> void complete(TakeResult takeResult) {
    std::exception_ptr failure;
    try {
      takeResult();
    } catch (...) {
      failure = std::current_exception();
    }
    const std::lock_guard<std::mutex> lock(mutex_);
    if (failure_ == nullptr) failure_ = failure;
    if (--underWay_ == wakeAt_) room_.notify_one();
  }

  static constexpr std::size_t none = static_cast<std::size_t>(-1);
  const std::size_t most_;
  std::mutex mutex_;  // guards the below
  std::condition_variable room_;
  std::size_t underWay_ = 0;
  std::size_t wakeAt_ = none;
  std::exception_ptr failure_;
};

}  // namespace velmora::mobile::xplat::cellar::bench
