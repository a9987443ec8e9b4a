#include "counts/Comparison.h"

#include <gnu/libc-version.h>
#include <sqlite3.h>
#include <sys/utsname.h>

#include <cmath>
#include <cstdint>
#include <cstdio>
#include <istream>
#include <ostream>
#include <set>
#include <sstream>
#include <stdexcept>

#include "Table.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr double kTolerance = 0.03;
constexpr const char* kInstructions = "instructions";
constexpr const char* kSystemCalls = "system calls";

std::string changeText(std::uint64_t before, std::uint64_t now) {
  if (before == now) return "none";
  if (before == 0) return "new";
  char text[32];
  const double percent = 100 * (static_cast<double>(now) / static_cast<double>(before) - 1);
  std::snprintf(text, sizeof(text), "%+.2f %%", percent);
  return text;
}

class Differences {
 public:
  void add(const std::string& scenario, const std::string& what, std::uint64_t before, std::uint64_t now,
           double tolerance) {
    const double change = std::abs(static_cast<double>(now) - static_cast<double>(before));
    const bool isFine = change <= tolerance * static_cast<double>(before);
    allFine_ = allFine_ && isFine;
    table_.addRow({scenario, what, std::to_string(before), std::to_string(now), changeText(before, now),
                   isFine ? "" : "too far"});
  }

  bool allFine() const { return allFine_; }
  std::string text() const { return table_.text(); }

 private:
  using Align = tools::Table::Align;
  tools::Table table_{{{"scenario", Align::Left},
                       {"what", Align::Left},
                       {"old", Align::Right},
                       {"new", Align::Right},
                       {"change", Align::Right},
                       {"", Align::Left}}};
  bool allFine_ = true;
};

std::uint64_t total(const Counts& calls) {
  std::uint64_t sum = 0;
  for (const auto& [name, count] : calls.items()) sum += count.get<std::uint64_t>();
  return sum;
}

// The sum, and each kind of which there are more or fewer.
void addCalls(Differences& differences, const std::string& scenario, const Counts& before, const Counts& now) {
  differences.add(scenario, kSystemCalls, total(before), total(now), 0);
  std::set<std::string> names;
  for (const auto& [name, count] : before.items()) names.insert(name);
  for (const auto& [name, count] : now.items()) names.insert(name);
  for (const std::string& name : names) {
    const auto old = before.value(name, std::uint64_t{0});
    const auto present = now.value(name, std::uint64_t{0});
    if (old != present) differences.add(scenario, "  " + name, old, present, 0);
  }
}

}  // namespace

Counts environmentOfThisProgram() {
  utsname system{};
  (void)::uname(&system);
  return {{"compiler", __VERSION__},
          {"SQLite", sqlite3_libversion()},
          {"C library", gnu_get_libc_version()},
          {"architecture", system.machine}};
}

Counts parseMeasured(std::istream& lines) {
  Counts scenarios = Counts::object();
  for (std::string line; std::getline(lines, line);) {
    std::istringstream fields(line);
    std::string scenario;
    std::string what;
    std::uint64_t count = 0;
    const bool isWhole = std::getline(fields, scenario, '\t') && std::getline(fields, what, '\t') && fields >> count;
    if (!isWhole) throw std::runtime_error("not a count: " + line);
    Counts& counts = scenarios[scenario];
    (what == kInstructions ? counts[kInstructions] : counts[kSystemCalls][what]) = count;
  }
  return {{"environment", environmentOfThisProgram()}, {"scenarios", scenarios}};
}

bool compare(const Counts& baseline, const Counts& measured, std::ostream& out) {
  Differences differences;
  bool isComplete = true;
  for (const auto& [scenario, now] : measured.at("scenarios").items()) {
    if (!baseline.at("scenarios").contains(scenario)) {
      out << "The baseline has no scenario '" << scenario << "'\n";
      isComplete = false;
      continue;
    }
    const Counts& before = baseline.at("scenarios").at(scenario);
    if (now.contains(kInstructions)) {
      differences.add(scenario, kInstructions, before.value(kInstructions, std::uint64_t{0}),
                      now.at(kInstructions).get<std::uint64_t>(), kTolerance);
    }
    if (now.contains(kSystemCalls)) {
      addCalls(differences, scenario, before.value(kSystemCalls, Counts::object()), now.at(kSystemCalls));
    }
  }
  out << differences.text();
  return isComplete && differences.allFine();
}

}  // namespace velmora::mobile::xplat::cellar::bench
