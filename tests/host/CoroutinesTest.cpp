#include "host/Coroutines.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstddef>
#include <exception>
#include <functional>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Future.h"
#include "PersistentKeyValueStore.h"
#include "host/Await.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::ManualExecutor;
using Value = std::unique_ptr<int>;
using Code = FutureError::Code;

// Says when the coroutine that holds it is gone.
using Token = std::shared_ptr<int>;
Token token() { return std::make_shared<int>(0); }

Future<int> plusOne(Future<int> number) { co_return co_await number + 1; }

Future<int> plusOneOn(std::shared_ptr<AsyncExecutor> executor, Future<int> number, Token held = nullptr) {
  const Token kept = std::move(held);
  co_return co_await resumeOn(number, executor) + 1;
}

Future<void> assign(Future<Value> from, Value& to) { to = co_await from; }

class Coroutines : public testing::Test {
 protected:
  void TearDown() override { queue_->dropAll(); }

  std::shared_ptr<ManualExecutor> queue_ = std::make_shared<ManualExecutor>();
};

bool isBroken(const Future<int>& future) {
  try {
    (void)await(future);
  } catch (const std::future_error& error) {
    return error.code() == std::future_errc::broken_promise;
  }
  return false;
}

// --- Values and errors ---

TEST_F(Coroutines, HaveTheValueThatTheyWaitFor) {
  Promise<int> promise;
  const Future<int> sum = plusOne(promise.getFuture());
  EXPECT_FALSE(sum.isReady());
  promise.setValue(41);
  EXPECT_TRUE(sum.isReady());
  EXPECT_EQ(await(sum), 42);
}

TEST_F(Coroutines, GoOnAtOnceWithAValueThatIsThere) {
  Promise<int> promise;
  promise.setValue(1);
  EXPECT_EQ(await(plusOne(promise.getFuture())), 2);
}

TEST_F(Coroutines, MoveValuesThatOnlyMove) {
  Promise<Value> promise;
  Value result;
  const Future<void> done = assign(promise.getFuture(), result);
  promise.setValue(std::make_unique<int>(3));
  EXPECT_NO_THROW(static_cast<void>(await(done)));
  EXPECT_EQ(*result, 3);
}

TEST_F(Coroutines, ReturnValuesThatOnlyMoveAndThoseThatConvert) {
  const auto make = [](int number) -> Future<Value> {
    if (number == 0) co_return nullptr;
    co_return std::make_unique<int>(number);
  };
  EXPECT_EQ(await(make(0)), nullptr);
  EXPECT_EQ(*await(make(5)), 5);
  const auto text = []() -> Future<std::string> { co_return "literal"; };
  EXPECT_EQ(await(text()), "literal");
}

TEST_F(Coroutines, MayCatchTheException) {
  const auto recover = [](Future<int> number) -> Future<int> {
    try {
      co_return co_await number;
    } catch (const std::runtime_error&) {
      co_return - 1;
    }
  };
  Promise<int> promise;
  const Future<int> result = recover(promise.getFuture());
  promise.setException(std::make_exception_ptr(std::runtime_error("no luck")));
  EXPECT_EQ(await(result), -1);
}

TEST_F(Coroutines, PassOnWhatTheyDoNotCatch) {
  Promise<int> promise;
  const Future<int> first = plusOne(promise.getFuture());
  promise.setException(std::make_exception_ptr(std::out_of_range("far away")));
  EXPECT_THROW((void)await(first), std::out_of_range);
  const auto fail = []() -> Future<void> {
    co_await std::suspend_never();
    throw std::runtime_error("thrown");
  };
  EXPECT_THROW(static_cast<void>(await(fail())), std::runtime_error);
  Future<int> broken;
  {
    Promise<int> dropped;
    broken = plusOne(dropped.getFuture());
  }
  EXPECT_TRUE(isBroken(broken));
}

TEST_F(Coroutines, FindOutAtOnceThatAFutureHasNoValueToGive) {
  const auto codeOf = [](Future<int> future, std::shared_ptr<AsyncExecutor> executor) -> Future<Code> {
    try {
      co_await resumeOn(future, executor);
    } catch (const FutureMisuseError& error) {
      co_return error.code();
    }
    throw std::logic_error("There was a value.");
  };
  Promise<int> promise;
  const Future<int> used = promise.getFuture();
  const Future<int> sum = plusOne(used);
  for (const std::shared_ptr<AsyncExecutor>& executor : {std::shared_ptr<AsyncExecutor>(), {queue_}}) {
    EXPECT_EQ(await(codeOf({}, executor)), Code::InvalidSharedState);
    EXPECT_EQ(await(codeOf(used, executor)), Code::CallbackAlreadySet);
  }
  promise.setValue(1);
  EXPECT_EQ(await(codeOf(used, nullptr)), Code::ValueAlreadyFetched);
  EXPECT_EQ(await(sum), 2);
}

TEST_F(Coroutines, AFutureMayNotBeAwaitedTwiceButDoesNotDeadlock) {
  const auto twice = [](Future<int> number) -> Future<int> { co_return co_await number + co_await number; };
  Promise<int> promise;
  const Future<int> sum = twice(promise.getFuture());
  promise.setValue(1);  // the second wait is under the lock of the first
  EXPECT_THROW((void)await(sum), FutureMisuseError);
}

TEST_F(Coroutines, WaitForEachOther) {
  Promise<int> promise;
  const Future<int> sum = plusOne(plusOne(plusOneOn(queue_, promise.getFuture())));
  promise.setValue(0);
  EXPECT_FALSE(sum.isReady());
  queue_->runAll();
  EXPECT_EQ(await(sum), 3);
}

TEST_F(Coroutines, MayLoopOverManyFuturesThatAreThere) {
  const auto sumUp = [](std::size_t count) -> Future<std::size_t> {
    std::size_t sum = 0;
    for (std::size_t i = 0; i < count; ++i) {
      Promise<std::size_t> promise;
      promise.setValue(i);
      sum += co_await promise.getFuture();
    }
    co_return sum;
  };
  constexpr std::size_t kMany = 100'000;  // too many to nest
  EXPECT_EQ(await(sumUp(kMany)), kMany * (kMany - 1) / 2);
}

// --- Executors ---

TEST_F(Coroutines, ResumeOnTheExecutorAlsoWithAValueThatIsThere) {
  Promise<int> promise;
  promise.setValue(1);
  const Future<int> sum = plusOneOn(queue_, promise.getFuture());
  EXPECT_FALSE(sum.isReady());
  EXPECT_EQ(queue_->runAll(), 1U);
  EXPECT_EQ(await(sum), 2);
}

TEST_F(Coroutines, ResumeOnAnExecutorThatRunsTasksAtOnce) {
  queue_->onDispatch = [this] { queue_->runAll(); };
  Promise<int> there;
  there.setValue(1);
  EXPECT_EQ(await(plusOneOn(queue_, there.getFuture())), 2);
  Promise<int> promise;
  const Future<int> sum = plusOneOn(queue_, promise.getFuture());
  promise.setValue(2);
  EXPECT_EQ(await(sum), 3);
  queue_->onDispatch = nullptr;
}

TEST_F(Coroutines, WithoutAnExecutorTheyResumeInline) {
  Promise<int> promise;
  const Future<int> sum = plusOneOn(nullptr, promise.getFuture());
  promise.setValue(1);
  EXPECT_EQ(await(sum), 2);
}

TEST_F(Coroutines, AreDestroyedWhenTheirResumptionIsDropped) {
  Promise<int> promise;
  const Future<int> source = promise.getFuture();
  Token held = token();
  const std::weak_ptr<int> watched = held;
  const Future<int> sum = plusOneOn(queue_, source, std::move(held));
  promise.setValue(1);
  EXPECT_FALSE(watched.expired());
  queue_->dropAll();
  EXPECT_TRUE(watched.expired());
  EXPECT_TRUE(isBroken(sum));
}

TEST_F(Coroutines, AreDestroyedThoughTheCallbackOfTheirFutureThrows) {
  const test::LogCapture log;
  Promise<int> promise;
  plusOneOn(queue_, promise.getFuture()).then([](std::future<int>& sum) { sum.get(); });
  promise.setValue(1);
  queue_->dropAll();
  EXPECT_EQ(log.errorCount(), 1U);
}

TEST_F(Coroutines, WaitingForOneThatIsDestroyedFailsWithItsBrokenPromise) {
  Promise<int> promise;
  const Future<int> sum = plusOne(plusOneOn(queue_, promise.getFuture()));
  promise.setValue(1);
  queue_->dropAll();
  EXPECT_TRUE(isBroken(sum));
}

TEST_F(Coroutines, AreDestroyedByAClosedQueue) {
  ThreadQueueFactory queues;
  const auto queue = queues.createQueue();
  queues.shutDown();
  Promise<int> there;
  there.setValue(1);
  Token held = token();
  const std::weak_ptr<int> watched = held;
  EXPECT_TRUE(isBroken(plusOneOn(queue, there.getFuture(), std::move(held))));
  EXPECT_TRUE(watched.expired());
  Promise<int> promise;
  const Future<int> sum = plusOneOn(queue, promise.getFuture());
  promise.setValue(1);
  EXPECT_TRUE(isBroken(sum));
}

TEST_F(Coroutines, AreDestroyedWhenTheExecutorThrows) {
  const test::LogCapture log;
  queue_->throwOnDispatch(true);
  Promise<int> there;
  there.setValue(1);
  Token held = token();
  const std::weak_ptr<int> watched = held;
  EXPECT_TRUE(isBroken(plusOneOn(queue_, there.getFuture(), std::move(held))));
  EXPECT_TRUE(watched.expired());
  Promise<int> promise;
  const Future<int> sum = plusOneOn(queue_, promise.getFuture());
  EXPECT_NO_THROW(promise.setValue(1));
  EXPECT_TRUE(isBroken(sum));
  const auto lines = test::KeyValueStoreFixture::errorLines(log);
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_EQ(lines[0].rfind("An executor has failed to run a coroutine: ", 0), 0U) << lines[0];
}

// --- The end ---

TEST_F(Coroutines, AreGoneWhenTheirFutureIsFulfilled) {
  Promise<int> promise;
  Token held = token();
  const std::weak_ptr<int> watched = held;
  const auto keep = [](Future<int> number, Token parameter) -> Future<int> {
    const Token variable = parameter;
    co_return co_await number;
  };
  Future<int> result = keep(promise.getFuture(), std::move(held));
  bool wasGone = false;
  result.then([&](std::future<int>&) { wasGone = watched.expired(); });
  promise.setValue(1);
  EXPECT_TRUE(wasGone);
}

TEST_F(Coroutines, FinishAlsoWhenNobodyKeepsTheirFuture) {
  Promise<Value> promise;
  Value result;
  assign(promise.getFuture(), result);
  promise.setValue(std::make_unique<int>(1));
  EXPECT_EQ(*result, 1);
}

TEST_F(Coroutines, WhatACallbackOfTheirFutureThrowsIsLogged) {
  const test::LogCapture log;
  Promise<int> promise;
  Future<int> sum = plusOne(promise.getFuture());
  sum.then([](std::future<int>&) { throw std::runtime_error("callback"); });
  EXPECT_NO_THROW(promise.setValue(1));
  EXPECT_EQ(test::KeyValueStoreFixture::errorLines(log),
            std::vector<std::string>{"A callback of a coroutine's future has thrown: callback"});
}

// --- Coroutines of other types ---

// A coroutine that is destroyed by its owner.
class Owned {
 public:
  struct promise_type {
    Owned get_return_object() { return Owned(std::coroutine_handle<promise_type>::from_promise(*this)); }
    std::suspend_never initial_suspend() const noexcept { return {}; }
    std::suspend_always final_suspend() const noexcept { return {}; }
    void return_void() const noexcept {}
    void unhandled_exception() { failure = std::current_exception(); }
    std::exception_ptr failure;
  };

  explicit Owned(std::coroutine_handle<promise_type> handle) : handle_(handle) {}
  Owned(Owned&& other) noexcept : handle_(std::exchange(other.handle_, nullptr)) {}
  Owned& operator=(Owned&&) = delete;
  ~Owned() {
    if (handle_) handle_.destroy();
  }

  bool isDone() const { return handle_.done(); }
  std::exception_ptr failure() const { return handle_.promise().failure; }

 private:
  std::coroutine_handle<promise_type> handle_;
};

Owned assignOn(std::shared_ptr<AsyncExecutor> executor, Future<int> from, int& to) {
  to = co_await resumeOn(from, executor);
}

TEST_F(Coroutines, OfAnotherTypeMayWaitToo) {
  Promise<int> promise;
  int result = 0;
  const Owned owned = assignOn(queue_, promise.getFuture(), result);
  promise.setValue(4);
  EXPECT_FALSE(owned.isDone());
  queue_->runAll();
  EXPECT_TRUE(owned.isDone());
  EXPECT_EQ(result, 4);
}

TEST_F(Coroutines, OfAnotherTypeFindABrokenPromiseWhenTheirResumptionIsDropped) {
  Promise<int> promise;
  int result = 0;
  const Owned owned = assignOn(queue_, promise.getFuture(), result);
  promise.setValue(4);
  queue_->dropAll();
  EXPECT_TRUE(owned.isDone());
  EXPECT_TRUE(test::isA<std::future_error>(owned.failure()));
  EXPECT_EQ(result, 0);
}

// One whose failure leaves whoever resumes it.
struct Throwing {
  struct promise_type {
    Throwing get_return_object() { return Throwing(std::coroutine_handle<promise_type>::from_promise(*this)); }
    std::suspend_never initial_suspend() noexcept { return {}; }
    std::suspend_always final_suspend() noexcept { return {}; }
    void return_void() {}
    void unhandled_exception() { throw; }
  };

  explicit Throwing(std::coroutine_handle<promise_type> handle) : coroutine(handle) {}
  Throwing(Throwing&& other) noexcept : coroutine(std::exchange(other.coroutine, nullptr)) {}
  Throwing& operator=(Throwing&&) = delete;
  ~Throwing() {
    if (coroutine != nullptr) coroutine.destroy();
  }

  std::coroutine_handle<promise_type> coroutine;
};

Throwing waitOn(std::shared_ptr<AsyncExecutor> executor, Future<int> from) { (void)co_await resumeOn(from, executor); }

TEST_F(Coroutines, WhatADroppedOneOfAnotherTypeThrowsIsOneErrorLine) {
  Promise<int> promise;
  const Throwing waiting = waitOn(queue_, promise.getFuture());
  promise.setValue(4);
  const test::LogCapture log;
  queue_->dropAll();
  ASSERT_EQ(log.messages().size(), 1U);
  EXPECT_EQ(log.messages().front().rfind("A coroutine that was dropped has thrown: ", 0), 0U);
}

// --- Stores and threads ---

using CoroutinesOfAStore = test::KeyValueStoreFixture;

Future<std::string> copy(std::shared_ptr<PersistentKeyValueStore> store, std::string from, std::string to) {
  const auto found = co_await store->fetch(from);
  if (found == nullptr) co_return "<miss>";
  co_await store->store(to, found->value);
  co_return test::textOf((co_await store->fetch(to))->value);
}

TEST_F(CoroutinesOfAStore, FetchAndStore) {
  open();
  put("one", "1");
  const Future<std::string> copied = copy(store, "one", "two");
  const Future<std::string> missed = copy(store, "three", "two");
  settle();
  EXPECT_EQ(await(copied), "1");
  EXPECT_EQ(await(missed), "<miss>");
}

TEST_F(CoroutinesOfAStore, HaveTheErrorsOfTheStore) {
  open();
  store->invalidateSoon();
  const Future<std::string> copied = copy(store, "one", "two");
  settle();
  EXPECT_THROW((void)await(copied), InvalidatedException);
}

TEST_F(Coroutines, RaceWithTheThreadThatBringsTheValue) {
  for (int round = 0; round < 300; ++round) {
    Promise<int> promise;
    const Future<int> source = promise.getFuture();
    Future<int> sum;
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) {
        promise.setValue(round);
      } else {
        sum = plusOne(source);
      }
    });
    ASSERT_EQ(await(sum), round + 1);
  }
}

TEST_F(Coroutines, GoFromQueueToQueue) {
  ThreadQueueFactory queues;
  const auto first = queues.createQueue();
  const auto second = queues.createWorkQueue();
  const auto wander = [](std::shared_ptr<AsyncExecutor> one, std::shared_ptr<AsyncExecutor> other) -> Future<int> {
    const auto caller = std::this_thread::get_id();
    int hops = 0;
    for (int i = 0; i < 200; ++i) {
      const auto there = co_await resumeOn(dispatchTask<std::thread::id>(one, std::this_thread::get_id), other);
      if (there != caller && std::this_thread::get_id() != caller) ++hops;
    }
    co_return hops;
  };
  EXPECT_EQ(await(wander(first, second)), 200);
}

TEST_F(Coroutines, RaceWithTheEndOfTheirQueue) {
  for (int round = 0; round < 50; ++round) {
    ThreadQueueFactory queues;
    const auto queue = queues.createQueue();
    std::vector<Future<int>> sums;
    const Token held = token();
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) return queues.shutDown();
      for (int i = 0; i < 20; ++i) {
        Promise<int> promise;
        sums.push_back(plusOneOn(queue, promise.getFuture(), held));
        promise.setValue(i);
      }
    });
    int ended = 0;
    for (int i = 0; i < 20; ++i) {
      try {
        ended += await(sums[static_cast<std::size_t>(i)]) == i + 1 ? 1 : 0;
      } catch (const std::future_error&) {
        ++ended;
      }
    }
    ASSERT_EQ(ended, 20);
    ASSERT_EQ(held.use_count(), 1);
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
