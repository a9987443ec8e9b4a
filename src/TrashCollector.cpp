#include "TrashCollector.h"

#include <glog/logging.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <exception>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "Clock.h"
#include "FileUtils.h"
#include "Future.h"
#include "Incident.h"
#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// A directory that something else keeps filling is given up after as many listings.
constexpr int kMaxListings = 10;

// How long a path is let become behind that of the trash. The system takes no more than PATH_MAX bytes, and each level
// takes a piece of the stack.
constexpr std::size_t kMaxPathInTrash = 512;

// How often a path is moved again when a pass has just removed the trash directory under it.
constexpr int kMaxMoves = 10;

}  // namespace

// The trash directory and the passes that empty it.
class TrashCollector::Trash {
 public:
  Trash(const std::string& path, const std::shared_ptr<FileUtils>& fileUtils)
      : path_(path), fileUtils_(fileUtils), random_(static_cast<std::uint64_t>(Clock::now())) {}

  // One pass, which is reported if it fails in a new way. Called from within a pass, by a file layer that collects
  // something on a queue that runs tasks at once, it leaves that to the pass.
  void collect() {
    if (passThread_ == std::this_thread::get_id()) return;
    const std::optional<std::string> failure = pass();
    if (failure && incidents_ != nullptr) incidents_->report({Incident::Kind::TrashStuck, path_, "", *failure});
  }

  void setIncidents(std::shared_ptr<const IncidentReporter> incidents) { incidents_ = std::move(incidents); }

  // A path in the trash that nothing has yet.
  std::string freeEntry() {
    const std::lock_guard<std::mutex> lock(randomMutex_);
    while (true) {
      char name[17];
      (void)std::snprintf(name, sizeof name, "%016" PRIx64, static_cast<std::uint64_t>(random_()));
      std::string entry = fileUtils_->combinePath(path_, name);
      if (!fileUtils_->pathExists(entry) && !fileUtils_->isSymLink(entry)) return entry;
    }
  }

  // Moves a path to its entry in the trash. No pass takes the trash directory away under it, but another process may:
  // nothing else is worth another try.
  void moveIn(const std::string& path, const std::string& entry) {
    const Move move(*this);
    for (int attempt = 1;; ++attempt) {
      try {
        throwIfLink();
        makeDirectory();
        fileUtils_->rename(path, entry);
        break;
      } catch (const FileUtilsIoException& error) {
        const bool pathIsThere = fileUtils_->pathExists(path) || fileUtils_->isSymLink(path);
        if (error.code() != ENOENT || !pathIsThere || attempt == kMaxMoves) throw;
      }
    }
    ++moves_;
  }

  // Makes a pass that is under way return at its next step.
  void interrupt() { running_ = false; }

  void resume() {
    deletedCount_ = 0;
    running_ = true;
  }

  // Files and directories deleted since `resume`.
  std::uint32_t deletedCount() const { return deletedCount_; }

 private:
  class Pass;

  // How a pass has failed.
  struct Failure {
    std::string text;
    std::set<std::string> stuck;  // the entries that it could not delete
  };

  // Until the trash is empty, what is left in it cannot be deleted, or the pass is interrupted. Never throws for a
  // failed file operation. Returns the line in the log if it fails in another way than the passes before it.
  std::optional<std::string> pass();

  // Whether nobody has been told.
  bool isNews(const Failure& failure) const {
    const std::set<std::string>& stuck = failure.stuck;
    return !lastFailure_ || lastFailure_->text != failure.text ||
           !std::includes(lastFailure_->stuck.begin(), lastFailure_->stuck.end(), stuck.begin(), stuck.end());
  }

  // While there is one, the trash directory stays.
  class Move {
   public:
    explicit Move(Trash& trash) : trash_(trash) {
      const std::lock_guard<std::recursive_mutex> lock(trash_.moveMutex_);
      ++trash_.movesUnderWay_;
    }
    ~Move() { --trash_.movesUnderWay_; }
    Move(const Move&) = delete;
    Move& operator=(const Move&) = delete;

   private:
    Trash& trash_;
  };

  // What is collected through a link would lie in somebody else's directory, where no pass deletes anything.
  void throwIfLink() const {
    if (fileUtils_->isSymLink(path_)) throw FileUtilsIoException(0, "Trash directory \"" + path_ + "\" is a link");
  }

  // One that is removed at the moment when it is looked at seems to be a file in the way.
  void makeDirectory() {
    try {
      fileUtils_->createDirectory(path_, true);
    } catch (const FileUtilsIoException& error) {
      const bool mayHaveGone = error.code() == EEXIST || error.code() == 0;
      if (!mayHaveGone || (fileUtils_->pathExists(path_) && !fileUtils_->isDirectory(path_))) throw;
      fileUtils_->createDirectory(path_, true);
    }
  }

  const std::string path_;
  const std::shared_ptr<FileUtils> fileUtils_;
  std::shared_ptr<const IncidentReporter> incidents_;
  std::mutex passMutex_;                // held by a pass: two at once would take each other's files away
  std::optional<Failure> lastFailure_;  // guarded by passMutex_; what has been told since a pass ended well
  std::atomic<std::thread::id> passThread_{};
  std::recursive_mutex moveMutex_;  // held where a move begins, and while the directory is removed; recursive because a
                                    // substituted file layer may collect something then
  std::atomic<unsigned int> movesUnderWay_{0};
  std::atomic<unsigned int> moves_{0};
  std::atomic<bool> running_{true};
  std::atomic<std::uint32_t> deletedCount_{0};
  std::mutex randomMutex_;
  std::mt19937_64 random_;  // guarded by randomMutex_
};

// One pass over the trash. An entry that cannot be deleted is left where it fails, and the others are deleted all the
// same.
class TrashCollector::Trash::Pass {
 public:
  explicit Pass(Trash& trash) : trash_(trash), fileUtils_(*trash.fileUtils_) {}

  // False when the rest is left to the pass that follows upon somebody's `moveIn`. Throws why the first entry that
  // cannot be deleted cannot.
  bool deleteTrash() {
    const unsigned int moves = trash_.moves_;
    trash_.throwIfLink();
    if (!fileUtils_.isDirectory(trash_.path_) || deleteEntries()) wasEmpty_ = false;
    if (failure_ != nullptr) std::rethrow_exception(failure_);
    if (!trash_.running_) return false;
    const std::lock_guard<std::recursive_mutex> lock(trash_.moveMutex_);
    if (trash_.movesUnderWay_ > 0) return false;
    if (moves != trash_.moves_) return true;
    // The directory itself counts with what it held: emptying an empty trash deletes nothing worth telling.
    if (!wasEmpty_) ++trash_.deletedCount_;
    fileUtils_.deleteFile(trash_.path_);
    return true;
  }

  const std::set<std::string>& stuck() const { return stuck_; }

 private:
  using Entries = std::vector<FileUtils::Info>;

  // False when there was nothing in the trash.
  bool deleteEntries() {
    int listings = 0;
    for (; listings < kMaxListings && trash_.running_; ++listings) {
      const Entries entries = untriedEntries();
      if (entries.empty()) break;
      for (const FileUtils::Info& entry : entries) deleteEntry(entry);
    }
    return listings > 0;
  }

  // What is in the trash but for the entries that cannot be deleted.
  Entries untriedEntries() {
    Entries entries = fileUtils_.listDirectory(trash_.path_);
    const Entries others = otherEntries(trash_.path_);
    entries.insert(entries.end(), others.begin(), others.end());
    const auto isStuck = [this](const FileUtils::Info& entry) { return stuck_.count(entry.path) > 0; };
    entries.erase(std::remove_if(entries.begin(), entries.end(), isStuck), entries.end());
    return entries;
  }

  // What the listing of a directory leaves out. A directory among it, on a file system that tells no types, is noticed
  // when it cannot be removed as a file.
  Entries otherEntries(const std::string& directory) {
    Entries entries;
    for (const std::string& path : fileUtils_.listOtherEntries(directory)) {
      entries.emplace_back(path, 0, FileUtils::Type::File);
    }
    return entries;
  }

  // With all that is moved up from within it, each part of which may fail by itself.
  void deleteEntry(const FileUtils::Info& entry) {
    trash_.throwIfLink();  // put there meanwhile
    parts_ = {entry};
    while (!parts_.empty() && trash_.running_) {
      const FileUtils::Info part = parts_.back();
      parts_.pop_back();
      try {
        recursiveDelete(part);
      } catch (const std::exception&) {
        stuck_.insert(part.path);
        if (failure_ == nullptr) failure_ = std::current_exception();
      }
    }
  }

  // The listing says what an entry is: asking the path again would follow a link.
  void recursiveDelete(const FileUtils::Info& entry) {
    if (!trash_.running_) return;
    if (entry.type != FileUtils::Type::Directory) return deletePath(entry.path);
    if (entry.path.size() > trash_.path_.size() + kMaxPathInTrash && moveUp(entry.path)) return;
    deleteContents(entry.path);
    if (trash_.running_) deletePath(entry.path);
  }

  // Out of the depth in which it is, to be deleted as an entry of the trash. False when it cannot be moved: it may be
  // deleted where it is.
  bool moveUp(const std::string& path) {
    const std::string entry = trash_.freeEntry();
    try {
      fileUtils_.rename(path, entry);
    } catch (const FileUtilsIoException&) {
      return false;
    }
    parts_.emplace_back(entry, 0, FileUtils::Type::Directory);
    return true;
  }

  void deleteContents(const std::string& path) {
    for (int listings = 0; listings < kMaxListings && trash_.running_; ++listings) {
      const Entries entries = fileUtils_.listDirectory(path);
      if (entries.empty()) return;
      deleteFrom(path, entries);
    }
  }

  void deleteFrom(const std::string& directory, const Entries& entries) {
    for (const FileUtils::Info& entry : entries) {
      // Whoever has put a link in the directory's place meanwhile would have us delete what lies behind it.
      if (fileUtils_.isSymLink(directory)) return;
      recursiveDelete(entry);
    }
  }

  // A directory may still hold what its listing leaves out.
  void deletePath(const std::string& path) {
    ++trash_.deletedCount_;
    Entries others;
    try {
      return fileUtils_.deleteFile(path);
    } catch (const FileUtilsIoException& error) {
      if (error.code() == ENOTEMPTY || error.code() == EEXIST) others = otherEntries(path);
      if (others.empty()) throw;
    }
    deleteFrom(path, others);
    if (trash_.running_) fileUtils_.deleteFile(path);
  }

  Trash& trash_;
  FileUtils& fileUtils_;
  bool wasEmpty_ = true;         // nothing has been found in the trash so far
  Entries parts_;                // what is left of the entry at hand: itself, and what has been moved up from within it
  std::set<std::string> stuck_;  // the entries that cannot be deleted
  std::exception_ptr failure_;   // of the first of them
};

std::optional<std::string> TrashCollector::Trash::pass() {
  const std::lock_guard<std::mutex> lock(passMutex_);
  passThread_ = std::this_thread::get_id();
  std::optional<std::string> news;
  Pass pass(*this);
  try {
    while (running_ && fileUtils_->pathExists(path_) && pass.deleteTrash()) {
    }
    if (running_) lastFailure_.reset();
  } catch (const std::exception& error) {
    const Failure failure{std::string("Cannot collect trash. ") + error.what(), pass.stuck()};
    LOG(ERROR) << failure.text;
    if (isNews(failure)) {
      news = failure.text;
      lastFailure_ = failure;
    }
  }
  passThread_ = std::thread::id();
  return news;
}

TrashCollector::TrashCollector(const std::string& trashPath, const std::shared_ptr<FileUtils>& fileUtils,
                               const std::shared_ptr<AnalyticsEventReporter>& reporter,
                               const std::shared_ptr<TaskQueueFactory>& taskQueueFactory)
    : fileUtils_(fileUtils),
      reporter_(reporter),
      trash_(std::make_shared<Trash>(trashPath, fileUtils)),
      queue_(taskQueueFactory == nullptr ? nullptr : taskQueueFactory->createQueue()) {}

bool TrashCollector::collectPath(const std::string& path) {
  try {
    if (queue_ == nullptr) {
      fileUtils_->recursiverDirectoryDelete(path);
      return true;
    }
    trash_->moveIn(path, trash_->freeEntry());
    queue_->dispatch([weakTrash = std::weak_ptr<Trash>(trash_)] {
      if (const auto trash = weakTrash.lock()) trash->collect();
    });
    return true;
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot collect path. " << error.what();
    return false;
  }
}

void TrashCollector::emptyAllTrash() {
  const auto start = std::chrono::system_clock::now();
  drainQueue();
  trash_->resume();
  trash_->collect();
  const auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::system_clock::now() - start);
  if (reporter_ != nullptr) reporter_->reportEvent(TrashCollectorEvent(elapsed, trash_->deletedCount()));
}

bool TrashCollector::removeFilesWithFilter(const std::string& path,
                                           const std::function<bool(const std::string&)>& filter) {
  try {
    if (!fileUtils_->isSymLink(path) && fileUtils_->isDirectory(path)) {
      bool allRemoved = true;
      for (const FileUtils::Info& entry : fileUtils_->listDirectory(path)) {
        if (fileUtils_->isSymLink(path)) break;  // put there meanwhile: it is removed as a link
        allRemoved = removeFilesWithFilter(entry.path, filter) && allRemoved;
      }
      if (!allRemoved) return false;
    }
    if (!filter(path)) return false;
    fileUtils_->deleteFile(path);
    return true;
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot collect path. " << error.what();
    return false;
  }
}

void TrashCollector::setIncidents(std::shared_ptr<const IncidentReporter> incidents) {
  trash_->setIncidents(std::move(incidents));
}

// Waits for everything queued so far; what a pass still had to do is left to the caller's own.
void TrashCollector::drainQueue() {
  if (queue_ == nullptr) return;
  trash_->interrupt();
  try {
    dispatchTask<void>(queue_, [] {}).get();
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot collect trash. " << error.what();  // the queue is shut down, so nothing runs on it either
  }
}

}  // namespace velmora::mobile::xplat::cellar
