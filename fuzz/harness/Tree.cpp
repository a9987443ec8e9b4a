#include "harness/Tree.h"

#include <fcntl.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <filesystem>
#include <fstream>
#include <functional>
#include <tuple>

#include "harness/Check.h"

namespace velmora::mobile::xplat::cellar::fuzz {

namespace {

namespace fs = std::filesystem;

using Visit = std::function<void(const std::string& path, const struct stat& status)>;

std::string textOf(const timespec& date) { return std::to_string(date.tv_sec) + "." + std::to_string(date.tv_nsec); }

std::string contentOf(const std::string& path, const struct stat& status) {
  if (S_ISLNK(status.st_mode)) return fs::read_symlink(path).string();
  if (!S_ISREG(status.st_mode)) return "";
  std::string bytes(static_cast<std::size_t>(status.st_size), '\0');
  std::ifstream(path, std::ios::binary).read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  return bytes;
}

void setDates(const std::string& path, const timespec& access, const timespec& change) {
  const std::array<timespec, 2> dates = {access, change};
  check(utimensat(AT_FDCWD, path.c_str(), dates.data(), AT_SYMLINK_NOFOLLOW) == 0, "dates can be set", path);
}

// A directory before its contents, and none with other dates than before. `visit` may make it readable.
void walk(const std::string& path, const Visit& visit) {
  struct stat status = {};
  check(lstat(path.c_str(), &status) == 0, "what is in a tree can be looked at", path);
  visit(path, status);
  if (S_ISDIR(status.st_mode)) {
    for (const auto& entry : fs::directory_iterator(path)) walk(entry.path().string(), visit);
  }
  setDates(path, status.st_atim, status.st_mtim);
}

}  // namespace

bool TreeEntry::operator==(const TreeEntry& other) const {
  return std::tie(number, isFile, content, dates) == std::tie(other.number, other.isFile, other.content, other.dates);
}

Tree treeOf(const std::string& directory) {
  Tree tree;
  walk(directory, [&](const std::string& path, const struct stat& status) {
    TreeEntry& entry = tree[path.substr(directory.size())];
    entry.number = status.st_ino;
    entry.isFile = S_ISREG(status.st_mode);
    entry.content = contentOf(path, status);
    entry.dates = (S_ISLNK(status.st_mode) ? "" : textOf(status.st_atim) + " ") + textOf(status.st_mtim);
  });
  return tree;
}

void checkUnchanged(const Tree& before, const Tree& now, const std::string& part, const char* law) {
  const auto checkOthers = [&](const Tree& some, const Tree& others) {
    for (const auto& [path, entry] : some) {
      if (path.compare(0, part.size(), part) != 0) continue;
      const auto other = others.find(path);
      check(other != others.end() && other->second == entry, law, path);
    }
  };
  checkOthers(before, now);
  checkOthers(now, before);
}

void makeOld(const std::string& directory) {
  constexpr timespec longPast = {1'000'000'000, 0};
  for (const auto& [below, entry] : treeOf(directory)) setDates(directory + below, longPast, longPast);
}

void makeReadable(const std::string& directory) {
  walk(directory, [](const std::string& path, const struct stat& status) {
    const bool hasRights = (status.st_mode & S_IRWXU) == S_IRWXU;
    if (!S_ISLNK(status.st_mode) && !hasRights) (void)chmod(path.c_str(), status.st_mode | S_IRWXU);
  });
}

void obeyPermissions() {
  __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  std::array<__user_cap_data_struct, _LINUX_CAPABILITY_U32S_3> sets{};
  if (syscall(SYS_capget, &header, sets.data()) != 0) return;
  sets[0].effective &= ~(1U << CAP_DAC_OVERRIDE | 1U << CAP_DAC_READ_SEARCH);
  (void)syscall(SYS_capset, &header, sets.data());
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
