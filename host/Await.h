#pragma once

#include <future>
#include <memory>
#include <utility>

#include <cellar/Future.h>

namespace velmora::mobile::xplat::cellar::host {

// Blocks until the future has its value, and returns it or rethrows the exception that came instead
// (`std::future_error`, broken promise, when the work was dropped). Any thread but the queue that has the work to do:
// there it would wait for itself. Throws `FutureError` for a future that is empty, that has a callback, or whose value
// was taken.
template <class T> T await(Future<T> future) {
  // Shared with the callback, which may still be on its way out when the value has arrived here.
  const auto arrival = std::make_shared<std::promise<std::future<T>>>();
  std::future<std::future<T>> arrived = arrival->get_future();
  future.then(nullptr, [arrival](std::future<T>& value) { arrival->set_value(std::move(value)); });
  return arrived.get().get();
}

}  // namespace velmora::mobile::xplat::cellar::host
