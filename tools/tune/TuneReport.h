#pragma once

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

#include "Table.h"
#include "tune/Fleet.h"
#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

struct TuneReport {
  std::string source;                         // what was read
  std::string store;                          // may be empty
  std::optional<std::uint64_t> reportedHits;  // by the running cache, if the source has it
  std::uint64_t reportedFirstHits = 0;        // the first access to their key: items that were stored before
  std::uint64_t damagedLines = 0;
  std::string missingStrategy;  // the present one, if it could not be simulated
  std::optional<Fleet> fleet;   // of the devices, if the figures are theirs together
  Tuning tuning;
};

// The report in words, for a terminal or a page.
struct TuneTexts {
  std::string title;
  std::vector<std::string> notes;
  std::vector<Table::Column> columns;
  std::vector<std::vector<std::string>> rows;
  std::string advice;
  std::string cost;  // of the present limit; empty without one
};

TuneTexts textsOf(const TuneReport& report);
void printTuning(const TuneReport& report, Console& console);
nlohmann::ordered_json tuningAsJson(const TuneReport& report);

}  // namespace velmora::mobile::xplat::cellar::tools
