#include "TrashCollector.h"

#include <glog/logging.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <exception>

#include "AnalyticsEventReporter.h"
#include "FileUtils.h"
#include "Future.h"
#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// A directory that something else keeps filling is given up after as many listings.
constexpr int kMaxListings = 10;

// How often a path is moved again when a pass has just removed the trash directory under it.
constexpr int kMaxMoves = 10;

}  // namespace

// The trash directory and the passes that empty it.
class TrashCollector::Trash {
 public:
  Trash(const std::string& path, const std::shared_ptr<FileUtils>& fileUtils) : path_(path), fileUtils_(fileUtils) {}

  // One pass: until the trash is gone or the pass is interrupted. Never throws for a failed file operation.
  void collect() {
    const std::lock_guard<std::mutex> lock(passMutex_);
    try {
      while (running_ && fileUtils_->pathExists(path_) && deleteTrash()) {
      }
    } catch (const std::exception& error) {
      LOG(ERROR) << "Cannot collect trash. " << error.what();
    }
  }

  // Moves a path to its entry in the trash. No pass takes the trash directory away under it, but another process may.
  void moveIn(const std::string& path, const std::string& entry) {
    const std::lock_guard<std::recursive_mutex> lock(moveMutex_);
    fileUtils_->createDirectory(path_, true);
    fileUtils_->rename(path, entry);
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
  // False when the rest is left to the pass that follows upon somebody's `moveIn`.
  bool deleteTrash() {
    const unsigned int moves = moves_;
    const bool isDirectory = !fileUtils_->isSymLink(path_) && fileUtils_->isDirectory(path_);
    const bool wasEmpty = isDirectory && !deleteContents(path_);
    if (!running_) return false;
    const std::unique_lock<std::recursive_mutex> lock(moveMutex_, std::try_to_lock);
    if (!lock.owns_lock()) return false;
    if (moves != moves_) return true;
    // The directory itself counts with what it held: emptying an empty trash deletes nothing worth telling.
    if (!wasEmpty) ++deletedCount_;
    fileUtils_->deleteFile(path_);
    return true;
  }

  // The listing says what an entry is: asking the path again would follow a link.
  void recursiveDelete(const FileUtils::Info& entry) {
    if (!running_) return;
    if (entry.type == FileUtils::Type::Directory) deleteContents(entry.path);
    if (!running_) return;
    ++deletedCount_;
    fileUtils_->deleteFile(entry.path);
  }

  // False when there was nothing in it.
  bool deleteContents(const std::string& path) {
    int listings = 0;
    for (; listings < kMaxListings && running_; ++listings) {
      const auto entries = fileUtils_->listDirectory(path);
      if (entries.empty()) break;
      for (const FileUtils::Info& entry : entries) {
        // Whoever has put a link in the directory's place meanwhile would have us delete what lies behind it.
        if (fileUtils_->isSymLink(path)) return true;
        recursiveDelete(entry);
      }
    }
    return listings > 0;
  }

  const std::string path_;
  const std::shared_ptr<FileUtils> fileUtils_;
  std::mutex passMutex_;            // held by a pass: two at once would take each other's files away
  std::recursive_mutex moveMutex_;  // held while a path is moved in, and while the directory goes; recursive because a
                                    // substituted file layer may run a pass in the middle of a move
  std::atomic<unsigned int> moves_{0};
  std::atomic<bool> running_{true};
  std::atomic<std::uint32_t> deletedCount_{0};
};

TrashCollector::TrashCollector(const std::string& trashPath, const std::shared_ptr<FileUtils>& fileUtils,
                               const std::shared_ptr<AnalyticsEventReporter>& reporter,
                               const std::shared_ptr<TaskQueueFactory>& taskQueueFactory)
    : trashPath_(trashPath),
      fileUtils_(fileUtils),
      reporter_(reporter),
      trash_(std::make_shared<Trash>(trashPath, fileUtils)),
      queue_(taskQueueFactory == nullptr ? nullptr : taskQueueFactory->createQueue()),
      random_(static_cast<std::uint64_t>(std::time(nullptr))) {}

bool TrashCollector::collectPath(const std::string& path) {
  try {
    if (queue_ == nullptr) {
      fileUtils_->recursiverDirectoryDelete(path);
      return true;
    }
    moveToTrash(path);
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
        if (fileUtils_->isSymLink(path)) break;  // put there meanwhile: it goes as a link
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

void TrashCollector::moveToTrash(const std::string& path) {
  const std::string entry = freeTrashEntry();
  for (int move = 1;; ++move) {
    try {
      return trash_->moveIn(path, entry);
    } catch (const FileUtilsIoException& error) {
      // Somebody may have removed the trash directory at any moment in between. Nothing else is worth another try.
      const bool mayHaveGone = error.code() == ENOENT || error.code() == EEXIST || error.code() == 0;
      const bool pathIsThere = fileUtils_->pathExists(path) || fileUtils_->isSymLink(path);
      if (!mayHaveGone || !pathIsThere || move == kMaxMoves) throw;
    }
  }
}

std::string TrashCollector::freeTrashEntry() {
  const std::lock_guard<std::mutex> lock(randomMutex_);
  while (true) {
    char name[17];
    (void)std::snprintf(name, sizeof name, "%016" PRIx64, static_cast<std::uint64_t>(random_()));
    std::string entry = fileUtils_->combinePath(trashPath_, name);
    if (!fileUtils_->pathExists(entry) && !fileUtils_->isSymLink(entry)) return entry;
  }
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
