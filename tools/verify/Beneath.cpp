#include "verify/Beneath.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstddef>
#include <cstdio>
#include <stdexcept>
#include <system_error>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
constexpr mode_t kDirectoryMode = 0777;  // less the umask
constexpr mode_t kFileMode = 0666;

// SQLite locks these bytes of a database for reading as long as it is open, if it has a write-ahead log.
constexpr off_t kSharedBytes = 0x40000002;
constexpr off_t kSharedCount = 510;

// "sunrise.jpg", "sunrise.jpg.1"; of a name as long as a name may be, the end is left out.
std::string numbered(const std::string& name, int number) {
  if (number == 0) return name;
  const std::string ending = "." + std::to_string(number);
  return name.substr(0, NAME_MAX - ending.size()) + ending;
}

bool writeAll(int file, const std::vector<unsigned char>& bytes) {
  for (std::size_t written = 0; written < bytes.size();) {
    const ssize_t count = write(file, bytes.data() + written, bytes.size() - written);
    if (count < 0 && errno != EINTR) return false;
    if (count > 0) written += static_cast<std::size_t>(count);
  }
  return true;
}

bool isLink(int directory, const std::string& name) {
  struct stat status = {};
  return fstatat(directory, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(status.st_mode);
}

}  // namespace

Beneath::Beneath(const std::string& base, const std::filesystem::path& below, IfMissing ifMissing)
    : path_(base), directory_(open(base.c_str(), kDirectory)) {
  if (directory_ < 0) fail("open", "", errno);
  try {
    for (const auto& part : below) {
      if (part == "..") throw std::runtime_error("'" + below.string() + "' is outside of '" + base + "'");
      if (!part.empty() && part != ".") enter(part.string(), ifMissing);
    }
  } catch (...) {
    close(directory_);
    throw;
  }
}

Beneath::~Beneath() { close(directory_); }

std::string Beneath::moveTo(const Beneath& target, const std::string& name) const {
  for (int number = 0;; ++number) {
    std::string free = numbered(name, number);
    struct stat status = {};
    if (fstatat(target.directory_, free.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0) continue;
    if (errno != ENOENT) target.fail("look for", free, errno);
    if (renameat(directory_, name.c_str(), target.directory_, free.c_str()) != 0) fail("move", name, errno);
    return free;
  }
}

std::string Beneath::create(const std::string& name, const std::vector<unsigned char>& bytes) const {
  for (int number = 0;; ++number) {
    std::string free = numbered(name, number);
    const int file = openat(directory_, free.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kFileMode);
    if (file < 0 && errno == EEXIST) continue;
    if (file < 0) fail("create", free, errno);
    bool isWritten = writeAll(file, bytes);
    const int code = errno;
    isWritten = close(file) == 0 && isWritten;
    if (isWritten) return free;
    (void)unlinkat(directory_, free.c_str(), 0);
    fail("write", free, code);
  }
}

void Beneath::remove(const std::string& name) const {
  if (unlinkat(directory_, name.c_str(), 0) != 0) fail("remove", name, errno);
}

void Beneath::requireOwn(const std::string& name) const {
  struct stat status = {};
  if (fstatat(directory_, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
    if (errno != ENOENT) fail("look at", name, errno);
    return;
  }
  if (!S_ISREG(status.st_mode)) throw std::runtime_error("'" + path_ + "/" + name + "' is not a regular file");
  if (status.st_nlink > 1) throw std::runtime_error("'" + path_ + "/" + name + "' has another name elsewhere");
}

pid_t Beneath::userOfDatabase(const std::string& name) const {
  const int file = openat(directory_, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (file < 0) return 0;
  struct flock lock = {};
  lock.l_type = F_WRLCK;
  lock.l_whence = SEEK_SET;
  lock.l_start = kSharedBytes;
  lock.l_len = kSharedCount;
  const bool isKnown = fcntl(file, F_GETLK, &lock) == 0;
  close(file);
  return isKnown && lock.l_type != F_UNLCK ? lock.l_pid : 0;
}

void Beneath::enter(const std::string& name, IfMissing ifMissing) {
  if (ifMissing == IfMissing::Create && mkdirat(directory_, name.c_str(), kDirectoryMode) != 0 && errno != EEXIST) {
    fail("create", name, errno);
  }
  const int inner = openat(directory_, name.c_str(), kDirectory);
  if (inner < 0) fail("open", name, isLink(directory_, name) ? ELOOP : errno);
  close(directory_);
  directory_ = inner;
  path_ += "/" + name;
}

void Beneath::fail(const char* what, const std::string& name, int code) const {
  const std::string reason = code == ELOOP ? "it is a link" : std::generic_category().message(code);
  throw std::runtime_error(std::string("cannot ") + what + " '" + path_ + (name.empty() ? "" : "/" + name) +
                           "': " + reason);
}

}  // namespace velmora::mobile::xplat::cellar::tools
