#include "host/Await.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstddef>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>

#include "Future.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::Latch;
using test::Watchdog;

constexpr unsigned int kLongEnough = 60;  // seconds, for whatever does not hang

template <class Operation> FutureError::Code codeOf(Operation operation) {
  try {
    operation();
  } catch (const FutureMisuseError& error) {
    return error.code();
  }
  throw std::logic_error("Awaiting worked.");
}

FutureError::Code codeOfAwaiting(const Future<void>& future) {
  return codeOf([&] { await(future); });
}

TEST(Await, ReturnsAValueThatIsThereAlready) {
  Promise<std::unique_ptr<std::string>> promise;
  Future<std::unique_ptr<std::string>> future = promise.getFuture();
  promise.setValue(std::make_unique<std::string>("value"));
  EXPECT_EQ(*await(std::move(future)), "value");
}

TEST(Await, ReturnsANullValueAsSuch) {
  Promise<std::unique_ptr<std::string>> promise;
  promise.setValue(nullptr);
  EXPECT_EQ(await(promise.getFuture()), nullptr);
}

TEST(Await, BlocksUntilTheValueComes) {
  ThreadQueueFactory queues;
  const auto queue = queues.createQueue();
  Latch gate(1);
  const Future<std::unique_ptr<int>> future = dispatchTask<std::unique_ptr<int>>(queue, [&] {
    gate.wait();
    return std::make_unique<int>(42);
  });
  std::thread opener([&] { gate.countDown(); });
  EXPECT_EQ(*await(future), 42);
  opener.join();
}

TEST(Await, WaitsForWorkWithoutAResult) {
  ThreadQueueFactory queues;
  bool ran = false;
  await(dispatchTask<void>(queues.createQueue(), [&] { ran = true; }));
  EXPECT_TRUE(ran);
}

TEST(Await, RethrowsTheStoredException) {
  ThreadQueueFactory queues;
  const auto queue = queues.createQueue();
  try {
    await(dispatchTask<void>(queue, [] { throw std::runtime_error("no luck"); }));
    FAIL() << "The task has failed.";
  } catch (const std::runtime_error& error) {
    // The thread sanitizer does not see how the standard library counts the holders of an exception: let the queue go
    // first.
    EXPECT_TRUE(queues.drain(std::chrono::hours(1)));
    EXPECT_STREQ(error.what(), "no luck");
  }
}

TEST(Await, RethrowsTheExceptionOfAValueToo) {
  Promise<std::unique_ptr<int>> promise;
  promise.setException(std::make_exception_ptr(std::out_of_range("far away")));
  EXPECT_THROW(static_cast<void>(await(promise.getFuture())), std::out_of_range);
}

TEST(Await, ThrowsABrokenPromiseWhenTheWorkWasDropped) {
  Future<void> future;
  {
    Promise<void> promise;
    future = promise.getFuture();
  }
  try {
    await(future);
    FAIL() << "There is no value.";
  } catch (const std::future_error& error) {
    EXPECT_EQ(error.code(), std::future_errc::broken_promise);
  }
}

TEST(Await, ThrowsABrokenPromiseWhenTheQueueIsClosed) {
  ThreadQueueFactory queues;
  const auto queue = queues.createQueue();
  queues.shutDown();
  EXPECT_THROW(static_cast<void>(await(dispatchTask<void>(queue, [] {}))), std::future_error);
}

TEST(Await, RefusesAnEmptyFuture) { EXPECT_EQ(codeOfAwaiting({}), FutureError::Code::InvalidSharedState); }

TEST(Await, RefusesAFutureWhoseValueWasTaken) {
  Promise<void> promise;
  const Future<void> future = promise.getFuture();
  promise.setValue();
  await(future);
  EXPECT_EQ(codeOfAwaiting(future), FutureError::Code::ValueAlreadyFetched);
}

TEST(Await, RefusesAFutureThatHasACallback) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  future.then(nullptr, [](std::future<void>&) {});
  EXPECT_EQ(codeOfAwaiting(future), FutureError::Code::CallbackAlreadySet);
}

TEST(Await, SaysWhatToDoAboutAFutureThatHasNoValueToGive) {
  Promise<int> promise;
  const Future<int> future = promise.getFuture();
  promise.setValue(1);
  EXPECT_EQ(await(future), 1);
  try {
    (void)await(future);
    FAIL() << "There is no second value.";
  } catch (const FutureError& error) {
    EXPECT_STREQ(error.what(), FutureMisuseError(FutureError::Code::ValueAlreadyFetched).what());
  }
}

// --- With a timeout ---

using std::chrono::milliseconds;

TEST(Await, ATimeoutThatIsNotReachedChangesNothing) {
  ThreadQueueFactory queues;
  const auto queue = queues.createQueue();
  for (const milliseconds timeout : {milliseconds(std::chrono::hours(24 * 365)), milliseconds::max()}) {
    EXPECT_EQ(await(dispatchTask<int>(queue, [] { return 42; }), timeout), 42);
  }
  EXPECT_EQ(await(dispatchTask<int>(queue, [] { return 42; }), std::chrono::seconds::max()), 42);
  EXPECT_EQ(await(dispatchTask<int>(queue, [] { return 42; }), std::chrono::hours::max()), 42);
  EXPECT_NO_THROW(static_cast<void>(await(dispatchTask<void>(queue, [] {}), std::chrono::minutes(10))));
  EXPECT_THROW(static_cast<void>(await(dispatchTask<void>(queue, [] { throw std::out_of_range("far away"); }),
                                       std::chrono::minutes(10))),
               std::out_of_range);
}

TEST(Await, ATimeoutOfNothingTakesWhatIsThereOnly) {
  for (const milliseconds timeout : {milliseconds(0), milliseconds(-1), milliseconds::min()}) {
    Promise<int> there;
    there.setValue(7);
    EXPECT_EQ(await(there.getFuture(), timeout), 7);
    Promise<int> missing;
    EXPECT_THROW(static_cast<void>((void)await(missing.getFuture(), timeout)), TimeoutError);
  }
}

TEST(Await, ATimeoutIsReportedWithItsLength) {
  Promise<void> promise;
  const auto began = std::chrono::steady_clock::now();
  try {
    await(promise.getFuture(), milliseconds(20));
    FAIL() << "There is no value.";
  } catch (const std::runtime_error& error) {
    EXPECT_STREQ(error.what(), "The future had no value after 20 ms.");
  }
  EXPECT_GE(std::chrono::steady_clock::now() - began, milliseconds(20));
}

TEST(Await, AValueThatComesTooLateIsDestroyedAtOnce) {
  Promise<std::shared_ptr<int>> promise;
  const auto future = promise.getFuture();
  EXPECT_THROW((void)await(future, milliseconds(0)), TimeoutError);
  EXPECT_EQ(codeOf([&] { (void)await(future); }), FutureError::Code::CallbackAlreadySet);
  auto value = std::make_shared<int>(0);
  const std::weak_ptr<int> watched = value;
  promise.setValue(std::move(value));
  EXPECT_TRUE(watched.expired());
  EXPECT_EQ(codeOf([&] { (void)await(future); }), FutureError::Code::ValueAlreadyFetched);
}

TEST(Await, ABrokenPromiseIsNotWaitedFor) {
  const auto queue = std::make_shared<test::ManualExecutor>();
  const Future<void> future = dispatchTask<void>(queue, [] {});
  queue->dropAll();
  EXPECT_THROW(static_cast<void>(await(future, std::chrono::hours(1))), std::future_error);
}

TEST(Await, WithATimeoutIsRefusedOnAThreadOfTheKitToo) {
  ThreadQueueFactory queues;
  const auto wait = [] { await(Promise<void>().getFuture(), milliseconds(0)); };
  EXPECT_THROW(dispatchTask<void>(queues.createQueue(), wait).get(), std::logic_error);
}

TEST(Await, AValueAndTheEndOfTheTimeMayMeet) {
  for (int round = 0; round < 100; ++round) {
    Promise<std::unique_ptr<int>> promise;
    const auto future = promise.getFuture();
    int outcomes = 0;
    test::runOnThreads(2, [&](std::size_t thread) {
      if (thread == 0) return promise.setValue(std::make_unique<int>(round));
      try {
        outcomes += *await(future, milliseconds(round % 2)) == round ? 1 : 0;
      } catch (const TimeoutError&) {
        ++outcomes;
      }
    });
    ASSERT_EQ(outcomes, 1);
  }
}

// --- How it waits ---

// Each on a thread of its own, as a thread remembers its last wait.
TEST(AwaitLookout, BeginsWhenTheLastWaitWasShortAndEnds) {
  const Watchdog watchdog(kLongEnough);
  std::thread([] {
    EXPECT_FALSE(detail::Lookout().goesOn());
    bool hasBegun = false;
    while (!hasBegun) {  // the processor may have been busy otherwise
      { const detail::Lookout brief; }
      const detail::Lookout next;
      hasBegun = next.goesOn();
      while (next.goesOn()) std::this_thread::yield();
    }
    EXPECT_FALSE(detail::Lookout().goesOn());  // that one took its time
  }).join();
}

TEST(AwaitLookout, IsOneOfItsThreadAlone) {
  { const detail::Lookout brief; }
  std::thread([] { EXPECT_FALSE(detail::Lookout().goesOn()); }).join();
}

// --- Where it is refused ---

TEST(Await, IsRefusedOnAThreadOfTheKitAndLeavesTheFutureAlone) {
  ThreadQueueFactory queues;
  const auto queue = queues.createQueue();
  Promise<void> promise;
  const Future<void> future = promise.getFuture();
  std::string refusal;
  dispatchTask<void>(queue, [&] {
    try {
      await(future);
    } catch (const std::logic_error& error) {
      refusal = error.what();
    }
  }).get();
  EXPECT_EQ(refusal, "await may deadlock on a thread of the host kit's queues. Use Future::then instead.");
  promise.setValue();
  await(future);
}

TEST(Await, IsRefusedOnAThreadOfTheKitAlsoWhenTheValueIsThere) {
  ThreadQueueFactory queues;
  Promise<void> promise;
  const Future<void> future = promise.getFuture();
  promise.setValue();
  EXPECT_THROW(dispatchTask<void>(queues.createQueue(), [&] { await(future); }).get(), std::logic_error);
  await(future);
}

TEST(Await, IsRefusedOnAThreadOfAnotherFactoryToo) {
  ThreadQueueFactory queues;
  ThreadQueueFactory others;
  const auto other = others.createQueue();
  const auto work = [&] { await(dispatchTask<void>(other, [] {})); };
  EXPECT_THROW(dispatchTask<void>(queues.createQueue(), work).get(), std::logic_error);
}

TEST(Await, ManyThreadsMayAwaitTheirOwnResults) {
  ThreadQueueFactory queues;
  const auto queue = queues.createWorkQueue();
  test::runOnThreads(4, [&](std::size_t thread) {
    for (std::size_t i = 0; i < 100; ++i) {
      const std::size_t number = thread * 100 + i;
      const auto result = await(
          dispatchTask<std::unique_ptr<std::size_t>>(queue, [=] { return std::make_unique<std::size_t>(number); }));
      EXPECT_EQ(*result, number);
    }
  });
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
