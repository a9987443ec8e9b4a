#pragma once

#include <condition_variable>
#include <cstddef>
#include <exception>
#include <mutex>
#include <thread>
#include <type_traits>
#include <vector>

namespace velmora::mobile::xplat::cellar::test {

// A gate that opens for good when it has been counted down to 0. Thread-safe.
class Latch {
 public:
  explicit Latch(std::size_t count) : count_(count) {}

  // Counting below 0 changes nothing.
  void countDown() {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (count_ > 0) --count_;
    if (count_ == 0) open_.notify_all();
  }

  void wait() {
    std::unique_lock<std::mutex> lock(mutex_);
    open_.wait(lock, [this] { return count_ == 0; });
  }

  void arriveAndWait() {
    countDown();
    wait();
  }

  bool isOpen() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return count_ == 0;
  }

 private:
  mutable std::mutex mutex_;  // guards the count
  std::condition_variable open_;
  std::size_t count_;
};

// Calls `function(i)` (or `function()`) on `count` threads that all start together, and waits for them. The first
// exception that leaves one of them is thrown again here.
template <class Function> void runOnThreads(std::size_t count, Function function) {
  Latch start(count);
  std::mutex mutex;
  std::exception_ptr failure;
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < count; ++i) {
    threads.emplace_back([&, i] {
      start.arriveAndWait();
      try {
        if constexpr (std::is_invocable_v<Function&, std::size_t>) {
          function(i);
        } else {
          static_cast<void>(i);
          function();
        }
      } catch (...) {
        const std::lock_guard<std::mutex> lock(mutex);
        if (!failure) failure = std::current_exception();
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  if (failure) std::rethrow_exception(failure);
}

}  // namespace velmora::mobile::xplat::cellar::test
