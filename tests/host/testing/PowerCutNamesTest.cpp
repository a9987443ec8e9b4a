#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>

#include "support/PowerCutFixture.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;
using testing::Contains;
using testing::ElementsAre;
using testing::Not;
using testing::UnorderedElementsAre;

class PowerCutNamesTest : public PowerCutFixture {};

TEST_F(PowerCutNamesTest, LosesASyncedFileWhoseDirectoryWasNotSynced) {
  write("file", "content");
  sync("file");
  EXPECT_THAT(contentsAfter("file"), ElementsAre("-", "content"));
}

TEST_F(PowerCutNamesTest, LosesASyncedDirectoryInOneThatWasNotSynced) {
  files_->createDirectory(path("a/b"), true);
  writeSynced("a/b/file", "content");
  sync("a/b");
  sync("a");
  sync("a/b/file");
  EXPECT_THAT(contentsAfter("a/b/file"), ElementsAre("content"));  // the root was synced after "a" was created

  files_->createDirectory(path("c/d"), true);
  write("c/d/file", "content");
  for (const string name : {"c/d/file", "c/d"}) sync(name);
  EXPECT_THAT(allRemains(), testing::SizeIs(3));  // no c, c alone, all
  syncDirectory();
  EXPECT_THAT(contentsAfter("c/d/file"), ElementsAre("-", "content"));
  sync("c");
  EXPECT_THAT(contentsAfter("c/d/file"), ElementsAre("content"));
}

TEST_F(PowerCutNamesTest, ReordersEntriesOfOneDirectory) {
  for (const string name : {"a", "b"}) {
    write(name, name);
    sync(name);
  }
  EXPECT_THAT(allRemains(),
              UnorderedElementsAre(Tree{}, Tree{{"a", "a"}}, Tree{{"b", "b"}}, Tree{{"a", "a"}, {"b", "b"}}));
}

TEST_F(PowerCutNamesTest, RenamesAtomically) {
  writeSynced("target", "old");
  writeSynced("new", "new");
  files_->rename(path("new"), path("target"));
  EXPECT_THAT(allRemains(), UnorderedElementsAre(Tree{{"target", "old"}, {"new", "new"}}, Tree{{"target", "new"}}));
  syncDirectory();
  EXPECT_THAT(allRemains(), ElementsAre(Tree{{"target", "new"}}));
}

TEST_F(PowerCutNamesTest, RenamesAFileThatWasNotSyncedBeforeItsContent) {
  writeSynced("target", "old");
  write("new", string(1000, 'n'));
  files_->rename(path("new"), path("target"));
  syncDirectory();
  const auto contents = contentsAfter("target");
  EXPECT_THAT(contents, Contains(""));
  EXPECT_THAT(contents, Contains("n1000"));
  EXPECT_THAT(contents, Not(Contains("old")));
}

TEST_F(PowerCutNamesTest, MovesBetweenDirectoriesAtomicallyAndDurablyWithASyncOfEither) {
  for (const string synced : {"from", "to"}) {
    files_->createDirectory(path("from"), false);
    files_->createDirectory(path("to"), false);
    syncDirectory();
    write("from/file", synced);
    sync("from/file");
    sync("from");
    files_->rename(path("from/file"), path("to/file"));
    EXPECT_THAT(allRemains(), UnorderedElementsAre(Tree{{"from", ""}, {"to", ""}, {"from/file", synced}},
                                                   Tree{{"from", ""}, {"to", ""}, {"to/file", synced}}));
    sync(synced);
    EXPECT_THAT(allRemains(), ElementsAre(Tree{{"from", ""}, {"to", ""}, {"to/file", synced}}));
    files_->recursiverDirectoryDelete(path("to"));
    syncDirectory();
  }
}

TEST_F(PowerCutNamesTest, LeavesWhatWasMovedTwiceInOnePlace) {
  writeSynced("a", "content");
  files_->rename(path("a"), path("b"));
  files_->rename(path("b"), path("c"));
  EXPECT_THAT(allRemains(),
              UnorderedElementsAre(Tree{{"a", "content"}}, Tree{{"b", "content"}}, Tree{{"c", "content"}}));
}

TEST_F(PowerCutNamesTest, BringsADeletedFileBackUnlessTheDirectoryIsSynced) {
  writeSynced("file", "content");
  files_->deleteFile(path("file"));
  EXPECT_THAT(contentsAfter("file"), ElementsAre("-", "content"));
  write("file", "other");
  sync("file");
  EXPECT_THAT(contentsAfter("file"), ElementsAre("-", "content", "other"));
  syncDirectory();
  EXPECT_THAT(contentsAfter("file"), ElementsAre("other"));
}

TEST_F(PowerCutNamesTest, BringsPartsOfADeletedTreeBack) {
  files_->createDirectory(path("tree"), false);
  for (const string name : {"tree/a", "tree/b"}) writeSynced(name, "content");
  sync("tree");
  files_->recursiverDirectoryDelete(path("tree"));
  const auto all = allRemains(150);
  EXPECT_THAT(all, Contains(Tree{}));
  EXPECT_THAT(all, Contains(Tree{{"tree", ""}}));
  EXPECT_THAT(all, Contains(Tree{{"tree", ""}, {"tree/b", "content"}}));
  syncDirectory();
  EXPECT_THAT(allRemains(), ElementsAre(Tree{}));
}

TEST_F(PowerCutNamesTest, SeesWhatOthersHaveCreatedMovedAndDeleted) {
  writeSynced("gone", "content");
  std::filesystem::remove(path("gone"));
  life_.write("new/file", "content");
  sync("new/file");
  sync("new");
  const Tree file = {{"new", ""}, {"new/file", "content"}};
  EXPECT_THAT(allRemains(), UnorderedElementsAre(Tree{}, Tree{{"gone", "content"}}, file,
                                                 Tree{{"gone", "content"}, {"new", ""}, {"new/file", "content"}}));
  syncDirectory();
  EXPECT_THAT(allRemains(), ElementsAre(file));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
