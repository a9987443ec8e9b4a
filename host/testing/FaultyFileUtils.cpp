#include "host/testing/FaultyFileUtils.h"

#include <algorithm>
#include <system_error>

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar::test {

namespace {

[[noreturn]] void fail(int errnoCode) {
  throw FileUtilsIoException(errnoCode, std::generic_category().message(errnoCode));
}

const char* nameOf(Operation operation) {
  switch (operation) {
    case Operation::ReadFile:
      return "readFile";
    case Operation::WriteFile:
      return "writeFile";
    case Operation::DeleteFile:
      return "deleteFile";
    case Operation::RecursiverDirectoryDelete:
      return "recursiverDirectoryDelete";
    case Operation::Rename:
      return "rename";
    case Operation::CreateDirectory:
      return "createDirectory";
    case Operation::CreateSymLink:
      return "createSymLink";
    case Operation::IsDirectory:
      return "isDirectory";
    case Operation::PathExists:
      return "pathExists";
    case Operation::GetDiskSpace:
      return "getDiskSpace";
    case Operation::ListDirectories:
      return "listDirectories";
    case Operation::ListDirectory:
      return "listDirectory";
    case Operation::IsSymLink:
      return "isSymLink";
    case Operation::ListOtherEntries:
      return "listOtherEntries";
    case Operation::CreateFile:
      return "createFile";
    case Operation::ReadPieces:
      return "readPieces";
    case Operation::Sync:
      return "sync";
    case Operation::ListFiles:
      return "listFiles";
  }
  return "";
}

}  // namespace

void FaultyFileUtils::failNext(Operation operation, int errnoCode) {
  const std::lock_guard<std::mutex> lock(mutex_);
  next_[operation].push_back(errnoCode);
}

void FaultyFileUtils::failAlways(Operation operation, int errnoCode) {
  const std::lock_guard<std::mutex> lock(mutex_);
  always_[operation] = errnoCode;
}

void FaultyFileUtils::failPath(Operation operation, const std::string& path, int errnoCode) {
  const std::lock_guard<std::mutex> lock(mutex_);
  paths_[{operation, path}] = errnoCode;
}

void FaultyFileUtils::failNth(std::size_t n, int errnoCode) {
  const std::lock_guard<std::mutex> lock(mutex_);
  callsToNth_ = n;
  nthErrnoCode_ = errnoCode;
}

void FaultyFileUtils::tearFailingWrites(bool tears) {
  const std::lock_guard<std::mutex> lock(mutex_);
  tearsFailingWrites_ = tears;
}

void FaultyFileUtils::tearNextWrite(std::size_t bytes, int errnoCode) {
  const std::lock_guard<std::mutex> lock(mutex_);
  tear_ = {bytes, errnoCode};
}

void FaultyFileUtils::heal() {
  const std::lock_guard<std::mutex> lock(mutex_);
  callsToNth_ = 0;
  next_.clear();
  always_.clear();
  paths_.clear();
  tear_.reset();
}

std::size_t FaultyFileUtils::failures() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return failures_;
}

std::size_t FaultyFileUtils::calls(Operation operation) const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return static_cast<std::size_t>(
      std::count_if(calls_.begin(), calls_.end(), [&](const auto& call) { return call.first == operation; }));
}

std::vector<std::string> FaultyFileUtils::trace() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::string> lines;
  for (const auto& call : calls_) lines.push_back(call.second);
  return lines;
}

void FaultyFileUtils::clearTrace() {
  const std::lock_guard<std::mutex> lock(mutex_);
  calls_.clear();
}

std::vector<unsigned char> FaultyFileUtils::readFile(const std::string& path) {
  failIfChosen(Operation::ReadFile, path);
  return FileUtils::readFile(path);
}

void FaultyFileUtils::writeFile(const std::string& path, const std::vector<unsigned char>& data) {
  const std::optional<Failure> failure = failureOfWrite(Operation::WriteFile, path, data.size());
  if (!failure) return FileUtils::writeFile(path, data);
  if (failure->bytesWritten) {
    const auto length = static_cast<std::ptrdiff_t>(*failure->bytesWritten);
    FileUtils::writeFile(path, {data.begin(), data.begin() + length});
  }
  fail(failure->errnoCode);
}

void FaultyFileUtils::deleteFile(const std::string& path) {
  failIfChosen(Operation::DeleteFile, path);
  FileUtils::deleteFile(path);
}

void FaultyFileUtils::recursiverDirectoryDelete(const std::string& path) {
  failIfChosen(Operation::RecursiverDirectoryDelete, path);
  FileUtils::recursiverDirectoryDelete(path);
}

void FaultyFileUtils::rename(const std::string& from, const std::string& to) {
  failIfChosen(Operation::Rename, from, " " + to);
  FileUtils::rename(from, to);
}

void FaultyFileUtils::createDirectory(const std::string& path, bool recursive) {
  failIfChosen(Operation::CreateDirectory, path);
  FileUtils::createDirectory(path, recursive);
}

void FaultyFileUtils::createSymLink(const std::string& linkPath, const std::string& targetPath) {
  failIfChosen(Operation::CreateSymLink, linkPath, " " + targetPath);
  FileUtils::createSymLink(linkPath, targetPath);
}

bool FaultyFileUtils::isDirectory(const std::string& path) {
  return !failureOf(Operation::IsDirectory, path) && FileUtils::isDirectory(path);
}

bool FaultyFileUtils::pathExists(const std::string& path) {
  return !failureOf(Operation::PathExists, path) && FileUtils::pathExists(path);
}

FileUtils::DiskSpace FaultyFileUtils::getDiskSpace(const std::string& path) {
  failIfChosen(Operation::GetDiskSpace, path);
  return FileUtils::getDiskSpace(path);
}

std::vector<std::string> FaultyFileUtils::listDirectories(const std::string& path) {
  failIfChosen(Operation::ListDirectories, path);
  return FileUtils::listDirectories(path);
}

std::vector<FileUtils::Info> FaultyFileUtils::listDirectory(const std::string& path) {
  failIfChosen(Operation::ListDirectory, path);
  return FileUtils::listDirectory(path);
}

bool FaultyFileUtils::isSymLink(const std::string& path) {
  return !failureOf(Operation::IsSymLink, path) && FileUtils::isSymLink(path);
}

std::vector<std::string> FaultyFileUtils::listOtherEntries(const std::string& path) {
  if (failureOf(Operation::ListOtherEntries, path)) return {};
  return FileUtils::listOtherEntries(path);
}

void FaultyFileUtils::createFile(const std::string& path, const std::vector<unsigned char>& data) {
  const std::optional<Failure> failure = failureOfWrite(Operation::CreateFile, path, data.size());
  if (!failure) return FileUtils::createFile(path, data);
  if (failure->bytesWritten) {
    const auto length = static_cast<std::ptrdiff_t>(*failure->bytesWritten);
    FileUtils::createFile(path, {data.begin(), data.begin() + length});
  }
  fail(failure->errnoCode);
}

void FaultyFileUtils::readPieces(const std::string& path,
                                 const std::function<void(const unsigned char* bytes, std::size_t count)>& consume) {
  failIfChosen(Operation::ReadPieces, path);
  FileUtils::readPieces(path, consume);
}

void FaultyFileUtils::sync(const std::string& path) {
  failIfChosen(Operation::Sync, path);
  FileUtils::sync(path);
}

std::vector<std::string> FaultyFileUtils::listFiles(const std::string& path) {
  failIfChosen(Operation::ListFiles, path);
  return FileUtils::listFiles(path);
}

void FaultyFileUtils::failIfChosen(Operation operation, const std::string& path, const std::string& rest) {
  const std::optional<int> failure = failureOf(operation, path, rest);
  if (failure) fail(*failure);
}

// Records the call; returns the code with which it has to fail, if any.
std::optional<int> FaultyFileUtils::failureOf(Operation operation, const std::string& path, const std::string& rest) {
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    calls_.emplace_back(operation, std::string(nameOf(operation)) + " " + path + rest);
  }
  if (onCall) onCall(operation, path);
  const std::lock_guard<std::mutex> lock(mutex_);
  const std::optional<int> failure = nextFailure(lock, operation, path);
  if (failure) ++failures_;
  return failure;
}

std::optional<int> FaultyFileUtils::nextFailure(const std::lock_guard<std::mutex>& /*lock*/, Operation operation,
                                                const std::string& path) {
  if (callsToNth_ > 0 && --callsToNth_ == 0) return nthErrnoCode_;
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

std::optional<FaultyFileUtils::Failure> FaultyFileUtils::failureOfWrite(Operation operation, const std::string& path,
                                                                        std::size_t length) {
  const std::optional<int> failure = failureOf(operation, path);
  const std::lock_guard<std::mutex> lock(mutex_);
  if (failure) return Failure{*failure, tearsFailingWrites_ ? std::make_optional(length / 2) : std::nullopt};
  if (!tear_) return std::nullopt;
  ++failures_;
  const auto [bytes, errnoCode] = *std::exchange(tear_, std::nullopt);
  return Failure{errnoCode, std::min(bytes, length)};
}

}  // namespace velmora::mobile::xplat::cellar::test
