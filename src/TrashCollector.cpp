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
#include <thread>

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

  // One pass: until the trash is gone or the pass is interrupted. Never throws for a failed file operation. Called from
  // within a pass, by a file layer that collects something on a queue that runs tasks at once, it leaves that to the
  // pass.
  void collect() {
    if (passThread_ == std::this_thread::get_id()) return;
    const std::lock_guard<std::mutex> lock(passMutex_);
    passThread_ = std::this_thread::get_id();
    try {
      bool wasEmpty = true;
      while (running_ && fileUtils_->pathExists(path_) && deleteTrash(wasEmpty)) {
      }
    } catch (const std::exception& error) {
      LOG(ERROR) << "Cannot collect trash. " << error.what();
    }
    passThread_ = std::thread::id();
  }

  // Moves a path to its entry in the trash. No pass takes the trash directory away under it, but another process may:
  // nothing else is worth another try.
  void moveIn(const std::string& path, const std::string& entry) {
    const Move move(*this);
    for (int attempt = 1;; ++attempt) {
      try {
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

  // One that goes at the moment when it is looked at seems to be a file in the way.
  void makeDirectory() {
    try {
      fileUtils_->createDirectory(path_, true);
    } catch (const FileUtilsIoException& error) {
      const bool mayHaveGone = error.code() == EEXIST || error.code() == 0;
      if (!mayHaveGone || (fileUtils_->pathExists(path_) && !fileUtils_->isDirectory(path_))) throw;
      fileUtils_->createDirectory(path_, true);
    }
  }

  // False when the rest is left to the pass that follows upon somebody's `moveIn`. `wasEmpty`: nothing has been found
  // in the trash so far.
  bool deleteTrash(bool& wasEmpty) {
    const unsigned int moves = moves_;
    const bool isDirectory = !fileUtils_->isSymLink(path_) && fileUtils_->isDirectory(path_);
    if (!isDirectory || deleteContents(path_)) wasEmpty = false;
    if (!running_) return false;
    const std::lock_guard<std::recursive_mutex> lock(moveMutex_);
    if (movesUnderWay_ > 0) return false;
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
  std::mutex passMutex_;  // held by a pass: two at once would take each other's files away
  std::atomic<std::thread::id> passThread_{};
  std::recursive_mutex moveMutex_;  // held where a move begins, and while the directory goes; recursive because a
                                    // substituted file layer may collect something then
  std::atomic<unsigned int> movesUnderWay_{0};
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
    trash_->moveIn(path, freeTrashEntry());
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
