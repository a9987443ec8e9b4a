#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include "DiskSizeCalculator.h"

namespace velmora::mobile::xplat::cellar::host {

class StoreFigures;

// Notes what it measures in the figures of the unmanaged stores.
class MeasuredSizes final : public DiskSizeCalculator {
 public:
  using DiskSizeCalculator::DiskSizeCalculator;
  ~MeasuredSizes() override;

  // From now on, in place of whoever has been watching that directory.
  void watch(const std::string& path, const std::shared_ptr<StoreFigures>& figures);

  // Of a directory that somebody else has measured.
  void noteMeasured(const std::string& path, const Stats& stats);

  long long fetchDirectorySize(const std::string& path) override;
  Stats calculateDirectorySize(const std::string& path) override;

 private:
  std::shared_ptr<StoreFigures> figuresOf(const std::string& path);

  std::mutex mutex_;
  std::unordered_map<std::string, std::weak_ptr<StoreFigures>> watched_;  // by path; guarded
};

}  // namespace velmora::mobile::xplat::cellar::host
