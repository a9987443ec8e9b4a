#pragma once

#include <limits>
#include <map>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "support/Samples.h"

namespace velmora::mobile::xplat::cellar::bench {

// Ours is to be at most `limit` times that of `against`: "lower bound", the name of a competitor, "fastest competitor",
// or empty when the limit is a figure of its own. Without a limit only the ratio is reported.
constexpr double kNoLimit = std::numeric_limits<double>::infinity();
struct Goal {
  std::string against;
  double limit;
};

// One comparison: what was measured where, and the figures of all who took part ("ours", "lower bound", competitors).
struct Row {
  std::string what;
  std::string where;
  std::string cpus;
  std::string unit;
  Figures figures;
  std::vector<Goal> goals;
};

// Points of a plot: a line for each name, of x and y.
struct Plot {
  std::string name;  // of its file
  std::string title;
  std::string xLabel;
  std::string yLabel;
  bool logarithmicY = false;
  std::map<std::string, std::vector<std::pair<double, double>>> lines{};
};

// What was measured, a section for each benchmark.
class Report {
 public:
  // What is added from now on belongs to this section.
  void begin(const std::string& name, const std::string& title);
  void add(Row row);
  void add(Plot plot);

  struct Section {
    std::string name;
    std::string title;
    std::vector<Row> rows;
  };
  const std::vector<Section>& sections() const { return sections_; }
  const std::vector<Plot>& plots() const { return plots_; }

  nlohmann::ordered_json json() const;

 private:
  std::vector<Section> sections_;
  std::vector<Plot> plots_;
};

// Ours over what the goal names.
double ratioOf(const Row& row, const Goal& goal);
bool isMet(const Row& row, const Goal& goal);

// The rows of a section, as a table for a terminal or in Markdown.
std::string tableText(const Report::Section& section);
std::string tableMarkdown(const Report::Section& section);

// In Markdown, only the figures, and only those of the first place on all processors.
std::string summaryMarkdown(const Report::Section& section);

}  // namespace velmora::mobile::xplat::cellar::bench
