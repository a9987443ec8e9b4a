#include "support/Report.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <limits>
#include <utility>

#include "Table.h"
#include "support/Places.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr const char* kFastest = "fastest competitor";
const std::vector<std::string> kContestants = {
    "ours", "lru",     "relaxed", "safe store",       "lower bound", "in groups", "LevelDB", "LevelDB in groups",
    "LMDB", "RocksDB", "SQLite",  "SQLite in groups", "du",          "rm -rf"};

std::string formatted(double value) {
  char text[32];
  const int digits = value >= 100 ? 0 : value >= 10 ? 1 : value >= 0.1 ? 2 : 3;
  std::snprintf(text, sizeof(text), "%.*f", digits, value);
  return text;
}

// With the quartiles, where there are several measurements.
std::string withQuartiles(const Figure& figure) {
  if (figure.lowerQuartile == figure.upperQuartile) return formatted(figure);
  return formatted(figure) + " (" + formatted(figure.lowerQuartile) + "-" + formatted(figure.upperQuartile) + ")";
}

nlohmann::ordered_json jsonOf(const Figure& figure) {
  return {{"median", figure.median}, {"quartiles", {figure.lowerQuartile, figure.upperQuartile}}};
}

double comparedWith(const Row& row, const Goal& goal) {
  if (goal.against != kFastest) return row.figures.at(goal.against);
  double fastest = std::numeric_limits<double>::max();
  for (const auto& [name, figure] : row.figures) {
    if (name == "ours" || name == "lower bound" || name == "in groups") continue;
    fastest = std::min<double>(fastest, figure);
  }
  return fastest;
}

bool contains(const Report::Section& section, const std::string& contestant) {
  return std::any_of(section.rows.begin(), section.rows.end(),
                     [&](const Row& row) { return row.figures.count(contestant) > 0; });
}

std::string goalText(const Row& row, const Goal& goal) {
  if (goal.limit == kNoLimit) return goal.against + ", no goal";
  if (goal.against.empty()) return "<= " + formatted(goal.limit) + " " + row.unit;
  return "<= " + formatted(goal.limit) + " " + goal.against;
}

using Cells = std::vector<std::string>;

Cells titlesOf(const Report::Section& section) {
  Cells titles = {"what", "where", "on", "unit"};
  for (const auto& contestant : kContestants) {
    if (contains(section, contestant)) titles.push_back(contestant);
  }
  for (const char* title : {"ratio", "goal", "met"}) titles.emplace_back(title);
  return titles;
}

using Format = std::string (*)(const Figure& figure);

std::string medianAlone(const Figure& figure) { return formatted(figure); }

Cells figureCells(const Report::Section& section, const Row& row, Format format) {
  Cells cells;
  for (const auto& contestant : kContestants) {
    if (!contains(section, contestant)) continue;
    const auto figure = row.figures.find(contestant);
    cells.push_back(figure == row.figures.end() ? "" : format(figure->second));
  }
  return cells;
}

Cells verdictCells(const Row& row, const Goal& goal) {
  const std::string ratio = goal.against.empty() ? "" : formatted(ratioOf(row, goal));
  if (goal.limit == kNoLimit) return {ratio, goalText(row, goal), ""};
  return {ratio, goalText(row, goal), isMet(row, goal) ? "yes" : "no"};
}

// A row with several goals has a line for each, the figures only in the first.
std::vector<Cells> linesOf(const Report::Section& section, const Row& row) {
  const Cells figures = figureCells(section, row, withQuartiles);
  Cells first = {row.what, row.where, row.cpus, row.unit};
  first.insert(first.end(), figures.begin(), figures.end());
  std::vector<Cells> lines;
  for (const Goal& goal : row.goals) {
    Cells line = lines.empty() ? first : Cells(first.size());
    for (auto& cell : verdictCells(row, goal)) line.push_back(std::move(cell));
    lines.push_back(std::move(line));
  }
  if (!lines.empty()) return lines;
  const bool hasLowerBound = row.figures.count("lower bound") > 0;
  first.push_back(hasLowerBound ? formatted(ratioOf(row, {"lower bound", 0})) : "");
  first.resize(first.size() + 2);
  return {first};
}

bool isFigure(const std::string& title) {
  return title == "ratio" || std::count(kContestants.begin(), kContestants.end(), title) > 0;
}

std::string markdown(const Cells& titles, const std::vector<Cells>& lines) {
  const auto line = [](const Cells& cells) {
    std::string text = "|";
    for (const auto& cell : cells) text += " " + cell + " |";
    return text + "\n";
  };
  std::string text = line(titles) + "|";
  for (const auto& title : titles) text += isFigure(title) ? "---:|" : "---|";
  text += "\n";
  for (const Cells& cells : lines) text += line(cells);
  return text;
}

// Of the places, the first alone; of the two ways to use processors, all of them.
bool isInSummary(const Report::Section& section, const Row& row) {
  const bool isOfFirstPlace = row.where == section.rows.front().where || row.where == "memory";
  return isOfFirstPlace && row.cpus != cpuName(true);
}

nlohmann::ordered_json jsonOf(const Row& row) {
  nlohmann::ordered_json json = {{"what", row.what}, {"where", row.where}, {"on", row.cpus}, {"unit", row.unit}};
  for (const auto& [name, figure] : row.figures) json["figures"][name] = jsonOf(figure);
  for (const Goal& goal : row.goals) {
    const double ratio = goal.against.empty() ? row.figures.at("ours").median : ratioOf(row, goal);
    json["goals"].push_back({{"against", goal.against}, {"ratio", ratio}});
    if (goal.limit == kNoLimit) continue;
    json["goals"].back()["limit"] = goal.limit;
    json["goals"].back()["met"] = isMet(row, goal);
  }
  return json;
}

}  // namespace

void Report::begin(const std::string& name, const std::string& title) { sections_.push_back({name, title, {}}); }

void Report::add(Row row) { sections_.back().rows.push_back(std::move(row)); }

void Report::add(Plot plot) { plots_.push_back(std::move(plot)); }

nlohmann::ordered_json Report::json() const {
  nlohmann::ordered_json json = nlohmann::ordered_json::object();
  for (const Section& section : sections_) {
    for (const Row& row : section.rows) json[section.name].push_back(jsonOf(row));
  }
  return json;
}

double ratioOf(const Row& row, const Goal& goal) { return row.figures.at("ours") / comparedWith(row, goal); }

bool isMet(const Row& row, const Goal& goal) {
  const double measured = goal.against.empty() ? row.figures.at("ours").median : ratioOf(row, goal);
  return measured <= goal.limit;
}

std::string tableText(const Report::Section& section) {
  std::vector<tools::Table::Column> columns;
  for (const auto& title : titlesOf(section)) {
    columns.push_back({title, isFigure(title) ? tools::Table::Align::Right : tools::Table::Align::Left});
  }
  tools::Table table(columns);
  for (const Row& row : section.rows) {
    for (Cells& line : linesOf(section, row)) table.addRow(std::move(line));
  }
  return table.text();
}

std::string tableMarkdown(const Report::Section& section) {
  std::vector<Cells> lines;
  for (const Row& row : section.rows) {
    for (Cells& line : linesOf(section, row)) lines.push_back(std::move(line));
  }
  return markdown(titlesOf(section), lines);
}

std::string summaryMarkdown(const Report::Section& section) {
  Cells titles = {"what", "unit"};
  for (const auto& contestant : kContestants) {
    if (contains(section, contestant)) titles.push_back(contestant);
  }
  std::vector<Cells> lines;
  for (const Row& row : section.rows) {
    if (!isInSummary(section, row)) continue;
    lines.push_back({row.what, row.unit});
    for (auto& cell : figureCells(section, row, medianAlone)) lines.back().push_back(std::move(cell));
  }
  return markdown(titles, lines);
}

}  // namespace velmora::mobile::xplat::cellar::bench
