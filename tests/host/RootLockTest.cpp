#include "host/RootLock.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <future>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "host/ThreadQueueFactory.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace {

std::atomic<int> flockError{0};  // 0: it works

}  // namespace

// In place of the system's, for all of this program.
extern "C" __attribute__((visibility("default"))) int flock(int descriptor, int operation) noexcept {
  if (flockError == 0) return static_cast<int>(::syscall(SYS_flock, descriptor, operation));
  errno = flockError;
  return -1;
}

namespace velmora::mobile::xplat::cellar::host {
namespace {

class RootLockTest : public testing::Test {
 protected:
  // How taking the lock fails: the code and the text.
  std::pair<int, std::string> failure() const {
    try {
      const RootLock lock(directory_.path());
    } catch (const FileUtilsIoException& error) {
      return {error.code(), error.description()};
    }
    return {-1, "no error"};
  }

  bool isFree() const { return failure().first == -1; }

  std::pair<int, std::string> inUseBy(const std::string& who) const {
    return {EWOULDBLOCK, "Root '" + directory_.path() + "' is in use by " + who + "."};
  }

  std::pair<int, std::string> couldNotLock(int code, const std::string& reason) const {
    return {code, "Could not lock \"" + directory_.file("_cellar_lock") + "\": " + reason};
  }

  static std::string thisProcess() { return "process " + std::to_string(::getpid()); }

  const test::Watchdog watchdog_{60};
  const test::TemporaryDirectory directory_;
};

// A process that does something and then waits to be told to end.
class Child {
 public:
  template <class Function> explicit Child(Function function) {
    int ready[2];
    EXPECT_EQ(::pipe(ready), 0);
    process_ = ::fork();
    if (process_ == 0) {
      function();
      (void)!::write(ready[1], "x", 1);
      while (true) (void)::pause();
    }
    char byte = 0;
    EXPECT_EQ(::read(ready[0], &byte, 1), 1);
    (void)::close(ready[0]);
    (void)::close(ready[1]);
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;
  ~Child() { kill(); }

  pid_t process() const { return process_; }

  void kill() {
    if (process_ == 0) return;
    EXPECT_EQ(::kill(process_, SIGKILL), 0);
    EXPECT_EQ(::waitpid(process_, nullptr, 0), process_);
    process_ = 0;
  }

 private:
  pid_t process_ = 0;
};

TEST_F(RootLockTest, HoldsTheProcessIdOfItsOwnerWhileItIsTaken) {
  {
    const RootLock lock(directory_.path());
    EXPECT_EQ(directory_.read("_cellar_lock"), std::to_string(::getpid()) + "\n");
  }
  EXPECT_EQ(directory_.read("_cellar_lock"), "");
}

TEST_F(RootLockTest, IsTakenOnceInAProcess) {
  const RootLock lock(directory_.path());
  EXPECT_EQ(failure(), inUseBy(thisProcess()));
  EXPECT_EQ(failure(), inUseBy(thisProcess()));  // the refused one has released nothing
}

TEST_F(RootLockTest, IsFreeAgainWhenItsOwnerIsDestroyed) {
  auto lock = std::make_unique<RootLock>(directory_.path());
  lock.reset();
  EXPECT_TRUE(isFree());
}

TEST_F(RootLockTest, OfAnOwnerThatHasAnnouncedItsEndIsWaitedFor) {
  auto lock = std::make_unique<RootLock>(directory_.path());
  lock->announceEnd();
  EXPECT_EQ(directory_.read("_cellar_lock"), std::to_string(::getpid()) + " ending\n");
  std::atomic<bool> isReleased{false};
  std::thread ending([&] {
    isReleased = true;
    lock.reset();
  });
  const RootLock next(directory_.path());
  EXPECT_TRUE(isReleased);
  ending.join();
  EXPECT_EQ(failure(), inUseBy(thisProcess()));
}

TEST_F(RootLockTest, OfAnOwnerThatHasAnnouncedItsEndIsRefusedOnAQueueThatItMayNeed) {
  const RootLock lock(directory_.path());
  lock.announceEnd();
  ThreadQueueFactory queues;
  std::promise<std::pair<int, std::string>> failed;
  queues.createQueue()->dispatch([&] { failed.set_value(failure()); });
  EXPECT_EQ(failed.get_future().get(), inUseBy(thisProcess()));
}

TEST_F(RootLockTest, OfAnotherProcessThatHasAnnouncedItsEndIsRefused) {
  const Child child([&] { (new RootLock(directory_.path()))->announceEnd(); });
  EXPECT_EQ(failure(), inUseBy("process " + std::to_string(child.process())));
}

TEST_F(RootLockTest, OfAnotherProcessIsRefusedWithItsIdUntilThatIsKilled) {
  Child child([&] { new RootLock(directory_.path()); });
  EXPECT_EQ(failure(), inUseBy("process " + std::to_string(child.process())));
  child.kill();
  EXPECT_TRUE(isFree());
}

TEST_F(RootLockTest, OfAProcessThatWasKilledIsTakenOverWithItsFile) {
  Child child([&] { new RootLock(directory_.path()); });
  child.kill();
  EXPECT_NE(directory_.read("_cellar_lock"), "");
  const RootLock lock(directory_.path());
  EXPECT_EQ(directory_.read("_cellar_lock"), std::to_string(::getpid()) + "\n");
}

TEST_F(RootLockTest, OfAnOwnerThatHasWrittenNoIdOrADeadOneIsAnotherProcess) {
  Child child([&] {
    const int file = ::open(directory_.file("_cellar_lock").c_str(), O_RDWR | O_CREAT, 0644);
    (void)::flock(file, LOCK_EX);
  });
  EXPECT_EQ(failure(), inUseBy("another process"));
  for (const std::string content : {"", "no number", "-1\n", "0\n", "2147483647\n"}) {
    directory_.write("_cellar_lock", content);
    EXPECT_EQ(failure(), inUseBy("another process")) << content;
  }
}

TEST_F(RootLockTest, IsReleasedByItsOwnerThoughAChildHasInheritedIt) {
  auto lock = std::make_unique<RootLock>(directory_.path());
  const Child child([] {});
  lock.reset();
  EXPECT_TRUE(isFree());
}

TEST_F(RootLockTest, IsNotReleasedByAChildThatDestroysItsCopy) {
  auto lock = std::make_unique<RootLock>(directory_.path());
  const Child child([&] { lock.reset(); });
  EXPECT_EQ(failure(), inUseBy(thisProcess()));
}

TEST_F(RootLockTest, IsNotInheritedByOtherPrograms) {
  const RootLock lock(directory_.path());
  int found = 0;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    if (std::filesystem::read_symlink(entry.path(), gone) != directory_.file("_cellar_lock")) continue;
    EXPECT_NE(::fcntl(std::stoi(entry.path().filename().string()), F_GETFD) & FD_CLOEXEC, 0);
    ++found;
  }
  EXPECT_EQ(found, 1);
}

TEST_F(RootLockTest, WhatTheFileHeldBeforeDoesNotMatter) {
  directory_.write("_cellar_lock", std::string(1000, '1'));
  const RootLock lock(directory_.path());
  EXPECT_EQ(directory_.read("_cellar_lock"), std::to_string(::getpid()) + "\n");
}

TEST_F(RootLockTest, AFifoInItsPlaceIsRefusedAndNotWaitedFor) {
  ASSERT_EQ(::mkfifo(directory_.file("_cellar_lock").c_str(), 0600), 0);
  EXPECT_EQ(failure(), couldNotLock(0, "not a regular file"));
}

TEST_F(RootLockTest, ALinkInItsPlaceIsRefusedAndItsTargetLeftAlone) {
  directory_.write("target", "mine");
  std::filesystem::create_symlink(directory_.file("target"), directory_.file("_cellar_lock"));
  EXPECT_EQ(failure(), couldNotLock(ELOOP, "Too many levels of symbolic links"));
  EXPECT_EQ(directory_.read("target"), "mine");
}

TEST_F(RootLockTest, AFileWithAnotherNameIsLockedButNotWritten) {
  directory_.write("another name", "mine");
  std::filesystem::create_hard_link(directory_.file("another name"), directory_.file("_cellar_lock"));
  {
    const RootLock lock(directory_.path());
    EXPECT_FALSE(isFree());
    EXPECT_EQ(directory_.read("another name"), "mine");
  }
  EXPECT_TRUE(isFree());
  EXPECT_EQ(directory_.read("another name"), "mine");
}

TEST_F(RootLockTest, ADirectoryInItsPlaceIsRefused) {
  directory_.makeDirectory("_cellar_lock");
  EXPECT_EQ(failure(), couldNotLock(EISDIR, "Is a directory"));
}

TEST_F(RootLockTest, ADirectoryThatDoesNotExistIsRefused) {
  try {
    const RootLock lock(directory_.file("missing"));
    FAIL() << "There is nothing to lock.";
  } catch (const FileUtilsIoException& error) {
    EXPECT_EQ(error.code(), ENOENT);
  }
}

TEST_F(RootLockTest, AFileSystemWithoutLocksIsAnErrorThatSaysSo) {
  flockError = EOPNOTSUPP;
  const auto failed = failure();
  flockError = 0;
  EXPECT_EQ(failed, couldNotLock(EOPNOTSUPP, "Operation not supported"));
  EXPECT_TRUE(isFree());
}

TEST_F(RootLockTest, ASlashAtTheEndOfTheDirectoryMakesNoDifference) {
  const RootLock lock(directory_.path() + "/");
  EXPECT_EQ(failure(), inUseBy(thisProcess()));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
