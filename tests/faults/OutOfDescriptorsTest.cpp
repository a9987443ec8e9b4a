// The scripted workload in a process that has no descriptor left for a while.

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <cstddef>
#include <string>

#include "faults/ScriptedWorkload.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

// While it runs, this process can open nothing. What is open stays open.
class NoDescriptors {
 public:
  NoDescriptors() {
    EXPECT_EQ(::getrlimit(RLIMIT_NOFILE, &before_), 0);
    const rlimit none = {0, before_.rlim_max};
    EXPECT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  }
  NoDescriptors(const NoDescriptors&) = delete;
  NoDescriptors& operator=(const NoDescriptors&) = delete;
  ~NoDescriptors() { EXPECT_EQ(::setrlimit(RLIMIT_NOFILE, &before_), 0); }

 private:
  rlimit before_{};
};

// The sanitizers need descriptors of their own to look at memory.
#if defined(CELLAR_SANITIZES_ADDRESSES)
constexpr bool kCanGoWithoutDescriptors = false;
#else
constexpr bool kCanGoWithoutDescriptors = true;
#endif

// None before each step in turn, for as many steps.
void liveWithoutDescriptors(std::size_t length) {
  if (!kCanGoWithoutDescriptors) GTEST_SKIP();
  for (std::size_t first = 0; first < ScriptedWorkload::stepCount() && !testing::Test::HasFailure(); ++first) {
    const testing::ScopedTrace trace(__FILE__, __LINE__, "none from step " + std::to_string(first));
    const Watchdog watchdog(60);
    const TemporaryDirectory directory(quickPlace());
    ScriptedWorkload workload(directory.path(), ScriptedWorkload::FaultMode::OneFault);
    for (std::size_t step = 0; step < ScriptedWorkload::stepCount() && !testing::Test::HasFailure(); ++step) {
      workload.isInTrouble = step >= first && step < first + length;
      if (workload.isInTrouble) {
        const NoDescriptors none;
        workload.step(step);
      } else {
        workload.step(step);
      }
    }
    workload.isInTrouble = false;
    if (!testing::Test::HasFailure()) workload.verify();
    EXPECT_EQ(workload.discards(), 0U);
  }
}

TEST(OutOfDescriptors, ForAnyStepCostsNoStore) { liveWithoutDescriptors(1); }

TEST(OutOfDescriptors, ForAnyThreeStepsCostsNoStore) { liveWithoutDescriptors(3); }

TEST(OutOfDescriptors, FromAnyStepToTheEndCostsNoStore) { liveWithoutDescriptors(ScriptedWorkload::stepCount()); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
