#include "host/QueueThreadMark.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "host/ThreadQueueFactory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using testing::ElementsAre;

TEST(QueueThreadMark, RefusesWhatWaitsAsLongAsItExists) {
  {
    const QueueThreadMark mark;
    try {
      ThreadQueueFactory::refuseOnQueueThread("operation", "Do not.");
      FAIL() << "It is not refused.";
    } catch (const std::logic_error& error) {
      EXPECT_STREQ(error.what(), "operation may deadlock in a task of a queue. Do not.");
    }
    std::thread([] { ThreadQueueFactory::refuseOnQueueThread("operation", "Do not."); }).join();
  }
  ThreadQueueFactory::refuseOnQueueThread("operation", "Do not.");
}

TEST(QueueThreadMark, TellsTheInnermostOne) {
  std::vector<std::string> told;
  const QueueThreadMark outer([&](const std::string& operation) { told.push_back("outer " + operation); });
  {
    const QueueThreadMark inner([&](const std::string& operation) { told.push_back("inner " + operation); });
    EXPECT_TRUE(QueueThreadMark::tell("a"));
  }
  EXPECT_TRUE(QueueThreadMark::tell("b"));
  EXPECT_THAT(told, ElementsAre("inner a", "outer b"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
