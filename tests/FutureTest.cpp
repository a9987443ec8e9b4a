#include "Future.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/LogCapture.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::ManualExecutor;
using Value = std::unique_ptr<int>;  // moves only, as what a fetch delivers
using Code = FutureError::Code;

constexpr int kRaces = 300;

std::exception_ptr failure(const string& text) { return std::make_exception_ptr(std::runtime_error(text)); }

const std::pair<Code, string> kNone{static_cast<Code>(0), "no FutureError"};

// The code and text that a misuse is answered with; `kNone` for an operation that is none.
template <class Operation> std::pair<Code, string> misuse(Operation operation) {
  try {
    operation();
  } catch (const FutureError& error) {
    return {error.code(), error.what()};
  }
  return kNone;
}

const std::pair<Code, string> kInvalid{Code::InvalidSharedState, "Shared state is invalid"};
const std::pair<Code, string> kFetchWithCallback{Code::FetchWithCallback,
                                                 "Value may not be fetched if a callback is set"};
const std::pair<Code, string> kCallbackAlreadySet{Code::CallbackAlreadySet, "Callback may not be set again"};
const std::pair<Code, string> kAlreadyFetched{Code::ValueAlreadyFetched, "Unknown error"};

template <class T> bool isBrokenPromise(std::future<T>& future) {
  try {
    future.get();
  } catch (const std::future_error& error) {
    return error.code() == std::future_errc::broken_promise;
  }
  return false;
}

template <class Operation> std::error_code standardMisuse(Operation operation) {
  try {
    operation();
  } catch (const std::future_error& error) {
    return error.code();
  }
  return {};
}

// Gives another thread the chance to do what a lock should keep it from.
void letOthersTry() {
  for (int i = 0; i < 2000; ++i) std::this_thread::yield();
}

class FutureTest : public testing::Test {
 protected:
  // A queued delivery holds its own queue: what a test leaves unrun would keep both.
  void TearDown() override {
    if (queue_ != nullptr) queue_->dropAll();
  }

  std::shared_ptr<ManualExecutor> queue_ = std::make_shared<ManualExecutor>();
};

// Errors

TEST(FutureErrorTest, CodesHaveTheirNumbersAndTexts) {
  EXPECT_EQ(static_cast<int>(Code::InvalidSharedState), 1);
  EXPECT_EQ(static_cast<int>(Code::FetchWithCallback), 2);
  EXPECT_EQ(static_cast<int>(Code::CallbackAlreadySet), 3);
  EXPECT_EQ(static_cast<int>(Code::ValueAlreadyFetched), 4);
  EXPECT_STREQ(FutureError(Code::InvalidSharedState).what(), "Shared state is invalid");
  EXPECT_STREQ(FutureError(Code::FetchWithCallback).what(), "Value may not be fetched if a callback is set");
  EXPECT_STREQ(FutureError(Code::CallbackAlreadySet).what(), "Callback may not be set again");
  EXPECT_STREQ(FutureError(Code::ValueAlreadyFetched).what(), "Unknown error");
}

TEST(FutureErrorTest, AnyOtherCodeIsAnUnknownErrorAndKeepsItsNumber) {
  for (const int number : {0, 5, -1, 1000}) {
    const FutureError error(static_cast<Code>(number));
    EXPECT_STREQ(error.what(), "Unknown error");
    EXPECT_EQ(static_cast<int>(error.code()), number);
  }
}

TEST(FutureErrorTest, IsALogicError) {
  try {
    throw FutureError(Code::CallbackAlreadySet);
  } catch (const std::logic_error& error) {
    EXPECT_STREQ(error.what(), "Callback may not be set again");
  }
}

// Misuse

TEST_F(FutureTest, EveryOperationOnADefaultFutureThrows) {
  Future<void> future;
  EXPECT_EQ(misuse([&] { future.get(); }), kInvalid);
  EXPECT_EQ(misuse([&] { future.then(nullptr, [](auto&) {}); }), kInvalid);
  EXPECT_EQ(misuse([&] { future.throwIfInvalid(); }), kInvalid);
  Future<Value> valued;
  EXPECT_EQ(misuse([&] { valued.then(nullptr, [](auto&) {}); }), kInvalid);
  EXPECT_EQ(misuse([&] { valued.throwIfInvalid(); }), kInvalid);
}

TEST_F(FutureTest, AMovedFromFutureIsEmptyAndTheOtherOneWorks) {
  Promise<void> promise;
  Future<void> source = promise.getFuture();
  Future<void> target = std::move(source);
  EXPECT_EQ(misuse([&] { source.throwIfInvalid(); }), kInvalid);  // NOLINT(bugprone-use-after-move)
  promise.setValue();
  EXPECT_NO_THROW(target.get());
}

TEST_F(FutureTest, TheOldStateIsLetGoWhenAFutureIsAssigned) {
  Promise<void> first;
  Promise<void> second;
  Future<void> future = first.getFuture();
  first.setValue();
  future.get();
  future = second.getFuture();
  second.setValue();
  EXPECT_NO_THROW(future.get());
}

TEST_F(FutureTest, AValidFutureMayBeAskedAgainAndAgain) {
  Promise<void> promise;
  const Future<void> future = promise.getFuture();
  EXPECT_NO_THROW(future.throwIfInvalid());
  EXPECT_NO_THROW(future.throwIfInvalid());
}

TEST_F(FutureTest, ThenTwiceThrowsAndTheFirstCallbackStays) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  int first = 0;
  int second = 0;
  future.then(nullptr, [&](auto&) { ++first; });
  EXPECT_EQ(misuse([&] { future.then(nullptr, [&](auto&) { ++second; }); }), kCallbackAlreadySet);
  promise.setValue();
  EXPECT_EQ(first, 1);
  EXPECT_EQ(second, 0);
}

TEST_F(FutureTest, ThenOnTwoCopiesThrows) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  int calls = 0;
  future.then(nullptr, [&](auto&) { ++calls; });
  EXPECT_EQ(misuse([&] { copy.then(queue_, [&](auto&) { calls += 100; }); }), kCallbackAlreadySet);
  promise.setValue();
  EXPECT_EQ(queue_->pending(), 0U);  // the refused executor was not kept either
  EXPECT_EQ(calls, 1);
}

TEST_F(FutureTest, GetAfterThenThrowsBeforeAndAfterFulfilment) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(queue_, [](auto&) {});
  EXPECT_EQ(misuse([&] { future.get(); }), kFetchWithCallback);
  promise.setValue();
  EXPECT_EQ(misuse([&] { future.get(); }), kFetchWithCallback);
}

TEST_F(FutureTest, AfterGetEveryOperationSaysThatTheValueIsGone) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  promise.setValue();
  future.get();
  EXPECT_EQ(misuse([&] { future.get(); }), kAlreadyFetched);
  EXPECT_EQ(misuse([&] { copy.get(); }), kAlreadyFetched);
  EXPECT_EQ(misuse([&] { copy.then(nullptr, [](auto&) { FAIL(); }); }), kAlreadyFetched);
  EXPECT_EQ(misuse([&] { copy.throwIfInvalid(); }), kAlreadyFetched);
}

TEST_F(FutureTest, AGetThatRethrowsTakesTheValueToo) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setException(failure("no luck"));
  EXPECT_THROW(future.get(), std::runtime_error);
  EXPECT_EQ(misuse([&] { future.get(); }), kAlreadyFetched);
}

TEST_F(FutureTest, AfterACallbackTookTheValueItIsGone) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  future.then(nullptr, [](std::future<Value>& value) { value.get(); });
  promise.setValue(std::make_unique<int>(7));
  EXPECT_EQ(misuse([&] { future.throwIfInvalid(); }), kAlreadyFetched);
  EXPECT_EQ(misuse([&] { future.then(nullptr, [](auto&) {}); }), kAlreadyFetched);
}

TEST_F(FutureTest, AfterACallbackThatLeftTheValueTheFutureStillHasItsCallback) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(nullptr, [](auto&) {});
  promise.setValue();
  EXPECT_NO_THROW(future.throwIfInvalid());
  EXPECT_EQ(misuse([&] { future.then(nullptr, [](auto&) {}); }), kCallbackAlreadySet);
  EXPECT_EQ(misuse([&] { future.get(); }), kFetchWithCallback);
}

// Readiness

TEST_F(FutureTest, IsReadyFromItsFulfilmentOnAlsoWhenTheValueHasBeenTaken) {
  Promise<Value> promise;
  const Future<Value> future = promise.getFuture();
  Future<Value> copy = future;
  EXPECT_FALSE(future.isReady());
  promise.setValue(nullptr);
  EXPECT_TRUE(future.isReady());
  copy.then([](std::future<Value>& value) { value.get(); });
  EXPECT_TRUE(future.isReady());
}

TEST_F(FutureTest, IsReadyWithAnExceptionABrokenPromiseOrAnEarlyValue) {
  Promise<void> failing;
  const Future<void> failed = failing.getFuture();
  failing.setException(failure("no luck"));
  EXPECT_TRUE(failed.isReady());
  const Future<void> broken = Promise<void>().getFuture();
  EXPECT_TRUE(broken.isReady());
  Promise<void> early;
  early.setValue();
  EXPECT_TRUE(early.getFuture().isReady());
}

TEST_F(FutureTest, AnEmptyFutureIsNeitherReadyNorNot) {
  EXPECT_EQ(misuse([] { (void)Future<Value>().isReady(); }), kInvalid);
}

TEST_F(FutureTest, AnInlineCallbackMayAskWhetherItsFutureIsReady) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  bool ready = false;
  future.then([&](auto&) { ready = future.isReady(); });
  promise.setValue();
  EXPECT_TRUE(ready);
}

TEST_F(FutureTest, AskingWhetherItIsReadyDoesNotWaitForAThreadThatGets) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  test::runOnThreads(2, [&](std::size_t thread) {
    if (thread == 0) return future.get();
    letOthersTry();
    EXPECT_FALSE(future.isReady());
    promise.setValue();
    EXPECT_TRUE(future.isReady());
  });
}

// Delivery

TEST_F(FutureTest, ThenWithoutAnExecutorDeliversInline) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  int seen = 0;
  future.then([&](std::future<Value>& value) { seen = *value.get(); });
  EXPECT_EQ(misuse([&] { future.then([](auto&) {}); }), kCallbackAlreadySet);
  promise.setValue(std::make_unique<int>(42));
  EXPECT_EQ(seen, 42);
}

TEST_F(FutureTest, ThenOnAFulfilledFutureRunsTheCallbackInlineAtOnceWithoutAnExecutor) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  promise.setValue(std::make_unique<int>(42));
  int seen = 0;
  std::thread::id thread;
  future.then(nullptr, [&](std::future<Value>& value) {
    seen = *value.get();
    thread = std::this_thread::get_id();
  });
  EXPECT_EQ(seen, 42);
  EXPECT_EQ(thread, std::this_thread::get_id());
}

TEST_F(FutureTest, ThenOnAFulfilledFutureGoesThroughDispatchWithAnExecutor) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  promise.setValue(std::make_unique<int>(42));
  int seen = 0;
  future.then(queue_, [&](std::future<Value>& value) { seen = *value.get(); });
  EXPECT_EQ(seen, 0);
  ASSERT_EQ(queue_->pending(), 1U);
  queue_->runAll();
  EXPECT_EQ(seen, 42);
}

TEST_F(FutureTest, FulfilmentRunsTheCallbackInlineOnTheFulfillingThread) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  std::thread::id callbackThread;
  future.then(nullptr, [&](auto&) { callbackThread = std::this_thread::get_id(); });
  EXPECT_EQ(callbackThread, std::thread::id());
  std::thread::id fulfillingThread;
  std::thread([&] {
    fulfillingThread = std::this_thread::get_id();
    promise.setValue();
    EXPECT_EQ(callbackThread, fulfillingThread);
  }).join();
  EXPECT_EQ(callbackThread, fulfillingThread);
}

TEST_F(FutureTest, FulfilmentDispatchesTheCallbackOnItsExecutor) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  int calls = 0;
  future.then(queue_, [&](std::future<void>& value) {
    value.get();
    ++calls;
  });
  EXPECT_EQ(queue_->pending(), 0U);
  promise.setValue();
  EXPECT_EQ(queue_->pending(), 1U);
  EXPECT_EQ(calls, 0);
  queue_->runAll();
  EXPECT_EQ(calls, 1);
}

TEST_F(FutureTest, ACallbackGetsTheStoredException) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  string text;
  future.then(nullptr, [&](std::future<Value>& value) {
    try {
      value.get();
    } catch (const std::runtime_error& error) {
      text = error.what();
    }
  });
  promise.setException(failure("disk on fire"));
  EXPECT_EQ(text, "disk on fire");
}

TEST_F(FutureTest, GetRethrowsTheStoredException) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setException(std::make_exception_ptr(42));
  try {
    future.get();
    FAIL();
  } catch (int number) {
    EXPECT_EQ(number, 42);
  }
}

TEST_F(FutureTest, GetWaitsForAFulfilmentOnAnotherThread) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  std::atomic<bool> aboutToFulfil{false};
  test::Latch started(1);
  std::thread producer([&] {
    started.wait();
    letOthersTry();
    aboutToFulfil = true;
    promise.setValue();
  });
  started.countDown();
  future.get();
  EXPECT_TRUE(aboutToFulfil);
  producer.join();
}

TEST_F(FutureTest, AnEmptyCallbackIsAsGoodAsNone) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(nullptr, nullptr);
  promise.setValue();
  EXPECT_NO_THROW(future.get());
}

// Locks

TEST_F(FutureTest, AnInlineCallbackOnFulfilmentRunsUnderTheLock) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  std::thread other;
  std::atomic<bool> callbackDone{false};
  test::Latch otherStarted(1);
  std::pair<Code, string> answer;
  bool waited = false;
  future.then(nullptr, [&](std::future<void>& value) {
    other = std::thread([&] {
      otherStarted.countDown();
      answer = misuse([&] { copy.then(nullptr, [](auto&) {}); });
      waited = callbackDone;
    });
    otherStarted.wait();
    letOthersTry();
    value.get();
    callbackDone = true;
  });
  promise.setValue();
  other.join();
  EXPECT_TRUE(waited);
  EXPECT_EQ(answer, kAlreadyFetched);  // without the lock it would have met the callback
}

TEST_F(FutureTest, AnInlineCallbackInThenRunsUnderTheLock) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  promise.setValue();
  std::thread other;
  std::atomic<bool> callbackDone{false};
  test::Latch otherStarted(1);
  bool waited = false;
  future.then(nullptr, [&](std::future<void>&) {
    other = std::thread([&] {
      otherStarted.countDown();
      EXPECT_EQ(misuse([&] { copy.get(); }), kFetchWithCallback);
      waited = callbackDone;
    });
    otherStarted.wait();
    letOthersTry();
    callbackDone = true;
  });
  other.join();
  EXPECT_TRUE(waited);
}

TEST_F(FutureTest, ACallbackOnAnExecutorRunsWithoutTheLock) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  std::vector<std::pair<Code, string>> answers;
  future.then(queue_, [&](std::future<void>&) {
    answers.push_back(misuse([&] { copy.get(); }));
    answers.push_back(misuse([&] { copy.then(nullptr, [](auto&) {}); }));
  });
  promise.setValue();
  queue_->runAll();
  EXPECT_EQ(answers, (std::vector<std::pair<Code, string>>{kFetchWithCallback, kCallbackAlreadySet}));
}

// What each operation of `copy` is answered with, `throwIfInvalid` first.
template <class T> std::vector<std::pair<Code, string>> misusesOf(Future<T>& copy) {
  std::vector<std::pair<Code, string>> answers;
  answers.push_back(misuse([&] { copy.throwIfInvalid(); }));
  answers.push_back(misuse([&] { copy.then(nullptr, [](auto&) { FAIL(); }); }));
  if constexpr (std::is_void_v<T>) answers.push_back(misuse([&] { copy.get(); }));
  return answers;
}

const std::vector<std::pair<Code, string>> kThreeTimesAlreadyFetched(3, kAlreadyFetched);

TEST_F(FutureTest, InACallbackOnAnExecutorEveryOperationOfACopySaysThatTheValueIsGoneOnceItIsTaken) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  std::vector<std::pair<Code, string>> before;
  std::vector<std::pair<Code, string>> after;
  future.then(queue_, [&](std::future<void>& value) {
    before = misusesOf(copy);
    value.get();
    after = misusesOf(copy);
  });
  promise.setValue();
  queue_->runAll();
  EXPECT_EQ(before, (std::vector<std::pair<Code, string>>{kNone, kCallbackAlreadySet, kFetchWithCallback}));
  EXPECT_EQ(after, kThreeTimesAlreadyFetched);
  EXPECT_EQ(misusesOf(copy), kThreeTimesAlreadyFetched);
}

TEST_F(FutureTest, AStoredExceptionThatIsRethrownInACallbackOnAnExecutorIsGoneAtOnceToo) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  std::vector<std::pair<Code, string>> answers;
  future.then(queue_, [&](std::future<void>& value) {
    EXPECT_THROW(value.get(), std::runtime_error);
    answers = misusesOf(copy);
  });
  promise.setException(failure("no luck"));
  queue_->runAll();
  EXPECT_EQ(answers, kThreeTimesAlreadyFetched);
}

TEST_F(FutureTest, AValueThatIsMovedOutOfACallbackOnAnExecutorIsGoneAtOnceToo) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  Future<Value> copy = future;
  std::future<Value> moved;
  std::vector<std::pair<Code, string>> answers;
  future.then(queue_, [&](std::future<Value>& value) {
    moved = std::move(value);
    answers = misusesOf(copy);
  });
  promise.setValue(std::make_unique<int>(8));
  queue_->runAll();
  EXPECT_EQ(answers, (std::vector<std::pair<Code, string>>(2, kAlreadyFetched)));
  EXPECT_EQ(*moved.get(), 8);
}

TEST_F(FutureTest, InAnInlineCallbackTheValueIsGoneOnceItIsTaken) {
  const test::Watchdog watchdog(60);  // the callback runs under the lock that `get` and `then` take
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  Future<void> copy = future;
  std::vector<std::pair<Code, string>> answers;
  future.then(nullptr, [&](std::future<void>& value) {
    EXPECT_NO_THROW(copy.throwIfInvalid());
    value.get();
    answers = misusesOf(copy);
  });
  promise.setValue();
  EXPECT_EQ(answers, kThreeTimesAlreadyFetched);
}

TEST_F(FutureTest, InACallbackThatLeavesTheValueTheFutureIsValidBeforeAndAfterTheCallback) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  future.then(queue_, [&](std::future<Value>&) { EXPECT_NO_THROW(future.throwIfInvalid()); });
  promise.setValue(std::make_unique<int>(1));
  std::thread([&] { queue_->runAll(); }).join();
  EXPECT_NO_THROW(future.throwIfInvalid());
  std::thread([&] { EXPECT_EQ(misuse([&] { future.then(nullptr, [](auto&) {}); }), kCallbackAlreadySet); }).join();
}

TEST_F(FutureTest, AnInlineCallbackMayUseOtherFutures) {
  Promise<void> first;
  Promise<void> second;
  Future<void> firstFuture = first.getFuture();
  Future<void> secondFuture = second.getFuture();
  bool done = false;
  firstFuture.then(nullptr, [&](auto&) {
    secondFuture.then(nullptr, [&](auto&) { done = true; });
    second.setValue();
  });
  first.setValue();
  EXPECT_TRUE(done);
}

// Exceptions out of callbacks and executors

TEST_F(FutureTest, WhatAnInlineCallbackThrowsReachesTheFulfillerAndReleasesTheLock) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(nullptr, [](auto&) { throw std::runtime_error("callback"); });
  EXPECT_THROW(promise.setValue(), std::runtime_error);
  EXPECT_EQ(misuse([&] { future.get(); }), kFetchWithCallback);
  EXPECT_EQ(standardMisuse([&] { promise.setValue(); }), std::future_errc::promise_already_satisfied);
}

TEST_F(FutureTest, WhatAnInlineCallbackThrowsReachesTheCallerOfThenAndReleasesTheLock) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setValue();
  EXPECT_THROW(future.then(nullptr,
                           [](std::future<void>& value) {
                             value.get();
                             throw std::runtime_error("callback");
                           }),
               std::runtime_error);
  EXPECT_EQ(misuse([&] { future.throwIfInvalid(); }), kAlreadyFetched);
}

TEST_F(FutureTest, AnInlineCallbackThatRethrowsTheFailureItWasGivenLeavesThePromiseFulfilled) {
  auto promise = std::make_unique<Promise<void>>();
  Future<void> future = promise->getFuture();
  int calls = 0;
  future.then(nullptr, [&](std::future<void>& value) {
    ++calls;
    value.get();
  });
  EXPECT_THROW(promise->setException(failure("first")), std::runtime_error);
  promise.reset();
  EXPECT_EQ(calls, 1);
}

TEST_F(FutureTest, WhatACallbackThrowsOnAnExecutorIsTheExecutorsAffair) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(queue_, [](auto&) { throw std::runtime_error("callback"); });
  EXPECT_NO_THROW(promise.setValue());
  EXPECT_THROW(queue_->runAll(), std::runtime_error);
}

TEST_F(FutureTest, AnExecutorThatTakesNoTasksFailsTheFulfiller) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(queue_, [](auto&) {});
  queue_->throwOnDispatch(true);
  EXPECT_THROW(promise.setValue(), std::runtime_error);
  EXPECT_EQ(misuse([&] { future.get(); }), kFetchWithCallback);  // the lock is free
}

TEST_F(FutureTest, AnExecutorThatTakesNoTasksFailsThenOnAFulfilledFuture) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setValue();
  queue_->throwOnDispatch(true);
  EXPECT_THROW(future.then(queue_, [](auto&) {}), std::runtime_error);
  EXPECT_EQ(misuse([&] { future.then(nullptr, [](auto&) {}); }), kCallbackAlreadySet);
}

// A destructor has nobody to throw to.

TEST_F(FutureTest, ACallbackThatThrowsOutOfADyingPromiseIsOneErrorLine) {
  const test::LogCapture log;
  auto promise = std::make_unique<Promise<void>>();
  Future<void> future = promise->getFuture();
  future.then([](std::future<void>& value) { value.get(); });  // throws the broken promise
  promise.reset();
  EXPECT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("A callback of a broken promise has failed: std::future_error"));
  EXPECT_EQ(misuse([&] { future.throwIfInvalid(); }), kAlreadyFetched);  // the lock is free
}

TEST_F(FutureTest, ACallbackThatThrowsWhatIsNoStandardExceptionOutOfADyingPromiseIsOneErrorLine) {
  const test::LogCapture log;
  {
    Promise<Value>().getFuture().then([](auto&) { throw 42; });
  }
  EXPECT_EQ(log.messages(), std::vector<string>{"A callback of a broken promise has failed: not a standard exception"});
}

TEST_F(FutureTest, ACallbackThatThrowsWhenAnExecutorDropsItsTaskIsOneErrorLine) {
  const test::LogCapture log;
  dispatchTask<void>(queue_, [] {}).then([](auto&) { throw std::runtime_error("callback"); });
  queue_->dropAll();
  EXPECT_EQ(log.messages(), std::vector<string>{"A callback of a broken promise has failed: callback"});
}

TEST_F(FutureTest, AnExecutorThatRefusesTheCallbackOfADyingPromiseIsOneErrorLine) {
  const test::LogCapture log;
  {
    Promise<void> promise;
    promise.getFuture().then(queue_, [](auto&) {});
    queue_->throwOnDispatch(true);
  }
  EXPECT_EQ(log.errorCount(), 1U);
}

TEST_F(FutureTest, WhatACallbackThrowsReachesWhoeverAbandonsThePromise) {
  const test::LogCapture log;
  Promise<void> promise;
  promise.getFuture().then([](auto&) { throw std::runtime_error("callback"); });
  EXPECT_THROW(promise.abandon(), std::runtime_error);
  EXPECT_EQ(log.errorCount(), 0U);
}

// Promises

TEST_F(FutureTest, AValueSetBeforeGetFutureIsThereAtOnce) {
  Promise<void> early;
  early.setValue();
  Future<void> future = early.getFuture();
  EXPECT_NO_THROW(future.get());

  Promise<Value> promise;
  promise.setValue(std::make_unique<int>(5));
  int seen = 0;
  promise.getFuture().then(nullptr, [&](std::future<Value>& value) { seen = *value.get(); });
  EXPECT_EQ(seen, 5);
}

TEST_F(FutureTest, AnExceptionSetBeforeGetFutureIsThereAtOnce) {
  Promise<void> promise;
  promise.setException(failure("early"));
  EXPECT_THROW(promise.getFuture().get(), std::runtime_error);
}

TEST_F(FutureTest, ASecondGetFutureThrowsAndTheFirstOneStillGetsItsValue) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  int calls = 0;
  future.then(nullptr, [&](auto&) { ++calls; });
  EXPECT_EQ(standardMisuse([&] { (void)promise.getFuture(); }), std::future_errc::future_already_retrieved);
  promise.setValue();
  EXPECT_EQ(calls, 1);
}

TEST_F(FutureTest, FulfillingTwiceThrowsAndTheCallbackRunsOnce) {
  Promise<Value> promise;
  Future<Value> future = promise.getFuture();
  int calls = 0;
  int seen = 0;
  future.then(nullptr, [&](std::future<Value>& value) {
    ++calls;
    seen = *value.get();
  });
  promise.setValue(std::make_unique<int>(1));
  EXPECT_EQ(standardMisuse([&] { promise.setValue(std::make_unique<int>(2)); }),
            std::future_errc::promise_already_satisfied);
  EXPECT_EQ(standardMisuse([&] { promise.setException(failure("late")); }),
            std::future_errc::promise_already_satisfied);
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(seen, 1);
}

TEST_F(FutureTest, APromiseThatDiesUnfulfilledBreaksForGet) {
  auto promise = std::make_unique<Promise<void>>();
  Future<void> future = promise->getFuture();
  promise.reset();
  EXPECT_EQ(standardMisuse([&] { future.get(); }), std::future_errc::broken_promise);
}

TEST_F(FutureTest, APromiseThatDiesUnfulfilledBreaksForAnInlineCallback) {
  auto promise = std::make_unique<Promise<Value>>();
  bool broken = false;
  promise->getFuture().then(nullptr, [&](std::future<Value>& value) { broken = isBrokenPromise(value); });
  EXPECT_FALSE(broken);
  promise.reset();
  EXPECT_TRUE(broken);
}

TEST_F(FutureTest, APromiseThatDiesUnfulfilledBreaksForACallbackOnAnExecutor) {
  auto promise = std::make_unique<Promise<void>>();
  bool broken = false;
  promise->getFuture().then(queue_, [&](std::future<void>& value) { broken = isBrokenPromise(value); });
  promise.reset();
  EXPECT_EQ(queue_->runAll(), 1U);
  EXPECT_TRUE(broken);
}

TEST_F(FutureTest, APromiseThatBrokeTakesACallbackLater) {
  auto promise = std::make_unique<Promise<void>>();
  Future<void> future = promise->getFuture();
  promise.reset();
  bool broken = false;
  future.then(nullptr, [&](std::future<void>& value) { broken = isBrokenPromise(value); });
  EXPECT_TRUE(broken);
}

TEST_F(FutureTest, APromiseThatDiesFulfilledLeavesItsValue) {
  auto promise = std::make_unique<Promise<void>>();
  Future<void> future = promise->getFuture();
  promise->setValue();
  promise.reset();
  EXPECT_NO_THROW(future.get());
}

TEST_F(FutureTest, AbandoningWithoutAFutureDoesNothing) {
  Promise<void> promise;
  promise.abandon();
  promise.setValue();
  EXPECT_NO_THROW(promise.getFuture().get());
}

TEST_F(FutureTest, AbandoningAFulfilledPromiseDoesNothing) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setValue();
  EXPECT_NO_THROW(promise.abandon());
  EXPECT_NO_THROW(future.get());
}

TEST_F(FutureTest, AbandoningBreaksThePromiseOnce) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  int calls = 0;
  future.then(nullptr, [&](auto&) { ++calls; });
  promise.abandon();
  promise.abandon();
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(standardMisuse([&] { promise.setValue(); }), std::future_errc::promise_already_satisfied);
}

// Lifetimes

TEST_F(FutureTest, TheStateGoesWithItsLastOwner) {
  auto promise = std::make_unique<Promise<void>>();
  auto future = std::make_unique<Future<void>>(promise->getFuture());
  auto copy = std::make_unique<Future<void>>(*future);
  auto token = std::make_shared<int>(0);
  const std::weak_ptr<int> kept = token;
  future->then(nullptr, [token = std::move(token)](auto&) {});
  promise->setValue();
  future.reset();
  EXPECT_FALSE(kept.expired());
  copy.reset();
  EXPECT_FALSE(kept.expired());
  promise.reset();
  EXPECT_TRUE(kept.expired());
}

TEST_F(FutureTest, AQueuedDeliveryKeepsStateAndExecutorAliveUntilItHasRun) {
  auto promise = std::make_unique<Promise<Value>>();
  int seen = 0;
  auto token = std::make_shared<int>(0);
  const std::weak_ptr<int> keptState = token;
  const std::weak_ptr<ManualExecutor> keptExecutor = queue_;
  promise->getFuture().then(queue_,
                            [&seen, token = std::move(token)](std::future<Value>& value) { seen = *value.get(); });
  promise->setValue(std::make_unique<int>(9));
  promise.reset();
  queue_.reset();
  ASSERT_FALSE(keptExecutor.expired());
  keptExecutor.lock()->runAll();
  EXPECT_EQ(seen, 9);
  EXPECT_TRUE(keptState.expired());
  EXPECT_TRUE(keptExecutor.expired());
}

TEST_F(FutureTest, ADroppedDeliveryFreesTheStateAndNeverRunsTheCallback) {
  Promise<void> promise;
  auto token = std::make_shared<int>(0);
  const std::weak_ptr<int> kept = token;
  bool ran = false;
  {
    Promise<void> inner;
    inner.getFuture().then(queue_, [&ran, token = std::move(token)](auto&) { ran = true; });
    inner.setValue();
  }
  EXPECT_FALSE(kept.expired());
  queue_->dropAll();
  EXPECT_TRUE(kept.expired());
  EXPECT_FALSE(ran);
}

TEST_F(FutureTest, AnInlineCallbackMayDestroyTheLastFuture) {
  auto future = std::make_unique<Future<void>>();
  {
    Promise<void> promise;
    *future = promise.getFuture();
    promise.setValue();
  }
  bool destroyed = false;
  future->then(nullptr, [&](std::future<void>&) {
    future.reset();
    destroyed = true;
  });
  EXPECT_TRUE(destroyed);
}

TEST_F(FutureTest, AnInlineCallbackMayDestroyItsFutureAsThePromiseIsFulfilled) {
  Promise<void> promise;
  auto future = std::make_unique<Future<void>>(promise.getFuture());
  future->then(nullptr, [&](std::future<void>&) { future.reset(); });
  promise.setValue();
  EXPECT_EQ(future, nullptr);
}

TEST_F(FutureTest, AnInlineCallbackMayDestroyThePromiseThatRunsIt) {
  auto promise = std::make_unique<Promise<void>>();
  promise->getFuture().then(nullptr, [&](std::future<void>& value) {
    value.get();
    promise.reset();
  });
  Promise<void>& fulfilled = *promise;
  fulfilled.setValue();
  EXPECT_EQ(promise, nullptr);
}

// Two threads, one state

TEST_F(FutureTest, OfTwoCopiesThatGetAtOnceOneHasTheValueAndTheOtherAFutureError) {
  for (int i = 0; i < kRaces; ++i) {
    Promise<void> promise;
    const Future<void> future = promise.getFuture();
    std::atomic<int> values{0};
    std::atomic<int> errors{0};
    test::runOnThreads(3, [&](std::size_t thread) {
      if (thread == 2) return promise.setValue();
      Future<void> copy = future;
      const auto answer = misuse([&] { copy.get(); });
      ++(answer == kAlreadyFetched ? errors : values);
    });
    ASSERT_EQ(values, 1);
    ASSERT_EQ(errors, 1);
  }
}

TEST_F(FutureTest, IsNotTakenBeforeTheValueHasCome) {
  std::promise<void> promise;
  const auto state = std::make_shared<detail::SharedFutureState<void>>();
  state->future = promise.get_future();
  Future<void> future(state);
  std::thread waiting([copy = future]() mutable { copy.get(); });
  while (state->mutex.try_lock()) {  // until it waits
    state->mutex.unlock();
    std::this_thread::yield();
  }
  EXPECT_NO_THROW(future.throwIfInvalid());
  promise.set_value();
  waiting.join();
  EXPECT_THROW(future.throwIfInvalid(), FutureError);
}

TEST_F(FutureTest, OfTwoCopiesThatSetACallbackAtOnceOneWins) {
  for (int i = 0; i < kRaces; ++i) {
    Promise<Value> promise;
    const Future<Value> future = promise.getFuture();
    std::atomic<int> delivered{0};
    std::atomic<int> errors{0};
    test::runOnThreads(3, [&](std::size_t thread) {
      if (thread == 2) return promise.setValue(std::make_unique<int>(1));
      Future<Value> copy = future;
      const auto answer =
          misuse([&] { copy.then(nullptr, [&](std::future<Value>& value) { delivered += *value.get(); }); });
      if (answer == kAlreadyFetched || answer == kCallbackAlreadySet) ++errors;
    });
    ASSERT_EQ(delivered, 1);
    ASSERT_EQ(errors, 1);
  }
}

TEST_F(FutureTest, OfAGetAndAThenAtOnceOneWins) {
  for (int i = 0; i < kRaces; ++i) {
    Promise<void> promise;
    const Future<void> future = promise.getFuture();
    std::atomic<int> values{0};
    std::atomic<int> errors{0};
    test::runOnThreads(3, [&](std::size_t thread) {
      Future<void> copy = future;
      std::pair<Code, string> answer;
      if (thread == 0) {
        answer = misuse([&] {
          copy.get();
          ++values;
        });
      } else if (thread == 1) {
        answer = misuse([&] {
          copy.then(nullptr, [&](std::future<void>& value) {
            value.get();
            ++values;
          });
        });
      } else {
        promise.setValue();
        return;
      }
      if (answer.first != static_cast<Code>(0)) ++errors;
    });
    ASSERT_EQ(values, 1);
    ASSERT_EQ(errors, 1);
  }
}

TEST_F(FutureTest, ACallbackSetWhileThePromiseIsFulfilledRunsExactlyOnce) {
  for (int i = 0; i < kRaces; ++i) {
    Promise<void> inlinePromise;
    Promise<void> queuedPromise;
    Future<void> inlineFuture = inlinePromise.getFuture();
    Future<void> queuedFuture = queuedPromise.getFuture();
    std::atomic<int> inlineCalls{0};
    std::atomic<int> queuedCalls{0};
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) {
        inlinePromise.setValue();
        queuedPromise.setValue();
      } else {
        inlineFuture.then(nullptr, [&](auto&) { ++inlineCalls; });
        queuedFuture.then(queue_, [&](auto&) { ++queuedCalls; });
      }
    });
    ASSERT_EQ(queue_->runAll(), 1U);
    ASSERT_EQ(inlineCalls, 1);
    ASSERT_EQ(queuedCalls, 1);
  }
}

TEST_F(FutureTest, AFutureMayBeUsedWhileItsCallbackTakesTheValueOnAnotherThread) {
  for (int i = 0; i < kRaces; ++i) {
    Promise<Value> promise;
    Future<Value> future = promise.getFuture();
    future.then(queue_, [&](std::future<Value>& value) {
      EXPECT_EQ(*value.get(), 3);
      EXPECT_EQ(misusesOf(future), (std::vector<std::pair<Code, string>>(2, kAlreadyFetched)));
    });
    promise.setValue(std::make_unique<int>(3));
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) {
        queue_->runAll();
        return;
      }
      const auto answers = misusesOf(future);
      EXPECT_TRUE(answers[0] == kNone || answers[0] == kAlreadyFetched) << answers[0].second;
      EXPECT_TRUE(answers[1] == kCallbackAlreadySet || answers[1] == kAlreadyFetched) << answers[1].second;
    });
  }
}

// dispatchTask

TEST_F(FutureTest, DispatchTaskRunsLaterOnTheExecutorAndFulfils) {
  bool ran = false;
  Future<void> future = dispatchTask<void>(queue_, [&] { ran = true; });
  EXPECT_FALSE(ran);
  EXPECT_EQ(queue_->runAll(), 1U);
  EXPECT_TRUE(ran);
  EXPECT_NO_THROW(future.get());
}

TEST_F(FutureTest, DispatchTaskRethrowsThatSameExceptionFromGet) {
  const auto thrown = failure("task");
  Future<void> future = dispatchTask<void>(queue_, [&] { std::rethrow_exception(thrown); });
  EXPECT_NO_THROW(queue_->runAll());
  try {
    future.get();
    FAIL();
  } catch (const std::runtime_error& error) {
    EXPECT_STREQ(error.what(), "task");
    EXPECT_EQ(std::current_exception(), thrown);
  }
}

TEST_F(FutureTest, DispatchTaskCarriesWhatIsNoStandardException) {
  Future<void> future = dispatchTask<void>(queue_, [] { throw string("odd"); });
  queue_->runAll();
  EXPECT_THROW(future.get(), string);
}

TEST_F(FutureTest, DispatchTaskThatIsDroppedBreaksItsPromise) {
  auto token = std::make_shared<int>(0);
  const std::weak_ptr<int> kept = token;
  Future<void> future = dispatchTask<void>(queue_, [token = std::move(token)] {});
  queue_->dropAll();
  EXPECT_TRUE(kept.expired());
  EXPECT_EQ(standardMisuse([&] { future.get(); }), std::future_errc::broken_promise);
}

TEST_F(FutureTest, DispatchTaskThatIsDroppedTellsTheCallback) {
  bool broken = false;
  dispatchTask<void>(queue_, [] {}).then(nullptr, [&](std::future<void>& value) { broken = isBrokenPromise(value); });
  queue_->dropAll();
  EXPECT_TRUE(broken);
}

TEST_F(FutureTest, DispatchTaskOnAnExecutorThatTakesNoneThrows) {
  queue_->throwOnDispatch(true);
  EXPECT_THROW(dispatchTask<void>(queue_, [] {}), std::runtime_error);
}

TEST_F(FutureTest, WhatAnInlineCallbackOfADispatchedTaskThrowsIsNotTheTasksFailure) {
  int calls = 0;
  dispatchTask<void>(queue_, [] {}).then(nullptr, [&](std::future<void>& value) {
    ++calls;
    value.get();
    throw std::runtime_error("callback");
  });
  EXPECT_THROW(queue_->runAll(), std::runtime_error);
  EXPECT_EQ(calls, 1);
}

TEST_F(FutureTest, DispatchTaskDeliversAValueThatOnlyMoves) {
  int seen = 0;
  dispatchTask<Value>(queue_, [] { return std::make_unique<int>(11); }).then(nullptr, [&](std::future<Value>& value) {
    seen = *value.get();
  });
  queue_->runAll();
  EXPECT_EQ(seen, 11);
}

TEST_F(FutureTest, DispatchTaskOfAValueCarriesItsException) {
  bool caught = false;
  dispatchTask<Value>(queue_, []() -> Value {
    throw std::runtime_error("task");
  }).then(nullptr, [&](std::future<Value>& value) {
    EXPECT_THROW(value.get(), std::runtime_error);
    caught = true;
  });
  queue_->runAll();
  EXPECT_TRUE(caught);
}

TEST_F(FutureTest, DispatchTaskFromManyThreadsLosesNothing) {
  constexpr int kTasks = 100;
  std::atomic<int> ran{0};
  std::atomic<int> fulfilled{0};
  test::runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < kTasks; ++i) {
      if (thread == 0) {
        queue_->runNext();
      } else {
        dispatchTask<void>(queue_, [&] { ++ran; }).then(nullptr, [&](auto&) { ++fulfilled; });
      }
    }
  });
  queue_->runAll();
  EXPECT_EQ(ran, 3 * kTasks);
  EXPECT_EQ(fulfilled, 3 * kTasks);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
