#include "demo/Demo.h"

#include <sys/file.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <optional>
#include <system_error>

#include "Console.h"
#include "Format.h"
#include "InputError.h"
#include "Stopwatch.h"
#include "demo/SourceFiles.h"
#include "demo/Story.h"
#include "storage/TemporaryFolder.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

// The file in a root that says that a demonstration may clear it.
constexpr const char* kMarker = ".cellar-demo";

using Marker = std::unique_ptr<std::FILE, int (*)(std::FILE*)>;

[[noreturn]] void refuse(const fs::path& root, const std::string& reason) {
  throw InputError("cannot use '" + root.string() + "' as the root: " + reason);
}

void requireOutside(const std::string& root, const std::string& directory) {
  std::error_code error;
  const fs::path below = root.empty() ? "" : fs::relative(directory, root, error);
  if (error || below.empty() || *below.begin() == "..") return;  // an error shows when the two are used
  refuse(root, "DIRECTORY '" + directory + "' lies in it and would be cleared");
}

// The absolute path. A directory that is neither empty nor marked as one of ours is never touched.
std::string makeRoot(const std::string& path) {
  std::error_code error;
  fs::create_directories(path, error);
  if (error) refuse(path, error.message());
  const bool isOurs = fs::exists(fs::path(path) / kMarker) || fs::is_empty(path, error);
  if (!isOurs) refuse(path, error ? error.message() : "it is not empty, and no earlier demo made it");
  return fs::canonical(path).string();
}

// Nobody else can lock the root while the marker is open.
Marker lockRoot(const std::string& root) {
  Marker marker(std::fopen((root + "/" + kMarker).c_str(), "ae"), std::fclose);
  if (marker == nullptr) refuse(root, std::generic_category().message(errno));
  if (flock(fileno(marker.get()), LOCK_EX | LOCK_NB) != 0) refuse(root, "another demo is running there");
  return marker;
}

void clearRoot(const std::string& root) {
  std::error_code error;
  for (const fs::directory_entry& entry : fs::directory_iterator(root, error)) {
    if (entry.path().filename() != kMarker && !error) fs::remove_all(entry.path(), error);
  }
  if (error) refuse(root, error.message());
}

// Every file is copied into a directory and stored by key; where there are but a few, each store gets one of them.
void requireSpace(const SourceFiles& source, const std::string& root) {
  constexpr std::uint64_t spare = 160U << 20U;  // for directories, attributes, manifests, pictures, videos
  const std::uint64_t needed = source.bytes * (source.files.size() < 10 ? 10 : 2) + spare;
  const std::uint64_t available = fs::space(root).available;
  if (available >= needed) return;
  throw InputError("the demo needs " + formatSize(needed) + " in '" + root + "', and only " + formatSize(available) +
                   " are free");
}

void introduce(Console& console, const std::string& directory, const SourceFiles& source, const std::string& stores) {
  console.heading("A day in the life of an application's storage");
  std::string files = formatFiles({source.files.size(), source.bytes});
  if (source.isPart) files += " of more";
  if (source.unreadable > 0) files += ", " + formatCount(source.unreadable) + " unreadable left out";
  console.line("files from   " + directory + " (" + files + ")");
  console.line("stores under " + stores);
}

}  // namespace

bool runDemo(const DemoOptions& options, Console& console) {
  const Stopwatch watch;
  requireOutside(options.root, options.directory);
  const SourceFiles source = readSourceFiles(options.directory, options.root);
  std::optional<TemporaryFolder> temporary;
  if (options.root.empty()) temporary.emplace("cellar-demo");
  const std::string root = temporary ? temporary->path() : makeRoot(options.root);
  const Marker marker = lockRoot(root);
  clearRoot(root);
  requireSpace(source, root);
  introduce(console, options.directory, source, root + (temporary ? " (removed at the end)" : ""));

  Story story(console, source, root);
  story.play();
  const bool isGood = story.failed() == 0;
  console.verdict((isGood ? "PASSED: " : "FAILED: ") + formatCount(story.passed(), "check", "checks") + " passed, " +
                      formatCount(story.failed()) + " failed (" + formatTime(watch.elapsed()) + ")",
                  isGood);
  return isGood;
}

}  // namespace velmora::mobile::xplat::cellar::tools
