#pragma once

#include <cstddef>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <cellar/Export.h>
#include <cellar/FileUtils.h>

namespace velmora::mobile::xplat::cellar::test {

// The operations that touch the disk.
enum class Operation {
  ReadFile,
  WriteFile,
  DeleteFile,
  RecursiverDirectoryDelete,
  Rename,
  CreateDirectory,
  CreateSymLink,
  IsDirectory,
  PathExists,
  GetDiskSpace,
  ListDirectories,
  ListDirectory,
  IsSymLink,
  ListOtherEntries,
  CreateFile,
  ReadPieces,
  Sync,
  ListFiles,
};

// The real file system; records every call, and makes chosen ones fail before they change anything. A failing operation
// throws FileUtilsIoException with the given code and the system's text for it; a failing query (IsDirectory,
// PathExists, IsSymLink) returns false, and ListOtherEntries nothing. Calls that operations make among themselves are
// recorded and can fail, too. Thread-safe; set `onCall` before other threads use the object.
class CELLAR_EXPORT FaultyFileUtils : public FileUtils {
 public:
  using Operation = test::Operation;

  // Called at the beginning of each operation, before it may fail, without a lock. `path` is the first argument. The
  // operation throws what this throws.
  std::function<void(Operation operation, const std::string& path)> onCall;

  // The next call fails; calling this n times makes the next n calls fail.
  void failNext(Operation operation, int errnoCode);

  void failAlways(Operation operation, int errnoCode);

  // Every call whose first argument is exactly `path` fails.
  void failPath(Operation operation, const std::string& path, int errnoCode);

  // The n-th call from now fails, whatever it is; 1 is the next. Replaces an earlier `failNth` that is still pending.
  void failNth(std::size_t n, int errnoCode);

  // From now on a failing `writeFile` or `createFile` writes the first half of the data.
  void tearFailingWrites(bool tears);

  // The next of these two writes only the first `bytes` bytes and then fails, as on a disk that fills up.
  void tearNextWrite(std::size_t bytes, int errnoCode);

  // From now on nothing fails. The recorded calls remain.
  void heal();

  // The number of calls that have failed so far.
  std::size_t failures() const;

  // The number of calls of one kind, including failed ones.
  std::size_t calls(Operation operation) const;

  // Every call so far, including failed ones: the operation's name and its paths, as in "rename /a /b".
  std::vector<std::string> trace() const;

  // Removes the calls recorded so far.
  void clearTrace();

  std::vector<unsigned char> readFile(const std::string& path) override;
  void writeFile(const std::string& path, const std::vector<unsigned char>& data) override;
  void deleteFile(const std::string& path) override;
  void recursiverDirectoryDelete(const std::string& path) override;
  void rename(const std::string& from, const std::string& to) override;
  void createDirectory(const std::string& path, bool recursive) override;
  void createSymLink(const std::string& linkPath, const std::string& targetPath) override;
  bool isDirectory(const std::string& path) override;
  bool pathExists(const std::string& path) override;
  FileUtils::DiskSpace getDiskSpace(const std::string& path) override;
  std::vector<std::string> listDirectories(const std::string& path) override;
  std::vector<FileUtils::Info> listDirectory(const std::string& path) override;
  bool isSymLink(const std::string& path) override;
  std::vector<std::string> listOtherEntries(const std::string& path) override;
  void createFile(const std::string& path, const std::vector<unsigned char>& data) override;
  void readPieces(const std::string& path,
                  const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) override;
  void sync(const std::string& path) override;
  std::vector<std::string> listFiles(const std::string& path) override;

 private:
  struct Failure {
    int errnoCode;
    std::optional<std::size_t> bytesWritten;  // by a torn `writeFile`
  };

  void failIfChosen(Operation operation, const std::string& path, const std::string& rest = "");
  std::optional<int> failureOf(Operation operation, const std::string& path, const std::string& rest = "");
  std::optional<int> nextFailure(const std::lock_guard<std::mutex>& lock, Operation operation, const std::string& path);
  std::optional<Failure> failureOfWrite(Operation operation, const std::string& path, std::size_t length);

  mutable std::mutex mutex_;  // guards everything below
  std::vector<std::pair<Operation, std::string>> calls_;
  std::size_t failures_ = 0;
  std::size_t callsToNth_ = 0;  // 0: no `failNth` is pending
  int nthErrnoCode_ = 0;
  bool tearsFailingWrites_ = false;
  std::map<Operation, std::deque<int>> next_;
  std::map<Operation, int> always_;
  std::map<std::pair<Operation, std::string>, int> paths_;
  std::optional<std::pair<std::size_t, int>> tear_;
};

}  // namespace velmora::mobile::xplat::cellar::test
