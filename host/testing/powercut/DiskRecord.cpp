#include "host/testing/powercut/DiskRecord.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>
#include <system_error>

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar::test {

namespace {

using Bytes = FileHistory::Bytes;

std::optional<std::string> canonical(const std::string& path) {
  const std::unique_ptr<char, decltype(&std::free)> real(::realpath(path.c_str(), nullptr), &std::free);
  return real ? std::make_optional<std::string>(real.get()) : std::nullopt;
}

std::string canonicalRoot(const std::string& directory) {
  const auto root = canonical(directory);
  if (!root) throw FileUtilsIoException(errno, std::generic_category().message(errno));
  return *root;
}

std::optional<Node::Kind> kindOf(const struct stat& status) {
  if (S_ISREG(status.st_mode)) return Node::Kind::File;
  if (S_ISDIR(status.st_mode)) return Node::Kind::Directory;
  if (S_ISLNK(status.st_mode)) return Node::Kind::Link;
  return std::nullopt;
}

std::int64_t dateOf(const struct stat& status) {
  return std::int64_t{status.st_mtim.tv_sec} * 1'000'000'000 + status.st_mtim.tv_nsec;
}

std::string targetOf(const std::string& link) {
  std::array<char, PATH_MAX> target = {};
  const auto length = ::readlink(link.c_str(), target.data(), target.size());
  return {target.data(), length < 0 ? 0 : static_cast<std::size_t>(length)};
}

NodePtr nodeOf(Node::Kind kind, std::uint64_t inode, const std::string& path) {
  auto node = std::make_shared<Node>();
  node->kind = kind;
  node->inode = inode;
  if (kind == Node::Kind::Link) node->target = targetOf(path);
  return node;
}

bool beginsWith(const Bytes& whole, const Bytes& beginning) {
  return whole.size() >= beginning.size() && std::equal(beginning.begin(), beginning.end(), whole.begin());
}

Bytes part(const Bytes& whole, std::size_t begin, std::size_t end) {
  return {whole.begin() + static_cast<std::ptrdiff_t>(begin), whole.begin() + static_cast<std::ptrdiff_t>(end)};
}

// Something that changed a file without having been seen at it has added to it, or has emptied and written it.
void assumeWritten(FileHistory& content, const Bytes& present) {
  const std::size_t known = content.current().size();
  if (present.size() > known && beginsWith(present, content.current())) {
    content.write(known, part(present, known, present.size()));
  } else {
    content.truncate(0);
    content.write(0, present);
  }
}

// A database is only ever changed in parts.
void assumeWrittenInParts(FileHistory& content, const Bytes& present) {
  content.truncate(present.size());
  for (std::size_t begin = 0; begin < present.size(); begin += FileHistory::kSectorSize) {
    const std::size_t end = std::min(begin + FileHistory::kSectorSize, present.size());
    const auto offset = static_cast<std::ptrdiff_t>(begin);
    const bool differs = !std::equal(present.begin() + offset, present.begin() + static_cast<std::ptrdiff_t>(end),
                                     content.current().begin() + offset);
    if (differs) content.write(begin, part(present, begin, end));
  }
}

}  // namespace

DiskRecord::DiskRecord(const std::string& directory) : root_(canonicalRoot(directory)) {
  observeTree(history_.root(), root_);
  history_.syncAll();
}

NodePtr DiskRecord::observe(const std::string& path) {
  std::string directoryPath;
  std::string name;
  NodePtr directory = directoryOf(path, directoryPath, name);
  if (!directory || name.empty()) return directory;
  NodePtr node = observeEntry(directory, directoryPath, name);
  if (node && node->kind == Node::Kind::File) observeContent(*node, disk_.combinePath(directoryPath, name));
  return node;
}

NodePtr DiskRecord::observeTarget(const std::string& path) { return observe(canonical(path).value_or(path)); }

void DiskRecord::replaced(const std::string& path, const std::vector<unsigned char>& data) {
  const std::string file = canonical(path).value_or(path);
  std::string directoryPath;
  std::string name;
  const NodePtr directory = directoryOf(file, directoryPath, name);
  const NodePtr node = directory && !name.empty() ? observeEntry(directory, directoryPath, name) : nullptr;
  if (!node || node->kind != Node::Kind::File) return;
  node->content.truncate(0);
  node->content.write(0, data);
  struct stat status {};
  if (::stat(file.c_str(), &status) == 0) node->changed = dateOf(status);
}

void DiskRecord::renamed(const std::string& from, const std::string& to) {
  std::string fromPath;
  std::string toPath;
  std::string fromName;
  std::string toName;
  const NodePtr fromDirectory = directoryOf(from, fromPath, fromName);
  const NodePtr toDirectory = directoryOf(to, toPath, toName);
  struct stat status {};
  const bool hasMoved = ::lstat((fromPath + "/" + fromName).c_str(), &status) != 0;
  if (fromDirectory && toDirectory && hasMoved && fromDirectory->entries.count(fromName) != 0) {
    history_.rename(fromDirectory, fromName, toDirectory, toName);
    return;
  }
  (void)observe(from);
  (void)observe(to);
}

void DiskRecord::synced(const std::string& path) {
  const NodePtr node = observeTarget(path);
  if (!node) return;
  node->content.sync();
  if (node->kind == Node::Kind::Directory) syncEntries(node, canonical(path).value_or(path));
}

void DiskRecord::syncedParentOf(const std::string& path) {
  std::string directoryPath;
  std::string name;
  const NodePtr directory = directoryOf(path, directoryPath, name);
  if (directory) syncEntries(directory, directoryPath);
}

NodePtr DiskRecord::openedAsDatabase(const std::string& path) {
  NodePtr node = observeTarget(path);
  if (!node || node->kind != Node::Kind::File) return nullptr;
  node->isDatabase = true;
  return node;
}

void DiskRecord::disregard(const std::string& path) {
  std::string directoryPath;
  std::string name;
  const NodePtr directory = directoryOf(path, directoryPath, name);
  if (directory) directory->disregarded.insert(name);
}

std::vector<Remains> DiskRecord::afterPowerCut(std::uint32_t seed) {
  observeTree(history_.root(), root_);
  Random random(seed);
  return history_.afterPowerCut(random);
}

// The path below the root, "" for the root itself. What does not exist lies below the last directory that does.
std::optional<std::string> DiskRecord::relative(const std::string& path) const {
  FileUtils names;
  std::string rest;
  std::string directory = path;
  std::optional<std::string> real;
  for (bool isLast = true; !real; isLast = false) {
    const std::string name = names.basename(directory);
    const bool isName = !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos;
    if (!isLast || !isName) real = canonical(directory.empty() ? "." : directory);
    if (real) break;
    if (!isName) return std::nullopt;
    rest = rest.empty() ? name : names.combinePath(name, rest);
    const std::string parent = names.parentPath(directory);
    directory = parent.empty() && directory.front() == '/' ? "/" : parent;
  }
  const std::string whole = rest.empty() ? *real : names.combinePath(*real, rest);
  if (whole == root_) return "";
  const std::string below = names.combinePath(root_, "");
  if (whole.compare(0, below.size(), below) != 0) return std::nullopt;
  return whole.substr(below.size());
}

// The directory that holds a path's last component; the root itself, with an empty name, for the root.
NodePtr DiskRecord::directoryOf(const std::string& path, std::string& directoryPath, std::string& name) {
  std::optional<std::string> rest = relative(path);
  if (!rest) return nullptr;
  NodePtr directory = history_.root();
  directoryPath = root_;
  for (auto slash = rest->find('/'); slash != std::string::npos; slash = rest->find('/')) {
    const std::string component = rest->substr(0, slash);
    directory = observeEntry(directory, directoryPath, component);
    if (!directory || directory->kind != Node::Kind::Directory) return nullptr;
    directoryPath += "/" + component;
    rest->erase(0, slash + 1);
  }
  name = *rest;
  return directory;
}

NodePtr DiskRecord::observeEntry(const NodePtr& directory, const std::string& directoryPath, const std::string& name) {
  if (directory->disregarded.count(name) != 0) return nullptr;
  const std::string path = disk_.combinePath(directoryPath, name);
  struct stat status {};
  const auto kind = ::lstat(path.c_str(), &status) == 0 ? kindOf(status) : std::nullopt;
  const auto known = directory->entries.find(name);
  if (!kind) {
    if (known != directory->entries.end()) history_.unlink(directory, name);
    return nullptr;
  }
  const auto inode = static_cast<std::uint64_t>(status.st_ino);
  const bool isKnown =
      known != directory->entries.end() && known->second->kind == *kind && known->second->inode == inode;
  if (isKnown) return known->second;
  NodePtr node = nodeOf(*kind, inode, path);
  history_.link(directory, name, node);
  return node;
}

// The names that a directory has, or had when it was last looked at. It may have vanished since.
std::vector<std::string> DiskRecord::observeEntries(const NodePtr& directory, const std::string& path) {
  std::set<std::string> names;
  for (const auto& [name, node] : directory->entries) names.insert(name);
  if (disk_.isDirectory(path)) {
    for (const FileUtils::Info& entry : disk_.listDirectory(path)) names.insert(disk_.basename(entry.path));
  }
  for (const std::string& name : names) (void)observeEntry(directory, path, name);
  return {names.begin(), names.end()};
}

void DiskRecord::observeTree(const NodePtr& directory, const std::string& path) {
  for (const std::string& name : observeEntries(directory, path)) {
    const auto entry = directory->entries.find(name);
    if (entry == directory->entries.end()) continue;
    const NodePtr node = entry->second;
    const std::string entryPath = disk_.combinePath(path, name);
    if (node->kind == Node::Kind::Directory) observeTree(node, entryPath);
    if (node->kind == Node::Kind::File) observeContent(*node, entryPath);
  }
}

void DiskRecord::syncEntries(const NodePtr& directory, const std::string& path) {
  (void)observeEntries(directory, path);
  history_.sync(directory);
}

// A file that has vanished since, or cannot be read, stays as it was known.
void DiskRecord::observeContent(Node& file, const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) return;
  Bytes present;
  try {
    present = disk_.readFile(path);
  } catch (const FileUtilsIoException&) {
    return;
  }
  const bool differs = present != file.content.current();
  if (file.isDatabase) {
    if (differs) assumeWrittenInParts(file.content, present);
  } else if (differs || dateOf(status) != file.changed) {
    assumeWritten(file.content, present);
  }
  file.changed = dateOf(status);
}

}  // namespace velmora::mobile::xplat::cellar::test
