#include "FileUtils.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <functional>
#include <iterator>
#include <stdexcept>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace {

// What the next seek to the end, tell and seek to the start do instead of succeeding. Some steps of reading a file fail
// on no real file system, so this program puts its own functions in the place of the C library's.
struct StreamFaults {
  int seekToEnd = 0;  // errno to fail with; 0: succeed
  int tell = 0;
  int seekToStart = 0;
  long added = 0;                // to the size that tell gives
  bool losesDescriptor = false;  // when seeking to the start
};
thread_local StreamFaults streamFaults;

int failWith(int error) {
  errno = error;
  return -1;
}

}  // namespace

extern "C" {

__attribute__((visibility("default"))) int fseek(FILE* stream, long offset, int whence) {
  if (whence == SEEK_END && streamFaults.seekToEnd != 0) return failWith(streamFaults.seekToEnd);
  if (whence == SEEK_SET && streamFaults.seekToStart != 0) return failWith(streamFaults.seekToStart);
  const int result = fseeko(stream, offset, whence);
  if (whence == SEEK_SET && streamFaults.losesDescriptor) close(fileno(stream));
  return result;
}

__attribute__((visibility("default"))) long ftell(FILE* stream) {
  if (streamFaults.tell != 0) return failWith(streamFaults.tell);
  const off_t position = ftello(stream);
  if (position > LONG_MAX) return failWith(EOVERFLOW);
  return static_cast<long>(position) + streamFaults.added;
}
}

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::Bytes;
using test::FaultyFileUtils;
using test::Operation;
using testing::ElementsAre;
using testing::UnorderedElementsAre;
using Type = FileUtils::Type;

Bytes bytes(const string& text) { return {text.begin(), text.end()}; }

// Faults of the stream functions, for as long as it lives.
class WithStreamFaults {
 public:
  explicit WithStreamFaults(const StreamFaults& faults) { streamFaults = faults; }
  WithStreamFaults(const WithStreamFaults&) = delete;
  WithStreamFaults& operator=(const WithStreamFaults&) = delete;
  ~WithStreamFaults() { streamFaults = {}; }
};

// A lower limit of a resource, for as long as it lives.
class ResourceLimit {
 public:
  ResourceLimit(decltype(RLIMIT_FSIZE) resource, rlim_t limit) : resource_(resource) {
    getrlimit(resource_, &before_);
    const rlimit lowered{limit, before_.rlim_max};
    if (setrlimit(resource_, &lowered) != 0) throw std::runtime_error("cannot lower a limit");
  }
  ResourceLimit(const ResourceLimit&) = delete;
  ResourceLimit& operator=(const ResourceLimit&) = delete;
  ~ResourceLimit() { setrlimit(resource_, &before_); }

 private:
  decltype(RLIMIT_FSIZE) resource_;
  rlimit before_{};
};

// Files cannot grow beyond `size` bytes, as on a full disk; exceeding it is an error instead of a signal.
class FileSizeLimit {
 public:
  explicit FileSizeLimit(rlim_t size) : handler_(std::signal(SIGXFSZ, SIG_IGN)), limit_(RLIMIT_FSIZE, size) {}
  FileSizeLimit(const FileSizeLimit&) = delete;
  FileSizeLimit& operator=(const FileSizeLimit&) = delete;
  ~FileSizeLimit() { std::signal(SIGXFSZ, handler_); }

 private:
  void (*handler_)(int);
  ResourceLimit limit_;
};

class FileModeMask {
 public:
  explicit FileModeMask(mode_t mask) : before_(umask(mask)) {}
  FileModeMask(const FileModeMask&) = delete;
  FileModeMask& operator=(const FileModeMask&) = delete;
  ~FileModeMask() { umask(before_); }

 private:
  mode_t before_;
};

class WorkingDirectory {
 public:
  explicit WorkingDirectory(const string& path) : before_(std::filesystem::current_path()) {
    std::filesystem::current_path(path);
  }
  WorkingDirectory(const WorkingDirectory&) = delete;
  WorkingDirectory& operator=(const WorkingDirectory&) = delete;
  ~WorkingDirectory() { std::filesystem::current_path(before_); }

 private:
  std::filesystem::path before_;
};

std::ptrdiff_t openDescriptors() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), std::filesystem::directory_iterator());
}

// The number that the next descriptor opened would get.
rlim_t nextDescriptor() {
  const int descriptor = open("/dev/null", O_RDONLY | O_CLOEXEC);
  close(descriptor);
  return static_cast<rlim_t>(descriptor);
}

mode_t permissionsOf(const string& path) {
  struct stat status {};
  if (stat(path.c_str(), &status) != 0) throw std::runtime_error("no " + path);
  return status.st_mode & 07777U;
}

class FileUtilsTest : public testing::Test {
 protected:
  // The operation fails with exactly this, and leaves no descriptor open.
  static void expectFailure(const std::function<void()>& operation, int code, const string& description) {
    const std::ptrdiff_t before = openDescriptors();
    try {
      operation();
      ADD_FAILURE() << "expected: " << description;
    } catch (const FileUtilsIoException& exception) {
      EXPECT_EQ(exception.code(), code) << exception.what();
      EXPECT_EQ(exception.description(), description);
      EXPECT_STREQ(exception.domain(), "QZLarderIoErrorErrorDomain");
    }
    EXPECT_EQ(openDescriptors(), before) << "leaks a descriptor: " << description;
  }

  // As above, for a failed system call.
  static void expectSystemFailure(const std::function<void()>& operation, int code, const string& text) {
    expectFailure(operation, code, (text.empty() ? "" : text + ": ") + std::strerror(code));
  }

  string link(const string& name, const string& target) {
    std::filesystem::create_symlink(target, directory_.file(name));
    return directory_.file(name);
  }

  string makeFifo(const string& name) {
    std::filesystem::create_directories(std::filesystem::path(directory_.file(name)).parent_path());
    if (mkfifo(directory_.file(name).c_str(), 0600) != 0) throw std::runtime_error("cannot make a fifo");
    return directory_.file(name);
  }

  string makeSocket(const string& name) {
    if (mknod(directory_.file(name).c_str(), S_IFSOCK | 0600U, 0) != 0)
      throw std::runtime_error("cannot make a socket");
    return directory_.file(name);
  }

  // A path that goes round in circles.
  string circle() { return link("circle", "circle"); }

  string tooLongName() { return directory_.file(string(300, 'n')); }

  test::TemporaryDirectory directory_;
  FileUtils files_;
};

// Path strings

TEST_F(FileUtilsTest, CombiningPutsOneSlashBetweenUnlessThereIsOne) {
  EXPECT_EQ(files_.combinePath("", "x"), "x");
  EXPECT_EQ(files_.combinePath("/a/", "b"), "/a/b");
  EXPECT_EQ(files_.combinePath("/a", "b"), "/a/b");
  EXPECT_EQ(files_.combinePath("a", "b/c"), "a/b/c");
  EXPECT_EQ(files_.combinePath("/", "b"), "/b");
  EXPECT_EQ(files_.combinePath("", ""), "");
  EXPECT_EQ(files_.combinePath("a", ""), "a/");
}

TEST_F(FileUtilsTest, CombiningNormalisesNothing) {
  EXPECT_EQ(files_.combinePath("/x", "/y"), "/x//y");
  EXPECT_EQ(files_.combinePath("/x/", "/y"), "/x//y");
  EXPECT_EQ(files_.combinePath("/x//", "../y/."), "/x//../y/.");
  EXPECT_EQ(files_.combinePath("", "/y"), "/y");
}

TEST_F(FileUtilsTest, TheBaseNameIsTheLastComponentWithoutTrailingSlashes) {
  EXPECT_EQ(files_.basename("/a/b"), "b");
  EXPECT_EQ(files_.basename("/a/b//"), "b");
  EXPECT_EQ(files_.basename("abc"), "abc");
  EXPECT_EQ(files_.basename("/a"), "a");
  EXPECT_EQ(files_.basename("/a/"), "a");
  EXPECT_EQ(files_.basename("a//b"), "b");
  EXPECT_EQ(files_.basename("/a/.."), "..");
}

TEST_F(FileUtilsTest, ABaseNameWithoutASlashBeforeItIsTheWholeInput) {
  EXPECT_EQ(files_.basename("a/"), "a/");
  EXPECT_EQ(files_.basename("a///"), "a///");
}

TEST_F(FileUtilsTest, TheBaseNameOfSlashesAloneAndOfNothingIsEmpty) {
  EXPECT_EQ(files_.basename("/"), "");
  EXPECT_EQ(files_.basename("//"), "");
  EXPECT_EQ(files_.basename("///"), "");
  EXPECT_EQ(files_.basename(""), "");
}

TEST_F(FileUtilsTest, TheParentIsWhatStandsBeforeTheLastComponent) {
  EXPECT_EQ(files_.parentPath("/a/b/"), "/a");
  EXPECT_EQ(files_.parentPath("/a/b"), "/a");
  EXPECT_EQ(files_.parentPath("a/b"), "a");
  EXPECT_EQ(files_.parentPath("/a/b/c//"), "/a/b");
}

TEST_F(FileUtilsTest, TheParentOfATopLevelPathIsEmpty) {
  EXPECT_EQ(files_.parentPath("abc"), "");
  EXPECT_EQ(files_.parentPath("/"), "");
  EXPECT_EQ(files_.parentPath("//"), "");
  EXPECT_EQ(files_.parentPath("/a"), "");
  EXPECT_EQ(files_.parentPath("/a/"), "");
  EXPECT_EQ(files_.parentPath("a/"), "");
  EXPECT_EQ(files_.parentPath(""), "");
}

TEST_F(FileUtilsTest, TheParentKeepsSlashesBeforeTheOneItIsCutAt) {
  EXPECT_EQ(files_.parentPath("a//b"), "a/");
  EXPECT_EQ(files_.parentPath("/a///b"), "/a//");
  EXPECT_EQ(files_.parentPath("//a"), "/");
}

// Reading and writing

TEST_F(FileUtilsTest, WhatIsWrittenIsReadBack) {
  Bytes all;
  for (int i = 0; i < 256 * 1024; ++i) all.push_back(static_cast<unsigned char>(i % 251));
  files_.writeFile(directory_.file("file"), all);
  EXPECT_EQ(files_.readFile(directory_.file("file")), all);
}

TEST_F(FileUtilsTest, ReadingAnEmptyFileGivesNothing) {
  EXPECT_TRUE(files_.readFile(directory_.write("empty", "")).empty());
}

TEST_F(FileUtilsTest, ZeroBytesAndLineEndsAreBytesLikeOthers) {
  const string content("a\0b\r\n\xff\x1a", 7);
  EXPECT_EQ(files_.readFile(directory_.write("file", content)), bytes(content));
}

TEST_F(FileUtilsTest, WritingReplacesALongerFile) {
  const string path = directory_.write("file", "a long content");
  files_.writeFile(path, bytes("short"));
  EXPECT_EQ(directory_.read("file"), "short");
  files_.writeFile(path, {});
  EXPECT_EQ(directory_.read("file"), "");
}

TEST_F(FileUtilsTest, WritingLeavesNothingElseInTheDirectory) {
  files_.writeFile(directory_.file("file"), bytes("x"));
  EXPECT_THAT(directory_.names(), ElementsAre("file"));
}

TEST_F(FileUtilsTest, WritingThroughALinkWritesItsTarget) {
  directory_.write("target", "");
  files_.writeFile(link("link", "target"), bytes("x"));
  EXPECT_EQ(directory_.read("target"), "x");
}

TEST_F(FileUtilsTest, NeitherReadingNorWritingLeavesADescriptorOpen) {
  const std::ptrdiff_t before = openDescriptors();
  files_.writeFile(directory_.file("file"), bytes("x"));
  files_.readFile(directory_.file("file"));
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(FileUtilsTest, AFileThatCannotBeOpenedIsReported) {
  expectSystemFailure([&] { files_.readFile(directory_.file("missing")); }, ENOENT, "Could not open file");
  expectSystemFailure([&] { files_.readFile(""); }, ENOENT, "Could not open file");
  expectSystemFailure([&] { files_.readFile(link("dangling", "nowhere")); }, ENOENT, "Could not open file");
  expectSystemFailure([&] { files_.readFile(directory_.write("file", "") + "/below"); }, ENOTDIR,
                      "Could not open file");
  expectSystemFailure([&] { files_.readFile(tooLongName()); }, ENAMETOOLONG, "Could not open file");
  expectSystemFailure([&] { files_.readFile(circle()); }, ELOOP, "Could not open file");
  expectSystemFailure([&] { files_.readFile(makeSocket("socket")); }, ENXIO, "Could not open file");
}

TEST_F(FileUtilsTest, AFileThatCannotBeCreatedIsReported) {
  expectSystemFailure([&] { files_.writeFile(directory_.file("missing/file"), {}); }, ENOENT, "Could not open file");
  expectSystemFailure([&] { files_.writeFile(directory_.path(), {}); }, EISDIR, "Could not open file");
  expectSystemFailure([&] { files_.writeFile(tooLongName(), {}); }, ENAMETOOLONG, "Could not open file");
  expectSystemFailure([&] { files_.writeFile(circle(), {}); }, ELOOP, "Could not open file");
}

TEST_F(FileUtilsTest, RunningOutOfDescriptorsIsReported) {
#if defined(CELLAR_SANITIZES_ADDRESSES)
  GTEST_SKIP() << "the sanitizers need descriptors of their own to look at memory";
#endif
  const string path = directory_.write("file", "x");
  const auto withoutDescriptors = [&](const std::function<void()>& operation) {
    return [=] {
      const ResourceLimit limit(RLIMIT_NOFILE, nextDescriptor());
      operation();
    };
  };
  expectSystemFailure(withoutDescriptors([&] { files_.readFile(path); }), EMFILE, "Could not open file");
  expectSystemFailure(withoutDescriptors([&] { files_.writeFile(path, {}); }), EMFILE, "Could not open file");
  expectSystemFailure(withoutDescriptors([&] { files_.listDirectory(directory_.path()); }), EMFILE,
                      "Could not open directory");
  expectSystemFailure(withoutDescriptors([&] { files_.listDirectories(directory_.path()); }), EMFILE,
                      "Could not open directory");
  expectSystemFailure(withoutDescriptors([&] { files_.recursiverDirectoryDelete(directory_.path()); }), EMFILE,
                      "Could not open directory");
  EXPECT_EQ(directory_.read("file"), "x");
}

TEST_F(FileUtilsTest, AFileThatCannotSeekToItsEndIsReported) {
  const string path = directory_.write("file", "x");
  StreamFaults wanted;
  wanted.seekToEnd = EIO;
  const WithStreamFaults faults(wanted);
  expectSystemFailure([&] { files_.readFile(path); }, EIO, "Could not seek to end of file");
}

TEST_F(FileUtilsTest, APipeCannotBeReadAsAFile) {
  const test::Watchdog watchdog(60);
  const string path = makeFifo("fifo");
  expectSystemFailure([&] { files_.readFile(path); }, ESPIPE, "Could not seek to end of file");
  expectSystemFailure([&] { files_.readFile(link("link", "fifo")); }, ESPIPE, "Could not seek to end of file");
  const int writer = open(path.c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_EQ(write(writer, "x", 1), 1);
  expectSystemFailure([&] { files_.readFile(path); }, ESPIPE, "Could not seek to end of file");
  close(writer);
}

TEST_F(FileUtilsTest, APipeCannotBeWrittenAsAFile) {
  const test::Watchdog watchdog(60);
  const string path = makeFifo("fifo");
  expectSystemFailure([&] { files_.writeFile(path, bytes("x")); }, ENXIO, "Could not open file");
  expectSystemFailure([&] { files_.writeFile(link("link", "fifo"), {}); }, ENXIO, "Could not open file");
  const int reader = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  expectSystemFailure([&] { files_.writeFile(path, bytes("x")); }, ENXIO, "Could not open file");
  char byte = 0;
  EXPECT_EQ(read(reader, &byte, 1), 0) << "what was not stored has been passed on";
  close(reader);
}

TEST_F(FileUtilsTest, AFileWhoseSizeCannotBeToldIsReported) {
  const string path = directory_.write("file", "x");
  StreamFaults wanted;
  wanted.tell = EOVERFLOW;
  const WithStreamFaults faults(wanted);
  expectSystemFailure([&] { files_.readFile(path); }, EOVERFLOW, "Could not determine size of file");
}

TEST_F(FileUtilsTest, AFileThatCannotSeekToItsStartIsReported) {
  const string path = directory_.write("file", "x");
  StreamFaults wanted;
  wanted.seekToStart = EIO;
  const WithStreamFaults faults(wanted);
  expectSystemFailure([&] { files_.readFile(path); }, EIO, "Could not seek to start of file");
}

TEST_F(FileUtilsTest, AReadThatFailsIsReported) {
  const string path = directory_.write("file", string(1U << 20U, 'x'));  // more than seeking reads ahead
  StreamFaults wanted;
  wanted.losesDescriptor = true;
  const WithStreamFaults faults(wanted);
  expectSystemFailure([&] { files_.readFile(path); }, EBADF, "File read failed");
}

TEST_F(FileUtilsTest, AFileThatBecameShorterMeanwhileIsAFailedReadWithACode) {
  const string path = directory_.write("file", "x");
  StreamFaults wanted;
  wanted.added = 10;
  const WithStreamFaults faults(wanted);
  try {
    files_.readFile(path);
    FAIL();
  } catch (const FileUtilsIoException& exception) {
    EXPECT_NE(exception.code(), 0);
    EXPECT_EQ(exception.description(), string("File read failed: ") + std::strerror(exception.code()));
  }
}

TEST_F(FileUtilsTest, AStreamThatCannotBeClosedAfterReadingIsReported) {
  const string path = directory_.write("empty", "");
  StreamFaults wanted;
  wanted.losesDescriptor = true;
  const WithStreamFaults faults(wanted);
  expectSystemFailure([&] { files_.readFile(path); }, EBADF, "Could not close file");
}

TEST_F(FileUtilsTest, ReadingADirectoryIsAnIoFailureOnEveryFileSystem) {
  const std::ptrdiff_t before = openDescriptors();
  for (const string& path : {directory_.path(), string("/"), string("/proc"), string("/proc/self"), string("/sys"),
                             string("/dev"), string("/dev/shm")}) {
    EXPECT_THROW(files_.readFile(path), FileUtilsIoException) << path;
  }
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(FileUtilsTest, ADeviceCannotBeReadAsAFile) {
  for (const char* path : {"/dev/null", "/dev/zero", "/dev/full"}) {
    expectSystemFailure([&] { files_.readFile(path); }, ESPIPE, "Could not seek to end of file");
  }
}

TEST_F(FileUtilsTest, AFileWithoutASizeOfItsOwnGivesBytesOrIsAnIoFailure) {
  for (const char* path : {"/proc/self/mem", "/proc/self/status"}) {
    try {
      EXPECT_LT(files_.readFile(path).size(), 1U << 20U) << path;
    } catch (const FileUtilsIoException& exception) {
      EXPECT_NE(exception.code(), 0) << path;
    }
  }
}

TEST_F(FileUtilsTest, ASmallWriteToAFullDiskFailsWhenItIsClosed) {
  expectSystemFailure([&] { files_.writeFile("/dev/full", bytes("x")); }, ENOSPC, "Could not close file");
}

TEST_F(FileUtilsTest, ALargeWriteToAFullDiskFails) {
  expectSystemFailure([&] { files_.writeFile("/dev/full", Bytes(1U << 20U)); }, ENOSPC, "File write failed");
}

TEST_F(FileUtilsTest, AWriteThatHitsTheFileSizeLimitLeavesItsBeginning) {
  expectSystemFailure(
      [&] {
        const FileSizeLimit limit(10);
        files_.writeFile(directory_.file("small"), bytes("0123456789abcdef"));
      },
      EFBIG, "Could not close file");
  EXPECT_EQ(directory_.read("small"), "0123456789");
  expectSystemFailure(
      [&] {
        const FileSizeLimit limit(4096);
        files_.writeFile(directory_.file("large"), Bytes(1U << 20U));
      },
      EFBIG, "File write failed");
  EXPECT_EQ(directory_.read("large").size(), 4096U);
}

// Deleting, renaming, linking

TEST_F(FileUtilsTest, DeletingRemovesAFileAnEmptyDirectoryOrALink) {
  directory_.write("target", "stays");
  for (const string& path : {directory_.write("file", "x"), directory_.makeDirectory("empty"), link("link", "target"),
                             link("dangling", "nowhere"), makeFifo("fifo")}) {
    files_.deleteFile(path);
  }
  EXPECT_THAT(directory_.names(), ElementsAre("target"));
  EXPECT_EQ(directory_.read("target"), "stays");
}

TEST_F(FileUtilsTest, WhatCannotBeDeletedIsReported) {
  directory_.write("full/file", "x");
  expectSystemFailure([&] { files_.deleteFile(directory_.file("missing")); }, ENOENT, "Could not remove file");
  expectSystemFailure([&] { files_.deleteFile(directory_.file("full")); }, ENOTEMPTY, "Could not remove file");
  expectSystemFailure([&] { files_.deleteFile(directory_.file("full/file/below")); }, ENOTDIR, "Could not remove file");
  expectSystemFailure([&] { files_.deleteFile(tooLongName()); }, ENAMETOOLONG, "Could not remove file");
  EXPECT_TRUE(directory_.exists("full/file"));
}

TEST_F(FileUtilsTest, RenamingMovesFilesAndDirectoriesAndReplacesAFile) {
  directory_.write("old", "replaced");
  files_.rename(directory_.write("from", "content"), directory_.file("old"));
  EXPECT_EQ(directory_.read("old"), "content");
  directory_.write("tree/a/b", "deep");
  files_.rename(directory_.file("tree"), directory_.file("moved"));
  EXPECT_EQ(directory_.read("moved/a/b"), "deep");
  EXPECT_THAT(directory_.names(), ElementsAre("moved", "old"));
}

TEST_F(FileUtilsTest, RenamingALinkMovesTheLink) {
  directory_.write("target", "x");
  files_.rename(link("link", "target"), directory_.file("moved"));
  EXPECT_TRUE(files_.isSymLink(directory_.file("moved")));
  EXPECT_EQ(directory_.read("target"), "x");
}

TEST_F(FileUtilsTest, AFailedRenameIsTheErrorTextAlone) {
  const string file = directory_.write("file", "x");
  const string full = directory_.file("full");
  directory_.write("full/file", "x");
  expectFailure([&] { files_.rename(directory_.file("missing"), file); }, ENOENT, "No such file or directory");
  expectSystemFailure([&] { files_.rename(file, full); }, EISDIR, "");
  expectSystemFailure([&] { files_.rename(directory_.makeDirectory("empty"), full); }, ENOTEMPTY, "");
  expectSystemFailure([&] { files_.rename(full, directory_.file("full/inside")); }, EINVAL, "");
  expectSystemFailure([&] { files_.rename(file, "/proc/file"); }, EXDEV, "");
  EXPECT_EQ(directory_.read("file"), "x");
}

TEST_F(FileUtilsTest, ALinkIsCreatedAtTheFirstPathPointingToTheSecond) {
  directory_.write("target", "content");
  files_.createSymLink(directory_.file("link"), "target");
  EXPECT_EQ(std::filesystem::read_symlink(directory_.file("link")), "target");
  EXPECT_EQ(directory_.read("link"), "content");
  files_.createSymLink(directory_.file("dangling"), "nowhere");
  EXPECT_TRUE(directory_.exists("dangling"));
}

TEST_F(FileUtilsTest, ALinkThatCannotBeCreatedIsReported) {
  const string file = directory_.write("file", "x");
  expectSystemFailure([&] { files_.createSymLink(file, "target"); }, EEXIST, "Could not create symlink");
  expectSystemFailure([&] { files_.createSymLink(directory_.file("missing/link"), "target"); }, ENOENT,
                      "Could not create symlink");
  expectSystemFailure([&] { files_.createSymLink(directory_.file("link"), ""); }, ENOENT, "Could not create symlink");
}

// Queries

TEST_F(FileUtilsTest, APathExistsWhenItLeadsToAnything) {
  directory_.write("file", "");
  EXPECT_TRUE(files_.pathExists(directory_.file("file")));
  EXPECT_TRUE(files_.pathExists(directory_.path()));
  EXPECT_TRUE(files_.pathExists(link("link", "file")));
  EXPECT_TRUE(files_.pathExists(makeFifo("fifo")));
}

TEST_F(FileUtilsTest, APathThatLeadsNowhereDoesNotExistAndNeverThrows) {
  EXPECT_FALSE(files_.pathExists(directory_.file("missing")));
  EXPECT_FALSE(files_.pathExists(link("dangling", "nowhere")));
  EXPECT_FALSE(files_.pathExists(directory_.write("file", "") + "/below"));
  EXPECT_FALSE(files_.pathExists(circle()));
  EXPECT_FALSE(files_.pathExists(tooLongName()));
  EXPECT_FALSE(files_.pathExists(""));
}

TEST_F(FileUtilsTest, DirectoriesAreToldFromFilesThroughLinksToo) {
  directory_.makeDirectory("directory");
  directory_.write("file", "");
  EXPECT_TRUE(files_.isDirectory(directory_.file("directory")));
  EXPECT_TRUE(files_.isDirectory(link("toDirectory", "directory")));
  EXPECT_FALSE(files_.isDirectory(directory_.file("file")));
  EXPECT_FALSE(files_.isDirectory(link("toFile", "file")));
  EXPECT_FALSE(files_.isDirectory(makeFifo("fifo")));
}

TEST_F(FileUtilsTest, AskingWhetherAnImpossiblePathIsADirectoryAnswersFalse) {
  EXPECT_FALSE(files_.isDirectory(directory_.file("missing")));
  EXPECT_FALSE(files_.isDirectory(link("dangling", "nowhere")));
  EXPECT_FALSE(files_.isDirectory(circle()));
  EXPECT_FALSE(files_.isDirectory(tooLongName()));
  EXPECT_FALSE(files_.isDirectory(""));
}

TEST_F(FileUtilsTest, TheDirectoryTestLooksAtOneBitThatSocketsCarryToo) {
  EXPECT_TRUE(files_.isDirectory(makeSocket("socket")));
}

TEST_F(FileUtilsTest, LinksAreToldByThemselvesDanglingOrNot) {
  directory_.makeDirectory("directory");
  EXPECT_TRUE(files_.isSymLink(link("toDirectory", "directory")));
  EXPECT_TRUE(files_.isSymLink(link("dangling", "nowhere")));
  EXPECT_TRUE(files_.isSymLink(circle()));
  EXPECT_FALSE(files_.isSymLink(directory_.file("directory")));
  EXPECT_FALSE(files_.isSymLink(directory_.write("file", "")));
  EXPECT_FALSE(files_.isSymLink(directory_.file("missing")));
  EXPECT_FALSE(files_.isSymLink(tooLongName()));
  EXPECT_FALSE(files_.isSymLink(""));
}

TEST_F(FileUtilsTest, TheDiskSpaceIsBlocksTimesBlockSize) {
  struct statfs status {};
  ASSERT_EQ(statfs("/proc", &status), 0);
  const FileUtils::DiskSpace none = files_.getDiskSpace("/proc");
  EXPECT_EQ(none.total, static_cast<long long>(status.f_blocks) * static_cast<long long>(status.f_bsize));
  ASSERT_EQ(statfs(directory_.path().c_str(), &status), 0);
  const FileUtils::DiskSpace space = files_.getDiskSpace(directory_.path());
  EXPECT_EQ(space.total, static_cast<long long>(status.f_blocks) * static_cast<long long>(status.f_bsize));
  EXPECT_GT(space.total, 0);
  EXPECT_LE(space.available, static_cast<long long>(status.f_bfree) * static_cast<long long>(status.f_bsize) +
                                 (1LL << 30));  // others use the same disk meanwhile
  EXPECT_GE(space.available, 0);
}

TEST_F(FileUtilsTest, UnknownDiskSpaceIsReportedWithThePath) {
  const string path = directory_.file("missing");
  expectSystemFailure([&] { files_.getDiskSpace(path); }, ENOENT,
                      "Could not get file system statistics for the path \"" + path + "\"");
  expectFailure([&] { files_.getDiskSpace(""); }, ENOENT,
                "Could not get file system statistics for the path \"\": No such file or directory");
}

// Creating directories

TEST_F(FileUtilsTest, CreatingADirectoryAtTheEmptyPathDoesNothing) {
  FaultyFileUtils files;
  files.createDirectory("", true);
  files.createDirectory("", false);
  EXPECT_EQ(files.calls(Operation::PathExists), 0U);
}

TEST_F(FileUtilsTest, CreatingAnExistingDirectoryReturnsQuietly) {
  directory_.write("directory/file", "stays");
  files_.createDirectory(directory_.file("directory"), false);
  files_.createDirectory(directory_.file("directory"), true);
  files_.createDirectory(link("link", "directory"), true);
  files_.createDirectory("/", true);
  EXPECT_EQ(directory_.read("directory/file"), "stays");
}

TEST_F(FileUtilsTest, CreatingRecursivelyCreatesEachParentWithTheModeLessTheMask) {
  {
    const FileModeMask mask(0);
    files_.createDirectory(directory_.file("a/b/c"), true);
  }
  for (const char* name : {"a", "a/b", "a/b/c"}) EXPECT_EQ(permissionsOf(directory_.file(name)), 0775U) << name;
  {
    const FileModeMask mask(0027);
    files_.createDirectory(directory_.file("x/y/z"), true);
  }
  for (const char* name : {"x", "x/y", "x/y/z"}) EXPECT_EQ(permissionsOf(directory_.file(name)), 0750U) << name;
}

TEST_F(FileUtilsTest, RelativePathsAndSurplusSlashesAreFine) {
  const WorkingDirectory here(directory_.path());
  files_.createDirectory("a/b/c", true);
  files_.createDirectory("d//e/", true);
  EXPECT_TRUE(files_.isDirectory(directory_.file("a/b/c")));
  EXPECT_TRUE(files_.isDirectory(directory_.file("d/e")));
}

TEST_F(FileUtilsTest, CreatingOverAFileFailsWithCodeZero) {
  const string path = directory_.write("file", "x");
  const string message = "Could not create directory at \"" + path + "\": file exists";
  expectFailure([&] { files_.createDirectory(path, false); }, 0, message);
  expectFailure([&] { files_.createDirectory(path, true); }, 0, message);
  expectFailure([&] { files_.createDirectory(path + "/below", true); }, 0, message);
  EXPECT_EQ(directory_.read("file"), "x");
}

TEST_F(FileUtilsTest, ADirectoryThatCannotBeCreatedIsTheErrorTextAlone) {
  expectFailure([&] { files_.createDirectory(directory_.file("a/b"), false); }, ENOENT, "No such file or directory");
  expectSystemFailure([&] { files_.createDirectory(directory_.write("file", "") + "/b", false); }, ENOTDIR, "");
  expectSystemFailure([&] { files_.createDirectory(link("dangling", "nowhere"), false); }, EEXIST, "");
  expectSystemFailure([&] { files_.createDirectory(circle() + "/b", false); }, ELOOP, "");
  expectSystemFailure([&] { files_.createDirectory(tooLongName(), true); }, ENAMETOOLONG, "");
  EXPECT_FALSE(directory_.exists("a"));
}

TEST_F(FileUtilsTest, CreatingGoesThroughTheVirtualQueries) {
  class EverythingIsAFile : public FileUtils {
   public:
    bool pathExists(const string&) override { return true; }
    bool isDirectory(const string&) override { return false; }
  };
  EverythingIsAFile files;
  expectFailure([&] { files.createDirectory("/nowhere/at/all", true); }, 0,
                "Could not create directory at \"/nowhere/at/all\": file exists");
}

TEST_F(FileUtilsTest, CreatingRecursivelyGoesThroughTheVirtualCreation) {
  FaultyFileUtils files;
  files.failPath(Operation::CreateDirectory, directory_.file("a"), EDQUOT);
  expectFailure([&] { files.createDirectory(directory_.file("a/b/c"), true); }, EDQUOT, std::strerror(EDQUOT));
  EXPECT_TRUE(directory_.names().empty());
  files.heal();
  files.clearTrace();
  files.createDirectory(directory_.file("a/b"), true);
  EXPECT_EQ(files.calls(Operation::CreateDirectory), 3U);
}

// Listing

TEST_F(FileUtilsTest, ListingDirectoriesGivesTheirBareNamesAlone) {
  directory_.makeDirectory("one/nested");
  directory_.makeDirectory(".hidden");
  directory_.write("file", "");
  link("toDirectory", "one");
  makeFifo("fifo");
  EXPECT_THAT(files_.listDirectories(directory_.path()), UnorderedElementsAre("one", ".hidden"));
  EXPECT_TRUE(files_.listDirectories(directory_.file("one/nested")).empty());
}

TEST_F(FileUtilsTest, ListingADirectoryGivesFullPathsTypesAndSizes) {
  directory_.write("file", "12345");
  directory_.write("directory/inner", "not listed");
  directory_.makeDirectory("..two dots");
  link("toFile", "file");
  link("dangling", "nowhere");
  std::vector<std::tuple<string, long long, Type>> seen;
  for (const FileUtils::Info& info : files_.listDirectory(directory_.path())) {
    seen.emplace_back(info.path, info.size, info.type);
  }
  EXPECT_THAT(seen, UnorderedElementsAre(std::make_tuple(directory_.file("file"), 5, Type::File),
                                         std::make_tuple(directory_.file("directory"), 0, Type::Directory),
                                         std::make_tuple(directory_.file("..two dots"), 0, Type::Directory),
                                         std::make_tuple(directory_.file("toFile"), 0, Type::SymLink),
                                         std::make_tuple(directory_.file("dangling"), 0, Type::SymLink)));
}

TEST_F(FileUtilsTest, ListingLeavesOutWhatIsNeitherFileNorLinkNorDirectory) {
  makeFifo("fifo");
  makeSocket("socket");
  EXPECT_TRUE(files_.listDirectory(directory_.path()).empty());
}

TEST_F(FileUtilsTest, ListingOtherEntriesGivesTheFullPathsOfWhatIsLeftOut) {
  directory_.write("file", "");
  directory_.makeDirectory("directory");
  link("link", "fifo");
  EXPECT_THAT(files_.listOtherEntries(directory_.path()),
              UnorderedElementsAre(makeFifo("fifo"), makeSocket("socket"), makeFifo(".hidden")));
  EXPECT_THAT(files_.listOtherEntries(directory_.path() + "/"), testing::Contains(directory_.file("fifo")));
}

TEST_F(FileUtilsTest, ThereAreNoOtherEntriesInWhatCannotBeListed) {
  makeFifo("target/fifo");
  const std::ptrdiff_t before = openDescriptors();
  for (const string& path : {string(), directory_.file("missing"), directory_.write("file", ""), link("link", "target"),
                             directory_.file("link/"), circle(), tooLongName()}) {
    EXPECT_TRUE(files_.listOtherEntries(path).empty()) << path;
  }
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(FileUtilsTest, ListingCombinesPathsAsCombinePathDoes) {
  directory_.write("file", "");
  EXPECT_EQ(files_.listDirectory(directory_.path() + "/").at(0).path, directory_.path() + "/file");
  EXPECT_EQ(files_.listDirectory(directory_.path() + "//").at(0).path, directory_.path() + "//file");
}

TEST_F(FileUtilsTest, ListingGoesThroughTheVirtualCombination) {
  class Marking : public FileUtils {
   public:
    string combinePath(const string& a, const string& b) override { return a + "/./" + b; }
  };
  directory_.write("file", "123");
  const std::vector<FileUtils::Info> entries = Marking().listDirectory(directory_.path());
  ASSERT_EQ(entries.size(), 1U);
  EXPECT_EQ(entries[0].path, directory_.path() + "/./file");
  EXPECT_EQ(entries[0].size, 3);
}

TEST_F(FileUtilsTest, AFileWhoseSizeCannotBeFoundIsLeftOut) {
  class Misleading : public FileUtils {
   public:
    string combinePath(const string& a, const string& b) override { return a + "/gone/" + b; }
  };
  directory_.write("file", "123");
  directory_.makeDirectory("directory");
  const std::vector<FileUtils::Info> entries = Misleading().listDirectory(directory_.path());
  ASSERT_EQ(entries.size(), 1U);
  EXPECT_EQ(entries[0].type, Type::Directory);
}

TEST_F(FileUtilsTest, SizesBeyond32BitsAreListedExactly) {
  constexpr off_t size = 5LL << 30;
  ASSERT_EQ(truncate(directory_.write("sparse", "").c_str(), size), 0);
  EXPECT_EQ(files_.listDirectory(directory_.path()).at(0).size, size);
}

TEST_F(FileUtilsTest, ADirectoryThatCannotBeOpenedIsReported) {
  const std::vector<std::pair<string, int>> paths = {{directory_.file("missing"), ENOENT},
                                                     {directory_.write("file", ""), ENOTDIR},
                                                     {tooLongName(), ENAMETOOLONG},
                                                     {"", ENOENT}};
  for (const auto& [path, code] : paths) {
    expectSystemFailure([&, path = path] { files_.listDirectory(path); }, code, "Could not open directory");
    expectSystemFailure([&, path = path] { files_.listDirectories(path); }, code, "Could not open directory");
    expectSystemFailure([&, path = path] { files_.recursiverDirectoryDelete(path); }, code, "Could not open directory");
  }
  const string round = circle();
  expectSystemFailure([&] { files_.listDirectory(round); }, ELOOP, "Could not open directory");
  expectSystemFailure([&] { files_.listDirectories(round); }, ELOOP, "Could not open directory");
}

TEST_F(FileUtilsTest, ListingLeavesNoDescriptorOpen) {
  directory_.makeDirectory("a/b");
  const std::ptrdiff_t before = openDescriptors();
  files_.listDirectory(directory_.path());
  files_.listDirectories(directory_.path());
  files_.recursiverDirectoryDelete(directory_.file("a"));
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(FileUtilsTest, AListingInterruptedByAnExceptionLeavesNoDescriptorOpen) {
  class Refusing : public FileUtils {
   public:
    string combinePath(const string&, const string&) override { throw std::logic_error("no paths today"); }
  };
  directory_.write("file", "");
  Refusing files;
  const std::ptrdiff_t before = openDescriptors();
  EXPECT_THROW(files.listDirectory(directory_.path()), std::logic_error);
  EXPECT_THROW(files.recursiverDirectoryDelete(directory_.path()), std::logic_error);
  EXPECT_EQ(openDescriptors(), before);
}

// Deleting trees

TEST_F(FileUtilsTest, DeletingATreeRemovesAllOfItAndNothingBesideIt) {
  directory_.write("tree/a/b/file", "x");
  directory_.write("tree/.hidden", "x");
  directory_.makeDirectory("tree/empty");
  directory_.write("neighbour", "stays");
  mkfifo(directory_.file("tree/fifo").c_str(), 0600);
  files_.recursiverDirectoryDelete(directory_.file("tree"));
  EXPECT_THAT(directory_.names(), ElementsAre("neighbour"));
}

TEST_F(FileUtilsTest, DeletingATreeWithASlashAtItsEndRemovesIt) {
  directory_.write("tree/file", "x");
  files_.recursiverDirectoryDelete(directory_.file("tree/"));
  EXPECT_TRUE(directory_.names().empty());
}

TEST_F(FileUtilsTest, DeletingATreeRemovesItsLinksAndLeavesTheirTargets) {
  directory_.write("target/file", "stays");
  directory_.makeDirectory("tree");
  link("tree/toDirectory", "../target");
  link("tree/toFile", "../target/file");
  link("tree/dangling", "nowhere");
  link("tree/toItself", ".");
  files_.recursiverDirectoryDelete(directory_.file("tree"));
  EXPECT_THAT(directory_.names(), ElementsAre("target"));
  EXPECT_EQ(directory_.read("target/file"), "stays");
}

TEST_F(FileUtilsTest, ALinkGivenAsTheTreeWithASlashIsRemovedAsALinkToo) {
  directory_.write("target/file", "1");
  std::filesystem::create_directory_symlink(directory_.file("target"), directory_.file("link"));
  FileUtils().recursiverDirectoryDelete(directory_.file("link") + "//");
  EXPECT_FALSE(std::filesystem::is_symlink(directory_.file("link")));
  EXPECT_TRUE(directory_.exists("target/file"));
}

TEST_F(FileUtilsTest, ALinkGivenAsTheTreeIsRemovedAsALink) {
  directory_.write("target/file", "stays");
  for (const char* target : {"target", "target/file", "nowhere"}) {
    files_.recursiverDirectoryDelete(link("link", target));
    EXPECT_FALSE(directory_.exists("link")) << target;
  }
  EXPECT_EQ(directory_.read("target/file"), "stays");
}

TEST_F(FileUtilsTest, DeletingATreeGoesDepthFirstThroughTheVirtualOperations) {
  directory_.write("tree/a/file", "x");
  FaultyFileUtils files;
  files.recursiverDirectoryDelete(directory_.file("tree"));
  std::vector<string> deletions = files.trace();
  const auto isDeletion = [](const string& line) { return line.find("elete") != string::npos; };
  deletions.erase(std::stable_partition(deletions.begin(), deletions.end(), isDeletion), deletions.end());
  EXPECT_THAT(deletions,
              ElementsAre("recursiverDirectoryDelete " + directory_.file("tree"),
                          "recursiverDirectoryDelete " + directory_.file("tree/a"),
                          "deleteFile " + directory_.file("tree/a/file"), "deleteFile " + directory_.file("tree/a"),
                          "deleteFile " + directory_.file("tree")));
}

TEST_F(FileUtilsTest, AFailureStopsTheWalkWhereItHappensAndLeavesTheRest) {
  directory_.write("tree/a/b/undeletable", "x");
  directory_.write("tree/a/b/c/deletable", "x");
  FaultyFileUtils files;
  files.failPath(Operation::DeleteFile, directory_.file("tree/a/b/undeletable"), EBUSY);
  expectFailure([&] { files.recursiverDirectoryDelete(directory_.file("tree")); }, EBUSY, std::strerror(EBUSY));
  EXPECT_EQ(files.trace().back(), "deleteFile " + directory_.file("tree/a/b/undeletable"));
  EXPECT_TRUE(directory_.exists("tree/a/b/undeletable"));
}

TEST_F(FileUtilsTest, WhatAFailedRemovalHasDeletedStaysDeleted) {
  directory_.write("tree/file", "x");
  FaultyFileUtils files;
  files.failPath(Operation::DeleteFile, directory_.file("tree"), EBUSY);
  expectFailure([&] { files.recursiverDirectoryDelete(directory_.file("tree")); }, EBUSY, std::strerror(EBUSY));
  EXPECT_TRUE(directory_.names("tree").empty());
}

TEST_F(FileUtilsTest, TheRemovalInsideATreeIsReportedAsARemoval) {
  class KeepsTheDirectoryFull : public FileUtils {
   public:
    void deleteFile(const string& path) override {
      if (isDirectory(path)) writeFile(path + "/late", {});
      FileUtils::deleteFile(path);
    }
  };
  KeepsTheDirectoryFull files;
  directory_.makeDirectory("tree");
  expectSystemFailure([&] { files.recursiverDirectoryDelete(directory_.file("tree")); }, ENOTEMPTY,
                      "Could not remove file");
}

TEST_F(FileUtilsTest, ATreeDeeperThanTheDescriptorsReachFailsWithoutHarm) {
#if defined(CELLAR_SANITIZES_ADDRESSES)
  GTEST_SKIP() << "the sanitizers need descriptors of their own to look at memory";
#endif
  directory_.write("1/2/3/4/5/6/7/8/9/10/file", "x");
  expectSystemFailure(
      [&] {
        const ResourceLimit limit(RLIMIT_NOFILE, nextDescriptor() + 5);
        files_.recursiverDirectoryDelete(directory_.file("1"));
      },
      EMFILE, "Could not open directory");
  EXPECT_EQ(directory_.read("1/2/3/4/5/6/7/8/9/10/file"), "x");
  files_.recursiverDirectoryDelete(directory_.file("1"));
  EXPECT_TRUE(directory_.names().empty());
}

// Records and threads

TEST(FileUtils, TheNumbersOfTheEntryTypesAreFixed) {
  EXPECT_EQ(static_cast<int>(Type::File), 0);
  EXPECT_EQ(static_cast<int>(Type::SymLink), 1);
  EXPECT_EQ(static_cast<int>(Type::Directory), 2);
}

TEST(FileUtils, RecordsHoldWhatTheyAreBuiltFrom) {
  const FileUtils::Info info("/a", 5LL << 32, Type::SymLink);
  EXPECT_EQ(info.path, "/a");
  EXPECT_EQ(info.size, 5LL << 32);
  EXPECT_EQ(info.type, Type::SymLink);
  const FileUtils::DiskSpace space(LLONG_MAX, 7);
  EXPECT_EQ(space.total, LLONG_MAX);
  EXPECT_EQ(space.available, 7);
}

TEST_F(FileUtilsTest, OneObjectServesSeveralThreads) {
  test::runOnThreads(4, [&](std::size_t thread) {
    const string own = directory_.file("thread " + std::to_string(thread));
    for (int i = 0; i < 20; ++i) {
      files_.createDirectory(own + "/nested", true);
      files_.writeFile(own + "/nested/file", bytes(own));
      if (files_.readFile(own + "/nested/file") != bytes(own)) throw std::runtime_error("wrong bytes");
      if (files_.listDirectory(own).size() != 1) throw std::runtime_error("wrong listing");
      files_.recursiverDirectoryDelete(own);
    }
  });
  EXPECT_TRUE(directory_.names().empty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
