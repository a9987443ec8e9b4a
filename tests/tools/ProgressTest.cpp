#include "Progress.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <sstream>
#include <string>

#include "Console.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::EndsWith;
using testing::HasSubstr;

constexpr std::chrono::milliseconds kNone(0);

// What is written while something goes up to a part.
std::string written(bool isTerminal, std::chrono::milliseconds patience, std::uint64_t part, std::uint64_t whole) {
  std::ostringstream out;
  Console console(out, isTerminal, false);
  {
    Progress progress(console, "reading", patience);
    for (std::uint64_t i = 1; i <= part; ++i) progress.advanceTo(i, whole);
  }
  return out.str();
}

TEST(Progress, DrawsABarOnATerminalAndWipesItAway) {
  const std::string bar = written(true, kNone, 64, 256);
  EXPECT_THAT(bar, HasSubstr("[#######.......................] reading, 25 %"));
  EXPECT_THAT(bar, EndsWith("\r\x1b[2K"));
}

TEST(Progress, CountsWhenTheWholeIsNotKnown) { EXPECT_THAT(written(true, kNone, 64, 0), HasSubstr("reading: 64")); }

TEST(Progress, DrawsNothingBeforePatienceIsOver) { EXPECT_EQ(written(true, std::chrono::hours(1), 5000, 5000), ""); }

TEST(Progress, DrawsNothingWhereThereIsNoTerminal) { EXPECT_EQ(written(false, kNone, 5000, 5000), ""); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
