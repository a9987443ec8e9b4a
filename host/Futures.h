#pragma once

#include <atomic>
#include <cstddef>
#include <exception>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <type_traits>
#include <utility>
#include <vector>

#include <cellar/Export.h>
#include <cellar/Future.h>

// Futures made of futures. Each function takes the value of the futures it is given, as a callback does, so it is the
// only one to use them; any thread may call. `Future::isReady` says whether a value is there.
//
// Nothing is lost: what a function throws, the exception of a source, and the broken promise of a source or of an
// executor that drops its task all reach the resulting future.
//
// Without an executor, functions run inline: on the thread that fulfils the source, under the lock of the source, or on
// the caller's thread if the source is fulfilled already. They must be short then, and not use the source.
namespace velmora::mobile::xplat::cellar::host {

// A future was used that cannot give its value. The code is the library's; the text says what to do instead.
class CELLAR_EXPORT FutureMisuseError : public FutureError {
 public:
  explicit FutureMisuseError(Code code);
  ~FutureMisuseError() override;

  const char* what() const noexcept override;
};

namespace detail {

// Has the value delivered inline. Throws `FutureMisuseError`; the callback has not been called and will not be then.
template <class T> void receive(Future<T> future, std::function<void(std::future<T>&)> callback) {
  try {
    future.then(nullptr, std::move(callback));
  } catch (const FutureError& error) {
    throw FutureMisuseError(error.code());
  }
}

// Fulfils the promise with the result or the exception of the function, but not with what a callback of the promise's
// own future throws: that is thrown here.
template <class R, class Function> void fulfil(Promise<R>& promise, Function&& function) {
  std::exception_ptr failure;
  if constexpr (std::is_void_v<R>) {
    try {
      function();
    } catch (...) {
      failure = std::current_exception();
    }
    failure ? promise.setException(std::move(failure)) : promise.setValue();
  } else {
    std::optional<R> value;
    try {
      value.emplace(function());
    } catch (...) {
      failure = std::current_exception();
    }
    failure ? promise.setException(std::move(failure)) : promise.setValue(std::move(*value));
  }
}

// What a future of a function's result is: that of a function which returns a future has the value of that one.
template <class R> struct Result {
  using Type = R;
  static constexpr bool isFuture = false;
};
template <class R> struct Result<Future<R>> {
  using Type = R;
  static constexpr bool isFuture = true;
};

// A function and the promise of its result. Whoever is to run it owns it: dropped, it breaks the promise.
template <class T, class Function> struct Step {
  using Returned = std::decay_t<std::invoke_result_t<Function&, std::future<T>&>>;
  using Value = typename Result<Returned>::Type;

  explicit Step(Function toRun) : function(std::move(toRun)) {}

  Function function;
  std::future<T> source;
  Promise<Value> promise;
  bool isFulfilled = false;  // by the future that the function has returned

  static void run(const std::shared_ptr<Step>& step) {
    if constexpr (Result<Returned>::isFuture) {
      try {
        receive<Value>(step->function(step->source), [kept = step](std::future<Value>& value) mutable {
          const auto owned = std::exchange(kept, nullptr);
          owned->isFulfilled = true;
          fulfil(owned->promise, [&] { return value.get(); });
        });
      } catch (...) {
        if (step->isFulfilled) throw;  // by a callback of the result
        step->promise.setException(std::current_exception());
      }
    } else {
      fulfil(step->promise, [&] { return step->function(step->source); });
    }
  }
};

}  // namespace detail

// Calls `function` once with the standard future that holds the value or exception of the source, as `Future::then`
// does, on the executor or, if that is null, inline. The result is what it returns or throws; if it returns a `Future`,
// the value or exception of that one. Throws `FutureMisuseError` for a source that is empty, that has a callback, or
// whose value has been taken.
template <class T, class Function>
[[nodiscard]] auto then(Future<T> source, std::shared_ptr<AsyncExecutor> executor, Function function) {
  using Step = detail::Step<T, Function>;
  auto step = std::make_shared<Step>(std::move(function));
  Future<typename Step::Value> result = step->promise.getFuture();
  // Copies of the source keep the callback, but nothing that it holds.
  detail::receive<T>(std::move(source), [step, executor = std::move(executor)](std::future<T>& value) mutable {
    auto owned = std::exchange(step, nullptr);
    const auto queue = std::exchange(executor, nullptr);
    owned->source = std::move(value);
    if (queue == nullptr) return Step::run(owned);
    queue->dispatch([owned = std::move(owned)] { Step::run(owned); });
  });
  return result;
}

template <class T, class Function> [[nodiscard]] auto then(Future<T> source, Function function) {
  return then(std::move(source), nullptr, std::move(function));
}

// The same with a function of the value itself (of nothing, if T is void). It is called only when there is a value; an
// exception is passed on to the result.
template <class T, class Function>
[[nodiscard]] auto map(Future<T> source, std::shared_ptr<AsyncExecutor> executor, Function function) {
  auto apply = [function = std::move(function)](std::future<T>& value) mutable {
    if constexpr (std::is_void_v<T>) {
      value.get();
      return function();
    } else {
      return function(value.get());
    }
  };
  return then(std::move(source), std::move(executor), std::move(apply));
}

template <class T, class Function> [[nodiscard]] auto map(Future<T> source, Function function) {
  return map(std::move(source), nullptr, std::move(function));
}

// A standard future with the value or exception of the source. It may be waited for on any thread but those that are to
// fulfil the source; its destructor does not wait. Throws as `then`.
template <class T> [[nodiscard]] std::future<T> toStdFuture(Future<T> source) {
  auto promise = std::make_shared<std::promise<T>>();
  std::future<T> result = promise->get_future();
  detail::receive<T>(std::move(source), [promise](std::future<T>& value) mutable {
    const auto owned = std::exchange(promise, nullptr);
    try {
      if constexpr (std::is_void_v<T>) {
        value.get();
        owned->set_value();
      } else {
        owned->set_value(value.get());
      }
    } catch (...) {
      owned->set_exception(std::current_exception());
    }
  });
  return result;
}

namespace detail {

template <class T> struct Gathering {
  using Value = std::conditional_t<std::is_void_v<T>, void, std::vector<T>>;

  explicit Gathering(std::size_t count) : arrived(count), missing(count) {}

  std::vector<std::future<T>> arrived;
  std::atomic<std::size_t> missing;
  Promise<Value> promise;

  void arrive(std::size_t i, std::future<T> value) {
    arrived[i] = std::move(value);
    if (--missing == 0) finish();
  }

  void finish() {
    fulfil(promise, [this] {
      if constexpr (std::is_void_v<T>) {
        for (auto& value : arrived) value.get();
      } else {
        Value values;
        values.reserve(arrived.size());
        for (auto& value : arrived) values.push_back(value.get());
        return values;
      }
    });
  }
};

}  // namespace detail

// Waits for all sources, then has their values in the same order (nothing, if T is void), or the exception of the first
// one in that order that has failed. A source that is empty, that has a callback, or whose value has been taken counts
// as failed with `FutureMisuseError`: so do copies of an earlier source. Without sources the result is there at once.
template <class T> [[nodiscard]] auto whenAll(std::vector<Future<T>> sources) {
  const auto gathering = std::make_shared<detail::Gathering<T>>(sources.size());
  auto result = gathering->promise.getFuture();
  if (sources.empty()) gathering->finish();
  for (std::size_t i = 0; i < sources.size(); ++i) {
    try {
      detail::receive<T>(std::move(sources[i]), [owned = gathering, i](std::future<T>& value) mutable {
        std::exchange(owned, nullptr)->arrive(i, std::move(value));
      });
    } catch (const FutureMisuseError&) {
      std::promise<T> failed;
      failed.set_exception(std::current_exception());
      gathering->arrive(i, failed.get_future());
    }
  }
  return result;
}

}  // namespace velmora::mobile::xplat::cellar::host
