#include "demo/Demo.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "Console.h"
#include "Format.h"
#include "InputError.h"
#include "Stopwatch.h"
#include "demo/SourceFiles.h"
#include "demo/Story.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr const char* kMarker = ".cellar-demo";

[[noreturn]] void refuse(const fs::path& root, const std::string& reason) {
  throw InputError("cannot use '" + root.string() + "' as the root: " + reason);
}

std::string makeTemporaryDirectory() {
  std::string path = (fs::temp_directory_path() / "cellar-demo-XXXXXX").string();
  if (mkdtemp(path.data()) == nullptr) refuse(path, std::generic_category().message(errno));
  return path;
}

std::string makeDirectory(const std::string& path) {
  std::error_code error;
  fs::create_directories(path, error);
  if (error) refuse(path, error.message());
  if (!fs::exists(fs::path(path) / kMarker) && !fs::is_empty(path, error)) {
    refuse(path, error ? error.message() : "it is not empty, and no earlier demo made it");
  }
  return fs::canonical(path).string();
}

// The directory that a demonstration has to itself while it runs. A directory of the user's that is neither empty nor
// marked as one of ours is never touched.
class DemoRoot {
 public:
  // Takes `path`, created if need be, and clears what an earlier demonstration left there; an empty `path` is a fresh
  // temporary directory that goes away at the end. Throws `InputError` when the directory cannot be had or belongs to
  // something else.
  explicit DemoRoot(const std::string& path);
  ~DemoRoot();
  DemoRoot(const DemoRoot&) = delete;
  DemoRoot& operator=(const DemoRoot&) = delete;

  const std::string& path() const;  // absolute
  bool isTemporary() const;

  // Throws `InputError` when `directory` lies in here, where it would be cleared.
  static void requireOutside(const std::string& root, const std::string& directory);

 private:
  void lock();
  void clear() const;

  const bool isTemporary_;
  const std::string path_;
  int lock_ = -1;  // file descriptor of the marker, locked
};

DemoRoot::DemoRoot(const std::string& path)
    : isTemporary_(path.empty()), path_(isTemporary_ ? makeTemporaryDirectory() : makeDirectory(path)) {
  lock();
  clear();
}

DemoRoot::~DemoRoot() {
  std::error_code ignored;
  if (isTemporary_) fs::remove_all(path_, ignored);
  if (lock_ >= 0) close(lock_);
}

const std::string& DemoRoot::path() const { return path_; }

bool DemoRoot::isTemporary() const { return isTemporary_; }

void DemoRoot::requireOutside(const std::string& root, const std::string& directory) {
  if (root.empty()) return;
  std::error_code error;
  const fs::path outer = fs::weakly_canonical(root, error);
  const fs::path inner = fs::weakly_canonical(directory, error);
  if (error) return;  // whatever is wrong with them shows when they are used
  const bool isInside = std::mismatch(outer.begin(), outer.end(), inner.begin(), inner.end()).first == outer.end();
  if (isInside) refuse(root, "DIRECTORY '" + directory + "' lies in it and would be cleared");
}

void DemoRoot::lock() {
  const std::string marker = (fs::path(path_) / kMarker).string();
  lock_ = open(marker.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (lock_ < 0) refuse(path_, std::generic_category().message(errno));
  if (flock(lock_, LOCK_EX | LOCK_NB) != 0) {
    close(lock_);
    refuse(path_, "another demo is running there");
  }
}

void DemoRoot::clear() const {
  try {
    for (const fs::directory_entry& entry : fs::directory_iterator(path_)) {
      if (entry.path().filename() != kMarker) fs::remove_all(entry.path());
    }
  } catch (const fs::filesystem_error& error) {
    close(lock_);
    refuse(path_, error.code().message());
  }
}

// What the stores take on disk beside the files themselves: directories, attributes, manifests, pictures, videos.
constexpr std::uint64_t kSpareBytes = 160U << 20U;

// Every file is copied into a directory and stored by key; where there are but a few, each store gets one of them.
std::uint64_t neededBytes(const SourceFiles& source) {
  constexpr std::size_t few = 10;
  return source.bytes * (source.files.size() < few ? few : 2) + kSpareBytes;
}

void requireSpace(const SourceFiles& source, const std::string& root) {
  const std::uint64_t needed = neededBytes(source);
  const std::uint64_t available = fs::space(root).available;
  if (available >= needed) return;
  throw InputError("the demo needs " + formatSize(needed) + " in '" + root + "', and only " + formatSize(available) +
                   " are free");
}

void introduce(Console& console, const DemoOptions& options, const SourceFiles& source, const DemoRoot& root) {
  console.heading("A day in the life of an application's storage");
  std::string files = formatFiles({source.files.size(), source.bytes});
  if (source.isPart) files += " of more";
  if (source.unreadable > 0) files += ", " + formatCount(source.unreadable) + " unreadable left out";
  console.line("files from   " + options.directory + " (" + files + ")");
  console.line("stores under " + root.path() + (root.isTemporary() ? " (removed at the end)" : ""));
}

}  // namespace

bool runDemo(const DemoOptions& options, Console& console) {
  const Stopwatch watch;
  DemoRoot::requireOutside(options.root, options.directory);
  const SourceFiles source = readSourceFiles(options.directory, options.root);
  const DemoRoot root(options.root);
  requireSpace(source, root.path());
  introduce(console, options, source, root);

  Story story(console, source, root.path());
  story.play();
  const bool isGood = story.failed() == 0;
  console.verdict((isGood ? "PASSED: " : "FAILED: ") + formatCount(story.passed(), "check", "checks") + " passed, " +
                      formatCount(story.failed()) + " failed (" + formatTime(watch.elapsed()) + ")",
                  isGood);
  return isGood;
}

}  // namespace velmora::mobile::xplat::cellar::tools
