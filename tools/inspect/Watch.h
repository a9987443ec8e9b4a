#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// Shows one survey after the other of a storage that is in use, each in the place of the one before on a terminal, and
// how many items have come and gone since the first.
class Watch {
 public:
  explicit Watch(Console& console) : console_(console) {}

  // The survey must have the hashes of all keys.
  void show(const Survey& survey);

 private:
  struct Tally {
    std::optional<std::vector<std::uint64_t>> keys;  // absent while the manifest could not be read
    std::uint64_t came = 0;
    std::uint64_t gone = 0;
  };

  void showManager(const ManagerSurvey& manager);
  const Tally& tallyOf(const StoreSurvey& store);

  Console& console_;
  bool isFirst_ = true;
  std::map<std::string, Tally> tallies_;  // by the path of the store
};

}  // namespace velmora::mobile::xplat::cellar::tools
