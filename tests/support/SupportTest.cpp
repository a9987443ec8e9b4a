#include <glog/logging.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "support/Barrier.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;
using testing::ElementsAre;

// LogCapture

TEST(LogCapture, RemembersTheLinesLoggedWhileItLives) {
  LOG(ERROR) << "before";
  const LogCapture capture;
  LOG(ERROR) << "an error " << 1;
  LOG(WARNING) << "a warning";
  EXPECT_THAT(capture.messages(), ElementsAre("an error 1", "a warning"));
  EXPECT_EQ(capture.errorCount(), 1U);
  EXPECT_EQ(capture.lines()[0].file, "SupportTest.cpp");
  EXPECT_EQ(capture.lines()[1].severity, google::GLOG_WARNING);
  EXPECT_TRUE(capture.contains("error 1"));
  EXPECT_FALSE(capture.contains("before"));
}

TEST(LogCapture, TwoMayListenAtOnceAndOneStops) {
  const LogCapture outer;
  {
    const LogCapture inner;
    LOG(ERROR) << "both";
    EXPECT_TRUE(inner.contains("both"));
  }
  LOG(ERROR) << "one";
  EXPECT_THAT(outer.messages(), ElementsAre("both", "one"));
}

// TemporaryDirectory

TEST(TemporaryDirectory, IsEmptyOfItsOwnAndGoneAtTheEnd) {
  string path;
  {
    const TemporaryDirectory one;
    const TemporaryDirectory two;
    EXPECT_NE(one.path(), two.path());
    EXPECT_TRUE(one.names().empty());
    one.write("a/b/c", "content");
    path = one.path();
    EXPECT_TRUE(std::filesystem::exists(path));
  }
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST(TemporaryDirectory, ReadsBackWhatItWrote) {
  const TemporaryDirectory directory;
  const string bytes("a\0\n\xff", 4);
  EXPECT_EQ(directory.write("deep/file", bytes), directory.file("deep/file"));
  EXPECT_EQ(directory.read("deep/file"), bytes);
  directory.makeDirectory("made/too");
  EXPECT_THAT(directory.names(), ElementsAre("deep", "made"));
  EXPECT_THAT(directory.names("deep"), ElementsAre("file"));
  EXPECT_TRUE(directory.exists("made/too"));
  EXPECT_FALSE(directory.exists("missing"));
  EXPECT_THROW(directory.read("missing"), std::runtime_error);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
