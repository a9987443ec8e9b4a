#include <gtest/gtest.h>

#include <cerrno>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>

#include "host/MemoryTierFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Got;
using test::hasNested;
using test::isA;
using test::kBroken;
using test::LogCapture;
using test::told;
using test::watch;
using test::Written;

// Each holds with values in memory and without.
class MemoryTierComputing : public test::MemoryTierFixture, public testing::WithParamInterface<std::size_t> {
 public:
  MemoryTierComputing() { openTier(GetParam()); }

  void finish(const std::string& value, std::size_t production = 0) {
    promises.at(production)->setValue(bytesOf(value));
    settle();
  }
};

INSTANTIATE_TEST_SUITE_P(Bounds, MemoryTierComputing, testing::Values(0, test::MemoryTierFixture::kRoomy),
                         [](const auto& bound) { return bound.param == 0 ? "WithoutMemory" : "WithMemory"; });

TEST_P(MemoryTierComputing, ComputesWhatIsMissingStoresItAndDoesNotComputeItAgain) {
  const Got got = watch(tier->fetchOrCompute("a", producing("made")));
  EXPECT_EQ(productions, 0);
  settle();
  EXPECT_EQ(told(got), "made");
  EXPECT_EQ(onDisk("a"), "made");
  const Got again = watch(tier->fetchOrCompute("a", producing("other")));
  settle();
  EXPECT_EQ(told(again), "made");
  EXPECT_EQ(productions, 1);
}

TEST_P(MemoryTierComputing, DoesNotComputeWhatTheStoreHas) {
  put("a", "stored");
  const Got got = watch(tier->fetchOrCompute("a", producing("made")));
  settle();
  EXPECT_EQ(told(got), "stored");
  EXPECT_EQ(productions, 0);
}

TEST_P(MemoryTierComputing, AllWhoAskMeanwhileShareOneRun) {
  const Got first = watch(tier->fetchOrCompute("a", producing()));
  const Got second = watch(tier->fetchOrCompute("a", producing()));  // before the store was asked
  settle();
  const Got third = watch(tier->fetchOrCompute("a", producing()));  // while the producer runs
  const Got another = watch(tier->fetchOrCompute("b", producing("b")));
  settle();
  EXPECT_EQ(told(another), "b");
  EXPECT_EQ(told(third), "<pending>");
  finish("made");
  EXPECT_EQ(told(first), "made");
  EXPECT_EQ(told(second), "made");
  EXPECT_EQ((*first->value).get(), (*third->value).get());
  EXPECT_EQ(productions, 2);
}

TEST_P(MemoryTierComputing, TheValueIsThereBeforeItIsStored) {
  const Got got = watch(tier->fetchOrCompute("a", producing()));
  settle();
  promises[0]->setValue(bytesOf("made"));
  EXPECT_EQ(told(got), "made");
  const Got again = watch(tier->fetchOrCompute("a", producing()));  // behind the value that is being stored
  settle();
  EXPECT_EQ(told(again), "made");
  EXPECT_EQ(productions, 1);
}

TEST_P(MemoryTierComputing, AFailureReachesAllIsNotStoredAndTheNextCallTriesAgain) {
  const Got first = watch(tier->fetchOrCompute("a", producing()));
  const Got second = watch(tier->fetchOrCompute("a", producing()));
  settle();
  promises[0]->setException(std::make_exception_ptr(std::runtime_error("offline")));
  EXPECT_EQ(told(first), "<error> offline");
  EXPECT_EQ(told(second), "<error> offline");
  settle();
  EXPECT_EQ(fetched("a"), "<miss>");
  const Got third = watch(tier->fetchOrCompute("a", producing("made")));
  settle();
  EXPECT_EQ(told(third), "made");
}

TEST_P(MemoryTierComputing, AProducerThatThrowsFailsTheCall) {
  const Got got = watch(
      tier->fetchOrCompute("a", []() -> Future<test::Bytes> { throw std::runtime_error("There is no network."); }));
  settle();
  EXPECT_EQ(told(got), "<error> There is no network.");
  EXPECT_EQ(fetched("a"), "<miss>");
}

TEST_P(MemoryTierComputing, AProducerWithoutAFutureOrNoneAtAllFailsTheCall) {
  const Got empty = watch(tier->fetchOrCompute("a", [] { return Future<test::Bytes>(); }));
  const Got none = watch(tier->fetchOrCompute("b", nullptr));
  settle();
  EXPECT_TRUE(isA<FutureError>(empty->failure));
  EXPECT_TRUE(isA<std::bad_function_call>(none->failure));
}

TEST_P(MemoryTierComputing, AProducerWhoseFutureHasACallbackAlreadyFailsTheCall) {
  Promise<test::Bytes> promise;
  const auto occupied = [&] {
    Future<test::Bytes> future = promise.getFuture();
    future.then(nullptr, [](std::future<test::Bytes>&) {});
    return future;
  };
  const Got got = watch(tier->fetchOrCompute("a", occupied));
  settle();
  EXPECT_TRUE(isA<FutureError>(got->failure));
  const Got again = watch(tier->fetchOrCompute("a", producing("made")));
  settle();
  EXPECT_EQ(told(again), "made");
}

TEST_P(MemoryTierComputing, WorkThatAQueueDropsIsABrokenPromiseForAllAndIsTriedAgain) {
  const auto queue = std::make_shared<test::ManualExecutor>();
  const auto onQueue = [queue] { return dispatchTask<test::Bytes>(queue, [] { return bytesOf("made"); }); };
  const Got first = watch(tier->fetchOrCompute("a", onQueue));
  const Got second = watch(tier->fetchOrCompute("a", onQueue));
  settle();
  queue->dropAll();
  EXPECT_EQ(told(first), kBroken);
  EXPECT_EQ(told(second), kBroken);
  const Got third = watch(tier->fetchOrCompute("a", onQueue));
  settle();
  queue->runAll();
  EXPECT_EQ(told(third), "made");
}

TEST_P(MemoryTierComputing, TheCallersHaveAValueThatCannotBeStored) {
  LogCapture log;
  const Got got = watch(tier->fetchOrCompute("a", producing()));
  settle();
  files->failNext(test::Operation::WriteFile, ENOSPC);
  finish("made");
  EXPECT_EQ(told(got), "made");
  EXPECT_TRUE(log.contains("The computed value of 'a' is not stored: "));
  EXPECT_EQ(inMemory("a"), "<miss>");
  EXPECT_EQ(fetched("a"), "<miss>");
}

TEST_P(MemoryTierComputing, AValueThatCannotBeReadIsComputedAgain) {
  LogCapture log;
  put("a", "stored");
  files->failNext(test::Operation::ReadFile, EIO);
  const Got got = watch(tier->fetchOrCompute("a", producing("made")));
  settle();
  EXPECT_EQ(told(got), "made");
  EXPECT_EQ(onDisk("a"), "made");
  EXPECT_TRUE(log.contains("The value of 'a' is computed again: "));
}

TEST_P(MemoryTierComputing, AStoreThatRefusesOrDropsTheFetchFailsTheCallWithoutARun) {
  const Got reserved = watch(tier->fetchOrCompute("manifest_v1.sqlite", producing("made")));
  settle();
  EXPECT_TRUE(hasNested<std::invalid_argument>(reserved->failure));
  EXPECT_EQ(told(reserved).rfind("<error> Store 'store', key 'manifest_v1.sqlite', " + store->path + ": ", 0), 0u);
  const Got dropped = watch(tier->fetchOrCompute("a", producing("made")));
  work().dropAll();
  EXPECT_EQ(told(dropped), kBroken);
  store->invalidateSoon();
  const Got invalid = watch(tier->fetchOrCompute("a", producing("made")));
  settle();
  EXPECT_TRUE(isA<InvalidatedException>(invalid->failure));
  EXPECT_EQ(productions, 0);
}

TEST_P(MemoryTierComputing, WhatIsStoredMeanwhileIsNotOverwritten) {
  const Got got = watch(tier->fetchOrCompute("a", producing()));
  settle();
  const Written written = watch(tier->store("a", bytesOf("newer")));
  const Got later = watch(tier->fetchOrCompute("a", producing()));
  settle();
  EXPECT_EQ(told(later), "newer");
  finish("older");
  EXPECT_EQ(told(got), "older");
  EXPECT_EQ(fetched("a"), "newer");
  EXPECT_EQ(onDisk("a"), "newer");
  EXPECT_EQ(productions, 1);
}

TEST_P(MemoryTierComputing, WhatIsRemovedMeanwhileStaysRemovedAndIsComputedAnew) {
  const Got before = watch(tier->fetchOrCompute("a", producing()));
  settle();
  const Written removed = watch(tier->remove("a"));
  const Got behind = watch(tier->fetchOrCompute("a", producing()));
  settle();
  EXPECT_EQ(productions, 2);
  finish("older");
  EXPECT_EQ(told(before), "older");
  EXPECT_EQ(told(behind), "<pending>");
  EXPECT_EQ(onDisk("a"), "<miss>");
  finish("newer", 1);
  EXPECT_EQ(told(behind), "newer");
  EXPECT_EQ(onDisk("a"), "newer");
}

TEST_P(MemoryTierComputing, WhatIsClearedMeanwhileStaysCleared) {
  const Got got = watch(tier->fetchOrCompute("a", producing()));
  settle();
  const Written cleared = watch(tier->clear());
  settle();
  finish("older");
  EXPECT_EQ(told(got), "older");
  EXPECT_EQ(fetched("a"), "<miss>");
}

TEST_P(MemoryTierComputing, AFetchDoesNotWaitForAProducer) {
  const Got computed = watch(tier->fetchOrCompute("a", producing()));
  settle();
  EXPECT_EQ(fetched("a"), "<miss>");
  finish("made");
  EXPECT_EQ(told(computed), "made");
}

TEST_P(MemoryTierComputing, AValueWhoseStoreIsInvalidatedMeanwhileReachesItsCallers) {
  const Got got = watch(tier->fetchOrCompute("a", producing()));
  settle();
  store->invalidateSoon();
  finish("made");
  EXPECT_EQ(told(got), "made");
  EXPECT_EQ(inMemory("a"), "<miss>");
}

TEST_P(MemoryTierComputing, ATierThatIsGoneLetsAProducerFinishAndStoresNothing) {
  const Got running = watch(tier->fetchOrCompute("a", producing()));
  settle();
  const Got fetching = watch(tier->fetchOrCompute("b", producing("b")));
  tier.reset();
  finish("made");
  EXPECT_EQ(told(running), "made");
  EXPECT_EQ(told(fetching), "b");
  EXPECT_EQ(onDisk("a"), "<miss>");
  EXPECT_EQ(onDisk("b"), "<miss>");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
