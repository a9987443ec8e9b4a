#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <unordered_set>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class AttributeStore;
class FileUtils;

// Measures how many files and bytes directory trees hold. Measuring is slow, so each directory's result is kept in its
// attributes and reused, at every depth, until it is older than a staleness interval. Each measurement, and each single
// large file met on the way, can be reported to analytics. Links are neither counted nor followed; sockets, devices and
// the like are not counted.
//
// Any thread may call; measurements run on the caller's thread and hold no lock. What is excluded meanwhile
// counts from the next measurement on. Two measurements of one tree at once are not kept apart: both write
// the same results.
//
// The result of a directory replaces whatever else its attributes held, the mark for trashing at start-up among them.
// The attributes file is itself a file of the tree: it is counted by later measurements unless its name is excluded.
class CELLAR_EXPORT DiskSizeCalculator {
 public:
  static constexpr long long LARGE_FILE_SIZE = 1048576;  // bytes from which on a file is reported by itself
  static constexpr double MIN_TIME_SPENT = 1e-09;        // seconds that every counted file adds to a measurement's time
  static constexpr int STALE_INTERVAL = 604800;  // seconds for directories registered without an interval: 7 days

  // The members of the attribute document in which a result is kept.
  static const std::string ATTR_SIZE;
  static const std::string ATTR_FILE_COUNT;
  static const std::string ATTR_TIME_SPENT;
  static const std::string ATTR_TIME_STAMP;

  struct CELLAR_EXPORT Stats {
    Stats(bool valid, double timeSpent, long long fileCount, long long size);

    bool valid;           // the figures come from a kept result or an excluded directory; false for a fresh measurement
    double timeSpent;     // seconds of processor time; the time of nested directories counts once for every level
    long long fileCount;  // regular files
    long long size;       // bytes of those files
  };

  DiskSizeCalculator(const std::shared_ptr<FileUtils>& fileUtils, const std::shared_ptr<AttributeStore>& attributeStore,
                     const std::shared_ptr<AnalyticsEventReporter>& reporter);  // `reporter` may be null
  virtual ~DiskSizeCalculator();
  DiskSizeCalculator(const DiskSizeCalculator&) = delete;
  DiskSizeCalculator& operator=(const DiskSizeCalculator&) = delete;

  // The bytes that were last measured, however long ago, without measuring: 0 for a directory that is missing or was
  // never measured, and (with one error line) when the kept result cannot be read.
  virtual long long fetchDirectorySize(const std::string& path);

  // Registers a directory for `startDiskSizeCalculation`, with the seconds for which its result stays fresh. Replaces
  // an earlier interval. What is not a directory is ignored.
  virtual void addDirectory(const std::string& path, long staleInterval);

  // Leaves out every directory and file of that name (the last path component), at every depth.
  virtual void exclude(const std::string& name);

  // Measures the registered directories, in no particular order, and forgets them, with what was registered meanwhile:
  // register again before the next start.
  virtual void startDiskSizeCalculation();

  // The figures of one tree: the kept result while it is fresh, else measured now. A failure anywhere in the tree is
  // one error line and all zeros; directories finished before it keep their results.
  virtual Stats calculateDirectorySize(const std::string& path);

  // Whether measurements are reported. Off until it is switched on.
  virtual void setAnalytics(bool enabled);

  // The walk behind `calculateDirectorySize`, calling itself for sub-directories. Throws what the file utilities throw.
  virtual Stats traverseDirectory(const std::string& path, const std::unordered_map<std::string, long>& directories,
                                  const std::unordered_set<std::string>& excluded);

  // The result kept with `path` if it is at most `staleInterval` seconds old, else an invalid one. A damaged result
  // counts as none.
  Stats getCachedStats(const std::string& path, long staleInterval);

  // Keeps a result with `path`, stamped with the current time.
  void setCachedStats(const std::string& path, const Stats& stats);

  // Reports a result, if there is a reporter and analytics are on.
  void reportAnalytics(const std::string& path, const Stats& stats);

 private:
  std::mutex mutex_;  // guards the three below
  bool analytics_ = false;
  std::unordered_map<std::string, long> directories_;
  std::unordered_set<std::string> excluded_;

  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<AttributeStore> attributeStore_;
  const std::shared_ptr<AnalyticsEventReporter> reporter_;
};

}  // namespace velmora::mobile::xplat::cellar
