#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

#include "LarderException.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;
using testing::ElementsAre;

class FaultyFileUtilsTest : public testing::Test {
 protected:
  int codeOf(const std::function<void()>& operation) {
    try {
      operation();
      return 0;
    } catch (const FileUtilsIoException& exception) {
      return exception.code();
    }
  }

  TemporaryDirectory directory_;
  FaultyFileUtils files_;
};

TEST_F(FaultyFileUtilsTest, WorksLikeTheRealOneUntilToldOtherwise) {
  files_.createDirectory(directory_.file("a"), false);
  files_.writeFile(directory_.file("a/b"), {'x'});
  EXPECT_EQ(files_.readFile(directory_.file("a/b")), std::vector<unsigned char>{'x'});
  files_.rename(directory_.file("a/b"), directory_.file("a/c"));
  EXPECT_TRUE(files_.isDirectory(directory_.file("a")));
  EXPECT_EQ(files_.listDirectories(directory_.path()), std::vector<string>{"a"});
  EXPECT_EQ(files_.listDirectory(directory_.file("a")).size(), 1U);
  files_.createSymLink(directory_.file("link"), "a");
  EXPECT_TRUE(files_.isSymLink(directory_.file("link")));
  EXPECT_TRUE(files_.listOtherEntries(directory_.path()).empty());
  EXPECT_GT(files_.getDiskSpace(directory_.path()).total, 0);
  files_.deleteFile(directory_.file("link"));
  files_.recursiverDirectoryDelete(directory_.file("a"));
  EXPECT_TRUE(directory_.names().empty());
}

TEST_F(FaultyFileUtilsTest, FailsAsOftenAsTold) {
  files_.failNext(Operation::WriteFile, ENOSPC);
  files_.failNext(Operation::WriteFile, EIO);
  const auto write = [&] { files_.writeFile(directory_.file("file"), {}); };
  EXPECT_EQ(codeOf(write), ENOSPC);
  EXPECT_EQ(codeOf(write), EIO);
  EXPECT_FALSE(directory_.exists("file"));
  EXPECT_EQ(codeOf(write), 0);
  EXPECT_TRUE(directory_.exists("file"));
}

TEST_F(FaultyFileUtilsTest, FailsAlwaysOrOnOnePathUntilHealed) {
  files_.failAlways(Operation::ReadFile, EIO);
  files_.failPath(Operation::DeleteFile, directory_.file("a"), EBUSY);
  directory_.write("a", "");
  directory_.write("b", "");
  EXPECT_EQ(codeOf([&] { files_.readFile(directory_.file("a")); }), EIO);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), EBUSY);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), EBUSY);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("b")); }), 0);
  files_.heal();
  EXPECT_EQ(codeOf([&] { files_.readFile(directory_.file("a")); }), 0);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), 0);
}

TEST_F(FaultyFileUtilsTest, AFailingQueryAnswersFalse) {
  files_.failNext(Operation::PathExists, EACCES);
  files_.failNext(Operation::IsDirectory, EACCES);
  EXPECT_FALSE(files_.pathExists(directory_.path()));
  EXPECT_FALSE(files_.isDirectory(directory_.path()));
  EXPECT_TRUE(files_.pathExists(directory_.path()));
  EXPECT_TRUE(files_.isDirectory(directory_.path()));
}

TEST_F(FaultyFileUtilsTest, AFailingListOfOtherEntriesIsEmpty) {
  ASSERT_EQ(mkfifo(directory_.file("fifo").c_str(), 0600), 0);
  files_.failNext(Operation::ListOtherEntries, EIO);
  EXPECT_TRUE(files_.listOtherEntries(directory_.path()).empty());
  EXPECT_THAT(files_.listOtherEntries(directory_.path()), ElementsAre(directory_.file("fifo")));
  EXPECT_THAT(files_.trace(), testing::Each("listOtherEntries " + directory_.path()));
}

TEST_F(FaultyFileUtilsTest, ATornWriteLeavesItsBeginning) {
  files_.tearNextWrite(2, ENOSPC);
  EXPECT_EQ(codeOf([&] { files_.writeFile(directory_.file("file"), {'a', 'b', 'c'}); }), ENOSPC);
  EXPECT_EQ(directory_.read("file"), "ab");
  EXPECT_EQ(codeOf([&] { files_.writeFile(directory_.file("file"), {'a', 'b', 'c'}); }), 0);
  EXPECT_EQ(directory_.read("file"), "abc");
}

TEST_F(FaultyFileUtilsTest, RecordsEveryCall) {
  files_.failNext(Operation::Rename, EIO);
  EXPECT_EQ(codeOf([&] { files_.rename("/a", "/b"); }), EIO);
  files_.pathExists("/c");
  EXPECT_THAT(files_.trace(), ElementsAre("rename /a /b", "pathExists /c"));
  EXPECT_EQ(files_.calls(Operation::Rename), 1U);
  EXPECT_EQ(files_.calls(Operation::ReadFile), 0U);
  files_.clearTrace();
  EXPECT_TRUE(files_.trace().empty());
}

TEST_F(FaultyFileUtilsTest, TheHookComesBeforeTheFailureAndMayArmIt) {
  std::vector<string> seen;
  files_.onCall = [&](Operation operation, const string& path) {
    seen.push_back(path);
    if (operation == Operation::ReadFile) files_.failNext(Operation::ReadFile, EIO);
  };
  EXPECT_EQ(codeOf([&] { files_.readFile("/missing"); }), EIO);
  EXPECT_THAT(seen, ElementsAre("/missing"));
}

TEST_F(FaultyFileUtilsTest, FailsTheNthCallWhateverItIsAndNoOther) {
  directory_.write("a", "");
  files_.failNth(3, EIO);
  EXPECT_TRUE(files_.pathExists(directory_.file("a")));
  EXPECT_EQ(codeOf([&] { files_.readFile(directory_.file("a")); }), 0);
  EXPECT_EQ(files_.failures(), 0U);
  EXPECT_FALSE(files_.pathExists(directory_.file("a")));
  EXPECT_EQ(files_.failures(), 1U);
  EXPECT_TRUE(files_.pathExists(directory_.file("a")));
  files_.failNth(1, EACCES);
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), EACCES);
  files_.failNth(1, EACCES);
  files_.heal();
  EXPECT_EQ(codeOf([&] { files_.deleteFile(directory_.file("a")); }), 0);
  EXPECT_EQ(files_.failures(), 2U);
}

TEST_F(FaultyFileUtilsTest, AFailingWriteLeavesHalfWhenItIsToldTo) {
  files_.tearFailingWrites(true);
  files_.failNext(Operation::WriteFile, ENOSPC);
  EXPECT_EQ(codeOf([&] { files_.writeFile(directory_.file("file"), {'a', 'b', 'c', 'd'}); }), ENOSPC);
  EXPECT_EQ(directory_.read("file"), "ab");
  files_.tearFailingWrites(false);
  files_.failNext(Operation::WriteFile, ENOSPC);
  EXPECT_EQ(codeOf([&] { files_.writeFile(directory_.file("other"), {'a'}); }), ENOSPC);
  EXPECT_FALSE(directory_.exists("other"));
  EXPECT_EQ(files_.failures(), 2U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
