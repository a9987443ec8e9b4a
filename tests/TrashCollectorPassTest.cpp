// What a pass over the trash does with entries that are in its way: some that cannot be deleted, fifos, paths longer
// than the system takes, links.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstddef>
#include <filesystem>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/IncidentLog.h"
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

constexpr int kManyLevels = PATH_MAX * 3 / 5;  // with names of one character

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

  // So many directories of that name, one in the other, with a file in the last.
  string makeDeep(const string& name, const string& component, int levels) const {
    string path = directory_.makeDirectory(name);
    int descriptor = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    for (int level = 0; level < levels; ++level) {
      mkdirat(descriptor, component.c_str(), 0700);
      const int next = openat(descriptor, component.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
      close(std::exchange(descriptor, next));
    }
    const int file = openat(descriptor, "leaf", O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    if (file == -1) throw std::runtime_error("cannot make a deep tree");
    close(file);
    close(descriptor);
    return path;
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

// --- What is reported of it ---

class TrashCollectorIncidents : public TrashCollectorPass {
 protected:
  TrashCollectorIncidents() { collector_->setIncidents(incidents_.reporter); }

  string stuck(int code, const string& text) const { return "TrashStuck " + trashPath() + ": " + logged(code, text); }
  string busy() const { return stuck(EBUSY, "Device or resource busy"); }

  void makeStuck(const string& name, int code = EBUSY) {
    directory_.write("cache/trash/" + name, "");
    files_->failPath(Operation::DeleteFile, entry(name), code);
  }

  test::IncidentLog incidents_;
};

TEST_F(TrashCollectorIncidents, TellOfAPassThatEndsWithAnErrorOnceWhileTheErrorLasts) {
  makeStuck("a");
  pass();
  EXPECT_EQ(incidents_.queue->pending(), 1U);
  EXPECT_THAT(incidents_.take(), ElementsAre(busy()));
  pass();
  empty();
  EXPECT_THAT(incidents_.take(), IsEmpty());
  EXPECT_EQ(log_.errorCount(), 3U);
}

TEST_F(TrashCollectorIncidents, TellOfTheSameErrorAgainAfterAPassWithoutOne) {
  for (int i = 0; i < 2; ++i) {
    makeStuck("a");
    pass();
    EXPECT_THAT(incidents_.take(), ElementsAre(busy()));
    files_->heal();
    pass();
    EXPECT_THAT(incidents_.take(), IsEmpty());
  }
}

TEST_F(TrashCollectorIncidents, TellOfAnotherErrorAndOfAnotherEntryButNotOfFewer) {
  makeStuck("a");
  pass();
  EXPECT_THAT(incidents_.take(), ElementsAre(busy()));
  makeStuck("b");
  pass();
  EXPECT_THAT(incidents_.take(), ElementsAre(busy()));
  files_->heal();
  files_->failPath(Operation::DeleteFile, entry("b"), EBUSY);
  pass();
  EXPECT_THAT(trashed(), ElementsAre("b"));
  EXPECT_THAT(incidents_.take(), IsEmpty());
  files_->failPath(Operation::DeleteFile, entry("b"), EACCES);
  pass();
  EXPECT_THAT(incidents_.take(), ElementsAre(stuck(EACCES, "Permission denied")));
}

TEST_F(TrashCollectorIncidents, TellOfALinkInThePlaceOfTheTrash) {
  directory_.makeDirectory("outside");
  link("cache/trash", directory_.file("outside"));
  for (int i = 0; i < 2; ++i) empty();
  EXPECT_THAT(incidents_.take(), ElementsAre(stuck(0, "Trash directory \"" + trashPath() + "\" is a link")));
}

TEST_F(TrashCollectorIncidents, AreNoneOfPathsThatCannotBeCollected) {
  EXPECT_FALSE(collector_->collectPath(directory_.file("missing")));
  EXPECT_THAT(incidents_.take(), IsEmpty());
}

TEST_F(TrashCollectorIncidents, AreToldWithoutALockSoThatTheHandlerMayEmptyTheTrash) {
  makeStuck("a");
  incidents_.runAtOnce();
  incidents_.onIncident = [&](const Incident&) {
    files_->heal();
    collector_->emptyAllTrash();
  };
  const auto other = makeCollectorWithoutQueue();
  other->setIncidents(incidents_.reporter);
  collector_ = other;
  collector_->emptyAllTrash();
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_THAT(incidents_.take(), ElementsAre(busy()));
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

// --- Entries deeper than a path may be long ---

TEST_F(TrashCollectorPass, DeletesWhatIsDeeperThanAPathMayBeLong) {
  EXPECT_TRUE(collector_->collectPath(makeDeep("long names", string(200, 'n'), 2 * PATH_MAX / 200)));
  EXPECT_TRUE(collector_->collectPath(makeDeep("many levels", "d", kManyLevels)));
  queues_->runAll();
  EXPECT_THAT(directory_.names("cache"), IsEmpty());
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorPass, CountsEachDirectoryOfADeepEntryOnce) {
  EXPECT_TRUE(collector_->collectPath(makeDeep("deep", "d", kManyLevels)));
  empty();
  EXPECT_EQ(reportedCount(), std::size_t{kManyLevels} + 3U);  // the outermost, the file, and the trash
}

TEST_F(TrashCollectorPass, DeletesDeepEntriesOfATrashWhosePathIsLong) {
  string below = "cache";
  while (directory_.file(below).size() < 2800) below += "/" + string(200, 'n');
  const string trash = directory_.file(below + "/trash");
  TrashCollector collector(trash, files_, nullptr, queues_);
  EXPECT_TRUE(collector.collectPath(makeDeep("deep", string(200, 'd'), 2 * PATH_MAX / 200)));
  queues_->runAll();
  EXPECT_FALSE(std::filesystem::exists(trash));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorPass, MovesNothingOfAnOrdinaryTree) {
  const string names = "/" + string(200, 'a') + "/" + string(200, 'b') + "/";
  for (const std::size_t length : {92U, 93U}) {  // 512 and 513 characters behind the trash directory's path
    const std::size_t before = files_->calls(Operation::Rename);
    directory_.makeDirectory("tree" + names + string(length, 'c'));
    EXPECT_TRUE(collector_->collectPath(directory_.file("tree")));
    queues_->runAll();
    EXPECT_EQ(files_->calls(Operation::Rename) - before, length == 92U ? 1U : 2U);
    EXPECT_FALSE(directory_.exists("cache/trash"));
  }
}

TEST_F(TrashCollectorPass, LeavesADeepEntryThatCannotBeDeletedAndDeletesTheOthers) {
  collector_->collectPath(makeDeep("deep", string(200, 'd'), 2 * PATH_MAX / 200));
  files_->failAlways(Operation::Rename, EACCES);
  makeTree("cache/trash/tree");
  queues_->runAll();
  EXPECT_EQ(trashed().size(), 1U);
  EXPECT_THAT(log_.messages(), ElementsAre(logged(ENAMETOOLONG, "Could not open directory: File name too long")));
}

TEST_F(TrashCollectorPass, DeletesWhereItIsWhatCannotBeMoved) {
  collector_->collectPath(makeDeep("deep", string(200, 'd'), 10));
  files_->failAlways(Operation::Rename, EXDEV);
  queues_->runAll();
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(TrashCollectorPass, ThatFailsInTheMidstOfADeepEntryLeavesAllOfItToTheNext) {
  collector_->collectPath(makeDeep("deep", string(200, 'd'), 2 * PATH_MAX / 200));
  files_->failAlways(Operation::DeleteFile, EBUSY);
  queues_->runAll();
  EXPECT_GT(trashed().size(), 1U);
  EXPECT_THAT(log_.messages(), ElementsAre(logged(EBUSY, "Device or resource busy")));
  files_->heal();
  pass();
  EXPECT_FALSE(directory_.exists("cache/trash"));
  EXPECT_EQ(log_.errorCount(), 1U);
}

// --- A link in the place of the trash directory ---

class TrashCollectorOverALink : public TrashCollectorPass {
 protected:
  string refusal() const { return ioFailure(0, "Trash directory \"" + trashPath() + "\" is a link"); }
};

TEST_F(TrashCollectorOverALink, RefusesToCollectAndLosesNothing) {
  for (const char* target : {"outside", "nowhere", "file"}) {
    directory_.makeDirectory("outside");
    directory_.write("file", "");
    link("cache/trash", directory_.file(target));
    makeTree("tree");
    EXPECT_FALSE(collector_->collectPath(directory_.file("tree"))) << target;
    EXPECT_TRUE(log_.contains("Cannot collect path. " + refusal()));
    EXPECT_EQ(directory_.names("tree").size(), 2U);
    EXPECT_THAT(directory_.names("outside"), IsEmpty());
    std::filesystem::remove(trashPath());
  }
  EXPECT_EQ(log_.errorCount(), 3U);
}

TEST_F(TrashCollectorOverALink, NamedWithASlashRefusesToo) {
  directory_.makeDirectory("outside");
  link("cache/trash", directory_.file("outside"));
  TrashCollector collector(trashPath() + "/", files_, nullptr, queues_);
  EXPECT_FALSE(collector.collectPath(makeTree("tree")));
  EXPECT_THAT(directory_.names("outside"), IsEmpty());
}

TEST_F(TrashCollectorOverALink, EmptiesNothingAndSaysSo) {
  makeTree("outside/tree");
  link("cache/trash", directory_.file("outside"));
  empty();
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. " + refusal()));
  EXPECT_EQ(directory_.names("outside/tree").size(), 2U);
  EXPECT_EQ(reportedCount(), 0U);
}

TEST_F(TrashCollectorOverALink, ThatWasPutThereAfterAMoveSaysSoToo) {
  EXPECT_TRUE(collector_->collectPath(makeTree("tree")));
  std::filesystem::rename(trashPath(), directory_.file("moved"));
  link("cache/trash", directory_.file("moved"));
  queues_->runAll();
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot collect trash. " + refusal()));
  EXPECT_EQ(directory_.names("moved").size(), 1U);
}

TEST_F(TrashCollectorOverALink, AboveTheTrashIsNoReasonToRefuse) {
  directory_.makeDirectory("elsewhere");
  link("cache", directory_.file("elsewhere"));
  EXPECT_TRUE(collector_->collectPath(makeTree("tree")));
  EXPECT_EQ(directory_.names("elsewhere/trash").size(), 1U);
  queues_->runAll();
  EXPECT_THAT(directory_.names("elsewhere"), IsEmpty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
