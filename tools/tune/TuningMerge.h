#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "tune/Fleet.h"
#include "tune/TuneDocument.h"

namespace velmora::mobile::xplat::cellar::tools {

// The caches of many devices together.
struct MergedTuning {
  std::string store;
  Fleet fleet;
  Tuning tuning;
};

// Adds up what devices have found at the limits that all list: the powers of two, and one and a half times these. Each
// device has the weight of its requests. Above the limits that a device lists, it finds what it finds at the last one.
// Below them, where it would find next to nothing, nothing. The order of the devices does not matter, and memory does
// not grow with their number, but for 8 bytes for each and each strategy.
class TuningMerge {
 public:
  // Throws `InputError`, which names the file, if the device cannot be added to those before: another store, another
  // share that a doubling has to be worth, or figures that add up to more than can be counted.
  void add(const std::string& file, const DeviceTuning& device);

  // At least one device was added.
  MergedTuning result() const;

 private:
  // What a limit adds to the next smaller one.
  struct Step {
    std::int64_t hits = 0;
    std::int64_t hitBytes = 0;
  };
  using Steps = std::map<std::string, Step>;  // by strategy

  void check(const std::string& file, const DeviceTuning& device) const;
  void addSteps(const Tuning& tuning);
  void addEnough(const Tuning& tuning);
  bool isComplete(const std::string& strategy) const;
  TunedLimit sumOf(std::int64_t limit, const Steps& steps) const;
  void sumUp(Tuning& tuning) const;

  MergedTuning merged_;
  std::map<std::string, std::uint64_t> devicesOf_;  // by strategy
  std::map<std::int64_t, Steps> steps_;             // by limit
};

}  // namespace velmora::mobile::xplat::cellar::tools
