#pragma once

#include <atomic>
#include <exception>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <thread>
#include <type_traits>
#include <utility>

#include "Export.h"
#include "executor/AsyncExecutor.h"

namespace velmora::mobile::xplat::cellar {

// A future was used in a way that can have no result.
class CELLAR_EXPORT FutureError : public std::logic_error {
 public:
  enum class Code : int {
    InvalidSharedState = 1,   // the future is empty: default constructed or moved from
    FetchWithCallback = 2,    // the value belongs to the callback
    CallbackAlreadySet = 3,   // there can be one callback only
    ValueAlreadyFetched = 4,  // the value has been taken
  };

  explicit FutureError(Code code);
  ~FutureError() override;

  Code code() const noexcept;

 private:
  Code code_;
};

namespace detail {

// One error line about the exception that is being handled: nobody was there to receive it.
CELLAR_EXPORT void logExceptionOfBrokenPromise() noexcept;

// What a promise and the copies of its future share. Lives as long as any of them, or a delivery that is still queued.
template <class T> struct SharedFutureState {
  std::mutex mutex;  // guards all but the atomics; held while an inline callback runs
  std::future<T> future;
  std::function<void(std::future<T>&)> callback;
  std::shared_ptr<AsyncExecutor> executor;
  std::atomic<bool> fulfilled{false};  // changed with the mutex held, or before the state is shared

  // Whether the value has left `future`. A callback on an executor takes it without the mutex, so only the thread that
  // runs the callback may ask `future` itself meanwhile; other threads hear of it when the callback returns.
  std::atomic<bool> taken{false};
  std::atomic<std::thread::id> taker{};

  void throwIfTaken() const {
    const bool isTaker = taker.load() == std::this_thread::get_id();
    if (isTaker ? !future.valid() : taken.load()) throw FutureError(FutureError::Code::ValueAlreadyFetched);
  }

  // Called with the mutex held, once: when the value and the callback are both there.
  static void runCallback(std::shared_ptr<SharedFutureState> state) {
    if (state->executor == nullptr) return state->invokeCallback();
    AsyncExecutor& executor = *state->executor;
    executor.dispatch([owned = std::move(state)] { owned->invokeCallback(); });
  }

  // Held while this thread may take the value; records afterwards, however that ended, whether it did.
  class Taking {
   public:
    explicit Taking(SharedFutureState& state) : state_(state) { state_.taker = std::this_thread::get_id(); }
    ~Taking() {
      state_.taken = !state_.future.valid();
      state_.taker = std::thread::id();
    }
    Taking(const Taking&) = delete;
    Taking& operator=(const Taking&) = delete;

   private:
    SharedFutureState& state_;
  };

 private:
  void invokeCallback() {
    const Taking taking(*this);
    callback(future);
  }
};

}  // namespace detail

// The consumer's end: one value or exception that arrives later. Copies refer to the same value, which is taken once:
// by `get`, or by the one callback given to `then`. Any thread; misuse throws `FutureError`.
template <class T> class Future {
 public:
  Future() = default;
  explicit Future(std::shared_ptr<detail::SharedFutureState<T>> state) : state_(std::move(state)) {}

  // Throws when the future is empty or its value has been taken. A callback that has taken the value finds so at once,
  // with this and the other operations; other threads do when that callback has returned.
  void throwIfInvalid() const {
    if (state_ == nullptr) throw FutureError(FutureError::Code::InvalidSharedState);
    state_->throwIfTaken();
  }

  // Whether the promise has been fulfilled, also with an exception: `get` does not wait then, and an inline callback
  // runs at once. It stays so when the value has been taken. Never waits; throws when the future is empty.
  [[nodiscard]] bool isReady() const {
    if (state_ == nullptr) throw FutureError(FutureError::Code::InvalidSharedState);
    return state_->fulfilled.load(std::memory_order_acquire);
  }

  // For a `Future<void>`. Blocks until the promise is fulfilled; rethrows its exception. Never call it on the queue
  // that is to fulfil the promise, nor in an inline callback of the same future.
  template <class U = T, class = std::enable_if_t<std::is_void_v<U>>> void get() {
    throwIfInvalid();
    const auto state = state_;
    const std::lock_guard<std::mutex> lock(state->mutex);
    state->throwIfTaken();
    if (state->callback) throw FutureError(FutureError::Code::FetchWithCallback);
    const typename detail::SharedFutureState<T>::Taking taking(*state);
    state->future.get();
  }

  // Does not compile: a value has no `get`.
  template <class U = T, std::enable_if_t<!std::is_void_v<U>, int> = 0> U get() {
    static_assert(std::is_void_v<U>,
                  "Only a Future<void> has get(). Take a value in the callback of then(), or wait for it with "
                  "cellar::host::await() of <cellar/host/Await.h>.");
  }

  // Calls `callback` once, with the standard future that holds the value or exception: on `executor`, or with a null
  // executor inline, on the thread that fulfils the promise or on this one when that has happened already. An inline
  // callback runs under the future's lock: it must not call `get` or `then` of this future or a copy. What it throws
  // reaches whoever ran it; where that is the end of an unfulfilled promise, it is one error line in the log.
  void then(std::shared_ptr<AsyncExecutor> executor, std::function<void(std::future<T>&)>&& callback) {
    throwIfInvalid();
    const auto state = state_;  // the callback may destroy this future
    const std::lock_guard<std::mutex> lock(state->mutex);
    state->throwIfTaken();
    if (state->callback) throw FutureError(FutureError::Code::CallbackAlreadySet);
    state->callback = std::move(callback);
    state->executor = std::move(executor);
    if (state->fulfilled.load(std::memory_order_relaxed)) state->runCallback(state);
  }

  // The same inline.
  void then(std::function<void(std::future<T>&)>&& callback) { then(nullptr, std::move(callback)); }

 private:
  std::shared_ptr<detail::SharedFutureState<T>> state_;
};

// The producer's end. Used by one thread at a time; fulfilling it twice throws `std::future_error`, and so does asking
// for a second future. Destroyed unfulfilled, it fails its future with `std::future_error` (broken promise); what an
// inline callback of that future throws, or an executor that refuses to take the callback, is one error line then.
template <class T> class Promise {
 public:
  Promise() = default;
  ~Promise() {
    try {
      abandon();
    } catch (...) {
      detail::logExceptionOfBrokenPromise();
    }
  }
  Promise(const Promise&) = delete;
  Promise& operator=(const Promise&) = delete;

  [[nodiscard]] Future<T> getFuture() {
    auto state = std::make_shared<detail::SharedFutureState<T>>();
    state->future = promise_.get_future();
    state->fulfilled.store(fulfilled_, std::memory_order_relaxed);
    state_ = std::move(state);
    return Future<T>(state_);
  }

  template <class U = T> std::enable_if_t<std::is_void_v<U>> setValue() {
    promise_.set_value();
    onFulfilled();
  }

  template <class U = T> std::enable_if_t<!std::is_void_v<U>> setValue(U value) {
    promise_.set_value(std::move(value));
    onFulfilled();
  }

  void setException(std::exception_ptr exception) {
    promise_.set_exception(std::move(exception));
    onFulfilled();
  }

  // Delivers the value to the callback, if there is one. Called by the setters.
  void onFulfilled() {
    fulfilled_ = true;
    const auto state = state_;  // the callback may destroy this promise
    if (state == nullptr) return;
    const std::lock_guard<std::mutex> lock(state->mutex);
    state->fulfilled.store(true, std::memory_order_release);
    if (state->callback) state->runCallback(state);
  }

  // Fails the future with a broken promise, if one was handed out and is still waiting.
  void abandon() {
    if (state_ == nullptr || fulfilled_) return;
    setException(std::make_exception_ptr(std::future_error(std::future_errc::broken_promise)));
  }

 private:
  std::promise<T> promise_;
  std::shared_ptr<detail::SharedFutureState<T>> state_;
  bool fulfilled_ = false;
};

// Runs `task` on `executor`. The future gets its result or exception, or a broken promise when the executor drops the
// task.
template <class T> Future<T> dispatchTask(const std::shared_ptr<AsyncExecutor>& executor, std::function<T()>&& task) {
  auto sharedTask = std::make_shared<std::function<T()>>(std::move(task));
  auto promise = std::make_shared<Promise<T>>();
  Future<T> future = promise->getFuture();
  executor->dispatch([sharedTask = std::move(sharedTask), promise = std::move(promise)] {
    std::exception_ptr failure;
    if constexpr (std::is_void_v<T>) {
      try {
        (*sharedTask)();
      } catch (...) {
        failure = std::current_exception();
      }
      failure ? promise->setException(failure) : promise->setValue();
    } else {
      std::optional<T> value;
      try {
        value = (*sharedTask)();
      } catch (...) {
        failure = std::current_exception();
      }
      failure ? promise->setException(failure) : promise->setValue(std::move(*value));
    }
  });
  return future;
}

}  // namespace velmora::mobile::xplat::cellar
