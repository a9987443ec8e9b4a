#pragma once

#include <chrono>
#include <future>
#include <stdexcept>
#include <thread>
#include <utility>

#include <cellar/Export.h>
#include <cellar/Future.h>
#include <cellar/host/Futures.h>
#include <cellar/host/ThreadQueueFactory.h>

namespace velmora::mobile::xplat::cellar::host {

// `await` has waited for as long as it was allowed to. The text says how long that was.
class CELLAR_EXPORT TimeoutError : public std::runtime_error {
 public:
  explicit TimeoutError(std::chrono::milliseconds timeout);
  ~TimeoutError() override;
};

namespace detail {

// One wait of this thread. While it `goesOn`, the thread yields instead of sleeping.
class CELLAR_EXPORT Lookout {
 public:
  Lookout();
  ~Lookout();
  Lookout(const Lookout&) = delete;
  Lookout& operator=(const Lookout&) = delete;

  bool goesOn() const;

 private:
  bool isShort() const;

  const std::chrono::steady_clock::time_point begin_;
};

template <class T> bool hasCome(const std::future<T>& value) {
  return value.wait_for(std::chrono::seconds(0)) == std::future_status::ready;
}

// False when the time is over. A timeout of 0 or less does not wait, one of more than a year never ends.
template <class T> bool arrives(const std::future<T>& value, std::chrono::milliseconds timeout) {
  constexpr std::chrono::hours year(24 * 365);  // a later end is beyond the range of some clocks
  if (hasCome(value)) return true;
  if (timeout.count() <= 0) return false;
  const Lookout lookout;
  while (lookout.goesOn() && !hasCome(value)) std::this_thread::yield();
  if (timeout <= year) return value.wait_for(timeout) == std::future_status::ready;
  value.wait();
  return true;
}

}  // namespace detail

// Blocks until the future has its value, and returns it or rethrows its exception (`std::future_error`, broken promise,
// when the work was dropped). Throws `FutureMisuseError` for a future that is empty, that has a callback, or whose
// value was already taken.
//
// Do not call it on the queue that does the work: it would deadlock. On the threads of the host kit's own queues (in a
// callback of a store, for example) and under a `QueueThreadMark` it throws `std::logic_error` and takes no value from
// the future: use `Future::then`. It throws there even when the value is available already, so that a program does not
// work or fail by chance.
//
// The thread sleeps. If the last value came within 100 microseconds, it first looks out for this one for as long.
template <class T> [[nodiscard]] T await(Future<T> future) {
  ThreadQueueFactory::refuseOnQueueThread("await", "Use Future::then instead.");
  std::future<T> value = toStdFuture(std::move(future));
  detail::arrives(value, std::chrono::milliseconds::max());
  return value.get();
}

// The same, for `timeout` at most; then it throws `TimeoutError`. The work is not cancelled: its value has been taken,
// and is destroyed when it comes. A timeout of 0 or less does not wait, one of more than a year never ends.
template <class T> [[nodiscard]] T await(Future<T> future, std::chrono::milliseconds timeout) {
  ThreadQueueFactory::refuseOnQueueThread("await", "Use Future::then instead.");
  std::future<T> value = toStdFuture(std::move(future));
  if (!detail::arrives(value, timeout)) throw TimeoutError(timeout);
  return value.get();
}

// The same, in any unit; rounded up to milliseconds.
template <class T, class Rep, class Period>
[[nodiscard]] T await(Future<T> future, std::chrono::duration<Rep, Period> timeout) {
  return await(std::move(future), detail::inMilliseconds(timeout));
}

}  // namespace velmora::mobile::xplat::cellar::host
