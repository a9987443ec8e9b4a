#pragma once

#include <algorithm>
#include <cstddef>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "FileUtils.h"
#include "LarderException.h"

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
};

// The real file system, with every call recorded and chosen ones failing before they touch anything. A failing
// operation throws FileUtilsIoException with the given code and the system's text for it; a failing query (IsDirectory,
// PathExists, IsSymLink) answers false. Calls that operations make among themselves are recorded and fail too.
// Thread-safe; `onCall` is to be set before other threads use the object.
class FaultyFileUtils : public FileUtils {
 public:
  using Operation = test::Operation;

  // Called at the beginning of each operation, before it may fail, with no lock held. `path` is the first argument.
  // What it throws leaves the operation.
  std::function<void(Operation operation, const std::string& path)> onCall;

  // The next call fails; calling this n times makes the next n calls fail.
  void failNext(Operation operation, int errnoCode) {
    const std::lock_guard<std::mutex> lock(mutex_);
    next_[operation].push_back(errnoCode);
  }
  void failAlways(Operation operation, int errnoCode) {
    const std::lock_guard<std::mutex> lock(mutex_);
    always_[operation] = errnoCode;
  }
  // Every call whose first argument is exactly `path` fails.
  void failPath(Operation operation, const std::string& path, int errnoCode) {
    const std::lock_guard<std::mutex> lock(mutex_);
    paths_[{operation, path}] = errnoCode;
  }
  // The next `writeFile` leaves only the first `bytes` bytes in the file and then fails, as on a disk that fills up.
  void tearNextWrite(std::size_t bytes, int errnoCode) {
    const std::lock_guard<std::mutex> lock(mutex_);
    tear_ = {bytes, errnoCode};
  }
  // From here on nothing fails. The records stay.
  void heal() {
    const std::lock_guard<std::mutex> lock(mutex_);
    next_.clear();
    always_.clear();
    paths_.clear();
    tear_.reset();
  }

  std::size_t calls(Operation operation) const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<std::size_t>(
        std::count_if(calls_.begin(), calls_.end(), [&](const auto& call) { return call.first == operation; }));
  }
  // Every call so far, failed ones too: the operation's name and its paths, as in "rename /a /b".
  std::vector<std::string> trace() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::string> lines;
    for (const auto& call : calls_) lines.push_back(call.second);
    return lines;
  }
  void clearTrace() {
    const std::lock_guard<std::mutex> lock(mutex_);
    calls_.clear();
  }

  std::vector<unsigned char> readFile(const std::string& path) override {
    failIfTold(Operation::ReadFile, "readFile", path);
    return FileUtils::readFile(path);
  }
  void writeFile(const std::string& path, const std::vector<unsigned char>& data) override {
    failIfTold(Operation::WriteFile, "writeFile", path);
    const std::optional<std::pair<std::size_t, int>> tear = takeTear();
    if (!tear) return FileUtils::writeFile(path, data);
    const auto length = static_cast<std::ptrdiff_t>(std::min(tear->first, data.size()));
    FileUtils::writeFile(path, {data.begin(), data.begin() + length});
    fail(tear->second);
  }
  void deleteFile(const std::string& path) override {
    failIfTold(Operation::DeleteFile, "deleteFile", path);
    FileUtils::deleteFile(path);
  }
  void recursiverDirectoryDelete(const std::string& path) override {
    failIfTold(Operation::RecursiverDirectoryDelete, "recursiverDirectoryDelete", path);
    FileUtils::recursiverDirectoryDelete(path);
  }
  void rename(const std::string& from, const std::string& to) override {
    failIfTold(Operation::Rename, "rename", from, " " + to);
    FileUtils::rename(from, to);
  }
  void createDirectory(const std::string& path, bool recursive) override {
    failIfTold(Operation::CreateDirectory, "createDirectory", path);
    FileUtils::createDirectory(path, recursive);
  }
  void createSymLink(const std::string& linkPath, const std::string& targetPath) override {
    failIfTold(Operation::CreateSymLink, "createSymLink", linkPath, " " + targetPath);
    FileUtils::createSymLink(linkPath, targetPath);
  }
  bool isDirectory(const std::string& path) override {
    return !failureOf(Operation::IsDirectory, "isDirectory", path) && FileUtils::isDirectory(path);
  }
  bool pathExists(const std::string& path) override {
    return !failureOf(Operation::PathExists, "pathExists", path) && FileUtils::pathExists(path);
  }
  FileUtils::DiskSpace getDiskSpace(const std::string& path) override {
    failIfTold(Operation::GetDiskSpace, "getDiskSpace", path);
    return FileUtils::getDiskSpace(path);
  }
  std::vector<std::string> listDirectories(const std::string& path) override {
    failIfTold(Operation::ListDirectories, "listDirectories", path);
    return FileUtils::listDirectories(path);
  }
  std::vector<FileUtils::Info> listDirectory(const std::string& path) override {
    failIfTold(Operation::ListDirectory, "listDirectory", path);
    return FileUtils::listDirectory(path);
  }
  bool isSymLink(const std::string& path) override {
    return !failureOf(Operation::IsSymLink, "isSymLink", path) && FileUtils::isSymLink(path);
  }

 private:
  [[noreturn]] static void fail(int errnoCode) {
    throw FileUtilsIoException(errnoCode, std::generic_category().message(errnoCode));
  }

  void failIfTold(Operation operation, const std::string& name, const std::string& path, const std::string& rest = "") {
    const std::optional<int> failure = failureOf(operation, name, path, rest);
    if (failure) fail(*failure);
  }

  // Records the call; the code it has to fail with, if any.
  std::optional<int> failureOf(Operation operation, const std::string& name, const std::string& path,
                               const std::string& rest = "") {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      calls_.emplace_back(operation, name + " " + path + rest);
    }
    if (onCall) onCall(operation, path);
    const std::lock_guard<std::mutex> lock(mutex_);
    std::deque<int>& queued = next_[operation];
    if (!queued.empty()) {
      const int code = queued.front();
      queued.pop_front();
      return code;
    }
    if (const auto found = paths_.find({operation, path}); found != paths_.end()) return found->second;
    if (const auto found = always_.find(operation); found != always_.end()) return found->second;
    return std::nullopt;
  }

  std::optional<std::pair<std::size_t, int>> takeTear() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(tear_, std::nullopt);
  }

  mutable std::mutex mutex_;  // guards everything below
  std::vector<std::pair<Operation, std::string>> calls_;
  std::map<Operation, std::deque<int>> next_;
  std::map<Operation, int> always_;
  std::map<std::pair<Operation, std::string>, int> paths_;
  std::optional<std::pair<std::size_t, int>> tear_;
};

}  // namespace velmora::mobile::xplat::cellar::test
