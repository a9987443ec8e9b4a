#pragma once

#include <chrono>
#include <cstddef>
#include <ctime>
#include <deque>
#include <functional>
#include <future>
#include <memory>
#include <utility>

#include "Future.h"
#include "Stopwatch.h"
#include "demo/DateRange.h"

namespace velmora::mobile::xplat::cellar::tools {

// Keeps up to `kMost` operations under way at once, as a host does that does not wait for each of them, and notes when
// each one was called and completed. Used by one thread, on which results are handed out in the order of the calls.
class OperationWindow {
 public:
  static constexpr std::size_t kMost = 32;

  struct Timing {
    std::chrono::nanoseconds took;  // from the call to the completion of its future
    DateRange dates;                // when that was
  };

  template <class T> using OnResult = std::function<void(std::future<T>& result, const Timing& timing)>;

  // Calls `operation`, having waited for the oldest that is under way if there are too many.
  template <class T> void call(const std::function<Future<T>()>& operation, OnResult<T> onResult) {
    if (underWay_.size() == kMost) finishOldest();
    const auto arrival = std::make_shared<std::promise<Arrival<T>>>();
    const auto arrived = std::make_shared<std::future<Arrival<T>>>(arrival->get_future());
    const std::time_t called = std::time(nullptr);
    const Stopwatch watch;
    operation().then(nullptr, [arrival, called, watch](std::future<T>& result) {
      arrival->set_value({std::move(result), {watch.elapsed(), {called, std::time(nullptr)}}});
    });
    underWay_.push_back([arrived, onResult = std::move(onResult)] {
      Arrival<T> outcome = arrived->get();
      onResult(outcome.result, outcome.timing);
    });
  }

  // Waits for all of them.
  void finish() {
    while (!underWay_.empty()) finishOldest();
  }

 private:
  template <class T> struct Arrival {
    std::future<T> result;
    Timing timing;
  };

  void finishOldest() {
    const std::function<void()> oldest = std::move(underWay_.front());
    underWay_.pop_front();
    oldest();
  }

  std::deque<std::function<void()>> underWay_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
