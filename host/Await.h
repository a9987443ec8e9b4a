#pragma once

#include <future>
#include <memory>
#include <utility>

#include <cellar/Future.h>
#include <cellar/host/ThreadQueueFactory.h>

namespace velmora::mobile::xplat::cellar::host {

// Blocks until the future has its value, and returns it or rethrows its exception (`std::future_error`, broken promise,
// when the work was dropped). Throws `FutureError` for a future that is empty, that has a callback, or whose value was
// already taken.
//
// Do not call it on the queue that does the work: it would deadlock. On the threads of the host kit's own queues, for
// example in a callback of a store, it throws `std::logic_error` and leaves the future unchanged: use `Future::then`.
// It throws there even when the value is available already, so that a program does not work or fail by chance.
template <class T> T await(Future<T> future) {
  ThreadQueueFactory::refuseOnQueueThread("await", "Use Future::then instead.");
  // Shared with the callback, which may still be returning when the value has arrived here.
  const auto arrival = std::make_shared<std::promise<std::future<T>>>();
  std::future<std::future<T>> arrived = arrival->get_future();
  future.then(nullptr, [arrival](std::future<T>& value) { arrival->set_value(std::move(value)); });
  return arrived.get().get();
}

}  // namespace velmora::mobile::xplat::cellar::host
