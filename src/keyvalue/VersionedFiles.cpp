#include "keyvalue/VersionedFiles.h"

#include <algorithm>
#include <cerrno>
#include <exception>
#include <system_error>
#include <utility>

#include "FileUtils.h"
#include "LarderException.h"
#include "base/Checksum.h"

namespace velmora::mobile::xplat::cellar {

namespace {

const std::string kUnfinished = ".part";

// Of a file that its writer has not finished; empty for other files.
std::optional<VersionedName> parseUnfinished(const std::string& name) {
  if (name.size() <= kUnfinished.size()) return std::nullopt;
  const auto length = name.size() - kUnfinished.size();
  if (name.compare(length, std::string::npos, kUnfinished) != 0) return std::nullopt;
  return VersionedName::parse(name.substr(0, length));
}

// Some file systems cannot.
void syncOrGiveUp(FileUtils& files, const std::string& path) {
  try {
    files.sync(path);
  } catch (const FileUtilsIoException& error) {
    if (error.code() != EINVAL) throw;
  }
}

}  // namespace

std::filesystem::file_type typeOfFile(const std::string& path) {
  std::error_code error;
  const auto type = std::filesystem::symlink_status(path, error).type();
  if (type != std::filesystem::file_type::none) return type;
  throw FileUtilsIoException(error.value(), "Could not look for \"" + path + "\": " + error.message());
}

void VersionedFiles::takeStock() {
  const std::lock_guard<std::mutex> lock(mutex_);
  if (hasTakenStock_) return;
  createDirectory();
  for (const std::string& name : namesInDirectory()) {
    auto version = VersionedName::parse(name);
    if (!version) version = parseUnfinished(name);
    if (version) next_ = std::max(next_, version->number + 1);
  }
  firstOwn_ = next_;
  hasTakenStock_ = true;
}

// A directory outlives a power cut when the one above it has been synced. How far up that is ours to do nobody knows.
void VersionedFiles::createDirectory() {
  const std::string& directory = context_.options.directory;
  context_.files->createDirectory(directory, true);
  if (context_.options.durability != Durability::Synced) return;
  try {
    for (std::string path = directory; !path.empty(); path = context_.files->parentPath(path)) {
      syncOrGiveUp(*context_.files, path);
    }
  } catch (const FileUtilsIoException& error) {
    if (error.code() != EACCES && error.code() != EPERM && error.code() != EROFS) throw;
  }
}

void VersionedFiles::noteNumber(std::uint64_t number) {
  const std::lock_guard<std::mutex> lock(mutex_);
  next_ = std::max(next_, number + 1);
}

bool VersionedFiles::exists(const std::string& name) const {
  return typeOfFile(pathOf(name)) != std::filesystem::file_type::not_found;
}

// None when somebody has removed it.
std::vector<std::string> VersionedFiles::namesInDirectory() const {
  try {
    return context_.files->listFiles(context_.options.directory);
  } catch (const FileUtilsIoException& error) {
    if (error.code() != ENOENT) throw;
    return {};
  }
}

std::uint64_t VersionedFiles::nextNumber() {
  takeStock();
  const std::lock_guard<std::mutex> lock(mutex_);
  return next_++;
}

VersionedFiles::Written VersionedFiles::write(const std::string& key, const std::vector<unsigned char>& value) {
  const std::uint32_t checksum = Checksum::of(key, value);
  std::string name = VersionedName::format(key, nextNumber(), checksum);
  const std::string path = pathOf(name);
  try {
    context_.files->createFile(path, value);
  } catch (const FileUtilsIoException& error) {
    if (error.code() != ENOENT) throw;
    createDirectory();  // which somebody has removed
    context_.files->createFile(path, value);
  }
  return {std::move(name), static_cast<std::uint32_t>(value.size()), checksum};
}

// Under another name until it is complete: the checksum, which belongs to the name, is not known before.
VersionedFiles::Written VersionedFiles::write(const std::string& key, const PersistentKeyValueStore::Writer& writer) {
  FileUtils& files = *context_.files;
  const std::uint64_t number = nextNumber();
  const std::string unfinished = pathOf(VersionedName::format(key, number, 0) + kUnfinished);
  try {
    if (!files.pathExists(context_.options.directory)) createDirectory();
    const std::uint32_t size = writer(unfinished);
    const std::uint32_t checksum = checksumOf(key, unfinished);
    std::string name = VersionedName::format(key, number, checksum);
    files.rename(unfinished, pathOf(name));
    return {std::move(name), size, checksum};
  } catch (...) {
    try {
      files.deleteFile(unfinished);
    } catch (const std::exception&) {  // it may not have been created; what remains is removed at the next start
    }
    throw;
  }
}

void VersionedFiles::beginSync(const std::string& name) { context_.files->beginSync(pathOf(name)); }

void VersionedFiles::sync(const std::string& name) { context_.files->sync(pathOf(name)); }

void VersionedFiles::syncDirectory() { syncOrGiveUp(*context_.files, context_.options.directory); }

std::vector<VersionedFiles::Found> VersionedFiles::found() {
  takeStock();
  const std::lock_guard<std::mutex> lock(mutex_);
  std::vector<Found> files;
  for (std::string& name : namesInDirectory()) {
    auto version = VersionedName::parse(name);
    if (version && version->number < firstOwn_) files.push_back({std::move(name), std::move(*version)});
  }
  const auto isEarlier = [](const Found& a, const Found& b) { return a.version.number < b.version.number; };
  std::sort(files.begin(), files.end(), isEarlier);
  return files;
}

std::vector<std::string> VersionedFiles::unfinished() {
  takeStock();
  const std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::string> names;
  for (const std::string& name : namesInDirectory()) {
    const auto version = parseUnfinished(name);
    if (version && version->number < firstOwn_) names.push_back(name);
  }
  return names;
}

std::uint32_t VersionedFiles::checksumOf(const std::string& key, const std::string& path, std::uint64_t* size) const {
  Checksum checksum(key);
  std::uint64_t bytesRead = 0;
  context_.files->readPieces(path, [&](const unsigned char* bytes, std::size_t count) {
    checksum.add(bytes, count);
    bytesRead += count;
  });
  if (size != nullptr) *size = bytesRead;
  return checksum.value();
}

std::optional<std::uint32_t> VersionedFiles::sizeIfIntact(const Found& file) const {
  if (!file.version.key) return std::nullopt;
  std::uint64_t size = 0;
  if (checksumOf(*file.version.key, pathOf(file.name), &size) != file.version.checksum) return std::nullopt;
  return static_cast<std::uint32_t>(size);
}

std::string VersionedFiles::pathOf(const std::string& name) const {
  return context_.files->combinePath(context_.options.directory, name);
}

}  // namespace velmora::mobile::xplat::cellar
