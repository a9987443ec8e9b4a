#pragma once

#include <chrono>
#include <future>
#include <stdexcept>
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

// Blocks until the future has its value, and returns it or rethrows its exception (`std::future_error`, broken promise,
// when the work was dropped). Throws `FutureMisuseError` for a future that is empty, that has a callback, or whose
// value was already taken.
//
// Do not call it on the queue that does the work: it would deadlock. On the threads of the host kit's own queues, for
// example in a callback of a store, it throws `std::logic_error` and leaves the future unchanged: use `Future::then`.
// It throws there even when the value is available already, so that a program does not work or fail by chance.
template <class T> [[nodiscard]] T await(Future<T> future) {
  ThreadQueueFactory::refuseOnQueueThread("await", "Use Future::then instead.");
  return toStdFuture(std::move(future)).get();
}

namespace detail {

// False when the time is over. A timeout of 0 or less does not wait, one of more than a year never ends.
template <class T> bool arrives(const std::future<T>& value, std::chrono::milliseconds timeout) {
  constexpr std::chrono::hours year(24 * 365);  // a later end is beyond the range of some clocks
  if (timeout <= year) return value.wait_for(timeout) == std::future_status::ready;
  value.wait();
  return true;
}

}  // namespace detail

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
