#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// The devices of which the figures were added up.
struct Fleet {
  std::uint64_t devices = 0;
  std::uint64_t shortDevices = 0;                          // whose log is too short to say which limit is enough
  std::uint64_t sampledDevices = 0;                        // of which a sample was simulated
  std::map<std::string, std::uint64_t> partialStrategies;  // how many devices have it, if not all do
  std::map<std::string, std::vector<std::int64_t>>
      enough;  // by strategy, without foresight; ascending, without short devices
};

// The smallest limit that is enough for so many percent of the devices; `enough` is ascending and not empty.
std::int64_t enoughFor(const std::vector<std::int64_t>& enough, unsigned percent);

}  // namespace velmora::mobile::xplat::cellar::tools
