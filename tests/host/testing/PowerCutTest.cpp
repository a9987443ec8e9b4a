#include "host/testing/PowerCut.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "LarderException.h"
#include "support/PowerCutFixture.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;
using testing::Contains;
using testing::Each;
using testing::ElementsAre;
using testing::IsSupersetOf;
using testing::Not;

class PowerCutTest : public PowerCutFixture {};

TEST_F(PowerCutTest, KeepsWhatWasThereAtTheBeginning) {
  const TemporaryDirectory directory;
  directory.write("a/b", "old");
  std::filesystem::create_symlink("a", directory.file("link"));
  const PowerCut powerCut(directory.path());
  for (std::uint32_t seed = 0; seed < 20; ++seed) {
    const TemporaryDirectory other;
    powerCut.cutInto(other.path(), seed);
    EXPECT_EQ(treeOf(other), (Tree{{"a", ""}, {"a/b", "old"}, {"link", "-> a"}}));
  }
}

TEST_F(PowerCutTest, KeepsASyncedFileInASyncedDirectoryWhole) {
  writeSynced("file", string(3000, 'x'));
  EXPECT_THAT(allRemains(), ElementsAre(Tree{{"file", string(3000, 'x')}}));
}

TEST_F(PowerCutTest, LosesTearsOrKeepsAnOverwriteThatWasNotSynced) {
  writeSynced("file", string(2000, 'o'));
  write("file", string(3000, 'n'));
  const auto contents = contentsAfter("file", 300);
  EXPECT_THAT(contents, IsSupersetOf({"o2000", "n3000"}));
  EXPECT_THAT(contents, Contains(""));                                                      // emptied, not yet written
  EXPECT_THAT(contents, Contains(".3000"));                                                 // the size without the data
  EXPECT_THAT(contents, Contains(testing::MatchesRegex("n[0-9]+")).Times(testing::Gt(2)));  // a beginning
  EXPECT_THAT(contents, Contains(testing::ContainsRegex("n[0-9]+ o")));                     // over the old content
  EXPECT_THAT(contents, Contains(testing::ContainsRegex("[.][0-9]+ n")));  // a sector without the one before
  EXPECT_THAT(contents, Not(Contains("-")));
}

TEST_F(PowerCutTest, LosesTearsOrKeepsANewFileThatWasNotSynced) {
  files_->createFile(path("file"), bytesOf("abcdefgh"));
  const auto contents = contentsAfter("file", 300);
  EXPECT_THAT(contents, IsSupersetOf({"-", "", "abcdefgh", "abc", "........"}));
}

TEST_F(PowerCutTest, KeepsTheNameOfANewFileWithoutItsContent) {
  write("file", "abcdefgh");
  syncDirectory();
  const auto contents = contentsAfter("file");
  EXPECT_THAT(contents, Contains(""));
  EXPECT_THAT(contents, Not(Contains("-")));
}

TEST_F(PowerCutTest, ReordersWritesToDifferentFiles) {
  writeSynced("a", "1");
  writeSynced("b", "1");
  write("a", "2");
  write("b", "2");
  const auto all = allRemains();
  EXPECT_THAT(all, Contains(Tree{{"a", "1"}, {"b", "2"}}));
  EXPECT_THAT(all, Contains(Tree{{"a", "2"}, {"b", "1"}}));
}

TEST_F(PowerCutTest, ReordersWritesToOneFileButNeverThoseToOneSector) {
  writeSynced("file", "");
  const auto append = [&](const string& text) {
    std::ofstream(path("file"), std::ios::app | std::ios::binary) << text;
    files_->rename(path("file"), path("file"));  // looks at it
  };
  append(string(512, 'a'));
  append(string(100, 'b'));
  append(string(100, 'c'));
  const auto contents = contentsAfter("file", 150);
  EXPECT_THAT(contents, Contains(".512 b100"));
  EXPECT_THAT(contents, Not(Contains(testing::AllOf(testing::HasSubstr("c100"), Not(testing::HasSubstr("b"))))));
}

TEST_F(PowerCutTest, TakesWhatOthersHaveWrittenForUnsyncedUntilItIsSynced) {
  writeSynced("file", "old");
  life_.write("file", "new content");
  EXPECT_THAT(contentsAfter("file", 300), IsSupersetOf({"old", "new content", "new"}));
  sync("file");
  EXPECT_THAT(contentsAfter("file"), ElementsAre("new content"));

  life_.write("other", "content");
  EXPECT_THAT(contentsAfter("other"), IsSupersetOf({"-", "", "content"}));
  sync("other");
  EXPECT_THAT(contentsAfter("other"), ElementsAre("-", "content"));
  syncDirectory();
  EXPECT_THAT(contentsAfter("other"), ElementsAre("content"));
}

TEST_F(PowerCutTest, KeepsTheSyncedBeginningOfAFileThatOthersAddTo) {
  writeSynced("file", "begin");
  std::ofstream(path("file"), std::ios::app) << "end";
  const auto contents = contentsAfter("file");
  EXPECT_THAT(contents, Contains("begin"));
  EXPECT_THAT(contents, Contains("beginend"));
  EXPECT_THAT(contents, Each(testing::StartsWith("begin")));
}

TEST_F(PowerCutTest, FollowsLinksToWhatTheyLeadTo) {
  writeSynced("file", "old");
  files_->createSymLink(path("link"), path("file"));
  syncDirectory();
  files_->writeFile(path("link"), bytesOf("new"));
  sync("link");
  const TemporaryDirectory other;
  powerCut_.cutInto(other.path(), 1);
  EXPECT_EQ(treeOf(other), (Tree{{"file", "new"}, {"link", "-> " + other.file("file")}}));
}

TEST_F(PowerCutTest, LeavesTheSameForTheSameSeed) {
  for (int i = 0; i < 10; ++i) write(std::to_string(i), string(2000, 'x'));
  EXPECT_EQ(remains(7), remains(7));
  EXPECT_GT(allRemains().size(), kCuts / 2);
}

TEST_F(PowerCutTest, DoesNotDisturbWhatIsRunning) {
  write("file", "content");
  const Tree before = treeOf(life_);
  (void)remains(1);
  EXPECT_EQ(treeOf(life_), before);
  sync("file");
  syncDirectory();
  EXPECT_EQ(remains(1), before);
}

TEST_F(PowerCutTest, CutsAnywhereButIntoTheDirectoryItselfOrIntoAFullOne) {
  const TemporaryDirectory other;
  EXPECT_THROW(powerCut_.cutInto(life_.path(), 1), std::invalid_argument);
  EXPECT_THROW(powerCut_.cutInto(path("a/b"), 1), std::invalid_argument);
  EXPECT_FALSE(life_.exists("a"));
  writeSynced("file", "content");
  powerCut_.cutInto(other.file("a/b"), 1);
  EXPECT_EQ(other.read("a/b/file"), "content");
  EXPECT_THROW(powerCut_.cutInto(other.path(), 1), std::invalid_argument);
  EXPECT_THROW(PowerCut(other.file("missing")), FileUtilsIoException);
}

TEST_F(PowerCutTest, FailsAsTheSystemDoesAndForgetsNothing) {
  writeSynced("file", "content");
  EXPECT_THROW(files_->createFile(path("file"), {}), FileUtilsIoException);
  EXPECT_THROW(files_->rename(path("missing"), path("file")), FileUtilsIoException);
  EXPECT_THROW(files_->createDirectory(path("file"), false), FileUtilsIoException);
  EXPECT_THROW(files_->deleteFile(path("missing")), FileUtilsIoException);
  try {
    sync("missing");
    FAIL();
  } catch (const FileUtilsIoException& error) {
    EXPECT_EQ(error.code(), ENOENT);
  }
  EXPECT_THAT(allRemains(), ElementsAre(Tree{{"file", "content"}}));
}

TEST_F(PowerCutTest, LeavesPathsOutsideAndWhatIsNeitherFileNorDirectoryAlone) {
  const TemporaryDirectory outside;
  files_->writeFile(outside.file("file"), bytesOf("content"));
  files_->sync(outside.file("file"));
  EXPECT_EQ(outside.read("file"), "content");
  ASSERT_EQ(::mkfifo(path("fifo").c_str(), 0600), 0);
  syncDirectory();
  EXPECT_TRUE(remains(1).empty());
  files_->rename(outside.file("file"), path("file"));  // what comes from outside is not durable
  EXPECT_THAT(contentsAfter("file"), IsSupersetOf({"-", "", "content"}));
  files_->rename(path("file"), outside.file("back"));
  syncDirectory();
  EXPECT_THAT(allRemains(), ElementsAre(Tree{}));
}

TEST_F(PowerCutTest, TellsOfEachOperationAndMayBeCutThen) {
  std::vector<Tree> seen;
  powerCut_.onOperation([&] { seen.push_back(remains(1)); });
  writeSynced("file", "content");
  powerCut_.onOperation(nullptr);
  files_->deleteFile(path("file"));
  ASSERT_EQ(seen.size(), 3U);  // the write and two syncs
  EXPECT_EQ(seen.back(), (Tree{{"file", "content"}}));
}

TEST_F(PowerCutTest, OfARemainderOfAnotherOneIsOneMore) {
  writeSynced("file", "content");
  const TemporaryDirectory other;
  powerCut_.cutInto(other.path(), 1);
  const PowerCut second(other.path());
  second.files()->deleteFile(other.file("file"));
  second.files()->sync(other.path());
  const TemporaryDirectory third;
  second.cutInto(third.path(), 1);
  EXPECT_TRUE(treeOf(third).empty());
  EXPECT_THAT(contentsAfter("file"), ElementsAre("content"));
}

TEST_F(PowerCutTest, KeepsWhatThreadsHaveSyncedByThen) {
  constexpr int kThreads = 4;
  constexpr int kFiles = 25;
  std::array<std::atomic<int>, kThreads> done{};
  std::vector<std::thread> threads;
  for (int thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int i = 0; i < kFiles; ++i) {
        writeSynced(std::to_string(thread) + "-" + std::to_string(i), string(100, 'x'));
        done.at(static_cast<std::size_t>(thread)) = i + 1;
      }
    });
  }
  for (std::uint32_t seed = 0; seed < 10; ++seed) {
    std::set<string> expected;
    for (int thread = 0; thread < kThreads; ++thread) {
      const int files = done.at(static_cast<std::size_t>(thread));
      for (int i = 0; i < files; ++i) expected.insert(std::to_string(thread) + "-" + std::to_string(i));
    }
    const Tree tree = remains(seed);
    for (const string& name : expected) {
      ASSERT_EQ(tree.count(name), 1U) << name;
      EXPECT_EQ(tree.at(name), string(100, 'x'));
    }
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(remains(1).size(), static_cast<std::size_t>(kThreads) * kFiles);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
