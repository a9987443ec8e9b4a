#include "host/RootLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <string>
#include <system_error>
#include <thread>

#include "LarderException.h"
#include "host/queues/ThreadPool.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr mode_t kMode = 0664;  // less the umask

// An owner writes its process id right after it has locked the file. Between the two, others try again this often.
constexpr int kAttempts = 20;
constexpr std::chrono::milliseconds kBetweenAttempts(1);

[[noreturn]] void fail(const std::string& path, int code, const std::string& reason) {
  throw FileUtilsIoException(code, "Could not lock \"" + path + "\": " + reason);
}

[[noreturn]] void failWithErrno(const std::string& path) {
  const int error = errno;
  fail(path, error, std::generic_category().message(error));
}

const char* const kEnding = " ending";  // behind the process id

struct Owner {
  pid_t process = 0;  // 0 if none is written, or one that has ended without removing it
  bool isEnding = false;
};

bool isAlive(pid_t process) { return process > 0 && (::kill(process, 0) == 0 || errno != ESRCH); }

[[noreturn]] void throwInUse(const std::string& root, pid_t owner) {
  const std::string who = owner == 0 ? "another process" : "process " + std::to_string(owner);
  throw FileUtilsIoException(EWOULDBLOCK, "Root '" + root + "' is in use by " + who + ".");
}

std::string inDirectory(const std::string& directory, const std::string& name) {
  return directory.empty() || directory.back() == '/' ? directory + name : directory + "/" + name;
}

}  // namespace

// The lock file, open.
class RootLock::File {
 public:
  explicit File(const std::string& path) : path_(path), descriptor_(open(path)) {}
  ~File() { (void)::close(descriptor_); }
  File(const File&) = delete;
  File& operator=(const File&) = delete;

  void requireRegular() const {
    struct stat status {};
    if (::fstat(descriptor_, &status) != 0) failWithErrno(path_);
    if (!S_ISREG(status.st_mode)) fail(path_, 0, "not a regular file");
  }

  // False if the file is locked already.
  bool tryLock() const {
    while (::flock(descriptor_, LOCK_EX | LOCK_NB) != 0) {
      if (errno == EWOULDBLOCK) return false;
      if (errno != EINTR) failWithErrno(path_);
    }
    return true;
  }

  // Explicitly: closing does not release the lock while a forked child has the file open, too.
  void unlock() const { (void)::flock(descriptor_, LOCK_UN); }

  Owner livingOwner() const {
    std::array<char, 32> text{};
    if (::pread(descriptor_, text.data(), text.size() - 1, 0) <= 0) return {};
    char* end = nullptr;
    const auto process = static_cast<pid_t>(std::strtol(text.data(), &end, 10));
    if (!isAlive(process)) return {};
    return {process, std::string(end).rfind(kEnding, 0) == 0};
  }

  // Only for those who wait, so a failure, for example on a full disk, is ignored. A file with another name may be
  // anybody's.
  void writeOwner(const std::string& text) const {
    struct stat status {};
    if (::fstat(descriptor_, &status) != 0 || status.st_nlink > 1) return;
    // A longer text fits into the block of a shorter one even when the disk is full.
    if (::pwrite(descriptor_, text.data(), text.size(), 0) < 0) return;
    (void)!::ftruncate(descriptor_, static_cast<off_t>(text.size()));
  }

 private:
  // Never blocks: a fifo is opened for reading and writing, and a link is refused.
  static int open(const std::string& path) {
    constexpr int flags = O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY;
    const int descriptor = ::open(path.c_str(), flags, kMode);
    if (descriptor < 0) failWithErrno(path);
    return descriptor;
  }

  const std::string path_;
  const int descriptor_;
};

const std::string RootLock::fileName = "_cellar_lock";

RootLock::RootLock(const std::string& root)
    : owner_(::getpid()), file_(std::make_unique<const File>(inDirectory(root, fileName))) {
  file_->requireRegular();
  int attempts = 0;
  while (!file_->tryLock()) {
    const Owner owner = file_->livingOwner();
    const bool isEndingHere = owner.isEnding && owner.process == owner_ && !ThreadPool::isThreadOfAnyPool();
    if (!isEndingHere && (owner.process != 0 || ++attempts == kAttempts)) throwInUse(root, owner.process);
    std::this_thread::sleep_for(kBetweenAttempts);
  }
  file_->writeOwner(std::to_string(owner_) + "\n");
}

void RootLock::announceEnd() const { file_->writeOwner(std::to_string(owner_) + kEnding + "\n"); }

RootLock::~RootLock() {
  if (::getpid() != owner_) return;
  file_->writeOwner("");
  file_->unlock();
}

}  // namespace velmora::mobile::xplat::cellar::host
