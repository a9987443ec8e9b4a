#include "DiskSizeCalculator.h"

#include <glog/logging.h>

#include <cstdint>
#include <exception>
#include <type_traits>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "AttributeStore.h"
#include "Clock.h"
#include "FileUtils.h"
#include "JsonValue.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr double kClockTicksPerSecond = 1000000.0;

// With 32 bits the clock wraps every 72 minutes of processor time; the difference is right across that.
double secondsSince(std::clock_t start) {
  const auto now = static_cast<std::make_unsigned_t<std::clock_t>>(std::clock());
  const auto elapsed = now - static_cast<std::make_unsigned_t<std::clock_t>>(start);
  return static_cast<double>(elapsed) / kClockTicksPerSecond;
}

// The member as an integer, or 0 when the document has none. Throws the JSON library's type error for anything else.
std::int64_t integerIn(const JsonValue& document, const std::string& key) {
  const auto member = document.find(key);
  return member == document.end() ? 0 : member->get_ref<const JsonValue::number_integer_t&>();
}

double numberIn(const JsonValue& document, const std::string& key) {
  const auto member = document.find(key);
  if (member == document.end()) return 0.0;
  if (member->is_number_integer()) return static_cast<double>(member->get<std::int64_t>());
  return member->get_ref<const JsonValue::number_float_t&>();
}

// Figures that others have written into the attributes may be of any size: their sum wraps.
void add(long long& sum, long long figure) {
  sum = static_cast<long long>(static_cast<unsigned long long>(sum) + static_cast<unsigned long long>(figure));
}

}  // namespace

const std::string DiskSizeCalculator::ATTR_SIZE = "qzDirectorySizeCalculationSize";
const std::string DiskSizeCalculator::ATTR_FILE_COUNT = "qzDirectorySizeCalculationFilecount";
const std::string DiskSizeCalculator::ATTR_TIME_SPENT = "qzDirectorySizeCalculationTimespent";
const std::string DiskSizeCalculator::ATTR_TIME_STAMP = "qzDirectorySizeCalculationTimestamp";

DiskSizeCalculator::Stats::Stats(bool valid_, double timeSpent_, long long fileCount_, long long size_)
    : valid(valid_), timeSpent(timeSpent_), fileCount(fileCount_), size(size_) {}

DiskSizeCalculator::DiskSizeCalculator(const std::shared_ptr<FileUtils>& fileUtils,
                                       const std::shared_ptr<AttributeStore>& attributeStore,
                                       const std::shared_ptr<AnalyticsEventReporter>& reporter)
    : fileUtils_(fileUtils), attributeStore_(attributeStore), reporter_(reporter) {}

DiskSizeCalculator::~DiskSizeCalculator() = default;

long long DiskSizeCalculator::fetchDirectorySize(const std::string& path) {
  try {
    if (!fileUtils_->pathExists(path)) return 0;
    return integerIn(attributeStore_->get(path), ATTR_SIZE);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot fetch directory size. " << error.what();
    return 0;
  }
}

void DiskSizeCalculator::addDirectory(const std::string& path, long staleInterval) {
  if (!fileUtils_->isDirectory(path)) return;
  const std::lock_guard<std::mutex> lock(mutex_);
  directories_[path] = staleInterval;
}

void DiskSizeCalculator::exclude(const std::string& name) {
  const std::lock_guard<std::mutex> lock(mutex_);
  excluded_.insert(name);
}

void DiskSizeCalculator::startDiskSizeCalculation() {
  std::vector<std::string> paths;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& directory : directories_) paths.push_back(directory.first);
  }
  for (const std::string& path : paths) calculateDirectorySize(path);
  const std::lock_guard<std::mutex> lock(mutex_);
  directories_.clear();
}

DiskSizeCalculator::Stats DiskSizeCalculator::calculateDirectorySize(const std::string& path) {
  try {
    std::unordered_map<std::string, long> directories;
    std::unordered_set<std::string> excluded;
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      directories = directories_;
      excluded = excluded_;
    }
    return traverseDirectory(path, directories, excluded);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot calculate directory size. " << error.what();
    return {false, 0, 0, 0};
  }
}

void DiskSizeCalculator::setAnalytics(bool enabled) {
  const std::lock_guard<std::mutex> lock(mutex_);
  analytics_ = enabled;
}

DiskSizeCalculator::Stats DiskSizeCalculator::traverseDirectory(
    const std::string& path, const std::unordered_map<std::string, long>& directories,
    const std::unordered_set<std::string>& excluded) {
  const bool isLink = fileUtils_->isSymLink(path);  // only a directory that was asked for by its name may be one
  if (!fileUtils_->isDirectory(path)) return {false, 0, 0, 0};
  if (excluded.count(fileUtils_->basename(path)) > 0) return {true, 0, 0, 0};

  const auto registered = directories.find(path);
  const Stats cached = getCachedStats(path, registered == directories.end() ? STALE_INTERVAL : registered->second);
  if (cached.valid) return cached;

  const std::clock_t start = std::clock();
  Stats stats(false, 0.0, 0, 0);
  const auto entries = fileUtils_->listDirectory(path);
  if (!isLink && fileUtils_->isSymLink(path)) return {false, 0, 0, 0};  // put there meanwhile
  for (const FileUtils::Info& entry : entries) {
    if (!excluded.empty() && excluded.count(fileUtils_->basename(entry.path)) > 0) continue;
    if (entry.type == FileUtils::Type::File) {
      stats.timeSpent += MIN_TIME_SPENT;
      add(stats.size, entry.size);
      add(stats.fileCount, 1);
      if (entry.size >= LARGE_FILE_SIZE) reportAnalytics(entry.path, Stats(false, 0.0, 1, entry.size));
    } else if (entry.type == FileUtils::Type::Directory && !fileUtils_->isSymLink(entry.path)) {
      const Stats nested = traverseDirectory(entry.path, directories, excluded);
      stats.timeSpent += nested.timeSpent;
      add(stats.size, nested.size);
      add(stats.fileCount, nested.fileCount);
    }
  }
  stats.timeSpent += secondsSince(start);

  setCachedStats(path, stats);
  reportAnalytics(path, stats);
  return stats;
}

DiskSizeCalculator::Stats DiskSizeCalculator::getCachedStats(const std::string& path, long staleInterval) {
  const Stats none(false, 0, 0, 0);
  const JsonValue document = attributeStore_->get(path);
  if (!document.is_object() || document.empty()) return none;
  try {
    const Stats kept(true, numberIn(document, ATTR_TIME_SPENT), integerIn(document, ATTR_FILE_COUNT),
                     integerIn(document, ATTR_SIZE));
    const std::int64_t timeStamp = integerIn(document, ATTR_TIME_STAMP);
    return timeStamp > 0 && Clock::now() - timeStamp <= staleInterval ? kept : none;
  } catch (const JsonValue::exception&) {
    return none;  // something else wrote there: measuring again fixes it
  }
}

void DiskSizeCalculator::setCachedStats(const std::string& path, const Stats& stats) {
  attributeStore_->set(path, {{ATTR_SIZE, stats.size},
                              {ATTR_TIME_SPENT, stats.timeSpent},
                              {ATTR_FILE_COUNT, stats.fileCount},
                              {ATTR_TIME_STAMP, Clock::now()}});
}

void DiskSizeCalculator::reportAnalytics(const std::string& path, const Stats& stats) {
  if (reporter_ == nullptr) return;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    if (!analytics_) return;
  }
  FileUtils::DiskSpace space(0, 0);
  try {
    space = fileUtils_->getDiskSpace(path);
  } catch (const std::exception&) {
    // The measurement counts without these figures too.
  }
  reporter_->reportEvent(
      DiskSizeCalculatorEvent(path, stats.size, stats.fileCount, stats.timeSpent, space.total, space.available));
}

}  // namespace velmora::mobile::xplat::cellar
