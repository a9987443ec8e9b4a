#include "topics/Topics.h"

namespace velmora::mobile::xplat::cellar::bench {

const std::vector<TopicDefinition>& topics() {
  static const std::vector<TopicDefinition> all = {
      {"store", "Storing: microseconds for each of many new values", measureStores},
      {"fetch", "Fetching: microseconds for each of many values that are there", measureFetches},
      {"caller", "The caller's time: microseconds until a call returns", measureCallers},
  };
  return all;
}

}  // namespace velmora::mobile::xplat::cellar::bench
