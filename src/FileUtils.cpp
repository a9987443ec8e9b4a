#include "FileUtils.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <new>
#include <stdexcept>
#include <utility>

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

namespace {

using std::string;

constexpr mode_t kFileMode = 0666;
constexpr mode_t kDirectoryMode = 0775;
constexpr mode_t kDirectoryBit = 0040000;

[[noreturn]] void throwSystemError(const string& operation, int error) {
  const string reason = std::strerror(error);  // NOLINT(concurrency-mt-unsafe): thread-safe in every libc we build for
  throw FileUtilsIoException(error, operation + (operation.empty() || reason.empty() ? "" : ": ") + reason);
}

// Opens a file for stdio without ever waiting: for the other end of a fifo, say.
int openDescriptor(const string& path, int flags) {
  const int descriptor = ::open(path.c_str(), flags | O_NONBLOCK | O_CLOEXEC, kFileMode);
  if (descriptor == -1) throwSystemError("Could not open file", errno);
  return descriptor;
}

// A stdio stream that is closed on every way out.
class File {
 public:
  static File forReading(const string& path) { return {openDescriptor(path, O_RDONLY), "rb"}; }
  static File forWriting(const string& path) { return {openDescriptor(path, O_WRONLY | O_CREAT | O_TRUNC), "wb"}; }
  ~File() {
    if (stream_ != nullptr) (void)std::fclose(stream_);
  }
  File(const File&) = delete;
  File& operator=(const File&) = delete;

  std::FILE* get() { return stream_; }

  struct stat status() {
    struct stat status {};
    if (::fstat(::fileno(stream_), &status) != 0) throwSystemError("Could not open file", errno);
    return status;
  }

  // Closing may be what writes the last bytes, so it can fail for want of space.
  void close() {
    if (std::fclose(std::exchange(stream_, nullptr)) != 0) throwSystemError("Could not close file", errno);
  }

 private:
  File(int descriptor, const char* mode) : stream_(::fdopen(descriptor, mode)) {
    if (stream_ != nullptr) return;
    const int error = errno;
    (void)::close(descriptor);
    throwSystemError("Could not open file", error);
  }

  std::FILE* stream_;
};

// What size a directory or a device claims to have differs from one file system to the next.
void throwUnlessRegular(File& file) {
  const auto status = file.status();
  if (S_ISDIR(status.st_mode)) throwSystemError("File read failed", EISDIR);
  if (!S_ISREG(status.st_mode)) throwSystemError("Could not seek to end of file", ESPIPE);
}

std::size_t sizeOf(File& file) {
  if (std::fseek(file.get(), 0, SEEK_END) != 0) throwSystemError("Could not seek to end of file", errno);
  const long size = std::ftell(file.get());
  if (size == -1) throwSystemError("Could not determine size of file", errno);
  if (std::fseek(file.get(), 0, SEEK_SET) != 0) throwSystemError("Could not seek to start of file", errno);
  return static_cast<std::size_t>(size);
}

std::vector<unsigned char> allocate(std::size_t size) {
  try {
    return std::vector<unsigned char>(size);
  } catch (const std::bad_alloc&) {
  } catch (const std::length_error&) {
  }
  throwSystemError("File read failed", ENOMEM);
}

bool isConcatenation(std::string_view whole, std::string_view first, std::string_view second) {
  return whole.size() == first.size() + second.size() && whole.substr(0, first.size()) == first &&
         whole.substr(first.size()) == second;
}

// A descriptor that is closed on every way out.
class Descriptor {
 public:
  Descriptor(const string& path, int flags) : descriptor_(openDescriptor(path, flags)) {}
  ~Descriptor() {
    if (descriptor_ != -1) (void)::close(descriptor_);
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int get() const { return descriptor_; }

  // Closing may be what writes the last bytes, so it can fail for want of space.
  void close() {
    if (::close(std::exchange(descriptor_, -1)) != 0) throwSystemError("Could not close file", errno);
  }

 private:
  int descriptor_;
};

void writeAll(const Descriptor& file, const std::vector<unsigned char>& data) {
  for (std::size_t written = 0; written < data.size();) {
    const auto count = ::write(file.get(), data.data() + written, data.size() - written);
    if (count >= 0) {
      written += static_cast<std::size_t>(count);
    } else if (errno != EINTR) {
      throwSystemError("File write failed", errno);
    }
  }
}

// A directory stream that is closed on every way out.
class DirectoryStream {
 public:
  explicit DirectoryStream(DIR* stream) : stream_(stream) {
    if (stream == nullptr) throwSystemError("Could not open directory", errno);
  }
  ~DirectoryStream() { (void)::closedir(stream_); }
  DirectoryStream(const DirectoryStream&) = delete;
  DirectoryStream& operator=(const DirectoryStream&) = delete;

  int descriptor() const { return ::dirfd(stream_); }

  // The next entry other than "." and "..", or null at the end.
  const dirent* next() {
    const dirent* entry = nullptr;
    do {
      entry = ::readdir(stream_);  // NOLINT(concurrency-mt-unsafe): the stream is this object's own
    } while (entry != nullptr && (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0));
    return entry;
  }

 private:
  DIR* stream_;
};

// Some file systems do not tell in the directory itself.
bool isRegular(const DirectoryStream& directory, const dirent& entry) {
  if (entry.d_type != DT_UNKNOWN) return entry.d_type == DT_REG;
  struct stat status {};
  return ::fstatat(directory.descriptor(), entry.d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode);
}

// Opens a directory to empty it: whatever has become of the path meanwhile, a link is not followed.
DIR* openUnlessLink(const string& path) {
  const int descriptor = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (descriptor == -1) return nullptr;
  DIR* stream = ::fdopendir(descriptor);
  if (stream == nullptr) {
    const int error = errno;
    (void)::close(descriptor);
    errno = error;
  }
  return stream;
}

// The last character that counts for the last component: trailing slashes are skipped, but never the first character.
std::size_t lastComponentEnd(const string& path) {
  std::size_t end = path.size() - 1;
  while (end > 0 && path[end] == '/') --end;
  return end;
}

// A slash at the end would make the system follow a link.
string withoutSlashes(const string& path) { return path.substr(0, lastComponentEnd(path) + 1); }

}  // namespace

FileUtils::Info::Info(const string& path_, long long size_, Type type_) : path(path_), size(size_), type(type_) {}

FileUtils::DiskSpace::DiskSpace(long long total_, long long available_) : total(total_), available(available_) {}

FileUtils::~FileUtils() = default;

string FileUtils::combinePath(const string& a, const string& b) {
  return a.empty() || a.back() == '/' ? a + b : a + "/" + b;
}

string FileUtils::basename(const string& path) {
  if (path.empty()) return path;
  const std::size_t end = lastComponentEnd(path);
  const std::size_t slash = path.rfind('/', end);
  return slash == string::npos ? path : path.substr(slash + 1, end - slash);
}

string FileUtils::parentPath(const string& path) {
  if (path.empty()) return path;
  const std::size_t slash = path.rfind('/', lastComponentEnd(path));
  return slash == string::npos ? "" : path.substr(0, slash);
}

std::vector<unsigned char> FileUtils::readFile(const string& path) {
  File file = File::forReading(path);
  throwUnlessRegular(file);
  (void)std::setvbuf(file.get(), nullptr, _IONBF, 0);  // straight into the result
  std::vector<unsigned char> data = allocate(sizeOf(file));
  errno = 0;
  if (!data.empty() && std::fread(data.data(), 1, data.size(), file.get()) != data.size()) {
    throwSystemError("File read failed", errno != 0 ? errno : EIO);  // the file has become shorter meanwhile
  }
  file.close();
  return data;
}

void FileUtils::writeFile(const string& path, const std::vector<unsigned char>& data) {
  File file = File::forWriting(path);
  if (S_ISFIFO(file.status().st_mode)) throwSystemError("Could not open file", ENXIO);  // as when nobody reads it
  if (!data.empty() && std::fwrite(data.data(), 1, data.size(), file.get()) != data.size()) {
    throwSystemError("File write failed", errno);
  }
  file.close();
}

void FileUtils::deleteFile(const string& path) {
  if (std::remove(path.c_str()) != 0) throwSystemError("Could not remove file", errno);
}

void FileUtils::recursiverDirectoryDelete(const string& path) {
  if (isSymLink(path)) return deleteFile(withoutSlashes(path));
  DirectoryStream directory(openUnlessLink(path));
  while (const dirent* entry = directory.next()) {
    const string entryPath = combinePath(path, entry->d_name);
    if (entry->d_type == DT_DIR) {
      recursiverDirectoryDelete(entryPath);
    } else {
      deleteFile(entryPath);
    }
  }
  deleteFile(path);
}

void FileUtils::rename(const string& from, const string& to) {
  if (std::rename(from.c_str(), to.c_str()) != 0) throwSystemError("", errno);
}

void FileUtils::createDirectory(const string& path, bool recursive) {
  if (path.empty()) return;
  if (pathExists(path)) {
    if (isDirectory(path)) return;
    throw FileUtilsIoException(0, "Could not create directory at \"" + path + "\": file exists");
  }
  if (recursive) createDirectory(parentPath(path), true);
  if (::mkdir(path.c_str(), kDirectoryMode) == 0) return;
  const int error = errno;
  if (error == EEXIST && isDirectory(path)) return;  // somebody else created it just now
  throwSystemError("", error);
}

void FileUtils::createSymLink(const string& linkPath, const string& targetPath) {
  if (::symlink(targetPath.c_str(), linkPath.c_str()) != 0) throwSystemError("Could not create symlink", errno);
}

bool FileUtils::isDirectory(const string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 && (status.st_mode & kDirectoryBit) != 0;
}

bool FileUtils::pathExists(const string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0;
}

FileUtils::DiskSpace FileUtils::getDiskSpace(const string& path) {
  struct statfs status {};
  if (::statfs(path.c_str(), &status) != 0) {
    throwSystemError("Could not get file system statistics for the path \"" + path + "\"", errno);
  }
  const auto blockSize = static_cast<std::uint64_t>(status.f_bsize);
  return {static_cast<long long>(status.f_blocks * blockSize), static_cast<long long>(status.f_bavail * blockSize)};
}

std::vector<string> FileUtils::listDirectories(const string& path) {
  std::vector<string> names;
  DirectoryStream directory(::opendir(path.c_str()));
  while (const dirent* entry = directory.next()) {
    if (entry->d_type == DT_DIR) names.emplace_back(entry->d_name);
  }
  return names;
}

std::vector<FileUtils::Info> FileUtils::listDirectory(const string& path) {
  std::vector<Info> entries;
  DirectoryStream directory(::opendir(path.c_str()));
  const string inDirectory = FileUtils::combinePath(path, "");
  while (const dirent* entry = directory.next()) {
    const string entryPath = combinePath(path, entry->d_name);
    if (entry->d_type == DT_REG) {
      // By its name alone, for which the system need not walk the whole path; unless a subclass names it otherwise.
      const bool isNamedAsItLies = isConcatenation(entryPath, inDirectory, entry->d_name);
      struct stat status {};
      const int result = isNamedAsItLies ? ::fstatat(directory.descriptor(), entry->d_name, &status, 0)
                                         : ::stat(entryPath.c_str(), &status);
      if (result == 0) entries.emplace_back(entryPath, status.st_size, Type::File);
    } else if (entry->d_type == DT_LNK) {
      entries.emplace_back(entryPath, 0, Type::SymLink);
    } else if (entry->d_type == DT_DIR) {
      entries.emplace_back(entryPath, 0, Type::Directory);
    }
  }
  return entries;
}

bool FileUtils::isSymLink(const string& path) {
  if (path.empty()) return false;
  struct stat status {};
  return ::lstat(withoutSlashes(path).c_str(), &status) == 0 && S_ISLNK(status.st_mode);
}

std::vector<string> FileUtils::listOtherEntries(const string& path) {
  std::vector<string> paths;
  DIR* const stream = path.empty() ? nullptr : openUnlessLink(withoutSlashes(path));
  if (stream == nullptr) return paths;
  DirectoryStream directory(stream);
  while (const dirent* entry = directory.next()) {
    const bool isListed = entry->d_type == DT_REG || entry->d_type == DT_LNK || entry->d_type == DT_DIR;
    if (!isListed) paths.push_back(combinePath(path, entry->d_name));
  }
  return paths;
}

void FileUtils::createFile(const string& path, const std::vector<unsigned char>& data) {
  Descriptor file(path, O_WRONLY | O_CREAT | O_EXCL);
  try {
    writeAll(file, data);
    file.close();
  } catch (...) {
    (void)std::remove(path.c_str());
    throw;
  }
}

void FileUtils::readPieces(const string& path,
                           const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) {
  constexpr std::size_t kPiece = std::size_t{64} << 10U;
  File file = File::forReading(path);
  throwUnlessRegular(file);
  (void)std::setvbuf(file.get(), nullptr, _IONBF, 0);
  std::vector<unsigned char> piece(kPiece);
  while (const std::size_t count = std::fread(piece.data(), 1, piece.size(), file.get())) consume(piece.data(), count);
  if (std::ferror(file.get()) != 0) throwSystemError("File read failed", errno);
}

void FileUtils::sync(const string& path) {
  const Descriptor file(path, O_RDONLY);
  if (::fsync(file.get()) != 0) throwSystemError("Could not sync file", errno);
}

void FileUtils::beginSync(const string& path) noexcept {
#if defined(SYNC_FILE_RANGE_WRITE) && (!defined(__ANDROID_API__) || __ANDROID_API__ >= 26)
  const int file = ::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  if (file < 0) return;
  (void)::sync_file_range(file, 0, 0, SYNC_FILE_RANGE_WRITE);  // up to the end
  (void)::close(file);
#else
  static_cast<void>(path);
#endif
}

std::vector<string> FileUtils::listFiles(const string& path) {
  std::vector<string> names;
  DirectoryStream directory(::opendir(path.c_str()));
  errno = 0;
  while (const dirent* entry = directory.next()) {
    if (isRegular(directory, *entry)) names.emplace_back(entry->d_name);
    errno = 0;
  }
  if (errno != 0) throwSystemError("Could not read directory", errno);
  return names;
}

}  // namespace velmora::mobile::xplat::cellar
