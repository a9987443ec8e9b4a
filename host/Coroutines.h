#pragma once

#if !defined(__cpp_impl_coroutine)
#error "<cellar/host/Coroutines.h> needs coroutines: compile as C++20, with g++ 10 or clang++ 15 at least."
#else

#include <atomic>
#include <coroutine>
#include <exception>
#include <future>
#include <memory>
#include <optional>
#include <type_traits>
#include <utility>

#include <cellar/Future.h>
#include <cellar/host/Futures.h>

// Coroutines that wait for futures:
//
//   Future<std::size_t> sizeOf(std::shared_ptr<DiskCache> thumbs, std::string key) {
//     const auto found = co_await thumbs->fetch(key);
//     co_return found == nullptr ? 0 : found->value.size();
//   }
//
// A coroutine that returns a `Future` begins at once, on the caller's thread. The future gets the value or exception
// that the coroutine ends with, when the coroutine's variables and parameters have been destroyed. Nobody has to keep
// the future. Take parameters by value: references may dangle after the first `co_await`, as may a lambda's captures.
// What an inline callback of the future throws is one error line in the log.
//
// `co_await future` has the value of the future, or throws its exception, or `FutureMisuseError` as `then` does. The
// coroutine continues on the thread that fulfils the future, a store's queue for example, under the lock of that
// future; or at once if the future is fulfilled already. `co_await resumeOn(future, executor)` continues on the
// executor.
//
// If the executor drops a coroutine or does not take it, it is destroyed there and its future is a broken promise. A
// coroutine of another type, which has an owner of its own, is resumed instead, and `co_await` throws the broken
// promise.
namespace velmora::mobile::xplat::cellar::host {

namespace detail {

// Logs the exception that is being handled, as one error line that begins with the text.
CELLAR_EXPORT void logException(const char* text) noexcept;

struct CoroutineOfAFuture {};

// What `co_await` waits with. It is a part of the coroutine and may be gone once the coroutine can continue: whoever
// has made that possible must not touch it any more. So the compiler must not move local variables into the coroutine,
// as some do when they inline a function.
template <class T> class Awaiter {
 public:
  Awaiter(Future<T> source, std::shared_ptr<AsyncExecutor> executor)
      : source_(std::move(source)), executor_(std::move(executor)) {}

  bool await_ready() const noexcept { return false; }

  // False if the coroutine is to continue at once.
  template <class CoroutinePromise>
  [[gnu::noinline]] bool await_suspend(std::coroutine_handle<CoroutinePromise> coroutine) {
    if (executor_ != nullptr) {
      receive<T>(std::move(source_), [this, coroutine](std::future<T>& value) { dispatch(coroutine, value); });
      return true;
    }
    receive<T>(std::move(source_), [this, coroutine](std::future<T>& value) {
      value_ = std::move(value);
      if (isSecond()) coroutine.resume();
    });
    return !isSecond();
  }

  T await_resume() {
    if (!value_.valid()) throw std::future_error(std::future_errc::broken_promise);
    return value_.get();
  }

 private:
  // Resumes a coroutine with its value. If that does not happen the destructor sees to the coroutine's end.
  class Resumption {
   public:
    template <class CoroutinePromise>
    Resumption(Awaiter& awaiter, std::coroutine_handle<CoroutinePromise> coroutine, std::future<T> value)
        : awaiter_(awaiter),
          coroutine_(coroutine),
          mayDestroy_(std::is_base_of_v<CoroutineOfAFuture, CoroutinePromise>),
          value_(std::move(value)) {}
    Resumption(const Resumption&) = delete;
    Resumption& operator=(const Resumption&) = delete;
    ~Resumption() {
      if (coroutine_ == nullptr) return;
      if (mayDestroy_) {
        coroutine_.destroy();
        return;
      }
      try {
        coroutine_.resume();
      } catch (...) {
        logException("A coroutine that was dropped has thrown: ");
      }
    }

    void run() {
      awaiter_.value_ = std::move(value_);
      std::exchange(coroutine_, nullptr).resume();
    }

   private:
    Awaiter& awaiter_;
    std::coroutine_handle<> coroutine_;
    const bool mayDestroy_;
    std::future<T> value_;
  };

  // Nothing is thrown: it would come out of a coroutine that may be gone.
  template <class CoroutinePromise>
  void dispatch(std::coroutine_handle<CoroutinePromise> coroutine, std::future<T>& value) {
    const auto executor = std::move(executor_);
    auto resumption = std::make_shared<Resumption>(*this, coroutine, std::move(value));
    try {
      executor->dispatch([owned = std::move(resumption)] { owned->run(); });
    } catch (...) {
      logException("An executor has failed to run a coroutine: ");
    }
  }

  // Of the thread that suspends the coroutine and the one that brings the value, the later one continues it.
  bool isSecond() { return isOneDone_.exchange(true); }

  Future<T> source_;
  std::shared_ptr<AsyncExecutor> executor_;
  std::future<T> value_;
  std::atomic<bool> isOneDone_{false};
};

// How a coroutine has ended, and the promise that is to say so when the coroutine is gone.
template <class T> struct Outcome {
  Promise<T> promise;
  std::optional<std::conditional_t<std::is_void_v<T>, bool, T>> value;
  std::exception_ptr failure;

  void deliver() noexcept {
    try {
      fulfil(promise, [this]() -> T {
        if (failure != nullptr) std::rethrow_exception(failure);
        if constexpr (!std::is_void_v<T>) return std::move(*value);
      });
    } catch (...) {
      logException("A callback of a coroutine's future has thrown: ");
    }
  }
};

template <class T> class CoroutinePromiseBase : public CoroutineOfAFuture {
 public:
  struct End {
    bool await_ready() const noexcept { return false; }
    template <class CoroutinePromise>
    [[gnu::noinline]] void await_suspend(std::coroutine_handle<CoroutinePromise> coroutine) const noexcept {
      const auto outcome = std::move(coroutine.promise().outcome_);
      coroutine.destroy();
      outcome->deliver();
    }
    void await_resume() const noexcept {}
  };

  Future<T> get_return_object() { return outcome_->promise.getFuture(); }
  std::suspend_never initial_suspend() const noexcept { return {}; }
  End final_suspend() const noexcept { return {}; }
  void unhandled_exception() noexcept { outcome_->failure = std::current_exception(); }

  CoroutinePromiseBase() = default;
  CoroutinePromiseBase(const CoroutinePromiseBase&) = delete;
  CoroutinePromiseBase& operator=(const CoroutinePromiseBase&) = delete;

 protected:
  // Of a coroutine that is dropped the future says so here, where what its callback throws does no harm.
  ~CoroutinePromiseBase() {
    if (outcome_ == nullptr) return;
    outcome_->failure = std::make_exception_ptr(std::future_error(std::future_errc::broken_promise));
    outcome_->deliver();
  }

  std::unique_ptr<Outcome<T>> outcome_ = std::make_unique<Outcome<T>>();
};

template <class T> class CoroutinePromise : public CoroutinePromiseBase<T> {
 public:
  template <class U = T> void return_value(U&& value) { this->outcome_->value.emplace(std::forward<U>(value)); }
};

template <> class CoroutinePromise<void> : public CoroutinePromiseBase<void> {
 public:
  void return_void() const noexcept {}
};

}  // namespace detail

// What a coroutine awaits to have the value of the future on the executor. A null executor: as without.
template <class T>
[[nodiscard]] detail::Awaiter<T> resumeOn(Future<T> future, std::shared_ptr<AsyncExecutor> executor) {
  return {std::move(future), std::move(executor)};
}

}  // namespace velmora::mobile::xplat::cellar::host

namespace velmora::mobile::xplat::cellar {

template <class T> host::detail::Awaiter<T> operator co_await(Future<T> future) { return {std::move(future), nullptr}; }

}  // namespace velmora::mobile::xplat::cellar

namespace std {

template <class T, class... Arguments>
struct coroutine_traits<velmora::mobile::xplat::cellar::Future<T>, Arguments...> {
  using promise_type = velmora::mobile::xplat::cellar::host::detail::CoroutinePromise<T>;
};

}  // namespace std

#endif
