#include "storage/UntouchedFiles.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <system_error>
#include <utility>

#include "Format.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kNotRegular = "not a regular file";
constexpr std::uint64_t kBlock = 512;  // the unit of st_blocks, whatever the file system's own blocks are

[[noreturn]] void fail(const std::string& path) {
  const int code = errno;
  throw UnreadableException(code, {path, code == ELOOP ? "it is a link" : std::generic_category().message(code)});
}

// Only the owner of a file, or root, may read it without changing its access date.
int openUntouched(const std::string& path, int flags) {
  const int file = open(path.c_str(), flags | O_RDONLY | O_CLOEXEC | O_NOATIME);
  return file >= 0 || errno != EPERM ? file : open(path.c_str(), flags | O_RDONLY | O_CLOEXEC);
}

// Of a regular file. Does not wait for the other end of a fifo, and does not open what a device or a socket does when
// it is opened.
class Descriptor {
 public:
  Descriptor(const std::string& path, int flags) : path_(path) {
    requireRegular();
    file_ = openUntouched(path, flags | O_NONBLOCK | O_NOCTTY);
    if (file_ < 0) fail(path);
    if (fstat(file_, &status_) == 0 && S_ISREG(status_.st_mode)) return;
    close(file_);
    refuse(kNotRegular);
  }
  ~Descriptor() { close(file_); }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int get() const { return file_; }

  std::uint64_t size() const { return static_cast<std::uint64_t>(status_.st_size); }

  // How many bytes were read; 0 at the end.
  std::size_t readInto(unsigned char* bytes, std::size_t count) const {
    for (;;) {
      const ssize_t found = read(file_, bytes, count);
      if (found >= 0) return static_cast<std::size_t>(found);
      if (errno != EINTR) fail(path_);
    }
  }

  [[noreturn]] void refuse(const std::string& reason) const { throw UnreadableException(EINVAL, {path_, reason}); }

 private:
  // Before it is opened, where a link leads to.
  void requireRegular() const {
    struct stat status = {};
    if (stat(path_.c_str(), &status) == 0 && !S_ISREG(status.st_mode)) refuse(kNotRegular);
  }

  const std::string path_;
  int file_ = -1;
  struct stat status_ = {};
};

std::uint64_t allocatedIn(const struct stat& status) { return static_cast<std::uint64_t>(status.st_blocks) * kBlock; }

Entry entryOf(const std::string& name, const struct stat& status) {
  Entry entry;
  entry.name = name;
  if (S_ISREG(status.st_mode)) {
    entry.type = Entry::Type::File;
    entry.size = static_cast<std::uint64_t>(status.st_size);
  } else if (S_ISDIR(status.st_mode)) {
    entry.type = Entry::Type::Directory;
  } else if (S_ISLNK(status.st_mode)) {
    entry.type = Entry::Type::Link;
  }
  entry.allocated = allocatedIn(status);
  entry.modified = status.st_mtime;
  return entry;
}

}  // namespace

UnreadableException::UnreadableException(int code, Unreadable what)
    : FileUtilsIoException(code, "cannot read '" + what.path + "': " + what.reason), what_(std::move(what)) {}

Unreadable unreadableBy(const std::exception& error, const std::string& path) {
  if (const auto* known = dynamic_cast<const UnreadableException*>(&error)) return known->unreadable();
  if (const auto* own = dynamic_cast<const LarderException*>(&error)) return {path, own->description()};
  return {path, error.what()};
}

std::string strangenessOf(const std::string& path) {
  struct stat status = {};
  if (lstat(path.c_str(), &status) != 0 || S_ISREG(status.st_mode)) return "";
  return S_ISLNK(status.st_mode) ? "it is a link" : kNotRegular;
}

std::vector<Entry> listUntouched(const std::string& directory) {
  const int file = openUntouched(directory, O_DIRECTORY | O_NOFOLLOW);
  if (file < 0) fail(directory);
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(fdopendir(file), closedir);
  if (stream == nullptr) {
    close(file);
    fail(directory);
  }
  std::vector<Entry> entries;
  // NOLINTNEXTLINE(concurrency-mt-unsafe): the stream is this function's own
  while (const dirent* const found = readdir(stream.get())) {
    const char* const name = static_cast<const char*>(found->d_name);
    if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) continue;
    struct stat status = {};
    if (fstatat(file, name, &status, AT_SYMLINK_NOFOLLOW) == 0) entries.push_back(entryOf(name, status));
  }
  std::sort(entries.begin(), entries.end(), [](const Entry& a, const Entry& b) { return a.name < b.name; });
  return entries;
}

std::uint64_t countFiles(const std::string& directory) {
  std::uint64_t files = 0;
  try {
    for (const Entry& entry : listUntouched(directory)) {
      if (entry.type == Entry::Type::File) ++files;
      if (entry.type == Entry::Type::Directory) files += countFiles(directory + "/" + entry.name);
    }
  } catch (const UnreadableException&) {
    return files;  // whoever looks at the files finds it, too
  }
  return files;
}

std::uint64_t allocatedBy(const std::string& path) {
  struct stat status = {};
  return lstat(path.c_str(), &status) == 0 ? allocatedIn(status) : 0;
}

std::vector<unsigned char> UntouchedFiles::readFile(const std::string& path) {
  const Descriptor file(path, O_NOFOLLOW);
  const auto requireRoom = [&](std::uint64_t size) {
    if (size > largest_) file.refuse("more than the " + formatSize(largest_) + " that are read of such a file");
  };
  requireRoom(file.size());
  std::vector<unsigned char> bytes(static_cast<std::size_t>(file.size()) +
                                   1);  // so that the end is seen in a file that does not grow
  std::size_t filled = 0;
  while (const std::size_t count = file.readInto(bytes.data() + filled, bytes.size() - filled)) {
    filled += count;
    requireRoom(filled);
    if (filled == bytes.size()) bytes.resize(2 * filled);
  }
  bytes.resize(filled);
  return bytes;
}

void UntouchedFiles::readPieces(const std::string& path,
                                const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) {
  const Descriptor file(path, 0);
  constexpr std::size_t step = std::size_t{1} << 16U;
  std::vector<unsigned char> piece(step);
  while (const std::size_t count = file.readInto(piece.data(), step)) consume(piece.data(), count);
}

}  // namespace velmora::mobile::xplat::cellar::tools
