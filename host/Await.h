#pragma once

#include <future>
#include <memory>
#include <utility>

#include <cellar/Future.h>
#include <cellar/host/ThreadQueueFactory.h>

namespace velmora::mobile::xplat::cellar::host {

// Blocks until the future has its value, and returns it or rethrows the exception that came instead
// (`std::future_error`, broken promise, when the work was dropped). Throws `FutureError` for a future that is empty,
// that has a callback, or whose value was taken.
//
// Not on a queue that has the work to do: there it would wait for itself. On every thread of the host kit's own queues,
// as in a callback of a store, it throws `std::logic_error` and leaves the future as it is: use `Future::then`. Also
// when the value is there already, so that it does not depend on chance whether a program works.
template <class T> T await(Future<T> future) {
  ThreadQueueFactory::refuseOnQueueThread("await", "Use Future::then instead.");
  // Shared with the callback, which may still be on its way out when the value has arrived here.
  const auto arrival = std::make_shared<std::promise<std::future<T>>>();
  std::future<std::future<T>> arrived = arrival->get_future();
  future.then(nullptr, [arrival](std::future<T>& value) { arrival->set_value(std::move(value)); });
  return arrived.get().get();
}

}  // namespace velmora::mobile::xplat::cellar::host
