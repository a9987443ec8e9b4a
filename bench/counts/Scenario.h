#pragma once

#include <memory>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::bench {

// Work that is the same in each run, to the instruction: one thread, fixed dates, queues run by hand. What it needs is
// there when it has been constructed.
class Scenario {
 public:
  Scenario() = default;
  virtual ~Scenario() = default;
  Scenario(const Scenario&) = delete;
  Scenario& operator=(const Scenario&) = delete;

  // What is counted.
  virtual void run() = 0;

  // Throws unless that has happened.
  virtual void verify() = 0;
};

const std::vector<std::string>& scenarioNames();

// In an empty directory. Throws `std::invalid_argument` for a name that is none of these.
std::unique_ptr<Scenario> createScenario(const std::string& name, const std::string& directory);

}  // namespace velmora::mobile::xplat::cellar::bench
