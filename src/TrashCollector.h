#pragma once

#include <functional>
#include <memory>
#include <string>

#include "Export.h"
#include "executor/TaskQueueFactory.h"

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class FileUtils;
class IncidentReporter;

// Makes directory trees vanish at once and frees their space later. The trash is a directory on the same file system as
// what is collected; it exists only while there is something in it. Shared by all managers and stores; any thread may
// call. Never throws for a failed file operation: it returns false, or logs one error line. Links are removed as links
// and never followed, so nothing outside a collected tree is touched. A link in the place of the trash directory itself
// is refused: nothing is collected then, and no pass deletes anything.
//
// Whatever is in the trash is deleted: trees deeper than PATH_MAX, fifos and sockets too. A path that cannot be deleted
// stays in the trash, from where deleting it failed, and the trash directory with it; everything else in the trash is
// deleted all the same. The first failure of a pass is its one error line, and the next pass tries again.
//
// What survives: a collected path is removed from its place even when the process is killed right after the call; what
// is still in the trash then is removed by the next pass of a collector over the same trash directory.
class CELLAR_EXPORT TrashCollector {
 public:
  // With a task queue factory, deletion runs on a queue of the collector's own; what is still queued when the collector
  // is destroyed is left to the next collector. Without a factory (null) everything happens on the caller's thread.
  // `reporter` may be null.
  TrashCollector(const std::string& trashPath, const std::shared_ptr<FileUtils>& fileUtils,
                 const std::shared_ptr<AnalyticsEventReporter>& reporter,
                 const std::shared_ptr<TaskQueueFactory>& taskQueueFactory);
  TrashCollector(const TrashCollector&) = delete;
  TrashCollector& operator=(const TrashCollector&) = delete;

  // Moves `path` into the trash under a fresh random name, by one rename, and returns at once; the bytes are freed
  // later on the collector's queue. Without a queue: deletes the directory in place. True when the path has left its
  // place; false (and one error line) when it could not be moved: nothing is lost then. Not an error: a trash directory
  // that does not exist yet.
  virtual bool collectPath(const std::string& path);

  // Empties the trash on the caller's thread and reports how long it took and how many files and directories went. A
  // pass that runs in the background is interrupted and everything queued before is waited for, so it must not be
  // called on the collector's queue.
  virtual void emptyAllTrash();

  // Deletes, in place, what `filter` accepts of the tree at `path`, contents before their directory; a directory goes
  // only when all its contents went and the filter accepts it too. True when `path` itself was deleted. An exception,
  // the filter's own included, leaves that entry where it is.
  virtual bool removeFilesWithFilter(const std::string& path, const std::function<bool(const std::string&)>& filter);

  // Reports `TrashStuck` to `incidents`, which may be null, when a pass ends with an error: the name is the path of the
  // trash directory. Passes that meet the same error at the same entries, or some of them, report it once, until one
  // ends without an error. To be called before several threads use the collector.
  void setIncidents(std::shared_ptr<const IncidentReporter> incidents);

 private:
  class Trash;

  void drainQueue();

  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<AnalyticsEventReporter> reporter_;
  const std::shared_ptr<Trash> trash_;          // what a pass works on, so that it can outlive the collector
  const std::shared_ptr<AsyncExecutor> queue_;  // null: everything on the caller's thread
};

}  // namespace velmora::mobile::xplat::cellar
