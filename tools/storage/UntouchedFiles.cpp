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

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::uint64_t kBlock = 512;  // the unit of st_blocks, whatever the file system's own blocks are

[[noreturn]] void fail(const std::string& path) {
  const int code = errno;
  throw FileUtilsIoException(code, "cannot read '" + path + "': " + std::generic_category().message(code));
}

// Only the owner of a file, or root, may read it without changing its access date.
int openUntouched(const std::string& path, int flags) {
  const int file = open(path.c_str(), flags | O_RDONLY | O_CLOEXEC | O_NOATIME);
  return file >= 0 || errno != EPERM ? file : open(path.c_str(), flags | O_RDONLY | O_CLOEXEC);
}

// Does not wait for the other end of a fifo.
class Descriptor {
 public:
  explicit Descriptor(const std::string& path) : file_(openUntouched(path, O_NONBLOCK)) {
    if (file_ < 0) fail(path);
  }
  ~Descriptor() { close(file_); }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int get() const { return file_; }

  bool isRegularFile() const {
    struct stat status = {};
    return fstat(file_, &status) == 0 && S_ISREG(status.st_mode);
  }

 private:
  const int file_;
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

std::vector<Entry> listUntouched(const std::string& directory) {
  const int file = openUntouched(directory, O_DIRECTORY);
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
  for (const Entry& entry : listUntouched(directory)) {
    if (entry.type == Entry::Type::File) ++files;
    if (entry.type == Entry::Type::Directory) files += countFiles(directory + "/" + entry.name);
  }
  return files;
}

std::uint64_t allocatedBy(const std::string& path) {
  struct stat status = {};
  return lstat(path.c_str(), &status) == 0 ? allocatedIn(status) : 0;
}

std::vector<unsigned char> UntouchedFiles::readFile(const std::string& path) {
  std::vector<unsigned char> bytes;
  readPieces(path, [&bytes](const unsigned char* piece, std::size_t count) {
    bytes.insert(bytes.end(), piece, piece + count);
  });
  return bytes;
}

void UntouchedFiles::readPieces(const std::string& path,
                                const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) {
  const Descriptor file(path);
  if (!file.isRegularFile()) throw FileUtilsIoException(EINVAL, "cannot read '" + path + "': not a regular file");
  constexpr std::size_t step = std::size_t{1} << 16U;
  std::vector<unsigned char> piece(step);
  for (;;) {
    const ssize_t count = read(file.get(), piece.data(), step);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) fail(path);
    if (count == 0) return;
    consume(piece.data(), static_cast<std::size_t>(count));
  }
}

}  // namespace velmora::mobile::xplat::cellar::tools
