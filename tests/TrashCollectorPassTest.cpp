// What a pass over the trash does with entries that are in its way: some that cannot be deleted, fifos.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <filesystem>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/TrashFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FaultyFileUtils;
using test::ioFailure;
using test::Operation;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

class TrashCollectorPass : public test::TrashFixture {
 protected:
  // One pass in the background.
  void pass() {
    collector_->collectPath(directory_.write("wanted by the pass", ""));
    queues_->runAll();
  }

  static string logged(int code, const string& text) { return "Cannot collect trash. " + ioFailure(code, text); }

  string entry(const string& name) const { return trashPath() + "/" + name; }

  string makeFifo(const string& name) const {
    std::filesystem::create_directories(std::filesystem::path(directory_.file(name)).parent_path());
    if (mkfifo(directory_.file(name).c_str(), 0600) != 0) throw std::runtime_error("cannot make a fifo");
    return directory_.file(name);
  }

  std::size_t deletionsBelow(const string& path) const {
    const std::vector<string> trace = files_->trace();
    return static_cast<std::size_t>(std::count_if(trace.begin(), trace.end(), [&](const string& line) {
      return line.rfind("deleteFile " + path + "/", 0) == 0;
    }));
  }
};

// --- Entries that cannot be deleted ---

TEST_F(TrashCollectorPass, LeavesWhatCannotBeDeletedAndDeletesTheOtherEntries) {
  const std::vector<string> names = {"a", "b", "c", "d", "e"};
  for (const string& stuck : names) {
    for (const string& name : names) makeTree("cache/trash/" + name);
    files_->failPath(Operation::DeleteFile, entry(stuck) + "/one", EBUSY);
    pass();
    EXPECT_THAT(trashed(), ElementsAre(stuck));
    files_->heal();
  }
  EXPECT_THAT(log_.messages(), testing::Each(logged(EBUSY, "Device or resource busy")));
  EXPECT_EQ(log_.errorCount(), names.size());
  pass();
  EXPECT_FALSE(directory_.exists("cache/trash"));
}

TEST_F(TrashCollectorPass, LogsTheFirstOfSeveralFailuresAlone) {
  makeTree("cache/trash/a");
  makeTree("cache/trash/b");
  std::vector<string> order;
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation == Operation::ListDirectory && path != trashPath()) order.push_back(files_->basename(path));
  };
  files_->failPath(Operation::ListDirectory, entry("a"), EACCES);
  files_->failPath(Operation::ListDirectory, entry("b"), EIO);
  pass();
  EXPECT_THAT(order, UnorderedElementsAre("a", "b"));
  EXPECT_THAT(log_.messages(), ElementsAre(order.at(0) == "a" ? logged(EACCES, "Permission denied")
                                                              : logged(EIO, "Input/output error")));
}

TEST_F(TrashCollectorPass, EndsAnEntryWhereItFails) {
  for (const char* name : {"one", "two", "three"}) {
    directory_.write(string("cache/trash/stuck/") + name, "");
    files_->failPath(Operation::DeleteFile, entry("stuck") + "/" + name, EBUSY);
  }
  pass();
  EXPECT_EQ(deletionsBelow(entry("stuck")), 1U);
  EXPECT_EQ(directory_.names("cache/trash/stuck").size(), 3U);
}

TEST_F(TrashCollectorPass, DoesNotTryToDeleteTheTrashDirectoryBesideWhatIsLeft) {
  directory_.write("cache/trash/stuck", "");
  files_->failPath(Operation::DeleteFile, entry("stuck"), EBUSY);
  pass();
  EXPECT_THAT(files_->trace(), testing::Not(testing::Contains("deleteFile " + trashPath())));
}

TEST_F(TrashCollectorPass, TriesEachEntryOnce) {
  directory_.write("cache/trash/stuck", "");
  files_->failPath(Operation::DeleteFile, entry("stuck"), EBUSY);
  pass();
  const std::vector<string> trace = files_->trace();
  EXPECT_EQ(std::count(trace.begin(), trace.end(), "deleteFile " + entry("stuck")), 1);
}

TEST_F(TrashCollectorPass, GoesOnAfterAFailureOfAnotherType) {
  makeTree("cache/trash/odd");
  makeTree("cache/trash/other");
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation == Operation::ListDirectory && path == entry("odd")) throw std::logic_error("odd host");
  };
  pass();
  EXPECT_THAT(trashed(), ElementsAre("odd"));
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. odd host"));
}

TEST_F(TrashCollectorPass, ThatFailsStillTakesWhatIsCollectedInTheMiddleOfIt) {
  directory_.write("cache/trash/stuck", "");
  files_->failPath(Operation::DeleteFile, entry("stuck"), EBUSY);
  const string late = makeTree("late");
  const auto queue = queues_->queue(0);
  queue->onDispatch = [raw = queue.get()] { raw->runAll(); };
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation == Operation::DeleteFile && path == entry("stuck")) collector_->collectPath(late);
  };
  collector_->collectPath(directory_.write("file", ""));
  files_->onCall = nullptr;
  queue->onDispatch = nullptr;
  EXPECT_FALSE(directory_.exists("late"));
  EXPECT_THAT(trashed(), ElementsAre("stuck"));
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(TrashCollectorPass, OfAnEmptyingCountsWhatItDeletesBesideAStuckEntry) {
  directory_.write("cache/trash/stuck", "");
  makeTree("cache/trash/tree");
  files_->failPath(Operation::DeleteFile, entry("stuck"), EBUSY);
  empty();
  EXPECT_EQ(reportedCount(), 4U);  // the tree with its two files, and the attempt
  EXPECT_THAT(trashed(), ElementsAre("stuck"));
  EXPECT_EQ(log_.errorCount(), 1U);
}

// --- Entries that no listing shows ---

TEST_F(TrashCollectorPass, DeletesFifosAndSocketsWhereverTheyAre) {
  makeFifo("tree/fifo");
  makeFifo("tree/deep/er/fifo");
  directory_.write("tree/deep/file", "");
  ASSERT_EQ(mknod(directory_.file("tree/deep/socket").c_str(), S_IFSOCK | 0600U, 0), 0);
  EXPECT_TRUE(collector_->collectPath(directory_.file("tree")));
  EXPECT_TRUE(collector_->collectPath(makeFifo("fifo")));
  empty();
  EXPECT_THAT(directory_.names("cache"), IsEmpty());
  EXPECT_THAT(log_.messages(), IsEmpty());
  EXPECT_EQ(reportedCount(), 9U);  // three fifos, a socket, a file, three directories and the trash
}

TEST_F(TrashCollectorPass, DeletesAFifoBesideWhatCannotBeDeleted) {
  directory_.write("cache/trash/stuck", "");
  makeFifo("cache/trash/fifo");
  files_->failPath(Operation::DeleteFile, entry("stuck"), EBUSY);
  pass();
  EXPECT_THAT(trashed(), ElementsAre("stuck"));
}

TEST_F(TrashCollectorPass, LeavesAFifoThatCannotBeDeletedAndDeletesTheOtherEntries) {
  for (const char* stuck : {"fifo", "tree/fifo"}) {
    makeFifo(string("cache/trash/") + stuck);
    makeTree("cache/trash/other");
    files_->failPath(Operation::DeleteFile, entry(stuck), EBUSY);
    pass();
    EXPECT_EQ(trashed().size(), 1U) << stuck;
    files_->heal();
  }
  EXPECT_THAT(log_.messages(), testing::Each(logged(EBUSY, "Device or resource busy")));
  EXPECT_EQ(log_.errorCount(), 2U);
}

TEST_F(TrashCollectorPass, DeletesEverythingOnAFileSystemThatTellsNoTypes) {
  class Typeless : public FaultyFileUtils {
   public:
    std::vector<FileUtils::Info> listDirectory(const string&) override { return {}; }
    std::vector<string> listOtherEntries(const string& path) override {
      std::vector<string> paths;
      for (const auto& info : FaultyFileUtils::listDirectory(path)) paths.push_back(info.path);
      return paths;
    }
  };
  collector_ = makeCollector(std::make_shared<Typeless>());
  makeTree("target");
  makeTree("tree/deep/er");
  link("tree/link", directory_.file("target"));
  EXPECT_TRUE(collector_->collectPath(directory_.file("tree")));
  queues_->runAll();
  EXPECT_THAT(directory_.names("cache"), IsEmpty());
  EXPECT_EQ(directory_.names("target").size(), 2U);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
