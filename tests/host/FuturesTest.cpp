#include "host/Futures.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Future.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::ManualExecutor;
using Value = std::unique_ptr<int>;
using Code = FutureError::Code;

Value valueOf(int number) { return std::make_unique<int>(number); }

template <class T> Future<T> failed(const std::string& text) {
  Promise<T> promise;
  Future<T> future = promise.getFuture();
  promise.setException(std::make_exception_ptr(std::runtime_error(text)));
  return future;
}

template <class T> Future<T> ready(T value) {
  Promise<T> promise;
  Future<T> future = promise.getFuture();
  promise.setValue(std::move(value));
  return future;
}

Future<void> ready() {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setValue();
  return future;
}

std::string describe(int value) { return std::to_string(value); }
std::string describe(const Value& value) { return value == nullptr ? "null" : std::to_string(*value); }
std::string describe(const std::string& value) { return value; }
template <class T> std::string describe(const std::vector<T>& values) {
  std::string text;
  for (const T& value : values) text += describe(value) + ",";
  return text;
}

// "<pending>", the value, or "<error>" with its text. Takes the value.
template <class T> std::string told(Future<T> future) {
  if (!future.isReady()) return "<pending>";
  std::string text;
  future.then([&](std::future<T>& result) {
    try {
      if constexpr (std::is_void_v<T>) {
        result.get();
        text = "<done>";
      } else {
        text = describe(result.get());
      }
    } catch (const std::future_error& error) {
      text = error.code() == std::future_errc::broken_promise ? "<broken>" : "<other>";
    } catch (const std::exception& error) {
      text = std::string("<error> ") + error.what();
    }
  });
  return text;
}

template <class Operation> Code misuseOf(Operation operation) {
  try {
    operation();
  } catch (const FutureMisuseError& error) {
    return error.code();
  }
  throw std::logic_error("That is not a misuse.");
}

class Futures : public testing::Test {
 protected:
  void TearDown() override { queue_->dropAll(); }

  std::shared_ptr<ManualExecutor> queue_ = std::make_shared<ManualExecutor>();
};

// --- Misuse ---

TEST_F(Futures, AMisuseSaysWhatToDoAndKeepsItsCode) {
  const std::string taken = FutureMisuseError(Code::ValueAlreadyFetched).what();
  EXPECT_EQ(
      taken,
      "The value of the future has been taken already. Copies of a future share one value: keep the value, or use "
      "one copy only.");
  const std::string callback = FutureMisuseError(Code::CallbackAlreadySet).what();
  EXPECT_EQ(
      callback,
      "The future has a callback, which gets its value. Copies of a future share one value: either wait for it or "
      "give it one callback.");
  EXPECT_EQ(FutureMisuseError(Code::FetchWithCallback).what(), callback);
  EXPECT_STREQ(FutureMisuseError(Code::InvalidSharedState).what(),
               "The future is empty: default constructed, or moved from. Use the one that the operation has returned.");
  EXPECT_STREQ(FutureMisuseError(static_cast<Code>(99)).what(), "Unknown error");
  EXPECT_EQ(FutureMisuseError(Code::CallbackAlreadySet).code(), Code::CallbackAlreadySet);
}

TEST_F(Futures, EachFunctionRefusesAFutureWithoutAValueToGive) {
  const auto useAll = [](const Future<int>& future, Code code) {
    EXPECT_EQ(misuseOf([&] { (void)then(future, [](std::future<int>&) {}); }), code);
    EXPECT_EQ(misuseOf([&] { (void)map(future, [](int) {}); }), code);
    EXPECT_EQ(misuseOf([&] { (void)toStdFuture(future); }), code);
  };
  useAll({}, Code::InvalidSharedState);
  Future<int> taken = ready(1);
  taken.then([](std::future<int>& value) { value.get(); });
  useAll(taken, Code::ValueAlreadyFetched);
  Promise<int> promise;
  Future<int> waiting = promise.getFuture();
  waiting.then([](std::future<int>&) {});
  useAll(waiting, Code::CallbackAlreadySet);
}

// --- then ---

TEST_F(Futures, ThenHasTheResultOfItsCallback) {
  Promise<Value> promise;
  const auto text = then(promise.getFuture(), [](std::future<Value>& value) { return describe(value.get()); });
  EXPECT_EQ(told(text), "<pending>");
  promise.setValue(valueOf(7));
  EXPECT_EQ(told(text), "7");
}

TEST_F(Futures, ThenMayRecoverFromAFailure) {
  const auto recovered = then(failed<Value>("no luck"), [](std::future<Value>& value) {
    try {
      return value.get();
    } catch (const std::runtime_error&) {
      return valueOf(-1);
    }
  });
  EXPECT_EQ(told(recovered), "-1");
}

TEST_F(Futures, ThenHasWhatItsCallbackThrows) {
  EXPECT_EQ(told(then(ready(), [](std::future<void>&) { throw std::out_of_range("too far"); })), "<error> too far");
}

TEST_F(Futures, ThenRunsOnTheExecutorOnly) {
  Promise<int> promise;
  bool ran = false;
  const auto done = then(promise.getFuture(), queue_, [&](std::future<int>&) { ran = true; });
  promise.setValue(1);
  EXPECT_FALSE(ran);
  EXPECT_EQ(told(done), "<pending>");
  EXPECT_EQ(queue_->runAll(), 1U);
  EXPECT_TRUE(ran);
  EXPECT_EQ(told(done), "<done>");
}

TEST_F(Futures, ThenTakesACallbackThatOnlyMoves) {
  const auto sum =
      then(ready(1), [owned = valueOf(41)](std::future<int>& value) mutable { return ++*owned + value.get() - 1; });
  EXPECT_EQ(told(sum), "42");
}

TEST_F(Futures, TheCallbackMayChangeItself) {
  const auto text = map(ready(1), [text = std::string("a")](int) mutable { return text += "b"; });
  EXPECT_EQ(told(text), "ab");
}

TEST_F(Futures, AReferenceIsCopied) {
  int number = 3;
  const auto copied = map(ready(1), [&](int) -> int& { return number; });
  number = 4;
  EXPECT_EQ(told(copied), "3");
}

TEST_F(Futures, ADroppedTaskBreaksThePromiseThoughTheSourceIsKept) {
  Promise<int> promise;
  const Future<int> source = promise.getFuture();
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watched = held;
  const auto result = then(source, queue_, [held = std::move(held)](std::future<int>&) {});
  promise.setValue(1);
  EXPECT_EQ(told(result), "<pending>");
  queue_->dropAll();
  EXPECT_EQ(told(result), "<broken>");
  EXPECT_TRUE(watched.expired());
}

TEST_F(Futures, AnExecutorThatThrowsBreaksThePromise) {
  Promise<int> promise;
  const Future<int> source = promise.getFuture();
  const auto result = then(source, queue_, [](std::future<int>&) {});
  queue_->throwOnDispatch(true);
  EXPECT_THROW(promise.setValue(1), std::runtime_error);
  EXPECT_EQ(told(result), "<broken>");
}

TEST_F(Futures, ABrokenPromiseIsPassedOn) {
  Future<void> result;
  {
    Promise<int> promise;
    result = map(promise.getFuture(), [](int) { FAIL(); });
  }
  EXPECT_EQ(told(result), "<broken>");
}

TEST_F(Futures, WhatTheCallbackHoldsIsGoneWhenItHasRunThoughTheSourceIsKept) {
  Promise<int> promise;
  const Future<int> source = promise.getFuture();
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watched = held;
  const auto result = map(source, [held = std::move(held)](int number) { return number; });
  EXPECT_FALSE(watched.expired());
  promise.setValue(1);
  EXPECT_TRUE(watched.expired());
  EXPECT_EQ(told(result), "1");
}

TEST_F(Futures, WhatACallbackOfTheResultThrowsReachesWhoFulfilsTheSource) {
  Promise<int> promise;
  auto result = map(promise.getFuture(), [](int number) { return number; });
  result.then([](std::future<int>&) { throw std::runtime_error("callback"); });
  EXPECT_THROW(promise.setValue(1), std::runtime_error);
}

// --- map ---

TEST_F(Futures, MapHasTheResultOfItsFunction) {
  EXPECT_EQ(told(map(ready(valueOf(20)), [](Value value) { return *value + 1; })), "21");
  EXPECT_EQ(told(map(ready(), [] { return std::string("nothing in, text out"); })), "nothing in, text out");
  EXPECT_EQ(told(map(ready(1), [](int) {})), "<done>");
}

TEST_F(Futures, MapPassesAnExceptionOnWithoutCallingItsFunction) {
  const auto fail = [](auto&&...) { ADD_FAILURE(); };
  EXPECT_EQ(told(map(failed<int>("no luck"), fail)), "<error> no luck");
  EXPECT_EQ(told(map(failed<void>("no luck"), fail)), "<error> no luck");
}

TEST_F(Futures, MapHasWhatItsFunctionThrows) {
  EXPECT_EQ(told(map(ready(1), [](int) -> int { throw std::out_of_range("too far"); })), "<error> too far");
}

TEST_F(Futures, MapRunsOnTheExecutor) {
  const auto doubled = map(ready(4), queue_, [](int number) { return 2 * number; });
  EXPECT_EQ(told(doubled), "<pending>");
  queue_->runAll();
  EXPECT_EQ(told(doubled), "8");
}

TEST_F(Futures, ACallbackThatOpensAnotherFutureIsWaitedFor) {
  Promise<int> second;
  const auto sum =
      map(ready(1), [&](int first) { return map(second.getFuture(), [first](int number) { return first + number; }); });
  EXPECT_EQ(told(sum), "<pending>");
  second.setValue(2);
  EXPECT_EQ(told(sum), "3");
}

TEST_F(Futures, TheFailureOfTheOtherFutureIsTheResults) {
  EXPECT_EQ(told(map(ready(1), [](int) { return failed<Value>("second"); })), "<error> second");
  EXPECT_EQ(told(map(ready(1), [](int) -> Future<int> { throw std::runtime_error("thrown"); })), "<error> thrown");
  EXPECT_EQ(told(map(ready(1), [](int) { return Future<int>(); })),
            std::string("<error> ") + FutureMisuseError(Code::InvalidSharedState).what());
  EXPECT_EQ(told(map(ready(1), [](int) { return Promise<int>().getFuture(); })), "<broken>");
}

TEST_F(Futures, WhatACallbackOfAFlattenedResultThrowsReachesWhoFulfils) {
  Promise<int> source;
  auto result = map(source.getFuture(), [](int number) { return ready(number); });
  int calls = 0;
  result.then([&](std::future<int>& value) {
    EXPECT_EQ(value.get(), 5);
    ++calls;
    throw std::out_of_range("callback");
  });
  EXPECT_THROW(source.setValue(5), std::out_of_range);
  EXPECT_EQ(calls, 1);
}

// --- toStdFuture ---

TEST_F(Futures, AStandardFutureHasTheValue) {
  Promise<Value> promise;
  std::future<Value> value = toStdFuture(promise.getFuture());
  EXPECT_EQ(value.wait_for(std::chrono::seconds(0)), std::future_status::timeout);
  promise.setValue(valueOf(3));
  EXPECT_EQ(*value.get(), 3);
  EXPECT_NO_THROW(toStdFuture(ready()).get());
}

TEST_F(Futures, AStandardFutureHasTheException) {
  EXPECT_THROW(toStdFuture(failed<int>("no luck")).get(), std::runtime_error);
  EXPECT_THROW(toStdFuture(failed<void>("no luck")).get(), std::runtime_error);
}

TEST_F(Futures, AStandardFutureThatIsDroppedTakesItsValueWithIt) {
  Promise<std::shared_ptr<int>> promise;
  const auto source = promise.getFuture();
  (void)toStdFuture(source);
  auto value = std::make_shared<int>(0);
  const std::weak_ptr<int> watched = value;
  promise.setValue(std::move(value));
  EXPECT_TRUE(watched.expired());
}

// --- whenAll ---

TEST_F(Futures, AllValuesComeInTheOrderOfTheSources) {
  std::vector<Promise<Value>> promises(3);
  std::vector<Future<Value>> sources;
  for (auto& promise : promises) sources.push_back(promise.getFuture());
  const auto all = whenAll(std::move(sources));
  promises[2].setValue(valueOf(2));
  promises[0].setValue(valueOf(0));
  EXPECT_EQ(told(all), "<pending>");
  promises[1].setValue(nullptr);
  EXPECT_EQ(told(all), "0,null,2,");
}

TEST_F(Futures, AllOfNoneIsThereAtOnce) {
  EXPECT_EQ(told(whenAll(std::vector<Future<int>>())), "");
  EXPECT_EQ(told(whenAll(std::vector<Future<void>>())), "<done>");
}

TEST_F(Futures, AllOfOneThatIsThereIsThere) {
  EXPECT_EQ(told(whenAll(std::vector<Future<int>>{ready(1)})), "1,");
  EXPECT_EQ(told(whenAll(std::vector<Future<void>>{ready()})), "<done>");
}

TEST_F(Futures, TheFirstFailureInTheOrderOfTheSourcesIsThrownWhenAllAreThere) {
  std::vector<Promise<void>> promises(4);
  std::vector<Future<void>> sources;
  for (auto& promise : promises) sources.push_back(promise.getFuture());
  const auto all = whenAll(std::move(sources));
  promises[3].setException(std::make_exception_ptr(std::runtime_error("fourth")));
  promises[1].setException(std::make_exception_ptr(std::runtime_error("second")));
  promises[0].setValue();
  EXPECT_EQ(told(all), "<pending>");
  promises[2].setValue();
  EXPECT_EQ(told(all), "<error> second");
}

TEST_F(Futures, ASourceThatBreaksItsPromiseCounts) {
  std::vector<Future<int>> sources{ready(1)};
  {
    Promise<int> promise;
    sources.push_back(promise.getFuture());
  }
  EXPECT_EQ(told(whenAll(std::move(sources))), "<broken>");
}

TEST_F(Futures, ASourceThatIsMisusedFailsTheWholeAndTheOthersAreWaitedFor) {
  Promise<int> promise;
  const Future<int> source = promise.getFuture();
  const auto all = whenAll(std::vector<Future<int>>{source, source, {}});
  EXPECT_EQ(told(all), "<pending>");
  promise.setValue(1);
  EXPECT_EQ(told(all), std::string("<error> ") + FutureMisuseError(Code::CallbackAlreadySet).what());
}

TEST_F(Futures, TruthValuesMayBeGathered) {
  EXPECT_EQ(told(map(whenAll(std::vector<Future<bool>>{ready(true), ready(false)}),
                     [](std::vector<bool> values) { return values[0] && !values[1] ? 1 : 0; })),
            "1");
}

TEST_F(Futures, WhatACallbackOfAllThrowsReachesWhoFulfilsTheLast) {
  Promise<int> promise;
  auto all = whenAll(std::vector<Future<int>>{ready(1), promise.getFuture()});
  all.then([](std::future<std::vector<int>>&) { throw std::out_of_range("callback"); });
  EXPECT_THROW(promise.setValue(2), std::out_of_range);
}

// --- Threads ---

TEST_F(Futures, ManyThreadsFulfilWhatOneWaitsFor) {
  constexpr std::size_t kThreads = 4;
  for (int round = 0; round < 200; ++round) {
    std::vector<Promise<std::size_t>> promises(kThreads);
    std::vector<Future<std::size_t>> sources;
    for (auto& promise : promises) sources.push_back(promise.getFuture());
    std::vector<std::size_t> values;
    test::runOnThreads(kThreads + 1, [&](std::size_t thread) {
      if (thread < kThreads) return promises[thread].setValue(thread);
      values = toStdFuture(map(whenAll(sources), [](std::vector<std::size_t> all) { return all; })).get();
    });
    ASSERT_EQ(values, (std::vector<std::size_t>{0, 1, 2, 3}));
  }
}

TEST_F(Futures, AChainPassesFromQueueToQueue) {
  ThreadQueueFactory queues;
  const auto first = queues.createQueue();
  const auto second = queues.createWorkQueue();
  std::atomic<int> sum{0};
  for (int i = 0; i < 200; ++i) {
    const auto opened = dispatchTask<int>(first, [i] { return i; });
    const auto doubled =
        map(opened, second, [&first](int number) { return dispatchTask<int>(first, [number] { return 2 * number; }); });
    sum += toStdFuture(doubled).get();
  }
  EXPECT_EQ(sum, 200 * 199);
}

TEST_F(Futures, AResultIsReadyForAThreadThatOnlyAsks) {
  for (int round = 0; round < 100; ++round) {
    Promise<void> promise;
    const Future<void> done = map(promise.getFuture(), [] {});
    int written = 0;
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) {
        written = 42;
        return promise.setValue();
      }
      while (!done.isReady()) std::this_thread::yield();
      EXPECT_EQ(written, 42);
    });
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
